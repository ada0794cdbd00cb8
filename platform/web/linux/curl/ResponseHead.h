// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <cstddef>
#include <optional>
#include <string>
#include <string_view>

#include "platform/web/WebTypes.h"

// What a server's words come to before libcurl or anybody else acts on them.
namespace brenvik {

// The header fields of a response, taken line by line as libcurl hands them over. Throws std::bad_alloc.
class ResponseHead {
 public:
  // Of all lines of one attempt together; a sane server stays far below.
  static constexpr std::size_t kMaxSize = std::size_t{256} * 1024;

  // False when that is too much. A line that starts a response, after an interim one, starts anew. A line
  // that begins with a blank goes on with the field before it (RFC 9112, 5.2).
  bool takeLine(std::string_view line);
  // From here on lines are trailers, which are not taken.
  void bodyBegins() noexcept { bodyHasBegun_ = true; }
  bool bodyHasBegun() const noexcept { return bodyHasBegun_; }

  HeaderMap fields;

 private:
  std::size_t taken_ = 0;
  std::string lastName_;  // of the field that a folded line would belong to; empty: none
  bool bodyHasBegun_ = false;
};

struct ParsedUrl {
  std::string scheme;  // lower case
  std::string host;    // without the brackets of an IPv6 address; never empty
};

// Nothing when the text is no URL: blanks and control characters in it included.
std::optional<ParsedUrl> parseUrl(const std::string& text);

// Addresses are not looked up, nor is this machine's own name, which libcurl knows by itself.
bool needsLookUp(const std::string& host);

}  // namespace brenvik

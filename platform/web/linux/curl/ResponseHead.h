// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <cstddef>
#include <optional>
#include <string>
#include <string_view>

#include "platform/web/WebTypes.h"

// Checks a server's header and URLs before libcurl or other code acts on them.
namespace brenvik {

// The header fields of a response, line by line as libcurl delivers them. Throws std::bad_alloc.
class ResponseHead {
 public:
  // The most bytes in all lines of one attempt; a sane server sends far fewer.
  static constexpr std::size_t kMaxSize = std::size_t{256} * 1024;

  // Takes a line; returns false if there are too many bytes. A status line after an interim response starts
  // again. A line that begins with a blank continues the previous field (RFC 9112, 5.2).
  bool takeLine(std::string_view line);
  // Later lines are trailers, which are ignored.
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

// Returns nothing if the text is not a URL, for example if it has blanks or control characters.
std::optional<ParsedUrl> parseUrl(const std::string& text);

// False for addresses, and for this machine's own name, which libcurl resolves by itself.
bool needsLookUp(const std::string& host);

}  // namespace brenvik

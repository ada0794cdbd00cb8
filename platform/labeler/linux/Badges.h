// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <unordered_map>
#include <unordered_set>

namespace brenvik {

// Makes the badges of one request: short upper-case forms of labels, no two alike. A badge is the first
// grapheme cluster (UAX 29) of its label; when that is taken, the first two, then three; then the first
// cluster and a number from 2 to 99; then a number or a code of three characters that is unrelated to the
// label. Blanks and invisible characters are ignored. One object serves one request, on one thread.
class Badges {
 public:
  // `language` is an ISO 639 code, NUL-terminated, and decides how letters become capitals. It must outlive
  // the object.
  explicit Badges(const char* language) noexcept : language_(language) {}

  // Makes a badge for the label, which is UTF-8. Returns nothing once all forms are used up (after tens of
  // thousands). Time and memory do not depend on the label's length, apart from leading blanks. Throws
  // std::bad_alloc.
  std::optional<std::string> make(std::string_view label);

 private:
  // Reserves the badge; false if it looks like one that is taken.
  bool take(const std::string& badge);
  std::optional<std::string> takeCode();

  const char* language_;
  std::unordered_set<std::string> taken_;            // their visible forms
  std::unordered_map<std::string, int> nextNumber_;  // by first cluster; all smaller numbers are taken
  std::uint32_t nextCode_ = 0;
};

}  // namespace brenvik

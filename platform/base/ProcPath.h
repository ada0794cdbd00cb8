// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <sys/types.h>

#include <array>
#include <charconv>
#include <cstddef>
#include <string_view>

namespace brenvik {

// The path of a file of /proc/PID. Each check-in needs two of them; made by snprintf(3), the first one costs
// five page faults.
class ProcPath {
 public:
  static constexpr std::size_t kLongestName = 15;

  // `name` has at most kLongestName characters; a longer one is cut.
  ProcPath(pid_t pid, std::string_view name) noexcept {
    constexpr std::string_view kFolder = "/proc/";
    char* at = text_.data() + kFolder.copy(text_.data(), kFolder.size());
    at = std::to_chars(at, at + kLongestNumber, pid).ptr;
    *at++ = '/';
    at[name.copy(at, kLongestName)] = '\0';
  }
  const char* c_str() const noexcept { return text_.data(); }

 private:
  static constexpr std::size_t kLongestNumber = 11;
  std::array<char, 6 + kLongestNumber + 1 + kLongestName + 1> text_;
};

}  // namespace brenvik

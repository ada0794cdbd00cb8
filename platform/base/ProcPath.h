// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <sys/types.h>

#include <array>
#include <charconv>
#include <cstddef>
#include <string_view>

namespace brenvik {

// The path of a file in /proc/PID. Each check-in needs two of them, and the first snprintf(3) of a process
// costs five page faults, so the path is put together by hand.
class ProcPath {
 public:
  static constexpr std::size_t kLongestName = 15;

  // A `name` of more than kLongestName characters is cut.
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

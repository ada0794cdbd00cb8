// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/base/ProcessStartTime.h"

#include <fcntl.h>
#include <unistd.h>

#include <array>
#include <charconv>
#include <cstdio>
#include <string_view>

#include "platform/base/UniqueFd.h"

namespace brenvik {

std::optional<std::uint32_t> processStartTime(pid_t pid) noexcept {
  std::array<char, 32> path;
  std::snprintf(path.data(), path.size(), "/proc/%d/stat", static_cast<int>(pid));
  const UniqueFd file(::open(path.data(), O_RDONLY | O_CLOEXEC));
  if (!file.isValid()) return std::nullopt;
  std::array<char, 1024> text;
  const ssize_t size = ::read(file.get(), text.data(), text.size());
  if (size <= 0) return std::nullopt;
  std::string_view rest(text.data(), static_cast<std::size_t>(size));
  // Field 2 is the program's name in brackets and may hold brackets and blanks itself: count from its end.
  const std::size_t nameEnd = rest.rfind(')');
  if (nameEnd == std::string_view::npos) return std::nullopt;
  rest.remove_prefix(nameEnd + 1);
  for (int field = 3; field <= 22; ++field) {
    const std::size_t blank = rest.find(' ');
    if (blank == std::string_view::npos) return std::nullopt;
    rest.remove_prefix(blank + 1);
  }
  std::uint64_t ticks = 0;
  const auto result = std::from_chars(rest.data(), rest.data() + rest.size(), ticks);
  if (result.ec != std::errc()) return std::nullopt;
  return static_cast<std::uint32_t>(ticks);
}

}  // namespace brenvik

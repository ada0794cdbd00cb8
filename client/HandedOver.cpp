// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "client/HandedOver.h"

#include <unistd.h>

#include <charconv>
#include <cstdlib>
#include <string_view>

namespace brenvik::client {
namespace {

constexpr int kFirstDescriptor = 3;  // SD_LISTEN_FDS_START

// The variable's number, or -1 when it is not set or is not a number.
int numberOf(const char* variable) noexcept {
  const char* const value = std::getenv(variable);
  if (value == nullptr) return -1;
  const std::string_view text(value);
  int number = -1;
  const auto [end, error] = std::from_chars(text.data(), text.data() + text.size(), number);
  return error == std::errc() && end == text.data() + text.size() ? number : -1;
}

}  // namespace

int descriptorHandedOver(const char* name) noexcept {
  // Variables that name another process were meant for it, and descriptor 3 may be anything here.
  if (numberOf("LISTEN_PID") != ::getpid()) return -1;
  const int count = numberOf("LISTEN_FDS");
  const char* const variable = std::getenv("LISTEN_FDNAMES");
  if (variable == nullptr) return -1;
  std::string_view names(variable);
  for (int i = 0; i < count; ++i) {
    const std::size_t end = names.find(':');
    if (names.substr(0, end) == name) return kFirstDescriptor + i;
    if (end == std::string_view::npos) break;
    names.remove_prefix(end + 1);
  }
  return -1;
}

}  // namespace brenvik::client

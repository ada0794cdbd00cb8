// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <algorithm>
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <span>
#include <string_view>

namespace brenvik {

// Ends the process if a fuzz target finds what must not be.
inline void require(bool holds) {
  if (!holds) std::abort();
}

// The bytes of a fuzzer, taken from the front as choices, numbers and texts. An exhausted input gives zeros
// and empty texts, so every input is one; a loop must ask isEmpty(). Integers are little-endian.
class FuzzInput {
 public:
  FuzzInput(const std::uint8_t* data, std::size_t size) noexcept : left_(data, size) {}

  bool isEmpty() const noexcept { return left_.empty(); }

  std::uint8_t byte() noexcept {
    if (left_.empty()) return 0;
    const std::uint8_t first = left_.front();
    left_ = left_.subspan(1);
    return first;
  }
  bool flag() noexcept { return (byte() & 1) != 0; }
  // A number of `width` bytes, at most 8.
  std::uint64_t number(int width) noexcept {
    std::uint64_t value = 0;
    for (int i = 0; i < width; ++i) value |= std::uint64_t{byte()} << (8 * i);
    return value;
  }
  // 0 to count - 1; count at most 256.
  std::size_t below(std::size_t count) noexcept { return byte() % count; }
  template <class Array>
  auto& oneOf(Array& choices) noexcept {
    return choices[below(std::size(choices))];
  }
  // At most `count` bytes, fewer at the end of the input.
  std::span<const std::byte> bytes(std::size_t count) noexcept {
    const auto taken = left_.first(std::min(count, left_.size()));
    left_ = left_.subspan(taken.size());
    return std::as_bytes(taken);
  }
  // A length of `width` bytes and so many characters.
  std::string_view text(int width = 1) noexcept {
    const auto taken = bytes(number(width));
    return {reinterpret_cast<const char*>(taken.data()), taken.size()};
  }
  std::span<const std::byte> rest() noexcept { return bytes(left_.size()); }

 private:
  std::span<const std::uint8_t> left_;
};

}  // namespace brenvik

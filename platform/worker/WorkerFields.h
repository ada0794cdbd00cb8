// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <bit>
#include <cstddef>
#include <cstdint>
#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <type_traits>
#include <utility>
#include <vector>

namespace brenvik {

// Writes the fields of a message one after the other, little-endian, without padding. Texts and bytes begin
// with a u32 length, an optional field with a u8 of 0 or 1. Throws std::bad_alloc.
class FieldWriter {
 public:
  FieldWriter& u8(std::uint8_t value) { return number(value); }
  FieldWriter& boolean(bool value) { return u8(value ? 1 : 0); }
  FieldWriter& u32(std::uint32_t value) { return number(value); }
  FieldWriter& u64(std::uint64_t value) { return number(value); }
  FieldWriter& i64(std::int64_t value) { return number(static_cast<std::uint64_t>(value)); }
  FieldWriter& real(double value) { return number(std::bit_cast<std::uint64_t>(value)); }
  FieldWriter& bytes(std::span<const std::byte> value);
  FieldWriter& text(std::string_view value) { return bytes(std::as_bytes(std::span(value))); }
  // Writes the field if there is one: optional(value, [](FieldWriter& to, const auto& it) { to.text(it); }).
  template <class Value, class Write>
  FieldWriter& optional(const std::optional<Value>& value, Write&& write) {
    boolean(value.has_value());
    if (value.has_value()) write(*this, *value);
    return *this;
  }
  FieldWriter& optionalText(const std::optional<std::string>& value) {
    return optional(value, [](FieldWriter& to, const std::string& it) { to.text(it); });
  }

  std::size_t size() const noexcept { return payload_.size(); }
  std::vector<std::byte> take() noexcept { return std::move(payload_); }

 private:
  template <class Number>
  FieldWriter& number(Number value) {
    for (std::size_t i = 0; i < sizeof value; ++i)
      payload_.push_back(static_cast<std::byte>(static_cast<std::uint64_t>(value) >> (8 * i)));
    return *this;
  }
  std::vector<std::byte> payload_;
};

// Reads the fields. A missing or incomplete field makes the reader fail; after that every field reads as zero
// or empty, so one check of whole() at the end covers all fields. Texts and bytes point into the payload.
class FieldReader {
 public:
  explicit FieldReader(std::span<const std::byte> payload) noexcept : left_(payload) {}

  std::uint8_t u8() noexcept { return number<std::uint8_t>(); }
  bool boolean() noexcept;  // fails for anything but 0 and 1
  std::uint32_t u32() noexcept { return number<std::uint32_t>(); }
  std::uint64_t u64() noexcept { return number<std::uint64_t>(); }
  std::int64_t i64() noexcept { return static_cast<std::int64_t>(number<std::uint64_t>()); }
  double real() noexcept { return std::bit_cast<double>(number<std::uint64_t>()); }
  std::span<const std::byte> bytes() noexcept;
  std::string_view text() noexcept;
  // Reads the field if there is one: optional([](FieldReader& from) { return from.u32(); }).
  template <class Read>
  auto optional(Read&& read) -> std::optional<std::decay_t<decltype(read(std::declval<FieldReader&>()))>> {
    if (!boolean()) return std::nullopt;
    auto value = read(*this);
    if (failed_) return std::nullopt;
    return value;
  }
  std::optional<std::string_view> optionalText() noexcept {
    return optional([](FieldReader& from) { return from.text(); });
  }

  // Makes the reader fail; for a value that is not allowed.
  void fail() noexcept {
    failed_ = true;
    left_ = {};
  }
  bool hasFailed() const noexcept { return failed_; }
  // True if every field was complete and no bytes are left.
  bool whole() const noexcept { return !failed_ && left_.empty(); }

 private:
  template <class Number>
  Number number() noexcept {
    const auto taken = take(sizeof(Number));
    std::uint64_t value = 0;
    for (std::size_t i = 0; i < taken.size(); ++i)
      value |= std::to_integer<std::uint64_t>(taken[i]) << (8 * i);
    return static_cast<Number>(value);
  }
  std::span<const std::byte> take(std::size_t size) noexcept;

  std::span<const std::byte> left_;
  bool failed_ = false;
};

}  // namespace brenvik

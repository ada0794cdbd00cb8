// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <cstddef>
#include <cstdint>
#include <memory>
#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

namespace brenvik {

// An immutable property-list value, or no value at all. Copies share what they hold; a value may be read
// from any thread. Destroying the deepest or most shared value takes no recursion.
class PropertyList {
 public:
  enum class Type : std::uint8_t { boolean, integer, real, string, data, date, array, dictionary };

  PropertyList() = default;  // no value

  static PropertyList boolean(bool value);
  static PropertyList integer(std::int64_t value);
  static PropertyList unsignedInteger(std::uint64_t value);
  static PropertyList real(double value);
  static PropertyList string(std::string_view utf8);  // no value when it is not valid UTF-8
  static PropertyList data(std::span<const std::byte> bytes);
  static PropertyList date(double secondsSince2001);  // since 2001-01-01T00:00:00Z
  static PropertyList array(std::vector<PropertyList> elements);  // absent elements are left out
  // Keys in the order given; of equal keys the last value stands. Absent values are left out.
  static PropertyList dictionary(std::vector<std::pair<std::string, PropertyList>> entries);

  bool hasValue() const noexcept;
  explicit operator bool() const noexcept { return hasValue(); }
  // Precondition: hasValue().
  Type type() const noexcept;
  bool is(Type wanted) const noexcept;

  // Nothing when there is no value or it has another type. Views live as long as any copy of the value.
  std::optional<bool> asBoolean() const noexcept;
  std::optional<std::int64_t> asInteger() const noexcept;  // nothing, too, above INT64_MAX
  std::optional<std::uint64_t> asUnsignedInteger() const noexcept;  // nothing, too, below 0
  std::optional<double> asReal() const noexcept;
  std::optional<std::string_view> asString() const noexcept;  // UTF-8, may hold NUL
  std::optional<std::span<const std::byte>> asData() const noexcept;
  std::optional<double> asDate() const noexcept;

  // Of an array or a dictionary: the number of elements or entries; 0 for everything else.
  std::size_t size() const noexcept;
  // Element of an array, value of a dictionary's entry, in order; no value when out of range.
  PropertyList at(std::size_t index) const noexcept;
  // Key of a dictionary's entry, in order; empty when out of range.
  std::string_view keyAt(std::size_t index) const noexcept;
  // Value under the key of a dictionary; no value when absent or not a dictionary.
  PropertyList find(std::string_view key) const noexcept;

  // Deep equality; dictionaries compare without regard to order.
  bool operator==(const PropertyList& other) const;
};

}  // namespace brenvik

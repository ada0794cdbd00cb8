// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <cstddef>
#include <cstdint>
#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "platform/plist/Node.h"

namespace brenvik {

// An immutable property-list value, or no value at all. Copies share their contents; any thread may read a
// value. Destroying even the deepest or most shared value needs no recursion. Functions that make a value
// from a text or from other values, and comparison, may throw std::bad_alloc; nothing else throws.
//
// A value taken from a parsed document keeps that document's memory alive as long as it lives.
class PropertyList {
 public:
  enum class Type : std::uint8_t { boolean, integer, real, string, data, date, array, dictionary };

  PropertyList() = default;  // no value
  PropertyList(const PropertyList& other) noexcept;
  PropertyList(PropertyList&& other) noexcept
      : node_(std::exchange(other.node_, {})), owner_(std::exchange(other.owner_, nullptr)) {}
  PropertyList& operator=(const PropertyList& other) noexcept;
  PropertyList& operator=(PropertyList&& other) noexcept;
  ~PropertyList() {
    if (owner_ != nullptr) letGo();
  }

  static PropertyList boolean(bool value) noexcept;
  static PropertyList integer(std::int64_t value) noexcept;
  static PropertyList unsignedInteger(std::uint64_t value) noexcept;
  static PropertyList real(double value) noexcept;
  static PropertyList string(std::string_view utf8);  // no value if it is not valid UTF-8
  static PropertyList data(std::span<const std::byte> bytes);
  static PropertyList date(double secondsSince2001) noexcept;            // since 2001-01-01T00:00:00Z
  static PropertyList array(const std::vector<PropertyList>& elements);  // absent elements are left out
  // Keys keep their order; if keys are equal, the last value counts. Absent values are left out. No value if
  // a key is not valid UTF-8.
  static PropertyList dictionary(const std::vector<std::pair<std::string, PropertyList>>& entries);

  // Returns a copy of this dictionary with the entry set (in its old place, or last) or, if `value` is
  // absent, removed. Takes one pass over the entries. No value if this is not a dictionary or the key is not
  // valid UTF-8.
  PropertyList withEntry(std::string_view key, const PropertyList& value) const;

  bool hasValue() const noexcept { return node_.tag != plist::Tag::none; }
  explicit operator bool() const noexcept { return hasValue(); }
  // Precondition: hasValue().
  Type type() const noexcept;
  bool is(Type wanted) const noexcept { return hasValue() && type() == wanted; }

  // Return nothing if there is no value or it has another type. Views live as long as any copy of the value.
  std::optional<bool> asBoolean() const noexcept;
  std::optional<std::int64_t> asInteger() const noexcept;           // nothing, too, above INT64_MAX
  std::optional<std::uint64_t> asUnsignedInteger() const noexcept;  // nothing, too, below 0
  std::optional<double> asReal() const noexcept;
  std::optional<std::string_view> asString() const noexcept;  // UTF-8, may hold NUL
  std::optional<std::span<const std::byte>> asData() const noexcept;
  std::optional<double> asDate() const noexcept;

  // The number of elements or entries of an array or a dictionary; 0 for other types.
  std::size_t size() const noexcept { return node_.isContainer() ? node_.size : 0; }
  // The element of an array, or the value of a dictionary's entry, in order; no value if out of range.
  PropertyList at(std::size_t index) const noexcept;
  // The key of a dictionary's entry, in order; empty if out of range.
  std::string_view keyAt(std::size_t index) const noexcept;
  // The value under the key of a dictionary; no value if it is absent or this is not a dictionary. Constant
  // time.
  PropertyList find(std::string_view key) const noexcept;

  // Deep equality, in time linear in the stored objects, however much is shared. The order of a dictionary's
  // entries does not matter; a real that is not a number (NaN) equals another one.
  bool operator==(const PropertyList& other) const;

 private:
  friend struct plist::Access;

  void letGo() noexcept;

  plist::Node node_;
  const plist::Document* owner_ = nullptr;  // null for what needs no memory: numbers, empty things
};

}  // namespace brenvik

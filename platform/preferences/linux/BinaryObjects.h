// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <cstddef>
#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/plist/PropertyList.h"

// The object level of binary property lists (version 00), as far as it takes to put one document together
// from pieces of others. What an object means is left to the codec. Functions here may throw std::bad_alloc.
namespace brenvik::bplist {

inline constexpr std::string_view kMagic = "bplist00";
inline constexpr std::size_t kTrailerSize = 32;

// Big-endian, `width` bytes from 1 to 8.
std::uint64_t readInteger(const char* at, std::size_t width) noexcept;
void writeInteger(char* at, std::size_t width, std::uint64_t value) noexcept;

// Fewest of 1, 2, 4 or 8 bytes that number so many objects; fewest bytes that hold the value.
std::size_t referenceWidth(std::size_t objects) noexcept;
std::size_t offsetWidth(std::uint64_t largest) noexcept;

// Where an object's parts lie, counted from its first byte.
struct Shape {
  std::uint8_t kind = 0;       // the marker's upper half
  std::size_t header = 0;      // bytes before the content
  std::size_t count = 0;       // bytes, units or entries, as the marker counts
  std::size_t references = 0;  // of a container: how many follow the header
  std::size_t size = 0;        // bytes in all
};

// Of the object that begins here. Nothing when it does not lie within `bytes` or is of no known kind.
std::optional<Shape> shapeOf(std::string_view bytes, std::size_t widthOfReference) noexcept;

// A marker with its count, as it stands before text, data and containers.
void appendHeader(std::string& out, std::uint8_t kind, std::size_t count);
// A string object: ASCII when it can be, else UTF-16. The text is valid UTF-8.
void appendString(std::string& out, std::string_view utf8);

// A document's objects by number. Looks at the given bytes; owns nothing.
class Document {
 public:
  static std::optional<Document> open(std::string_view bytes) noexcept;

  std::size_t objects() const noexcept { return objects_; }
  std::size_t top() const noexcept { return top_; }
  std::size_t widthOfReference() const noexcept { return widthOfReference_; }
  // From the object's first byte to the end of all objects; empty for a number that names none.
  std::string_view from(std::size_t object) const noexcept;

 private:
  std::string_view bytes_;
  std::size_t objects_ = 0;
  std::size_t top_ = 0;
  std::size_t table_ = 0;
  std::size_t widthOfOffset_ = 0;
  std::size_t widthOfReference_ = 0;
};

// What a value adds to the document that takes it in: its size as XML, never guessed too small.
struct Extent {
  std::uint64_t bytes = 0;  // at the outermost level
  std::uint64_t lines = 0;  // each grows by a byte for each level around it
  std::uint32_t depth = 0;  // levels of containers, empty ones included
};

// Takes values out of a document, one at a time: each with everything it refers to, in the order in which it
// will stand in another document, the value itself first. What is shared within the value stays shared.
class Extractor {
 public:
  explicit Extractor(const Document& document);

  // Selects the value. False when the document is not sound; then nothing is selected.
  bool select(std::size_t object);

  // Of the selected value.
  std::size_t objects() const noexcept { return order_.size(); }
  const Extent& extent() const noexcept { return extents_.front(); }
  // Appends its objects to `bytes` and where each begins there to `offsets`. The value itself gets the number
  // `first`, the others those that follow.
  void append(std::string& bytes, std::vector<std::uint32_t>& offsets, std::size_t first,
              std::size_t widthOfReference) const;

 private:
  static constexpr std::uint32_t kNoPlace = 0xFFFFFFFF;

  void clear() noexcept;
  std::uint32_t add(std::size_t object, const Shape& shape);
  std::size_t referenceOf(std::string_view container, const Shape& shape, std::size_t index) const noexcept;

  Document document_;
  std::vector<std::uint32_t> placeOf_;  // by number in the document: place in order_, or none
  std::vector<std::uint32_t> order_;    // numbers in the document
  std::vector<Extent> extents_;         // by place
  std::vector<bool> finished_;          // by place
};

}  // namespace brenvik::bplist

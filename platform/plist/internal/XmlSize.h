// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <algorithm>
#include <cstddef>
#include <cstdint>

#include "platform/plist/Node.h"
#include "platform/plist/PropertyListCodec.h"

// How large a value is as XML, without writing it.
namespace brenvik::plist {

// What surrounds the value. The document type is the one every writer of this format emits.
inline constexpr char kXmlHead[] =
    "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n"
    "<!DOCTYPE plist PUBLIC \"-//Apple//DTD PLIST 1.0//EN\" "
    "\"http://www.apple.com/DTDs/PropertyList-1.0.dtd\">\n"
    "<plist version=\"1.0\">\n";
inline constexpr char kXmlTail[] = "</plist>\n";
inline constexpr std::size_t kXmlFrame = sizeof kXmlHead + sizeof kXmlTail - 2;

// Bytes of data on one line of its base64 form, which has 76 characters.
inline constexpr std::size_t kDataBytesPerLine = 57;

// A value's form has `bytes` bytes, and one more for each of its `lines` lines and each level of indentation.
struct XmlExtent {
  std::uint64_t bytes = 0;
  std::uint64_t lines = 0;

  // One level deeper, as a child stands in its parent. Saves itself from overflow by staying huge.
  void addChild(const XmlExtent& child) noexcept {
    constexpr std::uint64_t kHuge = std::uint64_t{1} << 60;
    bytes += child.bytes + child.lines;
    lines += child.lines;
    if (bytes > kHuge) bytes = kHuge;
    if (lines > kHuge) lines = kHuge;
  }
};

// Tags and line ends of an array or a dictionary that has children, their own indentation aside.
inline constexpr XmlExtent tagExtent(Tag container) noexcept {
  return {container == Tag::array ? std::uint64_t{17} : std::uint64_t{15}, 2};
}

// At least the extent of a value or a key that is no container, or an empty one; costs nothing to find.
inline XmlExtent largestExtent(const Node& node) noexcept {
  return {64 + std::uint64_t{5} * node.size, 3 + node.size / 32};
}

// What a reader or writer of another format sums up of a value.
struct Measure {
  XmlExtent extent;        // at least
  std::size_t height = 0;  // levels of containers, an empty one included

  void addChild(const Measure& child) noexcept {
    extent.addChild(child.extent);
    height = std::max(height, child.height + 1);
  }
};
// Of a value or a key that is no container, or an empty one.
inline Measure leafMeasure(const Node& node) noexcept {
  return {largestExtent(node), std::size_t{node.isContainer()}};
}

inline bool fitsXmlLimit(const XmlExtent& extent) noexcept {
  return extent.bytes <= kLargestXmlForm - kXmlFrame;
}

// Whether the value as XML keeps to kLargestXmlForm: exact, in time linear in what is stored, however much
// of it is shared. Nesting is the caller's to limit. Throws std::bad_alloc.
bool xmlFormFits(const Node& root);

}  // namespace brenvik::plist

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/preferences/linux/BinaryObjects.h"

#include <algorithm>
#include <cstring>
#include <limits>
#include <unordered_map>

namespace brenvik::bplist {
namespace {

constexpr std::uint8_t kInteger = 0x1;
constexpr std::uint8_t kData = 0x4;
constexpr std::uint8_t kAscii = 0x5;
constexpr std::uint8_t kUtf16 = 0x6;
constexpr std::uint8_t kArray = 0xA;
constexpr std::uint8_t kDictionary = 0xD;

// Tags, line feed and the longest number or date; an entity is the most that one character can become.
constexpr std::uint64_t kXmlOverhead = 64;
constexpr std::uint64_t kXmlPerCharacter = 6;

// An object in text form takes this much; base64 of data is counted with the line feeds and indents that a
// writer may put into it.
Extent extentOf(const Shape& shape) noexcept {
  switch (shape.kind) {
    case kData:
      return {kXmlOverhead + 2 * std::uint64_t{shape.count}, 3 + std::uint64_t{shape.count} / 16, 0};
    case kAscii:
    case kUtf16:
      return {kXmlOverhead + kXmlPerCharacter * std::uint64_t{shape.count}, 1, 0};
    case kArray:
    case kDictionary:
      return {kXmlOverhead, 2, 1};  // an empty one is a level to every reader, too
    default:
      return {kXmlOverhead, 1, 0};
  }
}

// Saturating: shared parts make the sums grow by a factor at every level.
std::uint64_t sum(std::uint64_t one, std::uint64_t other) noexcept {
  return other > std::numeric_limits<std::uint64_t>::max() - one ? std::numeric_limits<std::uint64_t>::max()
                                                                 : one + other;
}

void addChild(Extent& parent, const Extent& child) noexcept {
  parent.bytes = sum(parent.bytes, sum(child.bytes, child.lines));
  parent.lines = sum(parent.lines, child.lines);
  parent.depth = std::max(parent.depth, child.depth + 1);
}

bool isContainer(const Shape& shape) noexcept { return shape.kind == kArray || shape.kind == kDictionary; }

}  // namespace

std::uint64_t readInteger(const char* at, std::size_t width) noexcept {
  std::uint64_t value = 0;
  for (std::size_t i = 0; i < width; ++i) value = value << 8 | static_cast<unsigned char>(at[i]);
  return value;
}

void writeInteger(char* at, std::size_t width, std::uint64_t value) noexcept {
  for (std::size_t i = width; i-- > 0; value >>= 8) at[i] = static_cast<char>(value & 0xFF);
}

std::size_t referenceWidth(std::size_t objects) noexcept {
  if (objects <= 0x100) return 1;
  if (objects <= 0x10000) return 2;
  return objects <= 0x100000000 ? 4 : 8;
}

std::size_t offsetWidth(std::uint64_t largest) noexcept {
  std::size_t width = 1;
  while (width < 8 && largest >> (8 * width) != 0) ++width;
  return width;
}

std::optional<Shape> shapeOf(std::string_view bytes, std::size_t widthOfReference) noexcept {
  if (bytes.empty()) return std::nullopt;
  const auto marker = static_cast<unsigned char>(bytes[0]);
  Shape shape;
  shape.kind = marker >> 4;
  shape.header = 1;
  const std::size_t low = marker & 0xF;
  std::size_t unit = 1;
  switch (shape.kind) {
    case 0x0:
      break;
    case kInteger:
    case 0x2:
    case 0x3:
      if (low > 4) return std::nullopt;
      shape.count = std::size_t{1} << low;
      break;
    case kUtf16:
      unit = 2;
      [[fallthrough]];
    case kData:
    case kAscii:
    case kArray:
    case kDictionary: {
      shape.count = low;
      if (low == 0xF) {
        if (bytes.size() < 2) return std::nullopt;
        const auto length = static_cast<unsigned char>(bytes[1]);
        if (length >> 4 != kInteger || (length & 0xF) > 3) return std::nullopt;
        const std::size_t width = std::size_t{1} << (length & 0xF);
        if (bytes.size() < 2 + width) return std::nullopt;
        shape.header = 2 + width;
        shape.count = readInteger(bytes.data() + 2, width);
      }
      if (isContainer(shape)) {
        if (shape.count > bytes.size()) return std::nullopt;
        shape.references = shape.kind == kDictionary ? 2 * shape.count : shape.count;
        unit = (shape.kind == kDictionary ? 2 : 1) * widthOfReference;
      }
      break;
    }
    default:
      return std::nullopt;
  }
  const std::size_t room = bytes.size() - shape.header;
  if (shape.count > room / unit) return std::nullopt;
  shape.size = shape.header + shape.count * unit;
  return shape;
}

void appendHeader(std::string& out, std::uint8_t kind, std::size_t count) {
  if (count < 0xF) {
    out += static_cast<char>(kind << 4 | static_cast<std::uint8_t>(count));
    return;
  }
  out += static_cast<char>(kind << 4 | 0xF);
  const std::size_t width = referenceWidth(count + 1);
  const int power = width == 1 ? 0 : width == 2 ? 1 : width == 4 ? 2 : 3;
  out += static_cast<char>(kInteger << 4 | power);
  char bytes[8];
  writeInteger(bytes, width, count);
  out.append(bytes, width);
}

void appendString(std::string& out, std::string_view utf8) {
  const bool ascii =
      std::all_of(utf8.begin(), utf8.end(), [](char c) { return static_cast<unsigned char>(c) < 0x80; });
  if (ascii) {
    appendHeader(out, kAscii, utf8.size());
    out += utf8;
    return;
  }
  std::string units;
  const auto addUnit = [&units](std::uint32_t unit) {
    units += static_cast<char>(unit >> 8 & 0xFF);
    units += static_cast<char>(unit & 0xFF);
  };
  for (std::size_t i = 0; i < utf8.size();) {
    const auto lead = static_cast<unsigned char>(utf8[i]);
    const std::size_t length = lead < 0x80 ? 1 : lead < 0xE0 ? 2 : lead < 0xF0 ? 3 : 4;
    std::uint32_t point = length == 1 ? lead : lead & (0x7Fu >> length);
    for (std::size_t k = 1; k < length && i + k < utf8.size(); ++k) {
      point = point << 6 | (static_cast<unsigned char>(utf8[i + k]) & 0x3Fu);
    }
    i += length;
    if (point > 0xFFFF) {
      addUnit(0xD800 + ((point - 0x10000) >> 10));
      addUnit(0xDC00 + (point & 0x3FF));
    } else {
      addUnit(point);
    }
  }
  appendHeader(out, kUtf16, units.size() / 2);
  out += units;
}

std::optional<Document> Document::open(std::string_view bytes) noexcept {
  if (bytes.size() < kMagic.size() + kTrailerSize || bytes.substr(0, kMagic.size()) != kMagic) {
    return std::nullopt;
  }
  const char* const trailer = bytes.data() + bytes.size() - kTrailerSize;
  Document document;
  document.bytes_ = bytes;
  document.widthOfOffset_ = static_cast<unsigned char>(trailer[6]);
  document.widthOfReference_ = static_cast<unsigned char>(trailer[7]);
  document.objects_ = readInteger(trailer + 8, 8);
  document.top_ = readInteger(trailer + 16, 8);
  document.table_ = readInteger(trailer + 24, 8);
  const auto isWidth = [](std::size_t width) { return width >= 1 && width <= 8; };
  const std::size_t end = bytes.size() - kTrailerSize;
  if (!isWidth(document.widthOfOffset_) || !isWidth(document.widthOfReference_) || document.table_ > end ||
      document.objects_ > (end - document.table_) / document.widthOfOffset_ ||
      document.objects_ > std::numeric_limits<std::uint32_t>::max() || document.top_ >= document.objects_) {
    return std::nullopt;
  }
  return document;
}

std::string_view Document::from(std::size_t object) const noexcept {
  if (object >= objects_) return {};
  const std::uint64_t offset = readInteger(bytes_.data() + table_ + object * widthOfOffset_, widthOfOffset_);
  if (offset >= table_) return {};
  return bytes_.substr(offset, table_ - offset);
}

Extractor::Extractor(const Document& document)
    : document_(document), placeOf_(document.objects(), kNoPlace) {}

void Extractor::clear() noexcept {
  for (const std::uint32_t object : order_) placeOf_[object] = kNoPlace;
  order_.clear();
  extents_.clear();
  finished_.clear();
}

std::uint32_t Extractor::add(std::size_t object, const Shape& shape) {
  const auto place = static_cast<std::uint32_t>(order_.size());
  order_.push_back(static_cast<std::uint32_t>(object));
  placeOf_[object] = place;
  extents_.push_back(extentOf(shape));
  finished_.push_back(shape.references == 0);
  return place;
}

std::size_t Extractor::referenceOf(std::string_view container, const Shape& shape,
                                   std::size_t index) const noexcept {
  const std::size_t width = document_.widthOfReference();
  return readInteger(container.data() + shape.header + index * width, width);
}

bool Extractor::select(std::size_t object) {
  clear();
  struct Frame {
    std::uint32_t place;
    std::string_view bytes;
    Shape shape;
    std::size_t next = 0;  // reference to look at next
  };
  const auto enter = [this](std::size_t number) -> std::optional<Frame> {
    const auto bytes = document_.from(number);
    const auto shape = shapeOf(bytes, document_.widthOfReference());
    if (!shape) return std::nullopt;
    return Frame{add(number, *shape), bytes, *shape};
  };
  const auto refuse = [this] {
    clear();
    return false;
  };
  std::vector<Frame> stack;
  auto root = enter(object);
  if (!root) return refuse();
  stack.push_back(*root);
  while (!stack.empty()) {
    Frame& frame = stack.back();
    if (frame.next == frame.shape.references) {
      const std::uint32_t done = frame.place;
      finished_[done] = true;
      stack.pop_back();
      if (!stack.empty()) addChild(extents_[stack.back().place], extents_[done]);
      continue;
    }
    const std::uint32_t parent = frame.place;
    const std::size_t child = referenceOf(frame.bytes, frame.shape, frame.next++);
    if (child >= placeOf_.size()) return refuse();
    if (placeOf_[child] == kNoPlace) {
      auto inner = enter(child);
      if (!inner) return refuse();
      if (inner->shape.references != 0) {
        stack.push_back(*inner);
        continue;
      }
    }
    if (!finished_[placeOf_[child]]) return refuse();  // a circle
    addChild(extents_[parent], extents_[placeOf_[child]]);
  }
  return true;
}

void Extractor::append(std::string& bytes, std::vector<std::uint32_t>& offsets, std::size_t first,
                       std::size_t widthOfReference) const {
  for (const std::uint32_t object : order_) {
    const auto source = document_.from(object);
    const auto shape = shapeOf(source, document_.widthOfReference());
    if (!shape) return;  // never: select() looked at it
    offsets.push_back(static_cast<std::uint32_t>(bytes.size()));
    if (!isContainer(*shape)) {
      bytes += source.substr(0, shape->size);
      continue;
    }
    bytes += source.substr(0, shape->header);
    const std::size_t start = bytes.size();
    bytes.resize(start + shape->references * widthOfReference);
    for (std::size_t i = 0; i < shape->references; ++i) {
      writeInteger(bytes.data() + start + i * widthOfReference, widthOfReference,
                   first + placeOf_[referenceOf(source, *shape, i)]);
    }
  }
}

}  // namespace brenvik::bplist

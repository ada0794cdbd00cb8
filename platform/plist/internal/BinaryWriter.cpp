// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/plist/internal/BinaryWriter.h"

#include <algorithm>
#include <bit>
#include <cstring>
#include <vector>

#include "platform/plist/internal/BinaryReader.h"
#include "platform/plist/internal/Document.h"
#include "platform/plist/internal/XmlSize.h"

namespace brenvik::plist {
namespace {

std::size_t widthFor(std::uint64_t largest) noexcept {
  return largest < 1u << 8 ? 1 : largest < 1u << 16 ? 2 : largest < std::uint64_t{1} << 32 ? 4 : 8;
}

bool isText(Tag tag) noexcept { return tag == Tag::string || tag == Tag::data; }

bool isAscii(const char* bytes, std::size_t size) noexcept {
  for (; size >= 8; size -= 8, bytes += 8) {
    std::uint64_t word;
    std::memcpy(&word, bytes, sizeof word);
    if ((word & 0x8080808080808080ULL) != 0) return false;
  }
  for (; size != 0; --size, ++bytes) {
    if (static_cast<unsigned char>(*bytes) >= 0x80) return false;
  }
  return true;
}

struct Object {
  Node node;
  std::uint32_t references = 0;  // of a container: where they begin
  std::uint32_t done = 0;        // of a container, when finished: its place among the measures
};

// Objects known so far, by what they say: open addressing, at least twice as many places as objects.
class ObjectTable {
 public:
  static constexpr std::uint32_t kNew = UINT32_MAX;

  // The number of the equal object, or kNew: the caller then adds this one behind the others.
  std::uint32_t findOrAdd(const Node& node, std::uint32_t hash, const std::vector<Object>& objects) {
    if ((objects.size() + 1) * 2 > places_.size()) enlarge();
    const std::size_t mask = places_.size() - 1;
    for (std::size_t at = hash & mask;; at = (at + 1) & mask) {
      Place& place = places_[at];
      if (place.object == kNew) {
        place = {hash, static_cast<std::uint32_t>(objects.size())};
        return kNew;
      }
      if (place.hash == hash && same(objects[place.object].node, node)) return place.object;
    }
  }

 private:
  struct Place {
    std::uint32_t hash;
    std::uint32_t object;
  };

  static bool same(const Node& one, const Node& other) noexcept {
    if (one.tag != other.tag || one.size != other.size) return false;
    return isText(one.tag) ? std::memcmp(one.text, other.text, one.size) == 0 : one.bits == other.bits;
  }

  void enlarge() {
    std::vector<Place> larger(std::max<std::size_t>(64, places_.size() * 4), Place{0, kNew});
    const std::size_t mask = larger.size() - 1;
    for (const Place& place : places_) {
      if (place.object == kNew) continue;
      std::size_t at = place.hash & mask;
      while (larger[at].object != kNew) at = (at + 1) & mask;
      larger[at] = place;
    }
    places_.swap(larger);
  }

  std::vector<Place> places_;
};

class Writer {
 public:
  std::optional<std::string> write(const Node& root);

 private:
  struct Measure {
    XmlExtent extent;  // at least
    std::size_t height;
  };
  struct Frame {
    const Node* children;
    std::size_t count;
    std::size_t next;
    std::uint32_t object;
    Measure measure;
  };

  bool number(const Node& root);
  std::uint32_t add(const Node& node, std::uint32_t hash);
  bool enter(const Node& container);
  void emit();
  void emitObject(const Object& object);
  void emitCounted(unsigned kind, std::size_t count);
  void emitString(const Node& node);
  void emitBig(std::uint64_t value, std::size_t width);

  ObjectTable table_;
  std::vector<Object> objects_;
  std::vector<std::uint32_t> references_;
  std::vector<Measure> done_;
  std::vector<Frame> frames_;
  std::size_t textRoom_ = 0;  // at least what texts take in the file

  std::string out_;
  char* cursor_ = nullptr;
  std::size_t referenceWidth_ = 0;
};

// The object's number; a new one stands last.
std::uint32_t Writer::add(const Node& node, std::uint32_t hash) {
  const std::uint32_t known = table_.findOrAdd(node, hash, objects_);
  if (known != ObjectTable::kNew) return known;
  objects_.push_back({node});
  if (isText(node.tag))
    textRoom_ +=
        node.tag == Tag::data || isAscii(node.text, node.size) ? node.size : 2 * std::size_t{node.size};
  return static_cast<std::uint32_t>(objects_.size() - 1);
}

bool Writer::enter(const Node& container) {
  const std::size_t count = container.childCount();
  // Every reference is at least eight bytes of the document as XML.
  if (frames_.size() == kDeepestPropertyList || references_.size() + count > kLargestXmlForm / 8)
    return false;
  const auto object = static_cast<std::uint32_t>(objects_.size() - 1);
  objects_[object].references = static_cast<std::uint32_t>(references_.size());
  frames_.push_back({container.children, count, 0, object, {tagExtent(container.tag), 1}});
  references_.resize(references_.size() + count);
  return true;
}

// Gives every object its number, a parent before its children.
bool Writer::number(const Node& root) {
  const Node& top = resolved(root);
  add(top, 0);
  if (!top.isContainer() || top.size == 0) return fitsXmlLimit(largestExtent(top)) || xmlFormFits(top);
  if (!enter(top)) return false;
  while (true) {
    Frame& frame = frames_.back();
    Object& parent = objects_[frame.object];
    if (frame.next == frame.count) {
      parent.done = static_cast<std::uint32_t>(done_.size());
      done_.push_back(frame.measure);
      frames_.pop_back();
      if (frames_.empty()) break;
      continue;  // the parent looks at this child again, and finds it done
    }
    const bool inDictionary = parent.node.tag == Tag::dictionary;
    const Node& child = resolved(frame.children[frame.next]);
    std::uint32_t hash = 0;
    if (inDictionary && frame.next % 2 == 0) {
      hash = keyHash(child);
    } else if (isText(child.tag)) {
      hash = static_cast<std::uint32_t>(hashOf(child.text, child.size)) & 0xFFFFFF;  // as keys have it
    } else {
      const std::uint64_t mixed =
          (child.bits + static_cast<std::uint64_t>(child.tag)) * 0x9E3779B97F4A7C15ULL;
      hash = static_cast<std::uint32_t>(mixed >> 32);
    }
    const std::size_t before = objects_.size();
    const std::uint32_t object = add(child, hash);
    const bool isFull = child.isContainer() && child.size != 0;
    if (isFull && object == before) {
      if (!enter(child)) return false;
      continue;
    }
    const Measure measure = isFull ? done_[objects_[object].done]
                                   : Measure{largestExtent(child), std::size_t{child.isContainer()}};
    frame.measure.extent.addChild(measure.extent);
    frame.measure.height = std::max(frame.measure.height, measure.height + 1);
    if (frames_.size() - 1 + frame.measure.height > kDeepestPropertyList) return false;
    // All the keys stand before all the values.
    std::size_t slot = frame.next;
    if (inDictionary) slot = frame.next / 2 + (frame.next % 2 == 0 ? 0 : frame.count / 2);
    references_[objects_[frame.object].references + slot] = object;
    ++frame.next;
  }
  return fitsXmlLimit(done_.back().extent) || xmlFormFits(top);
}

void Writer::emitBig(std::uint64_t value, std::size_t width) {
  for (std::size_t i = width; i-- > 0;) *cursor_++ = static_cast<char>(value >> (8 * i));
}

void Writer::emitCounted(unsigned kind, std::size_t count) {
  if (count < 15) {
    *cursor_++ = static_cast<char>(kind | count);
    return;
  }
  const std::size_t width = widthFor(count);
  *cursor_++ = static_cast<char>(kind | 15);
  *cursor_++ = static_cast<char>(0x10 | std::countr_zero(width));
  emitBig(count, width);
}

void Writer::emitString(const Node& node) {
  if (isAscii(node.text, node.size)) {
    emitCounted(0x50, node.size);
    std::memcpy(cursor_, node.text, node.size);
    cursor_ += node.size;
    return;
  }
  const auto* from = reinterpret_cast<const unsigned char*>(node.text);
  const auto* const end = from + node.size;
  std::size_t units = 0;
  for (const auto* at = from; at != end; ++at)
    units += std::size_t{(*at & 0xC0) != 0x80} + std::size_t{*at >= 0xF0};
  emitCounted(0x60, units);
  while (from != end) {  // valid UTF-8, by the contract of every string
    std::uint32_t c = *from++;
    if (c >= 0xF0) {
      c = (c & 0x07) << 18 | (from[0] & 0x3Fu) << 12 | (from[1] & 0x3Fu) << 6 | (from[2] & 0x3Fu);
      from += 3;
      c -= 0x10000;
      emitBig(0xD800 | c >> 10, 2);
      c = 0xDC00 | (c & 0x3FF);
    } else if (c >= 0xE0) {
      c = (c & 0x0F) << 12 | (from[0] & 0x3Fu) << 6 | (from[1] & 0x3Fu);
      from += 2;
    } else if (c >= 0xC0) {
      c = (c & 0x1F) << 6 | (from[0] & 0x3Fu);
      ++from;
    }
    emitBig(c, 2);
  }
}

void Writer::emitObject(const Object& object) {
  const Node& node = object.node;
  switch (node.tag) {
    case Tag::boolean:
      *cursor_++ = node.integer != 0 ? '\x09' : '\x08';
      return;
    case Tag::integer: {
      const std::size_t width = node.integer < 0 ? 8 : widthFor(node.unsignedInteger);
      *cursor_++ = static_cast<char>(0x10 | std::countr_zero(width));
      emitBig(node.unsignedInteger, width);
      return;
    }
    case Tag::unsignedInteger:
      *cursor_++ = '\x14';
      emitBig(0, 8);
      emitBig(node.unsignedInteger, 8);
      return;
    case Tag::real:
    case Tag::date:
      *cursor_++ = node.tag == Tag::real ? '\x23' : '\x33';
      emitBig(node.bits, 8);
      return;
    case Tag::data:
      emitCounted(0x40, node.size);
      std::memcpy(cursor_, node.text, node.size);
      cursor_ += node.size;
      return;
    case Tag::string:
      emitString(node);
      return;
    case Tag::array:
    case Tag::dictionary: {
      emitCounted(node.tag == Tag::array ? 0xA0 : 0xD0, node.size);
      const std::uint32_t* const first = references_.data() + object.references;
      for (std::size_t i = 0; i < node.childCount(); ++i) emitBig(first[i], referenceWidth_);
      return;
    }
    case Tag::none:
    case Tag::foreign:
    case Tag::pending:
      return;
  }
}

void Writer::emit() {
  // No object has more than a marker, a marker and a count of nine bytes, or sixteen bytes of number.
  constexpr std::size_t kObjectRoom = 17;
  constexpr std::size_t kOffsetRoom = 8;
  referenceWidth_ = widthFor(objects_.size() - 1);
  out_.resize(kBinaryMagic.size() + objects_.size() * (kObjectRoom + kOffsetRoom) + textRoom_ +
              references_.size() * referenceWidth_ + kBinaryTrailer);
  char* const begin = out_.data();
  std::memcpy(begin, kBinaryMagic.data(), kBinaryMagic.size());
  cursor_ = begin + kBinaryMagic.size();
  std::vector<std::uint64_t> offsets;
  offsets.reserve(objects_.size());
  for (const Object& object : objects_) {
    offsets.push_back(static_cast<std::uint64_t>(cursor_ - begin));
    emitObject(object);
  }
  const auto table = static_cast<std::uint64_t>(cursor_ - begin);
  const std::size_t offsetWidth = widthFor(table);
  for (const std::uint64_t offset : offsets) emitBig(offset, offsetWidth);
  emitBig(0, 6);
  emitBig(offsetWidth, 1);
  emitBig(referenceWidth_, 1);
  emitBig(objects_.size(), 8);
  emitBig(0, 8);  // the top is the first object
  emitBig(table, 8);
  out_.resize(static_cast<std::size_t>(cursor_ - begin));
}

std::optional<std::string> Writer::write(const Node& root) {
  if (!number(root)) return std::nullopt;
  emit();
  return std::move(out_);
}

}  // namespace

std::optional<std::string> writeBinary(const Node& root) { return Writer().write(root); }

}  // namespace brenvik::plist

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/plist/internal/BinaryWriter.h"

#include <algorithm>
#include <bit>
#include <cstring>

#include "platform/plist/internal/BinaryFormat.h"
#include "platform/plist/internal/Document.h"
#include "platform/plist/internal/Text.h"

namespace brenvik::plist {
namespace {

bool isText(Tag tag) noexcept { return tag == Tag::string || tag == Tag::data; }

bool isFull(const Node& node) noexcept { return node.isContainer() && node.size != 0; }

bool same(const Node& one, const Node& other) noexcept {
  if (one.tag != other.tag || one.size != other.size) return false;
  return isText(one.tag) ? std::memcmp(one.text, other.text, one.size) == 0 : one.bits == other.bits;
}

// Equal nodes have equal hashes, whether one of them is a key or not.
std::uint32_t hashOfChild(const Node& child, bool isKey) noexcept {
  if (isKey) return keyHash(child);
  if (isText(child.tag)) return static_cast<std::uint32_t>(hashOf(child.text, child.size)) & 0xFFFFFF;
  const std::uint64_t mixed = (child.bits + static_cast<std::uint64_t>(child.tag)) * 0x9E3779B97F4A7C15ULL;
  return static_cast<std::uint32_t>(mixed >> 32);
}

char* putInteger(char* to, const Node& node) noexcept {
  if (node.tag == Tag::unsignedInteger) {
    *to++ = '\x14';
    to = putBig(to, 0, 8);
    return putBig(to, node.unsignedInteger, 8);
  }
  const std::size_t width = node.integer < 0 ? 8 : widthFor(node.unsignedInteger);
  *to++ = static_cast<char>(kIntegerObject | static_cast<unsigned>(std::countr_zero(width)));
  return putBig(to, node.unsignedInteger, width);
}

}  // namespace

std::uint32_t ObjectWriter::ObjectTable::findOrAdd(const Node& node, std::uint32_t hash,
                                                   const std::vector<Object>& objects) {
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

void ObjectWriter::ObjectTable::enlarge() {
  constexpr std::size_t kSmallest = 64;
  if (places_.empty()) {
    places_.assign(kSmallest, Place{0, kNew});
    return;
  }
  std::vector<Place> larger(places_.size() * 4, Place{0, kNew});
  const std::size_t mask = larger.size() - 1;
  for (const Place& place : places_) {
    if (place.object == kNew) continue;
    std::size_t at = place.hash & mask;
    while (larger[at].object != kNew) at = (at + 1) & mask;
    larger[at] = place;
  }
  places_.swap(larger);
}

// The object's number; a new one stands last.
std::uint32_t ObjectWriter::add(const Node& node, std::uint32_t hash) {
  const std::uint32_t known = table_.findOrAdd(node, hash, objects_);
  if (known != ObjectTable::kNew) return known;
  objects_.push_back({node});
  if (isText(node.tag)) {
    const bool isCopied = node.tag == Tag::data || isAscii(node.text, node.size);
    textRoom_ += isCopied ? std::size_t{node.size} : 2 * std::size_t{node.size};
  }
  return static_cast<std::uint32_t>(objects_.size() - 1);
}

bool ObjectWriter::enter(const Node& container) {
  const std::size_t count = container.childCount();
  // Every reference is at least eight bytes of the document as XML.
  if (frames_.size() == kMaxPropertyListDepth || references_.size() + count > kLargestXmlForm / 8)
    return false;
  const auto object = static_cast<std::uint32_t>(objects_.size() - 1);
  objects_[object].references = static_cast<std::uint32_t>(references_.size());
  frames_.push_back({container.children, count, 0, object, {tagExtent(container.tag), 1}});
  references_.resize(references_.size() + count);
  return true;
}

// Finishes the container that was entered last.
void ObjectWriter::leave() {
  objects_[frames_.back().object].done = static_cast<std::uint32_t>(done_.size());
  done_.push_back(frames_.back().measure);
  frames_.pop_back();
}

// Takes in one child. A new container is entered, and looked at again when it is finished.
bool ObjectWriter::step() {
  Frame& frame = frames_.back();
  const Object& parent = objects_[frame.object];
  const std::uint32_t references = parent.references;
  const bool inDictionary = parent.node.tag == Tag::dictionary;
  const Node& child = resolved(frame.children[frame.next]);
  const std::size_t before = objects_.size();
  const std::uint32_t object = add(child, hashOfChild(child, inDictionary && frame.next % 2 == 0));
  if (isFull(child) && object == before) return enter(child);
  frame.measure.addChild(isFull(child) ? done_[objects_[object].done] : leafMeasure(child));
  if (frames_.size() - 1 + frame.measure.height > kMaxPropertyListDepth) return false;
  std::size_t slot = frame.next;
  if (inDictionary) slot = frame.next / 2 + (frame.next % 2 == 0 ? 0 : frame.count / 2);
  references_[references + slot] = object;
  ++frame.next;
  return true;
}

// Gives every object its number, a parent before its children.
bool ObjectWriter::select(const Node& root) {
  table_.clear();
  objects_.clear();
  references_.clear();
  done_.clear();
  frames_.clear();
  textRoom_ = 0;
  const Node& top = resolved(root);
  add(top, 0);
  if (isFull(top) && !enter(top)) return false;
  while (!frames_.empty()) {
    if (frames_.back().next == frames_.back().count) {
      leave();
    } else if (!step()) {
      return false;
    }
  }
  return fitsXmlLimit(measure().extent) || xmlFormFits(top);
}

Measure ObjectWriter::measure() const noexcept {
  return done_.empty() ? leafMeasure(objects_.front().node) : done_.back();
}

std::size_t ObjectWriter::room(std::size_t referenceWidth) const noexcept {
  // No object has more than sixteen bytes of number behind its marker, or a head and what it counts.
  constexpr std::size_t kObjectRoom = 17;
  return objects_.size() * kObjectRoom + textRoom_ + references_.size() * referenceWidth;
}

char* ObjectWriter::put(char* to, const Object& object, std::size_t first, std::size_t referenceWidth) const {
  const Node& node = object.node;
  switch (node.tag) {
    case Tag::boolean:
      *to++ = node.integer != 0 ? '\x09' : '\x08';
      return to;
    case Tag::integer:
    case Tag::unsignedInteger:
      return putInteger(to, node);
    case Tag::real:
    case Tag::date:
      *to++ = node.tag == Tag::real ? '\x23' : '\x33';
      return putBig(to, node.bits, 8);
    case Tag::data:
      to = putHead(to, kDataObject, node.size);
      std::memcpy(to, node.text, node.size);
      return to + node.size;
    case Tag::string:
      return putString(to, node.text, node.size);
    case Tag::array:
    case Tag::dictionary: {
      to = putHead(to, node.tag == Tag::array ? kArrayObject : kDictionaryObject, node.size);
      const std::uint32_t* const references = references_.data() + object.references;
      for (std::size_t i = 0; i < node.childCount(); ++i)
        to = putBig(to, first + references[i], referenceWidth);
      return to;
    }
    case Tag::none:
    case Tag::foreign:
    case Tag::pending:
      break;
  }
  return to;
}

void ObjectWriter::append(std::string& out, std::vector<std::uint32_t>& offsets, std::size_t first,
                          std::size_t referenceWidth) const {
  const std::size_t start = out.size();
  out.resize(start + room(referenceWidth));
  char* to = out.data() + start;
  for (const Object& object : objects_) {
    offsets.push_back(static_cast<std::uint32_t>(to - out.data()));
    to = put(to, object, first, referenceWidth);
  }
  out.resize(static_cast<std::size_t>(to - out.data()));
}

std::optional<std::string> writeBinary(const Node& root) {
  ObjectWriter writer;
  if (!writer.select(root)) return std::nullopt;
  const std::size_t objects = writer.objects();
  const std::size_t referenceWidth = referenceWidthFor(objects);
  std::string out(kBinaryMagic);
  out.reserve(out.size() + writer.room(referenceWidth) + objects * sizeof(std::uint32_t) + kTrailerSize);
  std::vector<std::uint32_t> offsets;
  offsets.reserve(objects);
  writer.append(out, offsets, 0, referenceWidth);
  const std::size_t table = out.size();
  const std::size_t offsetWidth = widthFor(table);
  appendNumbers(out, offsetWidth, objects, [&offsets](std::size_t i) { return offsets[i]; });
  appendTrailer(out, {offsetWidth, referenceWidth, objects, 0, table});
  return out;
}

}  // namespace brenvik::plist

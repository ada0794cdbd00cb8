// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/plist/EditableDictionary.h"

#include <algorithm>
#include <span>
#include <utility>

#include "platform/base/Utf8.h"
#include "platform/plist/internal/BinaryFormat.h"
#include "platform/plist/internal/BinaryReader.h"
#include "platform/plist/internal/BinaryWriter.h"
#include "platform/plist/internal/Document.h"
#include "platform/plist/internal/XmlSize.h"

namespace brenvik {

using plist::Access;
using plist::ObjectHead;
using plist::ObjectWriter;

namespace {

// Parts that two entries share in a document are doubled here. The reader's limit on the XML form bounds
// that, and this is beyond what it lets through.
constexpr std::size_t kMaxObjectBytes = 4 * EditableDictionary::kMaxFileSize;

const unsigned char* bytesOf(const std::string& objects) noexcept {
  return reinterpret_cast<const unsigned char*>(objects.data());
}

std::string keyObjectOf(std::string_view key) {
  std::string object(plist::stringRoom(key.size()), '\0');
  const char* const end = plist::putString(object.data(), key.data(), key.size());
  object.resize(static_cast<std::size_t>(end - object.data()));
  return object;
}

// Adds `by` to every reference of the containers that stand at these offsets.
void shiftReferences(std::string& objects, std::span<const std::uint32_t> offsets, std::size_t width,
                     std::int64_t by) noexcept {
  const unsigned char* const begin = bytesOf(objects);
  for (const std::uint32_t offset : offsets) {
    ObjectHead head;
    if (!plist::readHead(begin + offset, begin + objects.size(), &head) || !head.isContainer()) continue;
    std::size_t at = offset + head.size;
    for (std::size_t i = 0; i < head.references(); ++i, at += width) {
      const std::uint64_t moved = plist::loadBig(begin + at, width) + static_cast<std::uint64_t>(by);
      plist::putBig(objects.data() + at, moved, width);
    }
  }
}

// The dictionary is one more level around the value.
bool isTooDeep(const ObjectWriter& value) noexcept {
  return value.measure().height + 1 > kMaxPropertyListDepth;
}

}  // namespace

// The value of an entry to be: what set() finds out before it touches anything.
struct EditableDictionary::Draft {
  std::string bytes;                   // of its objects
  std::vector<std::uint32_t> offsets;  // of each of them in `bytes`
};

EditableDictionary::EditableDictionary() : objects_(plist::kBinaryMagic) {}

std::optional<EditableDictionary> EditableDictionary::of(const PropertyList& dictionary) {
  if (!dictionary.is(PropertyList::Type::dictionary)) return std::nullopt;
  const plist::Node& top = Access::node(dictionary);
  const std::size_t count = top.size;
  EditableDictionary made;
  made.entries_.reserve(count);
  made.offsets_.reserve(2 * count);
  made.makeRoomFor(2 * count + 1);
  ObjectWriter writer;
  bool fits = true;
  for (std::size_t i = 0; i < count; ++i) {
    if (!writer.select(top.children[2 * i + 1]) || isTooDeep(writer)) return std::nullopt;
    made.makeRoomFor(made.offsets_.size() + 1 + writer.objects() + 1);
    made.entries_.push_back(static_cast<std::uint32_t>(made.offsets_.size()));
    made.offsets_.push_back(static_cast<std::uint32_t>(made.objects_.size()));
    made.objects_ += keyObjectOf(dictionary.keyAt(i));
    writer.append(made.objects_, made.offsets_, made.offsets_.size(), made.referenceWidth_);
    if (made.objects_.size() > kMaxObjectBytes) return std::nullopt;
    fits = made.addXmlSize(dictionary.keyAt(i).size(), writer);
  }
  if (!fits && !plist::xmlFormFits(top)) return std::nullopt;
  return made;
}

PropertyList EditableDictionary::find(std::string_view key) const {
  if (!isValidUtf8(key)) return {};
  const std::size_t entry = entryOf(keyObjectOf(key));
  if (entry == entries_.size()) return {};
  const Range value = valueRangeOf(entry);
  const std::span offsets(offsets_.data() + value.firstObject, value.endObject - value.firstObject);
  return plist::readObjects(std::string_view(objects_).substr(0, value.endByte), offsets, value.firstObject,
                            referenceWidth_);
}

EditableDictionary::Change EditableDictionary::set(std::string_view key, const PropertyList& value) {
  if (!isValidUtf8(key)) return Change::refused;
  const std::string wanted = keyObjectOf(key);
  makeIndex();
  const std::size_t rank = rankOf(wanted);
  const bool exists = hasKey(rank, wanted);
  if (!value) return exists ? remove(rank) : Change::none;

  ObjectWriter writer;
  if (!writer.select(Access::node(value)) || isTooDeep(writer)) return Change::refused;
  const std::size_t entry = exists ? byKey_[rank] : entries_.size();
  const Range old = exists ? rangeOf(entry) : Range{offsets_.size(), offsets_.size(), 0, 0};
  const std::size_t objects = offsets_.size() - (old.endObject - old.firstObject) + 1 + writer.objects();
  makeRoomFor(objects + 1);
  Draft draft;
  writer.append(draft.bytes, draft.offsets, old.firstObject + 1, referenceWidth_);
  // References may have become wider.
  const std::size_t oldBytes = exists ? rangeOf(entry).endByte - rangeOf(entry).firstByte : 0;
  const std::size_t bytes = objects_.size() - oldBytes + wanted.size() + draft.bytes.size();
  if (sizeOfFile(entries_.size() + std::size_t{!exists}, objects, bytes) > kMaxFileSize)
    return Change::refused;
  if (exists && holds(entry, draft)) return Change::none;

  std::optional<EditableDictionary> before;
  const std::uint64_t xmlBytes = xmlBytes_;
  const std::uint64_t xmlLines = xmlLines_;
  const bool isSure = addXmlSize(key.size(), writer);
  if (!isSure) {
    before = *this;
    before->xmlBytes_ = xmlBytes;
    before->xmlLines_ = xmlLines;
  }
  if (exists) {
    replaceValue(entry, draft);
  } else {
    append(wanted, draft);
    byKey_.insert(byKey_.begin() + static_cast<std::ptrdiff_t>(rank), static_cast<std::uint32_t>(entry));
  }
  if (!isSure && !readBack()) {
    *this = std::move(*before);
    return Change::refused;
  }
  return Change::made;
}

std::array<std::string_view, 2> EditableDictionary::content() {
  const std::size_t count = entries_.size();
  const std::size_t top = objects_.size();
  tail_.clear();
  tail_.reserve(sizeOfFile(count, offsets_.size(), top) - top);
  tail_.resize(plist::kLargestHead);
  tail_.resize(
      static_cast<std::size_t>(plist::putHead(tail_.data(), plist::kDictionaryObject, count) - tail_.data()));
  plist::appendNumbers(tail_, referenceWidth_, count, [this](std::size_t i) { return entries_[i]; });
  plist::appendNumbers(tail_, referenceWidth_, count, [this](std::size_t i) { return entries_[i] + 1; });
  const std::size_t table = top + tail_.size();
  const std::size_t width = plist::widthFor(top);
  plist::appendNumbers(tail_, width, offsets_.size(), [this](std::size_t i) { return offsets_[i]; });
  plist::appendNumbers(tail_, width, 1, [top](std::size_t) { return top; });
  plist::appendTrailer(tail_, {width, referenceWidth_, offsets_.size() + 1, offsets_.size(), table});
  return {objects_, tail_};
}

EditableDictionary::Range EditableDictionary::rangeOf(std::size_t entry) const noexcept {
  const std::size_t first = entries_[entry];
  if (entry + 1 == entries_.size()) return {first, offsets_.size(), offsets_[first], objects_.size()};
  const std::size_t end = entries_[entry + 1];
  return {first, end, offsets_[first], offsets_[end]};
}

EditableDictionary::Range EditableDictionary::valueRangeOf(std::size_t entry) const noexcept {
  Range range = rangeOf(entry);
  range.firstByte = offsets_[++range.firstObject];
  return range;
}

std::string_view EditableDictionary::keyObject(std::size_t entry) const noexcept {
  const std::uint32_t number = entries_[entry];
  return std::string_view(objects_).substr(offsets_[number], offsets_[number + 1] - offsets_[number]);
}

std::size_t EditableDictionary::rankOf(std::string_view keyObject) const noexcept {
  const auto at =
      std::lower_bound(byKey_.begin(), byKey_.end(), keyObject,
                       [this](std::uint32_t entry, auto key) { return this->keyObject(entry) < key; });
  return static_cast<std::size_t>(at - byKey_.begin());
}

// A caller that reads only a value or two searches the keys without the index; making it would take longer.
std::size_t EditableDictionary::entryOf(std::string_view keyObject) const noexcept {
  if (byKey_.size() == entries_.size()) {
    const std::size_t rank = rankOf(keyObject);
    return hasKey(rank, keyObject) ? byKey_[rank] : entries_.size();
  }
  std::size_t entry = 0;
  while (entry < entries_.size() && this->keyObject(entry) != keyObject) ++entry;
  return entry;
}

void EditableDictionary::makeIndex() {
  if (byKey_.size() == entries_.size()) return;
  byKey_.resize(entries_.size());
  for (std::size_t i = 0; i < byKey_.size(); ++i) byKey_[i] = static_cast<std::uint32_t>(i);
  std::sort(byKey_.begin(), byKey_.end(),
            [this](std::uint32_t one, std::uint32_t other) { return keyObject(one) < keyObject(other); });
}

bool EditableDictionary::hasKey(std::size_t rank, std::string_view keyObject) const noexcept {
  return rank < byKey_.size() && this->keyObject(byKey_[rank]) == keyObject;
}

// Equal values are equal objects in the same order.
bool EditableDictionary::holds(std::size_t entry, const Draft& draft) const noexcept {
  const Range value = valueRangeOf(entry);
  return value.endObject - value.firstObject == draft.offsets.size() &&
         std::string_view(objects_).substr(value.firstByte, value.endByte - value.firstByte) == draft.bytes;
}

// The caller sees to byKey_ and the size as XML, here and below.
void EditableDictionary::append(std::string_view keyObject, const Draft& draft) {
  entries_.push_back(static_cast<std::uint32_t>(offsets_.size()));
  offsets_.push_back(static_cast<std::uint32_t>(objects_.size()));
  objects_ += keyObject;
  const auto firstByte = static_cast<std::uint32_t>(objects_.size());
  for (const std::uint32_t offset : draft.offsets) offsets_.push_back(firstByte + offset);
  objects_ += draft.bytes;
}

void EditableDictionary::replaceValue(std::size_t entry, const Draft& draft) {
  const Range old = valueRangeOf(entry);
  const auto objects = static_cast<std::int64_t>(draft.offsets.size()) -
                       static_cast<std::int64_t>(old.endObject - old.firstObject);
  const auto bytes =
      static_cast<std::int64_t>(draft.bytes.size()) - static_cast<std::int64_t>(old.endByte - old.firstByte);
  objects_.replace(old.firstByte, old.endByte - old.firstByte, draft.bytes);
  const auto at = offsets_.begin() + static_cast<std::ptrdiff_t>(old.firstObject);
  if (objects > 0) {
    offsets_.insert(at, static_cast<std::size_t>(objects), 0);
  } else {
    offsets_.erase(at, at - static_cast<std::ptrdiff_t>(objects));
  }
  for (std::size_t i = 0; i < draft.offsets.size(); ++i) {
    offsets_[old.firstObject + i] = static_cast<std::uint32_t>(old.firstByte + draft.offsets[i]);
  }
  renumberFrom(entry + 1, objects, bytes);
}

EditableDictionary::Change EditableDictionary::remove(std::size_t rank) {
  const std::size_t entry = byKey_[rank];
  const Range old = rangeOf(entry);
  const std::size_t objects = old.endObject - old.firstObject;
  const std::size_t bytes = old.endByte - old.firstByte;
  if (sizeOfFile(entries_.size() - 1, offsets_.size() - objects, objects_.size() - bytes) > kMaxFileSize) {
    return Change::refused;
  }
  objects_.erase(old.firstByte, bytes);
  offsets_.erase(offsets_.begin() + static_cast<std::ptrdiff_t>(old.firstObject),
                 offsets_.begin() + static_cast<std::ptrdiff_t>(old.endObject));
  entries_.erase(entries_.begin() + static_cast<std::ptrdiff_t>(entry));
  byKey_.erase(byKey_.begin() + static_cast<std::ptrdiff_t>(rank));
  for (std::uint32_t& place : byKey_) {
    if (place > entry) --place;
  }
  renumberFrom(entry, -static_cast<std::int64_t>(objects), -static_cast<std::int64_t>(bytes));
  return Change::made;
}

// Entries from this one on have moved by so many object numbers and bytes; the arrays are in place already.
void EditableDictionary::renumberFrom(std::size_t entry, std::int64_t objects, std::int64_t bytes) noexcept {
  if (entry >= entries_.size()) return;
  if (objects != 0) {
    for (std::size_t i = entry; i < entries_.size(); ++i) {
      entries_[i] = static_cast<std::uint32_t>(entries_[i] + objects);
    }
  }
  if (bytes != 0) {
    for (std::size_t i = entries_[entry]; i < offsets_.size(); ++i) {
      offsets_[i] = static_cast<std::uint32_t>(offsets_[i] + bytes);
    }
  }
  if (objects == 0) return;
  for (std::size_t i = entry; i < entries_.size(); ++i) {
    const Range value = valueRangeOf(i);
    const std::size_t count = value.endObject - value.firstObject;
    if (count < 2) continue;  // refers to nothing
    shiftReferences(objects_, std::span(offsets_).subspan(value.firstObject, count), referenceWidth_,
                    objects);
  }
}

// Makes references as wide as so many objects need.
void EditableDictionary::makeRoomFor(std::size_t objects) {
  const std::size_t width = plist::referenceWidthFor(objects);
  if (width <= referenceWidth_) return;
  const unsigned char* const begin = bytesOf(objects_);
  const unsigned char* const end = begin + objects_.size();
  std::string wide(plist::kBinaryMagic);
  wide.reserve(objects_.size() + offsets_.size() * (width - referenceWidth_));
  for (std::size_t i = 0; i < offsets_.size(); ++i) {
    const std::size_t from = offsets_[i];
    const std::size_t to = i + 1 < offsets_.size() ? offsets_[i + 1] : objects_.size();
    offsets_[i] = static_cast<std::uint32_t>(wide.size());
    ObjectHead head;
    if (!plist::readHead(begin + from, end, &head) || !head.isContainer()) {
      wide.append(objects_, from, to - from);
      continue;
    }
    wide.append(objects_, from, head.size);
    const unsigned char* const references = begin + from + head.size;
    plist::appendNumbers(wide, width, head.references(), [&](std::size_t reference) {
      return plist::loadBig(references + reference * referenceWidth_, referenceWidth_);
    });
  }
  objects_ = std::move(wide);
  referenceWidth_ = width;
}

// At least what the file takes with so many entries and, the dictionary's own aside, objects and bytes of
// them.
std::size_t EditableDictionary::sizeOfFile(std::size_t entries, std::size_t objects,
                                           std::size_t bytes) const noexcept {
  return bytes + plist::kLargestHead + entries * 2 * referenceWidth_ +
         (objects + 1) * plist::widthFor(bytes) + plist::kTrailerSize;
}

// Counts the entry. True while the XML form surely keeps to the limit.
bool EditableDictionary::addXmlSize(std::size_t keySize, const ObjectWriter& value) noexcept {
  plist::XmlExtent whole{xmlBytes_, xmlLines_};
  plist::Node key;
  key.tag = plist::Tag::string;
  key.size = static_cast<std::uint32_t>(keySize);
  whole.addChild(plist::largestExtent(key));
  whole.addChild(value.measure().extent);
  xmlBytes_ = whole.bytes;
  xmlLines_ = whole.lines;
  whole.bytes += plist::tagExtent(plist::Tag::dictionary).bytes;
  return plist::fitsXmlLimit(whole);
}

// Whether the reader takes the file. If so, its size as XML is counted anew: it grows with every value set,
// also with those that took another's place.
bool EditableDictionary::readBack() {
  const auto pieces = content();
  std::string whole(pieces[0]);
  whole += pieces[1];
  auto again = of(plist::readBinary(whole));
  if (!again) return false;
  *this = std::move(*again);
  return true;
}

}  // namespace brenvik

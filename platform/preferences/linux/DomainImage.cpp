// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/preferences/linux/DomainImage.h"

#include <algorithm>
#include <new>
#include <span>
#include <utility>

#include "platform/base/Utf8.h"
#include "platform/plist/PropertyListCodec.h"

namespace brenvik {
namespace {

constexpr std::uint8_t kDictionaryKind = 0xD;
// What the dictionary itself, the document type and the outermost tags add to the XML form.
constexpr std::uint64_t kXmlFrame = 1024;
// Parts that two entries share in a foreign file are doubled here; the reader's limit on the XML form bounds
// that, and this is beyond what it lets through.
constexpr std::size_t kLargestImage = 4 * kLargestDomain;

std::uint64_t xmlSizeOf(std::string_view keyObject, const bplist::Extent& value) noexcept {
  const std::uint64_t key = 64 + 6 * std::uint64_t{keyObject.size()};
  const std::uint64_t sum = value.bytes + value.lines;
  return sum < value.bytes || sum + key < sum ? ~std::uint64_t{0} : sum + key;
}

std::uint64_t saturatingSum(std::uint64_t one, std::uint64_t other) noexcept {
  return one + other < one ? ~std::uint64_t{0} : one + other;
}

// The compiler turns the inner loop into a byte swap, or a few stores: the tables of a large domain are
// written anew at every change.
template <std::size_t width, typename Numbers>
void putNumbers(char* out, std::size_t count, Numbers numberAt) noexcept {
  for (std::size_t i = 0; i < count; ++i, out += width) {
    const std::uint64_t number = numberAt(i);
    for (std::size_t byte = 0; byte < width; ++byte) {
      out[byte] = static_cast<char>(number >> (8 * (width - 1 - byte)) & 0xFF);
    }
  }
}

template <typename Numbers>
void appendNumbers(std::string& out, std::size_t width, std::size_t count, Numbers numberAt) {
  const std::size_t start = out.size();
  out.resize(start + width * count);
  char* const at = out.data() + start;
  switch (width) {
    case 1:
      return putNumbers<1>(at, count, numberAt);
    case 2:
      return putNumbers<2>(at, count, numberAt);
    case 3:
      return putNumbers<3>(at, count, numberAt);
    default:
      return putNumbers<4>(at, count, numberAt);  // an image never needs more
  }
}

void appendTrailer(std::string& out, std::size_t offsetWidth, std::size_t referenceWidth, std::size_t objects,
                   std::size_t top, std::size_t table) {
  char trailer[bplist::kTrailerSize] = {};
  trailer[6] = static_cast<char>(offsetWidth);
  trailer[7] = static_cast<char>(referenceWidth);
  bplist::writeInteger(trailer + 8, 8, objects);
  bplist::writeInteger(trailer + 16, 8, top);
  bplist::writeInteger(trailer + 24, 8, table);
  out.append(trailer, sizeof trailer);
}

// The codec's answers, with a lack of memory thrown.
PropertyList parse(std::string_view bytes) {
  CodecFailure failure{};
  PropertyList value = parsePropertyList(std::as_bytes(std::span(bytes)), &failure);
  if (failure == CodecFailure::noMemory) throw std::bad_alloc();
  return value;
}
std::optional<std::string> serialize(const PropertyList& value) {
  CodecFailure failure{};
  auto bytes = serializePropertyList(value, PropertyListFormat::binary, &failure);
  if (failure == CodecFailure::noMemory) throw std::bad_alloc();
  return bytes;
}

// Adds `by` to every reference of the containers that stand at these offsets.
void shiftReferences(char* bytes, std::size_t size, std::span<const std::uint32_t> offsets, std::size_t width,
                     std::int64_t by) noexcept {
  for (const std::uint32_t offset : offsets) {
    const auto shape = bplist::shapeOf({bytes + offset, size - offset}, width);
    if (!shape) continue;
    char* at = bytes + offset + shape->header;
    for (std::size_t i = 0; i < shape->references; ++i, at += width) {
      bplist::writeInteger(at, width, bplist::readInteger(at, width) + static_cast<std::uint64_t>(by));
    }
  }
}

}  // namespace

std::optional<DomainImage> DomainImage::of(const PropertyList& dictionary) {
  if (!dictionary.is(PropertyList::Type::dictionary)) return std::nullopt;
  // Written by our own codec, whatever file it came from: one form to take apart, checked already.
  const auto bytes = serialize(dictionary);
  if (!bytes) return std::nullopt;
  const auto document = bplist::Document::open(*bytes);
  if (!document) return std::nullopt;
  const auto top = document->from(document->top());
  const auto shape = bplist::shapeOf(top, document->widthOfReference());
  if (!shape || shape->kind != kDictionaryKind || shape->count != dictionary.size()) return std::nullopt;

  DomainImage image;
  image.objects_.reserve(bytes->size());
  image.entries_.reserve(shape->count);
  image.offsets_.reserve(document->objects() + shape->count);
  // Sharing between entries may hide some objects; what is missing then is made up for on the way.
  image.makeRoomFor(document->objects() + shape->count);
  bplist::Extractor value(*document);
  std::string keyObject;
  const std::size_t width = document->widthOfReference();
  const char* const values = top.data() + shape->header + shape->count * width;
  for (std::size_t i = 0; i < shape->count; ++i) {
    if (!value.select(bplist::readInteger(values + i * width, width))) return std::nullopt;
    keyObject.clear();
    bplist::appendString(keyObject, dictionary.keyAt(i));
    image.append(keyObject, value);
    image.xmlSize_ = saturatingSum(image.xmlSize_, xmlSizeOf(keyObject, value.extent()));
    if (image.objects_.size() > kLargestImage) return std::nullopt;
  }
  return image;
}

PropertyList DomainImage::find(std::string_view key) const {
  if (!isValidUtf8(key)) return {};
  std::string wanted;
  bplist::appendString(wanted, key);
  const std::size_t entry = entryOf(wanted);
  if (entry == entries_.size()) return {};
  // The entry's objects make a document of their own.
  const std::size_t firstObject = entries_[entry].first + 1;
  const std::size_t firstByte = offsets_[firstObject];
  const std::span<const std::uint32_t> offsets(offsets_.data() + firstObject,
                                               endOfNumbers(entry) - firstObject);
  const auto slice = std::string_view(objects_).substr(firstByte, endOfBytes(entry) - firstByte);
  std::string document(bplist::kMagic);
  document += slice;
  std::vector<std::uint32_t> moved(offsets.begin(), offsets.end());
  for (std::uint32_t& offset : moved) {
    offset = static_cast<std::uint32_t>(offset - firstByte + bplist::kMagic.size());
  }
  shiftReferences(document.data(), document.size(), moved, widthOfReference_,
                  -static_cast<std::int64_t>(firstObject));
  const std::size_t table = document.size();
  const std::size_t width = bplist::offsetWidth(table);
  appendNumbers(document, width, moved.size(), [&moved](std::size_t i) { return moved[i]; });
  appendTrailer(document, width, widthOfReference_, moved.size(), 0, table);
  return parse(document);
}

DomainImage::Change DomainImage::set(std::string_view key, const PropertyList& value) {
  if (!isValidUtf8(key)) return Change::refused;
  std::string wanted;
  bplist::appendString(wanted, key);
  makeIndex();
  const std::size_t rank = rankOf(wanted);
  const bool exists = hasKey(rank, wanted);
  const std::size_t entry = exists ? byKey_[rank] : entries_.size();
  const std::size_t oldObjects = exists ? endOfNumbers(entry) - entries_[entry].first : 0;
  const std::size_t oldBytes = exists ? endOfBytes(entry) - offsets_[entries_[entry].first] : 0;
  const std::size_t otherObjects = offsets_.size() - oldObjects;
  const std::size_t otherBytes = objects_.size() - oldBytes;
  if (!value) {
    if (!exists) return Change::none;
    if (sizeOfFile(entries_.size() - 1, otherObjects, otherBytes) > kLargestDomain) return Change::refused;
    remove(rank);
    return Change::made;
  }

  const auto bytes = serialize(value);
  if (!bytes) return Change::refused;
  const auto document = bplist::Document::open(*bytes);
  if (!document) return Change::refused;
  bplist::Extractor extractor(*document);
  if (!extractor.select(document->top())) return Change::refused;
  // The domain's dictionary is one more level around the value.
  if (extractor.extent().depth + 1 > kMaxPropertyListDepth) return Change::refused;

  makeRoomFor(otherObjects + extractor.objects() + 1);
  Draft draft;
  const std::size_t number = exists ? entries_[entry].first : offsets_.size();
  extractor.append(draft.bytes, draft.offsets, number + 1, widthOfReference_);
  if (sizeOfFile(entries_.size() + (exists ? 0 : 1), otherObjects + 1 + draft.offsets.size(),
                 otherBytes + wanted.size() + draft.bytes.size()) > kLargestDomain) {
    return Change::refused;
  }
  if (exists) {
    const std::size_t firstByte = offsets_[entries_[entry].first + 1];
    if (oldObjects == draft.offsets.size() + 1 &&
        std::string_view(objects_).substr(firstByte, endOfBytes(entry) - firstByte) == draft.bytes) {
      return Change::none;
    }
  }

  const std::uint64_t xmlSize = saturatingSum(xmlSize_, xmlSizeOf(wanted, extractor.extent()));
  const bool isSure = saturatingSum(xmlSize, kXmlFrame) <= kLargestXmlForm;
  std::optional<DomainImage> before;
  if (!isSure) before = *this;
  xmlSize_ = xmlSize;
  if (exists) {
    replaceValue(entry, draft);
  } else {
    append(wanted, extractor);
    byKey_.insert(byKey_.begin() + static_cast<std::ptrdiff_t>(rank), static_cast<std::uint32_t>(entry));
  }
  if (!isSure && !readBack()) {
    *this = std::move(*before);
    return Change::refused;
  }
  return Change::made;
}

std::array<std::string_view, 2> DomainImage::content() {
  const std::size_t count = entries_.size();
  tail_.clear();
  tail_.reserve(sizeOfFile(count, offsets_.size(), objects_.size()) - objects_.size());
  bplist::appendHeader(tail_, kDictionaryKind, count);
  appendNumbers(tail_, widthOfReference_, count, [this](std::size_t i) { return entries_[i].first; });
  appendNumbers(tail_, widthOfReference_, count, [this](std::size_t i) { return entries_[i].first + 1; });
  const std::size_t tableAt = objects_.size() + tail_.size();
  const std::size_t width = bplist::offsetWidth(objects_.size());
  appendNumbers(tail_, width, offsets_.size(), [this](std::size_t i) { return offsets_[i]; });
  appendNumbers(tail_, width, 1, [this](std::size_t) { return objects_.size(); });
  appendTrailer(tail_, width, widthOfReference_, offsets_.size() + 1, offsets_.size(), tableAt);
  return {objects_, tail_};
}

std::uint32_t DomainImage::endOfNumbers(std::size_t entry) const noexcept {
  return entry + 1 < entries_.size() ? entries_[entry + 1].first
                                     : static_cast<std::uint32_t>(offsets_.size());
}

std::size_t DomainImage::endOfBytes(std::size_t entry) const noexcept {
  return entry + 1 < entries_.size() ? offsets_[entries_[entry + 1].first] : objects_.size();
}

std::string_view DomainImage::keyObject(std::size_t entry) const noexcept {
  const std::uint32_t number = entries_[entry].first;
  return std::string_view(objects_).substr(offsets_[number], offsets_[number + 1] - offsets_[number]);
}

std::size_t DomainImage::rankOf(std::string_view keyObject) const noexcept {
  const auto at =
      std::lower_bound(byKey_.begin(), byKey_.end(), keyObject,
                       [this](std::uint32_t entry, auto key) { return this->keyObject(entry) < key; });
  return static_cast<std::size_t>(at - byKey_.begin());
}

// Without the index, whoever reads a value or two looks through the keys; making it would take longer.
std::size_t DomainImage::entryOf(std::string_view keyObject) const noexcept {
  if (byKey_.size() == entries_.size()) {
    const std::size_t rank = rankOf(keyObject);
    return hasKey(rank, keyObject) ? byKey_[rank] : entries_.size();
  }
  std::size_t entry = 0;
  while (entry < entries_.size() && this->keyObject(entry) != keyObject) ++entry;
  return entry;
}

void DomainImage::makeIndex() {
  if (byKey_.size() == entries_.size()) return;
  byKey_.resize(entries_.size());
  for (std::size_t i = 0; i < byKey_.size(); ++i) byKey_[i] = static_cast<std::uint32_t>(i);
  std::sort(byKey_.begin(), byKey_.end(),
            [this](std::uint32_t one, std::uint32_t other) { return keyObject(one) < keyObject(other); });
}

bool DomainImage::hasKey(std::size_t rank, std::string_view keyObject) const noexcept {
  return rank < byKey_.size() && this->keyObject(byKey_[rank]) == keyObject;
}

// The caller sees to byKey_ and xmlSize_.
void DomainImage::append(std::string_view keyObject, const bplist::Extractor& value) {
  makeRoomFor(offsets_.size() + 1 + value.objects() + 1);
  const auto number = static_cast<std::uint32_t>(offsets_.size());
  entries_.push_back({number});
  offsets_.push_back(static_cast<std::uint32_t>(objects_.size()));
  objects_ += keyObject;
  value.append(objects_, offsets_, number + 1, widthOfReference_);
}

void DomainImage::replaceValue(std::size_t entry, const Draft& draft) {
  const std::size_t firstObject = entries_[entry].first + 1;
  const std::size_t lastObject = endOfNumbers(entry);
  const std::size_t firstByte = offsets_[firstObject];
  const std::size_t lastByte = endOfBytes(entry);
  const auto objects =
      static_cast<std::int64_t>(draft.offsets.size()) - static_cast<std::int64_t>(lastObject - firstObject);
  const auto bytes =
      static_cast<std::int64_t>(draft.bytes.size()) - static_cast<std::int64_t>(lastByte - firstByte);
  objects_.replace(firstByte, lastByte - firstByte, draft.bytes);
  const auto at = offsets_.begin() + static_cast<std::ptrdiff_t>(firstObject);
  if (objects > 0) {
    offsets_.insert(at, static_cast<std::size_t>(objects), 0);
  } else {
    offsets_.erase(at, at - static_cast<std::ptrdiff_t>(objects));
  }
  for (std::size_t i = 0; i < draft.offsets.size(); ++i) {
    offsets_[firstObject + i] = static_cast<std::uint32_t>(firstByte + draft.offsets[i]);
  }
  renumberFrom(entry + 1, objects, bytes);
}

void DomainImage::remove(std::size_t rank) {
  const std::size_t entry = byKey_[rank];
  const std::size_t firstObject = entries_[entry].first;
  const std::size_t lastObject = endOfNumbers(entry);
  const std::size_t firstByte = offsets_[firstObject];
  const std::size_t lastByte = endOfBytes(entry);
  objects_.erase(firstByte, lastByte - firstByte);
  offsets_.erase(offsets_.begin() + static_cast<std::ptrdiff_t>(firstObject),
                 offsets_.begin() + static_cast<std::ptrdiff_t>(lastObject));
  entries_.erase(entries_.begin() + static_cast<std::ptrdiff_t>(entry));
  byKey_.erase(byKey_.begin() + static_cast<std::ptrdiff_t>(rank));
  for (std::uint32_t& place : byKey_) {
    if (place > entry) --place;
  }
  renumberFrom(entry, -static_cast<std::int64_t>(lastObject - firstObject),
               -static_cast<std::int64_t>(lastByte - firstByte));
}

// Entries from this one on have moved by so many object numbers and bytes; the arrays are in place already.
void DomainImage::renumberFrom(std::size_t entry, std::int64_t objects, std::int64_t bytes) noexcept {
  if (entry >= entries_.size()) return;
  if (objects != 0) {
    for (std::size_t i = entry; i < entries_.size(); ++i) {
      entries_[i].first = static_cast<std::uint32_t>(entries_[i].first + objects);
    }
  }
  if (bytes != 0) {
    for (std::size_t i = entries_[entry].first; i < offsets_.size(); ++i) {
      offsets_[i] = static_cast<std::uint32_t>(offsets_[i] + bytes);
    }
  }
  if (objects == 0) return;
  for (std::size_t i = entry; i < entries_.size(); ++i) {
    const std::size_t first = entries_[i].first + 1;
    const std::size_t count = endOfNumbers(i) - first;
    if (count < 2) continue;  // refers to nothing
    shiftReferences(objects_.data(), objects_.size(), std::span(offsets_).subspan(first, count),
                    widthOfReference_, objects);
  }
}

void DomainImage::makeRoomFor(std::size_t objects) {
  const std::size_t width = bplist::referenceWidth(objects);
  if (width <= widthOfReference_) return;
  std::string wide;
  wide.reserve(objects_.size() + offsets_.size() * (width - widthOfReference_));
  wide += bplist::kMagic;
  for (std::uint32_t& offset : offsets_) {
    const auto source = std::string_view(objects_).substr(offset);
    const auto shape = bplist::shapeOf(source, widthOfReference_);
    offset = static_cast<std::uint32_t>(wide.size());
    if (!shape) continue;  // never: these are our own
    if (shape->references == 0) {
      wide += source.substr(0, shape->size);
      continue;
    }
    wide += source.substr(0, shape->header);
    const char* const references = source.data() + shape->header;
    appendNumbers(wide, width, shape->references, [&](std::size_t i) {
      return bplist::readInteger(references + i * widthOfReference_, widthOfReference_);
    });
  }
  objects_ = std::move(wide);
  widthOfReference_ = width;
}

std::size_t DomainImage::sizeOfFile(std::size_t entries, std::size_t objects,
                                    std::size_t bytes) const noexcept {
  constexpr std::size_t kLongestHeader = 10;
  return bytes + kLongestHeader + entries * 2 * widthOfReference_ +
         (objects + 1) * bplist::offsetWidth(bytes) + bplist::kTrailerSize;
}

// Whether the codec reads the image. If so it is counted anew: xmlSize_ grows with every value set, also with
// those that took another's place.
bool DomainImage::readBack() {
  const auto pieces = content();
  std::string whole(pieces[0]);
  whole += pieces[1];
  const PropertyList dictionary = parse(whole);
  auto again = of(dictionary);
  if (!again) return false;
  *this = std::move(*again);
  return true;
}

}  // namespace brenvik

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "client/EventText.h"

#include <algorithm>
#include <array>
#include <cstdint>
#include <cstring>
#include <optional>

namespace brenvik::client {
namespace {

using Bytes = std::span<const std::byte>;

constexpr std::string_view kMagic = "bplist00";
constexpr std::size_t kTrailerSize = 32;

std::optional<std::uint64_t> readBigEndian(Bytes bytes, std::size_t offset, std::size_t width) noexcept {
  if (width == 0 || width > 8 || offset > bytes.size() || bytes.size() - offset < width) return std::nullopt;
  std::uint64_t value = 0;
  for (std::size_t i = 0; i < width; ++i)
    value = value << 8 | std::to_integer<std::uint64_t>(bytes[offset + i]);
  return value;
}

enum class Kind : std::uint8_t { ascii = 0x5, utf16 = 0x6, dictionary = 0xD };

struct Object {
  Kind kind;
  std::size_t count;    // of characters, UTF-16 units or entries
  std::size_t content;  // offset of the first
};

class Document {
 public:
  // False when the trailer is not one of a document of these bytes.
  bool open(Bytes bytes) noexcept;
  std::size_t top() const noexcept { return top_; }
  std::optional<Object> object(std::size_t reference) const noexcept;
  std::optional<std::size_t> reference(std::size_t offset, std::size_t index) const noexcept;
  std::size_t referenceSize() const noexcept { return referenceSize_; }
  Bytes objects() const noexcept { return objects_; }

 private:
  Bytes bytes_;
  Bytes objects_;  // all before the offset table
  std::size_t offsetSize_ = 0;
  std::size_t referenceSize_ = 0;
  std::size_t count_ = 0;
  std::size_t top_ = 0;
  std::size_t table_ = 0;
};

bool Document::open(Bytes bytes) noexcept {
  if (bytes.size() < kMagic.size() + kTrailerSize ||
      std::memcmp(bytes.data(), kMagic.data(), kMagic.size()) != 0) {
    return false;
  }
  bytes_ = bytes;
  const std::size_t trailer = bytes.size() - kTrailerSize;
  offsetSize_ = std::to_integer<std::size_t>(bytes[trailer + 6]);
  referenceSize_ = std::to_integer<std::size_t>(bytes[trailer + 7]);
  const auto count = *readBigEndian(bytes, trailer + 8, 8);
  const auto top = *readBigEndian(bytes, trailer + 16, 8);
  const auto table = *readBigEndian(bytes, trailer + 24, 8);
  if (offsetSize_ == 0 || offsetSize_ > 8 || referenceSize_ == 0 || referenceSize_ > 8 ||
      table < kMagic.size() || table > trailer || count > (trailer - table) / offsetSize_ || top >= count) {
    return false;
  }
  count_ = count;
  top_ = top;
  table_ = table;
  objects_ = bytes.first(table_);
  return true;
}

std::optional<Object> Document::object(std::size_t reference) const noexcept {
  if (reference >= count_) return std::nullopt;
  const auto offset = readBigEndian(bytes_, table_ + reference * offsetSize_, offsetSize_);
  if (!offset || *offset < kMagic.size() || *offset >= objects_.size()) return std::nullopt;
  const auto marker = std::to_integer<unsigned>(objects_[*offset]);
  Object object{static_cast<Kind>(marker >> 4), marker & 0xF, *offset + 1};
  if (object.count == 0xF) {
    // The count follows as an integer object of 1, 2, 4 or 8 bytes.
    if (object.content >= objects_.size()) return std::nullopt;
    const auto width = std::to_integer<unsigned>(objects_[object.content]);
    if (width >> 4 != 0x1 || (width & 0xF) > 3) return std::nullopt;
    const std::size_t size = std::size_t{1} << (width & 0xF);
    const auto count = readBigEndian(objects_, object.content + 1, size);
    if (!count) return std::nullopt;
    object.count = *count;
    object.content += 1 + size;
  }
  const std::size_t room = objects_.size() - object.content;
  switch (object.kind) {
    case Kind::ascii:
      return object.count <= room ? std::optional(object) : std::nullopt;
    case Kind::utf16:
      return object.count <= room / 2 ? std::optional(object) : std::nullopt;
    case Kind::dictionary:
      return object.count <= room / 2 / referenceSize_ ? std::optional(object) : std::nullopt;
    default:
      return std::nullopt;
  }
}

std::optional<std::size_t> Document::reference(std::size_t offset, std::size_t index) const noexcept {
  return readBigEndian(objects_, offset + index * referenceSize_, referenceSize_);
}

// Collects UTF-8 into a buffer of fixed size, never a part of a character, and counts what there was in all.
class Utf8Writer {
 public:
  explicit Utf8Writer(std::span<char> buffer) noexcept : buffer_(buffer) {}

  void add(std::uint32_t character) noexcept {
    std::array<char, 4> bytes{};
    std::size_t size = 0;
    const auto put = [&](std::uint32_t byte) { bytes[size++] = static_cast<char>(byte); };
    if (character < 0x80) {
      put(character);
    } else if (character < 0x800) {
      put(0xC0 | character >> 6);
      put(0x80 | (character & 0x3F));
    } else if (character < 0x10000) {
      put(0xE0 | character >> 12);
      put(0x80 | (character >> 6 & 0x3F));
      put(0x80 | (character & 0x3F));
    } else {
      put(0xF0 | character >> 18);
      put(0x80 | (character >> 12 & 0x3F));
      put(0x80 | (character >> 6 & 0x3F));
      put(0x80 | (character & 0x3F));
    }
    total_ += size;
    isFull_ = isFull_ || used_ + size >= buffer_.size();
    if (isFull_) return;
    std::copy_n(bytes.begin(), size, buffer_.begin() + static_cast<std::ptrdiff_t>(used_));
    used_ += size;
  }

  std::ptrdiff_t finish() noexcept {
    if (!buffer_.empty()) buffer_[used_] = '\0';
    return static_cast<std::ptrdiff_t>(total_);
  }

 private:
  std::span<char> buffer_;
  std::size_t used_ = 0;
  std::size_t total_ = 0;
  bool isFull_ = false;
};

constexpr bool isSurrogate(std::uint64_t unit) noexcept { return unit >= 0xD800 && unit < 0xE000; }

// False for UTF-16 with a lone surrogate.
bool writeText(Bytes objects, const Object& text, Utf8Writer& writer) noexcept {
  if (text.kind == Kind::ascii) {
    for (std::size_t i = 0; i < text.count; ++i) {
      writer.add(std::to_integer<std::uint32_t>(objects[text.content + i]) & 0x7F);
    }
    return true;
  }
  for (std::size_t i = 0; i < text.count; ++i) {
    auto unit = *readBigEndian(objects, text.content + 2 * i, 2);
    if (isSurrogate(unit)) {
      const auto low = readBigEndian(objects, text.content + 2 * (i + 1), 2);
      if (unit >= 0xDC00 || ++i == text.count || !low || *low < 0xDC00 || *low >= 0xE000) return false;
      unit = 0x10000 + ((unit - 0xD800) << 10) + (*low - 0xDC00);
    }
    writer.add(static_cast<std::uint32_t>(unit));
  }
  return true;
}

bool isKey(Bytes objects, const Object& object, std::string_view key) noexcept {
  return object.kind == Kind::ascii && object.count == key.size() &&
         std::memcmp(objects.data() + object.content, key.data(), key.size()) == 0;
}

}  // namespace

std::ptrdiff_t textOfBinaryDictionary(Bytes bytes, std::string_view key, std::span<char> buffer) noexcept {
  if (!buffer.empty()) buffer[0] = '\0';
  Document document;
  if (!document.open(bytes)) return -1;
  const auto dictionary = document.object(document.top());
  if (!dictionary || dictionary->kind != Kind::dictionary) return -1;
  const std::size_t values = dictionary->content + dictionary->count * document.referenceSize();
  for (std::size_t i = 0; i < dictionary->count; ++i) {
    const auto keyReference = document.reference(dictionary->content, i);
    const auto keyObject = keyReference ? document.object(*keyReference) : std::nullopt;
    if (!keyObject || !isKey(document.objects(), *keyObject, key)) continue;
    const auto valueReference = document.reference(values, i);
    const auto value = valueReference ? document.object(*valueReference) : std::nullopt;
    if (!value || value->kind == Kind::dictionary) return -1;
    Utf8Writer writer(buffer);
    if (!writeText(document.objects(), *value, writer)) {
      if (!buffer.empty()) buffer[0] = '\0';
      return -1;
    }
    return writer.finish();
  }
  return -1;
}

}  // namespace brenvik::client

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <bit>
#include <cstddef>
#include <cstdint>
#include <cstring>
#include <string>
#include <string_view>
#include <type_traits>

// The binary format, version 00, as the reader, the writer and the editable dictionary share it: the magic,
// objects, a table of their offsets, a trailer. Numbers are big-endian. Functions that write ("put") need the
// room they name and return the end of what they wrote.
namespace brenvik::plist {

inline constexpr std::string_view kBinaryMagic = "bplist00";

// An object begins with a marker: its kind, and in the lower four bits a size or a count.
enum ObjectKind : unsigned {
  kSimpleObject = 0x00,  // booleans
  kIntegerObject = 0x10,
  kRealObject = 0x20,
  kDateObject = 0x30,
  kDataObject = 0x40,
  kAsciiObject = 0x50,
  kUtf16Object = 0x60,
  kUidObject = 0x80,
  kArrayObject = 0xA0,
  kDictionaryObject = 0xD0,  // the keys stand before the values
};

// `width` bytes, from 1 to 8.
inline std::uint64_t loadBig(const unsigned char* bytes, std::size_t width) noexcept {
  switch (width) {
    case 1:
      return bytes[0];
    case 2:
      return std::uint64_t{bytes[0]} << 8 | bytes[1];
    case 4: {
      std::uint32_t word;
      std::memcpy(&word, bytes, sizeof word);
      return __builtin_bswap32(word);
    }
    case 8: {
      std::uint64_t word;
      std::memcpy(&word, bytes, sizeof word);
      return __builtin_bswap64(word);
    }
    default: {
      std::uint64_t value = 0;
      for (std::size_t i = 0; i < width; ++i) value = value << 8 | bytes[i];
      return value;
    }
  }
}
inline char* putBig(char* to, std::uint64_t value, std::size_t width) noexcept {
  for (std::size_t i = width; i-- > 0;) *to++ = static_cast<char>(value >> (8 * i));
  return to;
}

// The fewest of 1, 2, 4 or 8 bytes that hold the number.
constexpr std::size_t widthFor(std::uint64_t largest) noexcept {
  return largest < 1u << 8 ? 1 : largest < 1u << 16 ? 2 : largest < std::uint64_t{1} << 32 ? 4 : 8;
}
// Of references among so many objects, of which there is at least one.
constexpr std::size_t referenceWidthFor(std::size_t objects) noexcept { return widthFor(objects - 1); }

struct ObjectHead {
  unsigned kind = 0;      // an ObjectKind, or another number
  unsigned low = 0;       // the marker's lower four bits
  std::size_t size = 1;   // bytes of the marker and the count behind it
  std::size_t count = 0;  // of data, text and containers: bytes, UTF-16 units, elements, entries

  bool isContainer() const noexcept { return kind == kArrayObject || kind == kDictionaryObject; }
  std::size_t references() const noexcept { return kind == kDictionaryObject ? 2 * count : count; }
};

// Reads the head of the object at `at`, which is before `end`. False when it is malformed or does not end
// before `end`; what the count promises is not looked for.
inline bool readHead(const unsigned char* at, const unsigned char* end, ObjectHead* head) noexcept {
  head->kind = *at & 0xF0u;
  head->low = *at & 0x0Fu;
  head->size = 1;
  head->count = head->low;
  const bool isCounted = head->isContainer() || (head->kind >= kDataObject && head->kind <= kUtf16Object);
  if (!isCounted || head->low != 15) return true;
  if (end - at < 2 || (at[1] & 0xFC) != kIntegerObject) return false;
  const std::size_t width = std::size_t{1} << (at[1] & 3);
  if (static_cast<std::size_t>(end - at) < 2 + width) return false;
  head->count = loadBig(at + 2, width);
  head->size = 2 + width;
  return true;
}

inline constexpr std::size_t kLargestHead = 10;
inline char* putHead(char* to, ObjectKind kind, std::size_t count) noexcept {
  if (count < 15) {
    *to++ = static_cast<char>(kind | count);
    return to;
  }
  const std::size_t width = widthFor(count);
  *to++ = static_cast<char>(kind | 15);
  *to++ = static_cast<char>(kIntegerObject | static_cast<unsigned>(std::countr_zero(width)));
  return putBig(to, count, width);
}

// Room for a string object of this many bytes of UTF-8.
constexpr std::size_t stringRoom(std::size_t size) noexcept { return kLargestHead + 2 * size; }
// A string object of valid UTF-8: as ASCII when it can be, else as UTF-16.
char* putString(char* to, const char* utf8, std::size_t size) noexcept;

// A row of numbers. `width`: 1, 2 or 4.
template <typename Numbers>
void appendNumbers(std::string& out, std::size_t width, std::size_t count, Numbers numberAt) {
  const std::size_t start = out.size();
  out.resize(start + width * count);
  char* to = out.data() + start;
  // With the width known, the compiler makes the inner loop of putBig() a byte swap: the tables of a large
  // dictionary are written anew at every change.
  const auto put = [&](auto known) {
    for (std::size_t i = 0; i < count; ++i) to = putBig(to, numberAt(i), known);
  };
  if (width == 1) return put(std::integral_constant<std::size_t, 1>());
  if (width == 2) return put(std::integral_constant<std::size_t, 2>());
  put(std::integral_constant<std::size_t, 4>());
}

inline constexpr std::size_t kTrailerSize = 32;
struct Trailer {
  std::size_t offsetWidth = 0;
  std::size_t referenceWidth = 0;
  std::uint64_t objects = 0;
  std::uint64_t top = 0;
  std::uint64_t table = 0;  // where the table of offsets begins
};
Trailer loadTrailer(const unsigned char* at) noexcept;
void appendTrailer(std::string& out, const Trailer& trailer);

}  // namespace brenvik::plist

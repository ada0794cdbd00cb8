// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "client/EventText.h"

#include <gtest/gtest.h>

#include <array>
#include <string>
#include <vector>

namespace brenvik::client {
namespace {

std::string trailer(std::uint8_t offsetSize, std::uint8_t referenceSize, std::uint8_t count, std::uint8_t top,
                    std::uint8_t table) {
  std::string bytes(32, '\0');
  bytes[6] = static_cast<char>(offsetSize);
  bytes[7] = static_cast<char>(referenceSize);
  bytes[15] = static_cast<char>(count);
  bytes[23] = static_cast<char>(top);
  bytes[31] = static_cast<char>(table);
  return bytes;
}

// A document with the objects in order, the first of them on top, and one byte each for references and
// offsets.
std::string document(const std::vector<std::string>& objects) {
  std::string bytes = "bplist00";
  std::string table;
  for (const std::string& each : objects) {
    table += static_cast<char>(bytes.size());
    bytes += each;
  }
  const auto tableAt = static_cast<std::uint8_t>(bytes.size());
  return bytes + table + trailer(1, 1, static_cast<std::uint8_t>(objects.size()), 0, tableAt);
}

struct Found {
  std::ptrdiff_t length;
  std::string text;
  bool operator==(const Found&) const = default;
};
const Found kNothing{-1, ""};

Found find(const std::string& bytes, const char* key, std::size_t capacity = 64) {
  std::string buffer(capacity, '?');
  const std::ptrdiff_t length = textOfBinaryDictionary(std::as_bytes(std::span(bytes)), key, buffer);
  return {length, buffer.c_str()};
}

// {"A": "one", "B": <array>, "C": UTF-16 text}
std::string example() {
  return document({{"\xD3\x01\x02\x03\x04\x05\x06", 7},
                   "\x51"
                   "A",
                   "\x51"
                   "B",
                   "\x51"
                   "C",
                   "\x53one",
                   "\xA0",
                   std::string("\x64\0K\0\xF6\xD8\x3D\xDE\x00", 9)});
}

TEST(EventTextTest, FindsTextsByKey) {
  EXPECT_EQ(find(example(), "A"), (Found{3, "one"}));
  EXPECT_EQ(find(example(), "C"), (Found{7, "K\xC3\xB6\xF0\x9F\x98\x80"}));
}

TEST(EventTextTest, KeysThatAreAbsentOrNoTextsGiveNothing) {
  EXPECT_EQ(find(example(), "B"), kNothing);
  EXPECT_EQ(find(example(), "a"), kNothing);
  EXPECT_EQ(find(example(), ""), kNothing);
}

TEST(EventTextTest, CutsAtACharacterAndTellsTheWholeLength) {
  EXPECT_EQ(find(example(), "A", 3), (Found{3, "on"}));
  EXPECT_EQ(find(example(), "C", 7), (Found{7, "K\xC3\xB6"}));
  EXPECT_EQ(find(example(), "C", 3), (Found{7, "K"}));
  EXPECT_EQ(find(example(), "C", 1), (Found{7, ""}));
  const std::string bytes = example();
  EXPECT_EQ(textOfBinaryDictionary(std::as_bytes(std::span(bytes)), "A", {}), 3);
}

TEST(EventTextTest, ReadsLongCounts) {
  const std::string longText(300, 'x');
  std::string bytes = "bplist00";
  bytes += std::string("\xD1\x01\x02", 3) + "\x51k" + std::string("\x5F\x11\x01\x2C", 4) + longText;
  const std::size_t table = bytes.size();
  bytes += std::string("\0\x08\0\x0B\0\x0D", 6) + trailer(2, 1, 3, 0, 0);
  bytes[bytes.size() - 2] = static_cast<char>(table >> 8);
  bytes[bytes.size() - 1] = static_cast<char>(table & 0xFF);
  EXPECT_EQ(find(bytes, "k", 400), (Found{300, longText}));
}

TEST(EventTextTest, NothingElseIsADictionary) {
  EXPECT_EQ(find("", "A"), kNothing);
  EXPECT_EQ(find("bplist00", "A"), kNothing);
  EXPECT_EQ(find("<plist version=\"1.0\"><dict><key>A</key><string>x</string></dict></plist>", "A"),
            kNothing);
  EXPECT_EQ(find(document({"\x51"
                           "A"}),
                 "A"),
            kNothing);
}

TEST(EventTextTest, LoneSurrogatesAreNoText) {
  for (const std::string& units : {std::string("\xD8\x3D", 2), std::string("\xDE\x00", 2),
                                   std::string("\xD8\x3D\0A", 4), std::string("\xD8\x3D\xD8\x3D", 4)}) {
    const auto marker = static_cast<char>(0x60 + units.size() / 2);
    EXPECT_EQ(find(document({{"\xD1\x01\x02", 3},
                             "\x51"
                             "A",
                             marker + units}),
                   "A"),
              kNothing);
  }
}

TEST(EventTextTest, EveryShorterDocumentAndEveryChangedByteIsReadSafely) {
  const std::string good = example();
  for (std::size_t size = 0; size < good.size(); ++size) {
    // An exact copy on the heap, so that a read beyond its end is one beyond an allocation.
    const std::vector<char> exact(good.begin(), good.begin() + static_cast<std::ptrdiff_t>(size));
    std::array<char, 8> buffer{};
    EXPECT_EQ(textOfBinaryDictionary(std::as_bytes(std::span(exact)), "A", buffer), -1) << size;
  }
  for (std::size_t at = 0; at < good.size(); ++at) {
    for (int value = 0; value < 256; ++value) {
      std::vector<char> changed(good.begin(), good.end());
      changed[at] = static_cast<char>(value);
      std::array<char, 8> buffer{};
      const std::ptrdiff_t length = textOfBinaryDictionary(std::as_bytes(std::span(changed)), "C", buffer);
      EXPECT_GE(length, -1);
      EXPECT_LE(length, static_cast<std::ptrdiff_t>(3 * good.size()));
    }
  }
}

}  // namespace
}  // namespace brenvik::client

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/worker/WorkerFields.h"

#include <gtest/gtest.h>

#include <limits>
#include <string>
#include <vector>

namespace brenvik {
namespace {

std::vector<std::byte> everything() {
  const std::vector<std::byte> raw{std::byte{0}, std::byte{255}};
  return FieldWriter()
      .u8(7)
      .boolean(true)
      .u32(0xFFFFFFFE)
      .u64(std::numeric_limits<std::uint64_t>::max() - 1)
      .i64(-5)
      .real(-0.25)
      .bytes(raw)
      .text("häß")
      .text("")
      .optionalText(std::nullopt)
      .optionalText("there")
      .optional(std::optional<std::uint32_t>(9), [](FieldWriter& to, std::uint32_t it) { to.u32(it); })
      .take();
}

bool readEverything(FieldReader& from) {
  const bool isSame = from.u8() == 7 && from.boolean() && from.u32() == 0xFFFFFFFE &&
                      from.u64() == std::numeric_limits<std::uint64_t>::max() - 1 && from.i64() == -5 &&
                      from.real() == -0.25 && from.bytes().size() == 2 && from.text() == "häß" &&
                      from.text().empty() && from.optionalText() == std::nullopt &&
                      from.optionalText() == "there" &&
                      from.optional([](FieldReader& it) { return it.u32(); }) == 9U;
  return isSame && from.whole();
}

TEST(WorkerFieldsTest, WhatIsWrittenIsReadAgain) {
  const auto payload = everything();
  FieldReader reader(payload);
  EXPECT_TRUE(readEverything(reader));
}

TEST(WorkerFieldsTest, NumbersAreLittleEndianAndTextsHaveTheirLengthInFront) {
  const auto payload = FieldWriter().u32(0x01020304).text("a").take();
  const std::vector<std::byte> expected{std::byte{4}, std::byte{3}, std::byte{2}, std::byte{1},  std::byte{1},
                                        std::byte{0}, std::byte{0}, std::byte{0}, std::byte{'a'}};
  EXPECT_EQ(payload, expected);
}

TEST(WorkerFieldsTest, NothingShorterIsWholeAndNothingLongerEither) {
  auto payload = everything();
  for (std::size_t size = 0; size < payload.size(); ++size) {
    FieldReader reader(std::span<const std::byte>(payload).first(size));
    EXPECT_FALSE(readEverything(reader)) << size;
    EXPECT_FALSE(reader.whole()) << size;
  }
  payload.push_back(std::byte{0});
  FieldReader reader(payload);
  EXPECT_FALSE(readEverything(reader));
}

TEST(WorkerFieldsTest, AReaderThatFailedGivesNothingMore) {
  const auto payload = FieldWriter().u32(100).u32(1).u32(2).take();
  FieldReader reader(payload);
  EXPECT_TRUE(reader.bytes().empty()) << "it says 100 bytes";
  EXPECT_TRUE(reader.hasFailed());
  EXPECT_EQ(reader.u32(), 0U);
  EXPECT_EQ(reader.optionalText(), std::nullopt);
  EXPECT_FALSE(reader.whole());
}

TEST(WorkerFieldsTest, ABooleanIsZeroOrOne) {
  const auto payload = FieldWriter().u8(2).take();
  FieldReader reader(payload);
  EXPECT_FALSE(reader.boolean());
  EXPECT_TRUE(reader.hasFailed());
}

}  // namespace
}  // namespace brenvik

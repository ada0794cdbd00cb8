// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "helper/mobile/CString.h"

#include <gtest/gtest.h>
#include <malloc.h>

#include <array>
#include <string>
#include <vector>

namespace brenvik {
namespace {

// Counts blocks, and has no memory when told so.
class CountingAllocator final : public CStringAllocator {
 public:
  void* allocate(std::size_t size) noexcept override {
    sizes.push_back(size);
    if (exhausted) return nullptr;
    ++live;
    return defaultCStringAllocator().allocate(size);
  }
  void deallocate(void* block) noexcept override {
    --live;
    defaultCStringAllocator().deallocate(block);
  }
  std::vector<std::size_t> sizes;
  int live = 0;
  bool exhausted = false;
};

class GetOrCreateCStringTest : public testing::Test {
 protected:
  void TearDown() override { EXPECT_EQ(allocator.live, 0); }
  CountingAllocator allocator;
  std::array<char, 8> buffer{'o', 'l', 'd', '!', 'o', 'l', 'd', '!'};
};

TEST_F(GetOrCreateCStringTest, ATextThatFitsGoesIntoTheBuffer) {
  std::size_t size = buffer.size();
  char* const result = GetOrCreateCString(allocator, "mobile", buffer.data(), &size, StringEncoding::utf8);
  EXPECT_EQ(result, buffer.data());
  EXPECT_STREQ(result, "mobile");
  EXPECT_EQ(size, 6U);
  EXPECT_TRUE(allocator.sizes.empty());
}

TEST_F(GetOrCreateCStringTest, ATextThatJustFitsWithItsNulGoesIntoTheBuffer) {
  std::size_t size = buffer.size();
  char* const result = GetOrCreateCString(allocator, "1234567", buffer.data(), &size, StringEncoding::utf8);
  EXPECT_EQ(result, buffer.data());
  EXPECT_STREQ(result, "1234567");
  EXPECT_EQ(size, 7U);
}

TEST_F(GetOrCreateCStringTest, ATextWhoseNulDoesNotFitGetsABlockOfItsOwnAndLeavesTheBufferAlone) {
  std::size_t size = buffer.size();
  char* const result = GetOrCreateCString(allocator, "12345678", buffer.data(), &size, StringEncoding::utf8);
  ASSERT_NE(result, buffer.data());
  ASSERT_NE(result, nullptr);
  EXPECT_STREQ(result, "12345678");
  EXPECT_EQ(size, 8U);
  EXPECT_EQ(allocator.sizes, std::vector<std::size_t>{9});
  EXPECT_EQ(std::string(buffer.data(), buffer.size()), "old!old!");
  allocator.deallocate(result);
}

TEST_F(GetOrCreateCStringTest, WithoutABufferABlockIsMadeAndTheSizeSet) {
  std::size_t size = 4096;
  char* const result = GetOrCreateCString(allocator, "mobile", nullptr, &size, StringEncoding::utf8);
  ASSERT_NE(result, nullptr);
  EXPECT_STREQ(result, "mobile");
  EXPECT_EQ(size, 6U);
  allocator.deallocate(result);
}

TEST_F(GetOrCreateCStringTest, WithNeitherBufferNorSizeABlockIsMade) {
  char* const result = GetOrCreateCString(allocator, "mobile", nullptr, nullptr, StringEncoding::utf8);
  ASSERT_NE(result, nullptr);
  EXPECT_STREQ(result, "mobile");
  allocator.deallocate(result);
}

TEST_F(GetOrCreateCStringTest, ABufferWithoutASizeIsNotUsed) {
  char* const result = GetOrCreateCString(allocator, "a", buffer.data(), nullptr, StringEncoding::utf8);
  ASSERT_NE(result, buffer.data());
  EXPECT_STREQ(result, "a");
  EXPECT_EQ(buffer[0], 'o');
  allocator.deallocate(result);
}

TEST_F(GetOrCreateCStringTest, ABufferOfSizeZeroIsNotUsed) {
  std::size_t size = 0;
  char* const result = GetOrCreateCString(allocator, "", buffer.data(), &size, StringEncoding::utf8);
  ASSERT_NE(result, buffer.data());
  EXPECT_STREQ(result, "");
  EXPECT_EQ(size, 0U);
  EXPECT_EQ(buffer[0], 'o');
  allocator.deallocate(result);
}

TEST_F(GetOrCreateCStringTest, TheEmptyTextFitsABufferOfOneByte) {
  std::size_t size = 1;
  EXPECT_EQ(GetOrCreateCString(allocator, "", buffer.data(), &size, StringEncoding::utf8), buffer.data());
  EXPECT_EQ(buffer[0], '\0');
  EXPECT_EQ(buffer[1], 'l');
  EXPECT_EQ(size, 0U);
}

TEST_F(GetOrCreateCStringTest, WithoutMemoryTheBufferIsEmptiedAndReturnedAndTheSizeIsZero) {
  allocator.exhausted = true;
  std::size_t size = buffer.size();
  char* const result =
      GetOrCreateCString(allocator, "longer than the buffer", buffer.data(), &size, StringEncoding::utf8);
  EXPECT_EQ(result, buffer.data());
  EXPECT_STREQ(result, "");
  EXPECT_EQ(buffer[1], 'l') << "one byte is written";
  EXPECT_EQ(size, 0U);
}

TEST_F(GetOrCreateCStringTest, WithoutMemoryABufferOfSizeZeroIsEmptiedToo) {
  allocator.exhausted = true;
  std::size_t size = 0;
  EXPECT_EQ(GetOrCreateCString(allocator, "x", buffer.data(), &size, StringEncoding::utf8), buffer.data());
  EXPECT_STREQ(buffer.data(), "");
  EXPECT_EQ(size, 0U);
}

TEST_F(GetOrCreateCStringTest, WithoutMemoryAndWithoutABufferTheResultIsNull) {
  allocator.exhausted = true;
  std::size_t size = 12;
  EXPECT_EQ(GetOrCreateCString(allocator, "x", nullptr, &size, StringEncoding::utf8), nullptr);
  EXPECT_EQ(size, 0U);
  EXPECT_EQ(GetOrCreateCString(allocator, "x", nullptr, nullptr, StringEncoding::utf8), nullptr);
}

TEST_F(GetOrCreateCStringTest, Utf8PassesAsItIsAndItsLengthIsInBytes) {
  std::size_t size = buffer.size();
  char* const result =
      GetOrCreateCString(allocator, "\u00e9\u20ac", buffer.data(), &size, StringEncoding::utf8);
  EXPECT_STREQ(result, "\xC3\xA9\xE2\x82\xAC");
  EXPECT_EQ(size, 5U);
}

TEST_F(GetOrCreateCStringTest, AsciiIsMeasuredAfterEncodingAndReplacesWhatItLacks) {
  std::size_t size = 4;  // five characters' worth of UTF-8 would not fit
  char* const result =
      GetOrCreateCString(allocator, "a\u00e9\u20ac", buffer.data(), &size, StringEncoding::ascii);
  EXPECT_EQ(result, buffer.data());
  EXPECT_STREQ(result, "a??");
  EXPECT_EQ(size, 3U);
}

TEST_F(GetOrCreateCStringTest, ALongTextInAsciiGetsABlockOfItsEncodedLength) {
  char* const result =
      GetOrCreateCString(allocator, "\u20ac\u20ac\u20ac", nullptr, nullptr, StringEncoding::ascii);
  EXPECT_STREQ(result, "???");
  EXPECT_EQ(allocator.sizes, std::vector<std::size_t>{4});
  allocator.deallocate(result);
}

TEST(DefaultCStringAllocatorTest, GivesAndTakesMemory) {
  char* const result =
      GetOrCreateCString(defaultCStringAllocator(), "/var/mobile", nullptr, nullptr, StringEncoding::utf8);
  ASSERT_NE(result, nullptr);
  EXPECT_STREQ(result, "/var/mobile");
  defaultCStringAllocator().deallocate(result);
}

TEST(DefaultCStringAllocatorTest, WhatIsGivenBackIsFree) {
  constexpr std::size_t kLarge = std::size_t{64} << 20;  // more than malloc(3) ever takes from its heap
  const auto before = ::mallinfo2().hblks;
  void* const block = defaultCStringAllocator().allocate(kLarge);
  ASSERT_NE(block, nullptr);
  defaultCStringAllocator().deallocate(block);
  EXPECT_EQ(::mallinfo2().hblks, before);
}

}  // namespace
}  // namespace brenvik

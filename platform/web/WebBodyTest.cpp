// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/web/WebBody.h"

#include <gtest/gtest.h>
#include <sys/mman.h>
#include <unistd.h>

#include <limits>
#include <string>

namespace brenvik {
namespace {

std::span<const std::byte> bytesOf(const std::string& text) { return std::as_bytes(std::span(text)); }
std::string textOf(const WebBody& body) { return {reinterpret_cast<const char*>(body.data()), body.size()}; }

TEST(WebBodyTest, WhatIsAppendedStaysInOrderFromSmallToLarge) {
  WebBody body;
  std::string expected;
  for (std::size_t piece = 1; expected.size() < 20'000'000; piece = piece * 3 + 1) {
    const std::string text(piece, static_cast<char>('a' + piece % 26));
    body.append(bytesOf(text));
    expected += text;
    ASSERT_EQ(body.size(), expected.size());
    ASSERT_LE(body.size(), body.capacity());
    ASSERT_TRUE(textOf(body) == expected) << piece;
  }
}

TEST(WebBodyTest, ABodyThatGrowsInSmallPiecesHasRoomForNoMoreThanTwiceItsBytesAndMovesSeldom) {
  constexpr std::size_t kLargeUnit = std::size_t{2} << 20;  // a large body has a whole number of them
  const std::string piece(1000, 'x');
  WebBody body;
  int moves = 0;
  for (std::size_t before = 0; body.size() < 10'000'000; before = body.capacity()) {
    body.append(bytesOf(body.size() < 1000 ? "x" : piece));
    if (body.capacity() != before) ++moves;
    const std::size_t most = 2 * body.size();
    ASSERT_LE(body.capacity(), most < kLargeUnit ? most : most + kLargeUnit) << body.size();
  }
  EXPECT_LE(moves, 25);
}

TEST(WebBodyTest, ClearingKeepsTheRoom) {
  for (const std::size_t size : {1000U, 5'000'000U}) {
    WebBody body;
    body.append(bytesOf(std::string(size, 'x')));
    const auto* const before = body.data();
    body.clear();
    EXPECT_TRUE(body.empty());
    body.append(bytesOf("y"));
    EXPECT_EQ(body.data(), before);
    EXPECT_EQ(textOf(body), "y");
  }
}

TEST(WebBodyTest, ReservedRoomIsNotLeftWhileItSuffices) {
  for (const std::size_t size : {1000U, 5'000'000U}) {
    WebBody body;
    body.reserve(size);
    const auto* const before = body.data();
    for (std::size_t i = 0; i < size; i += size / 10) body.append(bytesOf(std::string(size / 10, 'x')));
    EXPECT_EQ(body.data(), before);
    body.reserve(1);
    EXPECT_EQ(body.size(), size);
  }
}

TEST(WebBodyTest, ACopyIsItsOwnAndAMoveLeavesNothing) {
  for (const std::size_t size : {0U, 1000U, 5'000'000U}) {
    const std::string text(size, 'x');
    WebBody body;
    body.append(bytesOf(text));
    WebBody copy = body;
    WebBody moved = std::move(body);
    EXPECT_TRUE(body.empty());  // NOLINT: what a moved body holds is promised
    moved.append(bytesOf("more"));
    EXPECT_TRUE(textOf(copy) == text);
    EXPECT_TRUE(textOf(moved) == text + "more");
    copy = moved;
    EXPECT_TRUE(textOf(copy) == text + "more");
    copy = WebBody();
    EXPECT_TRUE(copy.empty());
  }
}

TEST(WebBodyTest, ABodyForAnotherProcessArrivesThereAsItWasWritten) {
  WebBody made = WebBody::forAnotherProcess();
  made.append(bytesOf("of an attempt that came to nothing"));
  made.clear();
  made.append(bytesOf("first "));
  made.reserve(5'000'000);
  const std::string rest(5'000'000, 'r');
  made.append(bytesOf(rest));
  EXPECT_EQ(made.size(), 6 + rest.size());
  EXPECT_TRUE(std::span<const std::byte>(made).empty()) << "nobody reads it here";
  WebBody moved = std::move(made);
  UniqueFd memory = moved.takeSealed();
  ASSERT_TRUE(memory.isValid());
  EXPECT_TRUE(moved.empty());
  EXPECT_FALSE(moved.takeSealed().isValid()) << "once";
  const auto arrived = WebBody::ofSealedMemory(std::move(memory), 6 + rest.size());
  ASSERT_TRUE(arrived);
  EXPECT_TRUE(textOf(*arrived) == "first " + rest);
  EXPECT_GE(arrived->sealedMemory(), 0);
}

TEST(WebBodyTest, ABodyForAnotherProcessArrivesWhereverItsPiecesAndPagesEnd) {
  for (const std::size_t size : {1U, 4095U, 4096U, 4097U, 8192U}) {
    for (const std::size_t first : {std::size_t{1}, size / 2, size - 1, size}) {
      SCOPED_TRACE(std::to_string(first) + " of " + std::to_string(size));
      const std::string text = std::string(first, 'a') + std::string(size - first, 'b');
      WebBody made = WebBody::forAnotherProcess();
      made.append(bytesOf(text.substr(0, first)));
      made.append(bytesOf(text.substr(first)));
      EXPECT_EQ(made.size(), size);
      const auto arrived = WebBody::ofSealedMemory(made.takeSealed(), size);
      ASSERT_TRUE(arrived);
      EXPECT_TRUE(textOf(*arrived) == text);
    }
  }
}

TEST(WebBodyTest, ABodyOfItsOwnHasNoMemoryForAnotherProcess) {
  WebBody body;
  body.append(bytesOf("ours"));
  EXPECT_EQ(body.sealedMemory(), -1);
  EXPECT_FALSE(body.takeSealed().isValid());
  EXPECT_EQ(WebBody::forAnotherProcess().sealedMemory(), -1) << "nobody has sealed it yet";
}

TEST(WebBodyTest, MemoryThatCanStillChangeOrIsOfAnotherSizeIsNoBody) {
  const auto sealed = [] {
    WebBody body = WebBody::forAnotherProcess();
    body.append(bytesOf("four"));
    return body.takeSealed();
  };
  EXPECT_TRUE(WebBody::ofSealedMemory(sealed(), 4));
  EXPECT_FALSE(WebBody::ofSealedMemory(sealed(), 3));
  EXPECT_FALSE(WebBody::ofSealedMemory(sealed(), 5));
  EXPECT_FALSE(WebBody::ofSealedMemory(sealed(), 0));
  EXPECT_FALSE(WebBody::ofSealedMemory(UniqueFd(), 4));
  UniqueFd open(::memfd_create("open", MFD_CLOEXEC | MFD_ALLOW_SEALING));
  ASSERT_EQ(::write(open.get(), "four", 4), 4);
  EXPECT_FALSE(WebBody::ofSealedMemory(std::move(open), 4));
}

TEST(WebBodyTest, ABodyOfAnotherProcessBecomesOnesOwnWhenItIsCopiedOrAddedTo) {
  WebBody made = WebBody::forAnotherProcess();
  made.append(bytesOf("theirs"));
  auto body = WebBody::ofSealedMemory(made.takeSealed(), 6).value();
  const WebBody copy = body;
  EXPECT_EQ(textOf(copy), "theirs");
  EXPECT_EQ(copy.sealedMemory(), -1);
  body.append(bytesOf(" and ours"));
  EXPECT_EQ(textOf(body), "theirs and ours");
  EXPECT_EQ(body.sealedMemory(), -1);
  body.clear();
  EXPECT_TRUE(body.empty());
}

TEST(WebBodyTest, MoreThanThereIsThrowsAndChangesNothing) {
  WebBody body;
  body.append(bytesOf("kept"));
  EXPECT_THROW(body.reserve(std::numeric_limits<std::size_t>::max()), std::bad_alloc);
  EXPECT_THROW(body.reserve(std::numeric_limits<std::size_t>::max() / 2), std::bad_alloc);
  EXPECT_EQ(textOf(body), "kept");
}

}  // namespace
}  // namespace brenvik

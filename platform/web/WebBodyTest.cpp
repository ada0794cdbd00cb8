// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/web/WebBody.h"

#include <gtest/gtest.h>

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

TEST(WebBodyTest, MoreThanThereIsThrowsAndChangesNothing) {
  WebBody body;
  body.append(bytesOf("kept"));
  EXPECT_THROW(body.reserve(std::numeric_limits<std::size_t>::max()), std::bad_alloc);
  EXPECT_THROW(body.reserve(std::numeric_limits<std::size_t>::max() / 2), std::bad_alloc);
  EXPECT_EQ(textOf(body), "kept");
}

}  // namespace
}  // namespace brenvik

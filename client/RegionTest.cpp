// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "client/Region.h"

#include <gtest/gtest.h>

#include <cstdlib>

namespace brenvik::client {
namespace {

TEST(BufferTest, HasBytesOnlyWhileItOwnsThem) {
  Buffer buffer;
  EXPECT_TRUE(buffer.bytes().empty());
  ASSERT_TRUE(buffer.ensure());
  EXPECT_EQ(buffer.bytes().size(), kBufferSize);
  void* const given = buffer.release();
  EXPECT_NE(given, nullptr);
  EXPECT_TRUE(buffer.bytes().empty());
  std::free(given);
}

}  // namespace
}  // namespace brenvik::client

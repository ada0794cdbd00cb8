// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/base/UniqueFd.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include <utility>

namespace brenvik {
namespace {

bool isOpen(int descriptor) { return ::fcntl(descriptor, F_GETFD) >= 0; }

int opened() { return ::open("/dev/null", O_RDONLY | O_CLOEXEC); }

TEST(UniqueFdTest, ItsEndClosesTheDescriptor) {
  const int number = opened();
  {
    const UniqueFd file(number);
    EXPECT_TRUE(file.isValid());
    EXPECT_EQ(file.get(), number);
    EXPECT_TRUE(isOpen(number));
  }
  EXPECT_FALSE(isOpen(number));
}

TEST(UniqueFdTest, WhatItGaveUpStaysOpenAndItHasNone) {
  const int number = opened();
  {
    UniqueFd file(number);
    EXPECT_EQ(file.release(), number);
    EXPECT_FALSE(file.isValid());
    EXPECT_EQ(file.get(), -1);
  }
  EXPECT_TRUE(isOpen(number));
  ::close(number);
}

TEST(UniqueFdTest, AMoveLeavesNoneBehindAndClosesWhatWasThere) {
  const int first = opened();
  const int second = opened();
  UniqueFd from(first);
  UniqueFd to(second);
  to = std::move(from);
  EXPECT_FALSE(from.isValid());  // NOLINT(bugprone-use-after-move): that is what a move leaves
  EXPECT_EQ(to.get(), first);
  EXPECT_TRUE(isOpen(first));
  EXPECT_FALSE(isOpen(second));
  UniqueFd last(std::move(to));
  EXPECT_FALSE(to.isValid());  // NOLINT(bugprone-use-after-move)
  EXPECT_EQ(last.get(), first);
}

TEST(UniqueFdTest, AResetClosesTheOldOneAndTakesTheNext) {
  const int first = opened();
  const int second = opened();
  UniqueFd file(first);
  file.reset(second);
  EXPECT_FALSE(isOpen(first));
  EXPECT_EQ(file.get(), second);
  file.reset();
  EXPECT_FALSE(isOpen(second));
  EXPECT_FALSE(file.isValid());
}

}  // namespace
}  // namespace brenvik

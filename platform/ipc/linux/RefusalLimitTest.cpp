// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/ipc/linux/RefusalLimit.h"

#include <gtest/gtest.h>

namespace brenvik {
namespace {

const RefusalLimit::Time kStart{std::chrono::hours(1)};

TEST(RefusalLimitTest, AnAccountMayBeRefusedSoOftenAtOnceAndThenWaits) {
  RefusalLimit limit;
  for (int i = 0; i < RefusalLimit::kBurst; ++i) {
    ASSERT_TRUE(limit.allows(7, kStart)) << i;
    limit.refused(7, kStart);
  }
  EXPECT_FALSE(limit.allows(7, kStart));
  EXPECT_TRUE(limit.allows(8, kStart)) << "another account does not wait";
}

TEST(RefusalLimitTest, ARefusalIsPaidForByTime) {
  RefusalLimit limit;
  for (int i = 0; i < RefusalLimit::kBurst; ++i) limit.refused(7, kStart);
  const auto later = kStart + RefusalLimit::kOneMoreEvery;
  EXPECT_FALSE(limit.allows(7, later - std::chrono::nanoseconds(1)));
  EXPECT_TRUE(limit.allows(7, later));
  limit.refused(7, later);
  EXPECT_FALSE(limit.allows(7, later));
}

TEST(RefusalLimitTest, AccountsBeyondCountAreForgottenTheQuietOnesFirst) {
  RefusalLimit limit;
  for (uid_t account = 0; account < 5000; ++account) limit.refused(account, kStart);
  EXPECT_LE(limit.accounts(), 1024U);
  const auto later = kStart + std::chrono::hours(1);
  limit.refused(9999, later);
  EXPECT_EQ(limit.accounts(), 1U);
}

}  // namespace
}  // namespace brenvik

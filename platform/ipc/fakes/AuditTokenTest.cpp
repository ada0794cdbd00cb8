// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/ipc/AuditToken.h"

#include <gtest/gtest.h>

namespace brenvik {
namespace {

TEST(AuditTokenTest, EachFactStandsInItsOwnWord) {
  const AuditToken token{{10, 11, 12, 13, 14, 15, 16, 17}};
  EXPECT_EQ(token.uid(), 11U);
  EXPECT_EQ(token.gid(), 12U);
  EXPECT_EQ(token.pid(), 15);
  EXPECT_EQ(token.pidVersion(), 17U);
}

TEST(AuditTokenTest, ATokenThatNamesNoProcessHasTheProcessMinus1) {
  EXPECT_EQ(AuditToken{}.pid(), -1);
  EXPECT_EQ((AuditToken{{0, 0, 0, 0, 0, 1, 0, 0}}.pid()), 1);
}

TEST(AuditTokenTest, TokensAreEqualOnlyIfEveryWordIs) {
  const AuditToken token{{10, 11, 12, 13, 14, 15, 16, 17}};
  EXPECT_TRUE(AuditToken(token) == token);
  for (std::size_t i = 0; i < token.words.size(); ++i) {
    AuditToken other = token;
    ++other.words[i];
    EXPECT_FALSE(other == token) << i;
  }
}

}  // namespace
}  // namespace brenvik

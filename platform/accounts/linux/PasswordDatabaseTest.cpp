// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/accounts/linux/PasswordDatabase.h"

#include <gtest/gtest.h>
#include <pwd.h>

namespace brenvik {
namespace {

TEST(PasswordDatabaseTest, KnowsTheSuperuser) {
  PasswordDatabase accounts;
  EXPECT_EQ(accounts.idsOf("root"), (AccountIds{0, 0}));
  EXPECT_EQ(accounts.homeDirectoryOf("root"), "/root");
}

TEST(PasswordDatabaseTest, GivesWhatTheSystemsOwnLookUpGives) {
  PasswordDatabase accounts;
  const passwd* const entry = ::getpwnam("nobody");
  ASSERT_NE(entry, nullptr);
  const AccountIds ids{entry->pw_uid, entry->pw_gid};
  const std::string home = entry->pw_dir;
  EXPECT_EQ(accounts.idsOf("nobody"), ids);
  EXPECT_EQ(accounts.homeDirectoryOf("nobody"), home);
}

TEST(PasswordDatabaseTest, AnAccountThatDoesNotExistHasNeitherIdsNorHome) {
  PasswordDatabase accounts;
  EXPECT_EQ(accounts.idsOf("no-such-account-here"), std::nullopt);
  EXPECT_EQ(accounts.homeDirectoryOf("no-such-account-here"), std::nullopt);
  EXPECT_EQ(accounts.idsOf(""), std::nullopt);
}

}  // namespace
}  // namespace brenvik

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "helper/mobile/MobileUser.h"

#include <gtest/gtest.h>

#include <string>
#include <thread>
#include <utility>
#include <vector>

#include "platform/accounts/fakes/FakeAccountDirectory.h"

namespace brenvik {
namespace {

class NoMemory final : public CStringAllocator {
 public:
  void* allocate(std::size_t) noexcept override { return nullptr; }
  void deallocate(void*) noexcept override { ADD_FAILURE() << "nothing was allocated"; }
};

class Counting final : public CStringAllocator {
 public:
  void* allocate(std::size_t size) noexcept override {
    ++live;
    return defaultCStringAllocator().allocate(size);
  }
  void deallocate(void* block) noexcept override {
    --live;
    defaultCStringAllocator().deallocate(block);
  }
  int live = 0;
};

TEST(MobileUserTest, GivesHomeDirectoryAndIdsOfTheMobileAccount) {
  FakeAccountDirectory accounts;
  accounts.accounts["mobile"] = {AccountIds{501, 502}, "/var/mobile"};
  accounts.accounts["root"] = {AccountIds{0, 0}, "/root"};
  MobileUser user(accounts);
  EXPECT_STREQ(user.homeDirectory(), "/var/mobile");
  EXPECT_EQ(user.uid(), 501U);
  EXPECT_EQ(user.gid(), 502U);
}

TEST(MobileUserTest, ATrailingSlashOfTheHomeDirectoryIsLeftOut) {
  const std::vector<std::pair<std::string, std::string>> homes{
      {"/var/mobile/", "/var/mobile"}, {"/var/mobile//", "/var/mobile"}, {"/", "/"}, {"//", "/"}};
  for (const auto& [inDatabase, expected] : homes) {
    FakeAccountDirectory accounts;
    accounts.accounts["mobile"] = {AccountIds{501, 502}, inDatabase};
    MobileUser user(accounts);
    EXPECT_EQ(user.homeDirectory(), expected) << inDatabase;
  }
}

TEST(MobileUserTest, WithoutAMobileEntryUidAndGidAreZeroAndThereIsNoHome) {
  FakeAccountDirectory accounts;
  MobileUser user(accounts);
  EXPECT_EQ(user.uid(), 0U);
  EXPECT_EQ(user.gid(), 0U);
  EXPECT_EQ(user.homeDirectory(), nullptr);
}

TEST(MobileUserTest, AnAccountWithoutAHomeDirectoryHasItsIds) {
  FakeAccountDirectory accounts;
  accounts.accounts["mobile"] = {AccountIds{501, 502}, std::nullopt};
  MobileUser user(accounts);
  EXPECT_EQ(user.homeDirectory(), nullptr);
  EXPECT_EQ(user.uid(), 501U);
}

TEST(MobileUserTest, AHomeDirectoryWithoutAPasswordEntryIsKeptAndTheIdsAreZero) {
  FakeAccountDirectory accounts;
  accounts.accounts["mobile"] = {std::nullopt, "/var/mobile"};
  MobileUser user(accounts);
  EXPECT_STREQ(user.homeDirectory(), "/var/mobile");
  EXPECT_EQ(user.uid(), 0U);
  EXPECT_EQ(user.gid(), 0U);
}

TEST(MobileUserTest, ALookUpThatLacksMemoryIsNoAnswerAndTheNextOneAsksAgain) {
  FakeAccountDirectory accounts;
  accounts.accounts["mobile"] = {AccountIds{501, 502}, "/var/mobile"};
  accounts.exhausted = true;
  MobileUser user(accounts);
  EXPECT_THROW((void)user.homeDirectory(), std::bad_alloc);
  EXPECT_THROW((void)user.gid(), std::bad_alloc);
  accounts.exhausted = false;
  EXPECT_STREQ(user.homeDirectory(), "/var/mobile");
  EXPECT_EQ(user.gid(), 502U);
}

TEST(MobileUserTest, WithoutMemoryForThePathThereIsNoAnswerEither) {
  FakeAccountDirectory accounts;
  accounts.accounts["mobile"] = {AccountIds{501, 502}, "/var/mobile"};
  NoMemory memory;
  MobileUser user(accounts, memory);
  EXPECT_THROW((void)user.homeDirectory(), std::bad_alloc);
  EXPECT_THROW((void)user.gid(), std::bad_alloc);
}

TEST(MobileUserTest, ThePathGoesWithTheObject) {
  FakeAccountDirectory accounts;
  accounts.accounts["mobile"] = {AccountIds{501, 502}, "/var/mobile"};
  Counting memory;
  {
    MobileUser user(accounts, memory);
    EXPECT_STREQ(user.homeDirectory(), "/var/mobile");
    EXPECT_EQ(memory.live, 1);
  }
  EXPECT_EQ(memory.live, 0);
}

TEST(MobileUserTest, TheAccountIsLookedUpOnceAndNotBeforeItIsAskedFor) {
  FakeAccountDirectory accounts;
  accounts.accounts["mobile"] = {AccountIds{501, 502}, "/var/mobile"};
  MobileUser user(accounts);
  EXPECT_EQ(accounts.idLookUps + accounts.homeLookUps, 0);
  EXPECT_EQ(user.gid(), 502U);
  accounts.accounts["mobile"] = {AccountIds{1, 2}, "/elsewhere"};
  EXPECT_EQ(user.uid(), 501U);
  EXPECT_EQ(user.gid(), 502U);
  EXPECT_STREQ(user.homeDirectory(), "/var/mobile");
  EXPECT_EQ(accounts.idLookUps, 1);
  EXPECT_EQ(accounts.homeLookUps, 1);
}

TEST(MobileUserTest, ManyThreadsMayAskFirstAndAllGetTheOneAnswer) {
  FakeAccountDirectory accounts;
  accounts.accounts["mobile"] = {AccountIds{501, 502}, "/var/mobile"};
  MobileUser user(accounts);
  std::vector<const char*> homes(8);
  std::vector<std::thread> threads;
  for (auto& home : homes) {
    threads.emplace_back([&user, &home] { home = user.uid() == 501 ? user.homeDirectory() : nullptr; });
  }
  for (auto& thread : threads) thread.join();
  for (const char* const home : homes) EXPECT_EQ(home, user.homeDirectory());
  EXPECT_STREQ(user.homeDirectory(), "/var/mobile");
  EXPECT_EQ(accounts.idLookUps, 1);
}

TEST(MobileUserTest, TheProcessHasOneObjectWhoeverAsks) {
  static FakeAccountDirectory first;  // as long-lived as the object that keeps a reference to it
  first.accounts["mobile"] = {AccountIds{501, 502}, "/var/mobile"};
  FakeAccountDirectory second;
  MobileUser& user = MobileUser::shared(first);
  EXPECT_EQ(&MobileUser::shared(second), &user);
  EXPECT_EQ(user.uid(), 501U);
  EXPECT_EQ(second.idLookUps, 0);
}

}  // namespace
}  // namespace brenvik

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/ipc/linux/ConnectionBooks.h"

#include <gtest/gtest.h>

#include <deque>

namespace brenvik {
namespace {

constexpr std::size_t kOfOne = ConnectionBooks::kMaxStrangersPerAccount;
constexpr std::size_t kInAll = ConnectionBooks::kMaxStrangers;

class ConnectionBooksTest : public testing::Test {
 protected:
  ConnectionBooks::Entry& add(uid_t account) {
    books.add(entries.emplace_back(account));
    return entries.back();
  }
  std::deque<ConnectionBooks::Entry> entries;
  ConnectionBooks books;
};

TEST_F(ConnectionBooksTest, AnAccountThatHasTooManyLosesItsOwnOldest) {
  add(1);
  auto& oldest = add(2);
  for (std::size_t i = 1; i < kOfOne; ++i) EXPECT_EQ(books.overdueAfter(add(2)), nullptr);
  EXPECT_EQ(books.overdueAfter(add(2)), &oldest);
  EXPECT_EQ(books.overdueAfter(entries.front()), nullptr) << "the other account has one";
}

TEST_F(ConnectionBooksTest, TheTotalHoldsForAnyNumberOfAccounts) {
  for (std::size_t i = 0; i < kInAll; ++i) EXPECT_EQ(books.overdueAfter(add(static_cast<uid_t>(i))), nullptr);
  for (std::size_t i = 0; i < 3000; ++i) {
    auto& last = add(static_cast<uid_t>(kInAll + i));
    ASSERT_EQ(books.overdueAfter(last), &entries[i]) << "the oldest of all";
    books.remove(entries[i]);
    ASSERT_EQ(books.strangers(), kInAll);
    ASSERT_EQ(books.accounts(), kInAll) << "accounts without connections are forgotten";
  }
}

TEST_F(ConnectionBooksTest, WhoHasCheckedInIsNoStrangerAnyMore) {
  auto& client = add(1);
  books.admit(client);
  books.admit(client);
  for (std::size_t i = 0; i < kOfOne; ++i) EXPECT_EQ(books.overdueAfter(add(1)), nullptr);
  EXPECT_EQ(books.oldestStranger(), &entries[1]);
  EXPECT_EQ(books.admitted(), 1U);
  books.remove(client);
  books.remove(client);
  EXPECT_EQ(books.admitted(), 0U);
}

TEST_F(ConnectionBooksTest, OfTheConnectionsOfClientsTheOldestMayGo) {
  for (std::size_t i = 0; i < ConnectionBooks::kMaxAdmitted; ++i) {
    books.admit(add(1));
    EXPECT_EQ(books.overdueAdmitted(), nullptr);
  }
  books.admit(add(2));
  EXPECT_EQ(books.overdueAdmitted(), &entries.front());
}

}  // namespace
}  // namespace brenvik

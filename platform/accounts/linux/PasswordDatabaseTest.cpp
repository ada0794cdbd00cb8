// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/accounts/linux/PasswordDatabase.h"

#include <gtest/gtest.h>
#include <pwd.h>

#include <cerrno>
#include <cstring>
#include <functional>
#include <new>
#include <string>

#include "platform/base/fakes/FailingAllocations.h"

namespace brenvik {
namespace {

// Another account database than this machine's, while a test sets one.
using LookUp = std::function<int(passwd* entry, char* text, std::size_t size, passwd** found)>;
LookUp* lookUp = nullptr;

// Sets the home behind whatever else an entry holds, if there is room for both.
int answer(std::size_t otherBytes, const char* home, passwd* entry, char* text, std::size_t size,
           passwd** found) {
  const std::size_t length = std::strlen(home) + 1;
  if (size < otherBytes + length) return ERANGE;
  entry->pw_uid = 7;
  entry->pw_gid = 8;
  entry->pw_dir = std::strcpy(text + otherBytes, home);
  *found = entry;
  return 0;
}

class OtherDatabaseTest : public testing::Test {
 protected:
  ~OtherDatabaseTest() override { lookUp = nullptr; }
  void use(LookUp given) {
    database = std::move(given);
    lookUp = &database;
  }
  LookUp database;
  PasswordDatabase accounts;
};

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

TEST_F(OtherDatabaseTest, AnEntryMayBeAsLongAsAMebibyteAndNoLonger) {
  for (const std::size_t bytes : {100UL, 5000UL, 900'000UL}) {
    use([bytes](auto... arguments) { return answer(bytes, "/home", arguments...); });
    EXPECT_EQ(accounts.idsOf("keeper"), (AccountIds{7, 8})) << bytes;
    EXPECT_EQ(accounts.homeDirectoryOf("keeper"), "/home") << bytes;
  }
  std::size_t largest = 0;
  use([&largest](passwd*, char*, std::size_t size, passwd**) {
    largest = size;
    return ERANGE;
  });
  EXPECT_EQ(accounts.idsOf("keeper"), std::nullopt);
  EXPECT_EQ(largest, std::size_t{1} << 20);
}

TEST_F(OtherDatabaseTest, ADatabaseThatCannotBeAskedForWantOfMemoryOrDescriptorsIsNoAnswer) {
  for (const int error : {EMFILE, ENFILE, ENOMEM}) {
    use([error](passwd*, char*, std::size_t, passwd**) { return error; });
    EXPECT_THROW((void)accounts.idsOf("root"), std::bad_alloc) << error;
    EXPECT_THROW((void)accounts.homeDirectoryOf("root"), std::bad_alloc) << error;
  }
  use([](passwd*, char*, std::size_t, passwd**) {
    errno = ENOMEM;  // and it says that there is no such account
    return 0;
  });
  EXPECT_THROW((void)accounts.idsOf("root"), std::bad_alloc);
}

TEST_F(OtherDatabaseTest, ADatabaseThatCannotBeAskedKnowsNobody) {
  for (const int error : {EIO, EINTR}) {
    use([error](passwd* entry, char*, std::size_t, passwd** found) {
      *found = entry;  // whatever else it says
      return error;
    });
    EXPECT_EQ(accounts.idsOf("root"), std::nullopt) << error;
    EXPECT_EQ(accounts.homeDirectoryOf("root"), std::nullopt) << error;
  }
}

TEST_F(OtherDatabaseTest, AnAccountWithoutAHomeHasNone) {
  use([](auto... arguments) { return answer(0, "", arguments...); });
  EXPECT_EQ(accounts.homeDirectoryOf("keeper"), std::nullopt);
  EXPECT_EQ(accounts.idsOf("keeper"), (AccountIds{7, 8}));
  use([](passwd* entry, char*, std::size_t, passwd** found) {
    entry->pw_dir = nullptr;
    *found = entry;
    return 0;
  });
  EXPECT_EQ(accounts.homeDirectoryOf("keeper"), std::nullopt);
}

TEST_F(OtherDatabaseTest, WithoutMemoryForALongEntryThereIsNoAnswer) {
  if (!FailingAllocations::kWork) GTEST_SKIP() << "operator new belongs to the sanitizer";
  use([](auto... arguments) { return answer(5000, "/home", arguments...); });
  const FailingAllocations noMemory(0);
  EXPECT_THROW((void)accounts.idsOf("keeper"), std::bad_alloc);
  EXPECT_THROW((void)accounts.homeDirectoryOf("keeper"), std::bad_alloc);
}

}  // namespace
}  // namespace brenvik

extern "C" int getpwnam_r(const char* name, passwd* entry, char* text, std::size_t size, passwd** found) {
  if (brenvik::lookUp != nullptr) return (*brenvik::lookUp)(entry, text, size, found);
  // The machine's own, by the call that has no such twin.
  const passwd* const known = ::getpwnam(name);
  *found = nullptr;
  if (known == nullptr) return 0;
  const int result = brenvik::answer(0, known->pw_dir, entry, text, size, found);
  entry->pw_uid = known->pw_uid;
  entry->pw_gid = known->pw_gid;
  return result;
}

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/stores/linux/PreparedFolder.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>
#include <functional>
#include <string>

#include "platform/files/fakes/ChildProcesses.h"
#include "platform/files/fakes/TemporaryDirectory.h"

namespace brenvik {
namespace {

using IfMissing = StoreFolder::IfMissing;
using State = StoreFolder::State;

constexpr uid_t kMobile = 4711;
constexpr gid_t kGroup = 4712;
const std::string kDatabase("SQLite format 3\0 and more", 25);

class PreparedFolderTest : public testing::Test {
 protected:
  static PreparedFolder folderOf(const std::string& home, uid_t uid = ::geteuid() == 0 ? kMobile : ::getuid(),
                                 gid_t gid = ::geteuid() == 0 ? kGroup : ::getgid()) {
    return {[home, uid, gid] { return PreparedFolder::Account{home, uid, gid}; }, "Store", "store.db"};
  }
  State open(PreparedFolder folder, IfMissing ifMissing = IfMissing::fail) {
    opened = {};
    return folder.open(ifMissing, &opened);
  }
  // Where nobody but root may write, up to the root of the file system: on a file system of this test's own.
  static void inRootsHome(const std::function<void(const std::string& home)>& body) {
    if (::geteuid() != 0) GTEST_SKIP() << "gives files away";
    inPrivateMounts([&] {
      (void)::umask(022);
      mountSmallDisk("/mnt", 256);
      ASSERT_EQ(::chmod("/mnt", 0755), 0);
      std::filesystem::create_directories("/mnt/home/Library/Store");
      body("/mnt/home");
    });
  }
  static void write(const std::string& path, const std::string& content = kDatabase, mode_t mode = 0644) {
    std::ofstream(path, std::ios::binary) << content;
    ASSERT_EQ(::chmod(path.c_str(), mode), 0);
  }
  static uid_t ownerOf(const std::string& path) { return statOf(path).st_uid; }

  TemporaryDirectory home;
  StoreFolder::Opened opened;
};

TEST_F(PreparedFolderTest, LookingMakesNothingAndAChangeMakesTheFoldersOfTheAccount) {
  EXPECT_EQ(open(folderOf(home.path())), State::missing);
  EXPECT_FALSE(isThere(home / "Library"));
  const mode_t before = ::umask(0);
  EXPECT_EQ(open(folderOf(home.path()), IfMissing::create), State::open);
  ::umask(before);
  EXPECT_EQ(opened.inode, statOf(home / "Library/Store").st_ino);
  EXPECT_EQ(statOf(home / "Library").st_mode, S_IFDIR | 0755u);
  EXPECT_EQ(statOf(home / "Library/Store").st_mode, S_IFDIR | 0700u);
  for (const char* name : {"Library", "Library/Store"}) {
    EXPECT_EQ(statOf(home / name).st_uid, ::geteuid() == 0 ? kMobile : ::getuid());
    EXPECT_EQ(statOf(home / name).st_gid, ::geteuid() == 0 ? kGroup : ::getgid());
  }
  const StoreFolder::Opened first = std::move(opened);
  EXPECT_EQ(open(folderOf(home.path())), State::open);
  EXPECT_TRUE(opened.isSameAs(first));
}

TEST_F(PreparedFolderTest, WithoutAHomeThereIsNoFolder) {
  EXPECT_EQ(open(folderOf(""), IfMissing::create), State::missing);
  EXPECT_EQ(open(folderOf(home / "missing"), IfMissing::create), State::missing);
  EXPECT_FALSE(isThere(home / "missing"));
}

TEST_F(PreparedFolderTest, WithTooFewDescriptorsItIsALackWhateverWasToBeMade) {
  rlimit before{};
  ASSERT_EQ(::getrlimit(RLIMIT_NOFILE, &before), 0);
  const UniqueFd next(::dup(STDERR_FILENO));
  int lacks = 0;
  State state = State::outOfMemory;
  for (rlim_t count = 0; count < 20 && state == State::outOfMemory; ++count) {
    const rlimit few{static_cast<rlim_t>(next.get()) + 1 + count, before.rlim_max};
    ASSERT_EQ(::setrlimit(RLIMIT_NOFILE, &few), 0);
    state = open(folderOf(home.path()), IfMissing::create);
    ASSERT_EQ(::setrlimit(RLIMIT_NOFILE, &before), 0);
    if (state == State::outOfMemory) ++lacks;
  }
  EXPECT_EQ(state, State::open);
  EXPECT_GT(lacks, 2) << "for the home, for a folder in it, for making it";
}

TEST_F(PreparedFolderTest, AHomeBehindALinkOfRootsIsTheSameHome) {
  TemporaryDirectory other;
  EXPECT_EQ(open(folderOf(other.link("home", home.path())), IfMissing::create), State::open);
  EXPECT_TRUE(isThere(home / "Library/Store"));
}

TEST_F(PreparedFolderTest, NoLinkBelowTheHomeIsFollowed) {
  TemporaryDirectory elsewhere;
  home.link("Library/Store", elsewhere.path());
  EXPECT_EQ(open(folderOf(home.path()), IfMissing::create), State::unusable);
  std::filesystem::remove_all(home / "Library");
  elsewhere.directory("Store");
  home.link("Library", elsewhere.path());
  EXPECT_EQ(open(folderOf(home.path()), IfMissing::create), State::unusable);
  std::filesystem::remove_all(home / "Library");
  home.file("Library", "a file");
  EXPECT_EQ(open(folderOf(home.path()), IfMissing::create), State::unusable);
}

TEST_F(PreparedFolderTest, AFolderOfSomebodyElsesThatStandsWhereOneIsMadeIsNotGivenAway) {
  if (::geteuid() != 0) GTEST_SKIP() << "gives files away";
  // Left by an earlier version, killed in between, or put there under its name.
  home.directory("Library/.brenvik-folder");
  EXPECT_EQ(open(folderOf(home.path()), IfMissing::create), State::open);
  EXPECT_EQ(ownerOf(home / "Library/.brenvik-folder"), 0U);
}

TEST_F(PreparedFolderTest, WhatOnlyRootCanHavePlacedIsGivenToTheAccount) {
  inRootsHome([&](const std::string& root) {
    const std::string store = root + "/Library/Store";
    for (const char* name : {"store.db", "store.db-journal", "store.db-wal", "store.db-shm", "other.db"}) {
      write(store + "/" + name, "whatever", 0600);
    }
    ASSERT_EQ(open(folderOf(root)), State::open);
    EXPECT_TRUE(folderOf(root).prepare(opened));
    EXPECT_EQ(ownerOf(store), kMobile);
    EXPECT_EQ(statOf(store).st_gid, kGroup);
    for (const char* name : {"/store.db", "/store.db-journal", "/store.db-wal", "/store.db-shm"}) {
      EXPECT_EQ(ownerOf(store + name), kMobile) << name;
      EXPECT_EQ(statOf(store + name).st_mode & 07777U, 0600U) << name;
    }
    EXPECT_EQ(ownerOf(store + "/other.db"), 0U);
    EXPECT_EQ(ownerOf(root + "/Library"), 0U);
    EXPECT_FALSE(folderOf(root).prepare(opened)) << "nothing is left to give";
  });
}

TEST_F(PreparedFolderTest, WhatIsNoPlainFileOfRootsWithOneNameStays) {
  inRootsHome([&](const std::string& root) {
    const std::string store = root + "/Library/Store";
    write(root + "/private", "private", 0600);
    ASSERT_EQ(::link((root + "/private").c_str(), (store + "/store.db").c_str()), 0);
    ASSERT_EQ(::symlink((root + "/private").c_str(), (store + "/store.db-journal").c_str()), 0);
    ASSERT_EQ(::mkfifo((store + "/store.db-wal").c_str(), 0600), 0);
    write(store + "/store.db-shm");
    ASSERT_EQ(::chown((store + "/store.db-shm").c_str(), 99, 99), 0);
    ASSERT_EQ(open(folderOf(root)), State::open);
    EXPECT_TRUE(folderOf(root).prepare(opened));
    EXPECT_EQ(ownerOf(root + "/private"), 0U);
    EXPECT_EQ(ownerOf(store + "/store.db-journal"), 0U);
    EXPECT_EQ(ownerOf(store + "/store.db-wal"), 0U);
    EXPECT_EQ(ownerOf(store + "/store.db-shm"), 99U);
  });
}

TEST_F(PreparedFolderTest, AnAccountThatIsRootsGetsNothingThatItHasAlready) {
  inRootsHome([&](const std::string& root) {
    write(root + "/Library/Store/store.db");
    ASSERT_EQ(open(folderOf(root, 0, kGroup)), State::open);
    EXPECT_FALSE(folderOf(root, 0, kGroup).prepare(opened));
    EXPECT_EQ(statOf(root + "/Library/Store").st_gid, 0U);
    EXPECT_EQ(statOf(root + "/Library/Store/store.db").st_gid, 0U);
  });
}

TEST_F(PreparedFolderTest, WhereSomebodyElseMayWriteOnTheWayNothingOfRootsIsGiven) {
  inRootsHome([&](const std::string& root) {
    const std::string store = root + "/Library/Store";
    write(store + "/store.db");
    const auto expectNothingGiven = [&](const char* how) {
      ASSERT_EQ(open(folderOf(root)), State::open) << how;
      EXPECT_FALSE(folderOf(root).prepare(opened)) << how;
      EXPECT_EQ(ownerOf(store), 0U) << how;
      EXPECT_EQ(ownerOf(store + "/store.db"), 0U) << how;
    };
    for (const std::string& writable : {root, root + "/Library", store}) {
      ASSERT_EQ(::chmod(writable.c_str(), 0777), 0);
      expectNothingGiven("everybody writes");
      ASSERT_EQ(::chmod(writable.c_str(), 0775), 0);
      expectNothingGiven("the group writes");
      ASSERT_EQ(::chmod(writable.c_str(), 0755), 0);
    }
    ASSERT_EQ(::chmod(store.c_str(), 01777), 0);
    expectNothingGiven("everybody puts files there");
    ASSERT_EQ(::chmod(store.c_str(), 0755), 0);
    ASSERT_EQ(::chown(root.c_str(), 99, 99), 0);
    expectNothingGiven("the home is a third one's");
  });
}

TEST_F(PreparedFolderTest, WhereEverybodyMayPutFoldersOfHisOwnRootsAreStillRoots) {
  inRootsHome([&](const std::string& root) {
    write(root + "/Library/Store/store.db", kDatabase, 0600);
    ASSERT_EQ(::chmod("/mnt", 01777), 0);
    ASSERT_EQ(open(folderOf(root)), State::open);
    EXPECT_TRUE(folderOf(root).prepare(opened));
    EXPECT_EQ(ownerOf(root + "/Library/Store/store.db"), kMobile);
  });
}

TEST_F(PreparedFolderTest, InAHomeOfTheAccountsAFolderOfRootsIsGivenIfItHoldsNothingButAnOpenDatabase) {
  inRootsHome([&](const std::string& root) {
    const std::string library = root + "/Library";
    const std::string store = library + "/Store";
    const auto isGiven = [&](const std::function<void()>& make) {
      std::filesystem::remove_all(library);
      std::filesystem::create_directories(store);
      EXPECT_EQ(::chown(root.c_str(), kMobile, kGroup), 0);
      make();
      EXPECT_EQ(open(folderOf(root)), State::open);
      const bool says = folderOf(root).prepare(opened);
      EXPECT_EQ(says, ownerOf(store) == kMobile);
      if (isThere(store + "/store.db")) {
        EXPECT_EQ(says, ownerOf(store + "/store.db") == kMobile);
      }
      return says;
    };
    const auto put = [&](const char* name, const std::string& content = kDatabase, mode_t mode = 0644) {
      return [=] { write(store + "/" + name, content, mode); };
    };
    const auto withDatabase = [&](std::function<void()> more) {
      return [=] {
        write(store + "/store.db");
        more();
      };
    };
    EXPECT_TRUE(isGiven(put("store.db")));
    EXPECT_TRUE(isGiven(put("store.db", "")));
    EXPECT_TRUE(isGiven([] {})) << "empty";
    EXPECT_TRUE(isGiven(withDatabase(put("store.db-journal", "a journal"))));
    EXPECT_TRUE(isGiven(withDatabase([&] { ASSERT_EQ(::chown(library.c_str(), kMobile, kGroup), 0); })));

    EXPECT_FALSE(isGiven(put("store.db", kDatabase, 0600)));
    EXPECT_FALSE(isGiven(put("store.db", "not a database")));
    EXPECT_FALSE(isGiven(put("store.db", kDatabase, 04755)));
    EXPECT_FALSE(isGiven(withDatabase(put("store.db-wal", "private", 0640))));
    EXPECT_FALSE(isGiven(withDatabase(put("another"))));
    EXPECT_FALSE(isGiven(withDatabase([&] { std::filesystem::create_directory(store + "/store.db-shm"); })));
    EXPECT_FALSE(isGiven(withDatabase([&] { ASSERT_EQ(::chmod(store.c_str(), 0700), 0); })));
    EXPECT_FALSE(isGiven(withDatabase([&] { ASSERT_EQ(::chmod(library.c_str(), 0700), 0); })));
    EXPECT_FALSE(isGiven(withDatabase([&] { ASSERT_EQ(::chmod(library.c_str(), 0777), 0); })));
    EXPECT_FALSE(isGiven(withDatabase([&] { ASSERT_EQ(::chown(library.c_str(), 99, 99), 0); })));
    EXPECT_FALSE(isGiven(withDatabase(
        [&] { ASSERT_EQ(::link((store + "/store.db").c_str(), (root + "/second").c_str()), 0); })));
  });
}

TEST_F(PreparedFolderTest, InAFolderOfTheAccountsOnlyADatabaseThatEverybodyMayReadIsGiven) {
  if (::geteuid() != 0) GTEST_SKIP() << "gives files away";
  ASSERT_EQ(open(folderOf(home.path()), IfMissing::create), State::open);
  const std::string file = home / "Library/Store/store.db";
  const auto isGiven = [&](const std::string& content, mode_t mode) {
    (void)::unlink(file.c_str());
    write(file, content, mode);
    const bool says = folderOf(home.path()).prepare(opened);
    EXPECT_EQ(says, ownerOf(file) == kMobile);
    return says;
  };
  EXPECT_TRUE(isGiven(kDatabase, 0644));
  EXPECT_TRUE(isGiven("", 0644));
  EXPECT_FALSE(isGiven(kDatabase, 0600));
  EXPECT_FALSE(isGiven(kDatabase, 0640));
  EXPECT_FALSE(isGiven("not a database", 0644));
  EXPECT_FALSE(isGiven(kDatabase, 04755));
  ASSERT_EQ(::chmod(file.c_str(), 0644), 0);
  ASSERT_EQ(::link(file.c_str(), (home / "other").c_str()), 0);
  EXPECT_FALSE(folderOf(home.path()).prepare(opened)) << "it has two names";
  EXPECT_EQ(ownerOf(file), 0U);
  (void)::unlink(file.c_str());
  write(file);
  ASSERT_EQ(::chown(file.c_str(), 99, 99), 0);
  EXPECT_FALSE(folderOf(home.path()).prepare(opened)) << "it is a third one's";
  EXPECT_EQ(ownerOf(file), 99U);
  (void)::unlink(file.c_str());
  ASSERT_EQ(::mkfifo(file.c_str(), 0644), 0);
  EXPECT_FALSE(folderOf(home.path()).prepare(opened));
  ASSERT_EQ(::chown((home / "Library/Store").c_str(), 99, 99), 0);
  EXPECT_FALSE(isGiven(kDatabase, 0644)) << "the folder is a third one's";
}

}  // namespace
}  // namespace brenvik

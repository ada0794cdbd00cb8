// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/voicemail/linux/SqliteVoicemailStore.h"

#include <gtest/gtest.h>
#include <sched.h>
#include <sqlite3.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <chrono>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "platform/base/fakes/FailingCalls.h"
#include "platform/files/fakes/ChildProcesses.h"
#include "platform/files/fakes/TemporaryDirectory.h"
#include "platform/log/fakes/RecordingLog.h"
#include "platform/sqlite/fakes/ManualSqliteTime.h"
#include "platform/stores/linux/PreparedFolder.h"
#include "platform/voicemail/fakes/InMemoryVoicemailStore.h"
#include "platform/voicemail/linux/DynamicVisualVoicemail.h"

extern "C" int fsync(int file) {
  if (brenvik::FailingCall::failsNow("fsync")) return -1;
  return static_cast<int>(::syscall(SYS_fsync, file));
}

namespace brenvik {
namespace {

using namespace std::chrono_literals;

// In <home>/Library/Voicemail, as it comes about for the account when it is first written to.
class StoreAtHome final : public VoicemailStore {
 public:
  StoreAtHome(const std::string& home, uid_t uid, gid_t gid,
              const SqliteTime& time = SqliteTime::ofTheSystem())
      : folder_([account = PreparedFolder::Account{home, uid, gid}] { return account; }, "Voicemail",
                "voicemail.db"),
        store_(
            [this](SqliteVoicemailStore::Purpose purpose) {
              const bool writes = purpose == SqliteVoicemailStore::Purpose::writing;
              const auto state = folder_.open(
                  writes ? StoreFolder::IfMissing::create : StoreFolder::IfMissing::fail, &opened_);
              errno = state == StoreFolder::State::missing ? ENOENT : EACCES;
              return state == StoreFolder::State::open ? opened_.descriptor.get() : -1;
            },
            time) {}
  void expectUse() noexcept override {}
  void setToken(const std::string* token) override { store_.setToken(token); }
  void setTokenForKey(const std::string& key, const std::string& token) override {
    store_.setTokenForKey(key, token);
  }
  void removeAllRecords() override { store_.removeAllRecords(); }
  std::optional<std::string> copyToken() override { return store_.copyToken(); }
  std::optional<std::string> copyTokenForKey(const std::string& key) override {
    return store_.copyTokenForKey(key);
  }

 private:
  PreparedFolder folder_;
  StoreFolder::Opened opened_;
  SqliteVoicemailStore store_;
};

// ---- what every store does

struct SqliteAtHome {
  TemporaryDirectory home;
  std::unique_ptr<VoicemailStore> make() {
    return std::make_unique<StoreAtHome>(home.path(), ::getuid(), ::getgid());
  }
};
struct InMemory {
  std::unique_ptr<VoicemailStore> make() { return std::make_unique<InMemoryVoicemailStore>(); }
};

template <typename Maker>
class VoicemailStoreContract : public testing::Test {
 protected:
  Maker maker;
  std::unique_ptr<VoicemailStore> store = maker.make();
};
using Stores = testing::Types<InMemory, SqliteAtHome>;
TYPED_TEST_SUITE(VoicemailStoreContract, Stores);

TYPED_TEST(VoicemailStoreContract, AnEmptyStoreHasNoTokens) {
  EXPECT_EQ(this->store->copyToken(), std::nullopt);
  EXPECT_EQ(this->store->copyTokenForKey("key"), std::nullopt);
  EXPECT_EQ(this->store->copyTokenForKey(""), std::nullopt);
}

TYPED_TEST(VoicemailStoreContract, TokensAreKeptReplacedAndCleared) {
  const std::string first = "first";
  const std::string second = "sécond 'quoted' \xF0\x9F\x98\x80";
  this->store->setToken(&first);
  this->store->setToken(&second);
  this->store->setTokenForKey("a", "1");
  this->store->setTokenForKey("a", "2");
  this->store->setTokenForKey("", "empty key");
  this->store->setTokenForKey("b", "");
  EXPECT_EQ(this->store->copyToken(), second);
  EXPECT_EQ(this->store->copyTokenForKey("a"), "2");
  EXPECT_EQ(this->store->copyTokenForKey(""), "empty key");
  EXPECT_EQ(this->store->copyTokenForKey("b"), "");
  EXPECT_EQ(this->store->copyTokenForKey("A"), std::nullopt);
  this->store->setToken(nullptr);
  EXPECT_EQ(this->store->copyToken(), std::nullopt);
  EXPECT_EQ(this->store->copyTokenForKey("a"), "2");
}

TYPED_TEST(VoicemailStoreContract, RemovingAllRecordsKeepsTheGeneralToken) {
  const std::string token = "general";
  this->store->setToken(&token);
  this->store->setTokenForKey("a", "1");
  this->store->removeAllRecords();
  this->store->removeAllRecords();
  EXPECT_EQ(this->store->copyTokenForKey("a"), std::nullopt);
  EXPECT_EQ(this->store->copyToken(), token);
}

// ---- on the disk

class SqliteVoicemailStoreTest : public testing::Test {
 protected:
  TemporaryDirectory home;
  std::string file = home / "Library/Voicemail/voicemail.db";
  StoreAtHome store{home.path(), ::getuid(), ::getgid()};
  const std::string token = "token";

  static RecordingLog::Entry errorLine(const std::string& text) {
    return RecordingLog::unifiedLine(LogLevel::error, text);
  }
  // As the account's user may.
  void plant(const char* statements) {
    sqlite3* handle = nullptr;
    ASSERT_EQ(::sqlite3_open(file.c_str(), &handle), SQLITE_OK);
    EXPECT_EQ(::sqlite3_exec(handle, statements, nullptr, nullptr, nullptr), SQLITE_OK);
    ::sqlite3_close(handle);
  }
};

TEST_F(SqliteVoicemailStoreTest, ReadingMakesNothingAndWritingMakesAPrivateFileOfTheAccount) {
  EXPECT_EQ(store.copyToken(), std::nullopt);
  EXPECT_FALSE(isThere(home / "Library"));
  const uid_t owner = ::geteuid() == 0 ? 4711 : ::getuid();
  const gid_t group = ::geteuid() == 0 ? 4712 : ::getgid();
  const mode_t before = ::umask(0);
  StoreAtHome of(home.path(), owner, group);
  of.setToken(&token);
  ::umask(before);
  EXPECT_EQ(of.copyToken(), token);
  EXPECT_EQ(statOf(file).st_mode, S_IFREG | 0600u);
  EXPECT_EQ(statOf(home / "Library/Voicemail").st_mode, S_IFDIR | 0700u);
  EXPECT_EQ(statOf(home / "Library/Voicemail").st_uid, owner);
  EXPECT_EQ(statOf(home / "Library").st_mode, S_IFDIR | 0755u);
}

TEST_F(SqliteVoicemailStoreTest, AFileThatOthersMayReadIsMadePrivateWhenItIsOpened) {
  store.setToken(&token);
  for (const mode_t mode : {0644U, 0666U, 04600U}) {
    ASSERT_EQ(::chmod(file.c_str(), mode), 0);
    EXPECT_EQ(store.copyToken(), token);
    EXPECT_EQ(statOf(file).st_mode, S_IFREG | 0600U) << mode;
  }
}

TEST_F(SqliteVoicemailStoreTest, KilledWhileItMakesItsFoldersItNeverShowsOneTheAccountMayNotEnter) {
  const uid_t owner = ::geteuid() == 0 ? 4711 : ::getuid();
  const gid_t group = ::geteuid() == 0 ? 4712 : ::getgid();
  StoreAtHome of(home.path(), owner, group);
  for (int round = 0; round < 60; ++round) {
    const pid_t child = ::fork();
    if (child == 0) {
      killThisProcessAfter(std::chrono::microseconds(100 + round * 41));
      for (;;) of.setToken(&token);
    }
    ::waitpid(child, nullptr, 0);
    for (const char* name : {"Library", "Library/Voicemail"}) {
      if (!isThere(home / name)) continue;
      EXPECT_EQ(statOf(home / name).st_mode, name[7] == '/' ? S_IFDIR | 0700u : S_IFDIR | 0755u) << round;
      EXPECT_EQ(statOf(home / name).st_uid, owner) << round;
      EXPECT_EQ(statOf(home / name).st_gid, group) << round;
    }
    std::filesystem::remove_all(home / "Library");
  }
}

TEST_F(SqliteVoicemailStoreTest, AnotherObjectSeesWhatWasSet) {
  store.setToken(&token);
  StoreAtHome second(home.path(), ::getuid(), ::getgid());
  EXPECT_EQ(second.copyToken(), token);
}

TEST_F(SqliteVoicemailStoreTest, AHomeBehindALinkIsTheSameHome) {
  TemporaryDirectory other;
  StoreAtHome linked(other.link("home", home.path()), ::getuid(), ::getgid());
  linked.setToken(&token);
  EXPECT_EQ(store.copyToken(), token);
}

TEST_F(SqliteVoicemailStoreTest, WhatStandsInItsPlaceNowIsWhatCounts) {
  store.setToken(&token);
  StoreAtHome other(home / "other", ::getuid(), ::getgid());
  home.directory("other");
  const std::string theirs = "theirs";
  other.setToken(&theirs);
  const std::string otherFile = home / "other/Library/Voicemail/voicemail.db";
  // The file, the folder with the same file, a new table in the same file, no file.
  std::filesystem::rename(file, home / "kept");
  std::filesystem::rename(otherFile, file);
  EXPECT_EQ(store.copyToken(), theirs);
  std::filesystem::rename(home / "Library/Voicemail", home / "moved");
  home.directory("Library/Voicemail");
  std::filesystem::rename(home / "moved/voicemail.db", file);
  const std::string second = "second";
  store.setToken(&second);
  EXPECT_EQ(store.copyToken(), second);
  plant("DROP TABLE general");
  EXPECT_EQ(store.copyToken(), std::nullopt);
  store.setToken(&token);
  EXPECT_EQ(store.copyToken(), token);
  std::filesystem::remove(file);
  EXPECT_EQ(store.copyToken(), std::nullopt);
  EXPECT_FALSE(isThere(file));
}

TEST_F(SqliteVoicemailStoreTest, WithoutAHomeTheStoreIsAlwaysEmpty) {
  RecordingLog log;
  for (const std::string& none : {std::string(), home / "missing"}) {
    StoreAtHome without(none, 0, 0);
    without.setToken(&token);
    without.removeAllRecords();
    EXPECT_EQ(without.copyToken(), std::nullopt);
  }
  EXPECT_FALSE(isThere(home / "missing"));
}

TEST_F(SqliteVoicemailStoreTest, NoLinkInTheAccountsOwnFoldersIsFollowed) {
  TemporaryDirectory elsewhere;
  RecordingLog log;
  elsewhere.file("victim", "kept");
  home.link("Library/Voicemail/voicemail.db", elsewhere / "victim");
  store.setToken(&token);
  EXPECT_EQ(contentOf(elsewhere / "victim"), "kept");
  EXPECT_EQ(store.copyToken(), std::nullopt);
  std::filesystem::remove_all(home / "Library/Voicemail");
  home.link("Library/Voicemail", elsewhere.path());
  store.setToken(&token);
  EXPECT_FALSE(isThere(elsewhere / "voicemail.db"));
  EXPECT_EQ(store.copyToken(), std::nullopt);
}

TEST_F(SqliteVoicemailStoreTest, ADamagedStoreIsMovedAsideAndANewOneMade) {
  store.setToken(&token);
  home.file("Library/Voicemail/voicemail.db", std::string(8192, 'x'));
  RecordingLog log;
  EXPECT_EQ(store.copyToken(), std::nullopt);
  store.setTokenForKey("key", "value");
  EXPECT_EQ(store.copyTokenForKey("key"), "value");
  EXPECT_EQ(contentOf(file + ".damaged"), std::string(8192, 'x'));
  EXPECT_EQ(log.entries(), (std::vector{errorLine("The voicemail store could not be read"),
                                        errorLine("The voicemail store is damaged; moved aside to "
                                                  "voicemail.db.damaged")}));
}

TEST_F(SqliteVoicemailStoreTest, ASecondDamageGetsANameOfItsOwnAndNothingIsWrittenOver) {
  home.directory("Library/Voicemail");
  RecordingLog log;
  std::vector<RecordingLog::Entry> lines;
  const std::vector<std::string> names{"voicemail.db.damaged", "voicemail.db.damaged.1",
                                       "voicemail.db.damaged.2"};
  for (std::size_t i = 0; i < names.size(); ++i) {
    home.file("Library/Voicemail/voicemail.db", std::string(8192, static_cast<char>('a' + i)));
    store.setToken(&token);
    EXPECT_EQ(store.copyToken(), token);
    lines.push_back(errorLine("The voicemail store is damaged; moved aside to " + names[i]));
  }
  for (std::size_t i = 0; i < names.size(); ++i) {
    EXPECT_EQ(contentOf(home / "Library/Voicemail/" + names[i]),
              std::string(8192, static_cast<char>('a' + i)));
  }
  EXPECT_EQ(log.entries(), lines);
}

TEST_F(SqliteVoicemailStoreTest, WhereAllNamesForDamageAreTakenTheStoreIsLeftAlone) {
  home.file("Library/Voicemail/voicemail.db.damaged", "kept");
  for (int i = 1; i < 100; ++i) {
    home.file("Library/Voicemail/voicemail.db.damaged." + std::to_string(i), "kept");
  }
  const std::string damaged(8192, 'x');
  home.file("Library/Voicemail/voicemail.db", damaged);
  RecordingLog log;
  store.setToken(&token);
  EXPECT_EQ(contentOf(file), damaged);
  EXPECT_EQ(contentOf(file + ".damaged"), "kept");
  EXPECT_EQ(contentOf(file + ".damaged.99"), "kept");
  EXPECT_EQ(log.entries(),
            (std::vector{errorLine("The voicemail store is damaged and cannot be moved aside (File exists)"),
                         errorLine("The voicemail store could not be written")}));
}

TEST_F(SqliteVoicemailStoreTest, AnAnsweredChangeIsHeldFastInItsFolder) {
  store.setToken(&token);
  // What SQLite does with names and folders, in order: with the journal's name gone, the folder is synced.
  static std::vector<std::string> calls;
  calls.clear();
  sqlite3_vfs* const files = ::sqlite3_vfs_find(nullptr);
  static const auto realUnlink =
      reinterpret_cast<int (*)(const char*)>(files->xGetSystemCall(files, "unlink"));
  static const auto realOpenDirectory =
      reinterpret_cast<int (*)(const char*, int*)>(files->xGetSystemCall(files, "openDirectory"));
  const auto unlink = +[](const char* path) {
    calls.emplace_back("unlink");
    return realUnlink(path);
  };
  const auto openDirectory = +[](const char* path, int* folder) {
    calls.emplace_back("open folder to sync it");
    return realOpenDirectory(path, folder);
  };
  files->xSetSystemCall(files, "unlink", reinterpret_cast<sqlite3_syscall_ptr>(unlink));
  files->xSetSystemCall(files, "openDirectory", reinterpret_cast<sqlite3_syscall_ptr>(openDirectory));
  store.setTokenForKey("key", "value");
  files->xSetSystemCall(files, "unlink", reinterpret_cast<sqlite3_syscall_ptr>(realUnlink));
  files->xSetSystemCall(files, "openDirectory", reinterpret_cast<sqlite3_syscall_ptr>(realOpenDirectory));
  ASSERT_FALSE(calls.empty());
  EXPECT_EQ(std::count(calls.begin(), calls.end(), "unlink"), 1);
  EXPECT_EQ(calls.back(), "open folder to sync it");
}

TEST_F(SqliteVoicemailStoreTest, AFolderThatCannotBeHeldFastIsNoPlaceForATokenAndIsMadeAgain) {
  // Of the home, of the folder in it; then all is as usual.
  for (const int earlier : {0, 1}) {
    FailingCall fails("fsync", EIO, earlier);
    RecordingLog log;
    store.setToken(&token);
    EXPECT_EQ(fails.failures(), 1);
    EXPECT_EQ(log.entries(), std::vector{errorLine("The voicemail store could not be written")});
    EXPECT_FALSE(isThere(home / "Library/Voicemail"));
    std::filesystem::remove_all(home / "Library");
  }
  store.setToken(&token);
  EXPECT_EQ(store.copyToken(), token);
}

TEST_F(SqliteVoicemailStoreTest, TablesThatAreTakenFromAnOpenStoreAreMadeAgain) {
  store.setToken(&token);
  plant("DROP TABLE general");
  RecordingLog log;
  const std::string other = "other";
  store.setToken(&other);
  EXPECT_EQ(store.copyToken(), other);
  plant("DROP TABLE general");
  EXPECT_EQ(store.copyToken(), std::nullopt);
  EXPECT_TRUE(log.entries().empty());
}

TEST_F(SqliteVoicemailStoreTest, AnEndlessSearchIsCutOffAndTold) {
  store.setToken(&token);
  plant(
      "DROP TABLE general; CREATE TABLE general(id, token);"
      "WITH RECURSIVE n(i) AS (SELECT 1 UNION ALL SELECT i + 1 FROM n WHERE i < 100000) "
      "INSERT INTO general SELECT i, 'x' FROM n;");
  ManualSqliteTime time;
  time.perLook = 1ms;
  StoreAtHome limited(home.path(), ::getuid(), ::getgid(), time.asTime());
  RecordingLog log;
  EXPECT_EQ(limited.copyToken(), std::nullopt);
  EXPECT_GT(time.now, SqliteVoicemailStore::kPatience);
  EXPECT_LT(time.now, SqliteVoicemailStore::kPatience + 10ms);
  EXPECT_EQ(log.entries(), std::vector{errorLine("The voicemail store could not be read")});
}

TEST_F(SqliteVoicemailStoreTest, AValueTooLongToBeATokenIsNotRead) {
  store.setToken(&token);
  plant("UPDATE general SET token = hex(zeroblob(50000))");
  RecordingLog log;
  EXPECT_EQ(store.copyToken(), std::nullopt);
  EXPECT_EQ(log.entries(), std::vector{errorLine("The voicemail store could not be read")});
}

TEST_F(SqliteVoicemailStoreTest, AViewInATablesPlaceIsNotLookedThrough) {
  store.setToken(&token);
  plant("DROP TABLE general; CREATE VIEW general AS SELECT 0 AS id, 'planted' AS token");
  RecordingLog log;
  EXPECT_EQ(store.copyToken(), std::nullopt);
}

TEST_F(SqliteVoicemailStoreTest, APipeInTheJournalsPlaceKeepsNobodyWaiting) {
  store.setToken(&token);
  ASSERT_EQ(::mkfifo((file + "-journal").c_str(), 0600), 0);
  RecordingLog log;
  const std::string other = "other";
  store.setToken(&other);
  EXPECT_EQ(store.copyToken(), std::nullopt);
  EXPECT_EQ(log.entries(), (std::vector{errorLine("The voicemail store could not be written"),
                                        errorLine("The voicemail store could not be read")}));
  std::filesystem::remove(file + "-journal");
  EXPECT_EQ(store.copyToken(), token);
}

TEST_F(SqliteVoicemailStoreTest, ATriggerPlantedByTheAccountsUserDoesNotRun) {
  store.setTokenForKey("a", "1");
  plant("CREATE TRIGGER t AFTER INSERT ON tokens BEGIN DELETE FROM tokens; END;");
  store.setTokenForKey("b", "2");
  EXPECT_EQ(store.copyTokenForKey("a"), "1");
  EXPECT_EQ(store.copyTokenForKey("b"), "2");
}

TEST_F(SqliteVoicemailStoreTest, AStoreThatAnotherProcessHoldsDropsTheWriteAfterASecondAndStaysSound) {
  store.setToken(&token);
  store.setTokenForKey("key", "value");
  sqlite3* handle = nullptr;
  ASSERT_EQ(::sqlite3_open(file.c_str(), &handle), SQLITE_OK);
  ASSERT_EQ(::sqlite3_exec(handle, "BEGIN EXCLUSIVE", nullptr, nullptr, nullptr), SQLITE_OK);
  ManualSqliteTime time;
  StoreAtHome limited(home.path(), ::getuid(), ::getgid(), time.asTime());
  RecordingLog log;
  const std::string other = "other";
  limited.setToken(&other);
  EXPECT_EQ(time.slept, 1s);
  EXPECT_EQ(log.entries(), std::vector{errorLine("The voicemail store could not be written")});
  log.clear();
  EXPECT_EQ(limited.copyToken(), std::nullopt);
  EXPECT_EQ(time.slept, 2s);
  EXPECT_EQ(log.entries(), std::vector{errorLine("The voicemail store could not be read")});
  // A reset is two operations, and waits no longer than a request may.
  time.slept = 0s;
  limited.setToken(nullptr);
  limited.removeAllRecords();
  EXPECT_EQ(time.slept, 2s);
  ::sqlite3_close(handle);
  EXPECT_EQ(store.copyToken(), token);
  EXPECT_EQ(store.copyTokenForKey("key"), "value");
}

TEST_F(SqliteVoicemailStoreTest, OnAFullDiskTheOldTokenIsStillRead) {
  home.directory("disk");
  inPrivateMounts([&] {
    mountSmallDisk(home / "disk", 64);
    StoreAtHome small(home / "disk", ::getuid(), ::getgid());
    small.setToken(&token);
    EXPECT_EQ(small.copyToken(), token);
    home.file("disk/filler", std::string(64 << 10, 'f'));
    const std::string large(250, 'l');
    for (int i = 0; i < 60; ++i) small.setTokenForKey("key" + std::to_string(i), large);
    EXPECT_EQ(small.copyTokenForKey("key59"), std::nullopt);
    EXPECT_EQ(small.copyToken(), token);
    std::filesystem::remove(home / "disk/filler");
    small.setTokenForKey("key", "fits again");
    EXPECT_EQ(small.copyTokenForKey("key"), "fits again");
  });
}

TEST_F(SqliteVoicemailStoreTest, KilledAtAnyMomentItOpensAndHoldsEveryTokenWhoseSetWasAnswered) {
  int answered = -1;
  int last = 0;
  // More rounds, each longer than the one before, where the disk is so slow that few sets were answered.
  for (int round = 0; round < 15 || (answered <= 0 && round < 60); ++round) {
    int channel[2];
    ASSERT_EQ(::pipe(channel), 0);
    const pid_t child = ::fork();
    if (child == 0) {
      killThisProcessAfter(std::chrono::microseconds(20'000 + round * 15'013));
      for (int i = last;; ++i) {
        store.setTokenForKey("key" + std::to_string(i % 50), std::to_string(i));
        if (::write(channel[1], &i, sizeof i) != sizeof i) ::_exit(1);
      }
    }
    ::close(channel[1]);
    for (int i = 0; ::read(channel[0], &i, sizeof i) == sizeof i;) answered = i;
    ::close(channel[0]);
    ::waitpid(child, nullptr, 0);
    if (answered >= 0) {
      for (int i = std::max(0, answered - 48); i <= answered; ++i) {
        ASSERT_EQ(store.copyTokenForKey("key" + std::to_string(i % 50)), std::to_string(i));
      }
    }
    last = answered + 1;
  }
  EXPECT_GT(answered, 0);
}

// The store's changes in a fixed order, and what it holds after the first `count` of them.
class Changes {
 public:
  static void apply(VoicemailStore& store, int number) {
    const std::string text = std::to_string(number);
    if (number % 31 == 30) {
      store.removeAllRecords();
    } else if (number % 7 == 6) {
      store.setToken(nullptr);
    } else if (number % 2 == 0) {
      store.setToken(&text);
    } else {
      store.setTokenForKey("key" + std::to_string(number % 9), text);
    }
  }
  static std::vector<std::optional<std::string>> after(int count) {
    InMemoryVoicemailStore model;
    for (int number = std::max(0, count - 200); number < count; ++number) apply(model, number);
    return contentOf(model);
  }
  static std::vector<std::optional<std::string>> contentOf(VoicemailStore& store) {
    std::vector<std::optional<std::string>> content{store.copyToken()};
    for (int i = 0; i < 9; ++i) content.push_back(store.copyTokenForKey("key" + std::to_string(i)));
    return content;
  }
};

TEST_F(SqliteVoicemailStoreTest, KilledAmidSetsClearsAndResetsItHoldsWhatWasAnsweredAndAtMostOneChangeMore) {
  // In memory where the system has such a place: what a kill leaves is the same, and there is time for more.
  TemporaryDirectory memory(::access("/dev/shm", W_OK) == 0 ? std::filesystem::path("/dev/shm")
                                                            : std::filesystem::temp_directory_path());
  StoreAtHome fast(memory.path(), ::getuid(), ::getgid());
  int done = 0;
  // More rounds, each longer than the one before, where the machine is so busy that few changes were made.
  for (int round = 0; round < 200 || (done <= 200 && round < 1200); ++round) {
    int channel[2];
    ASSERT_EQ(::pipe(channel), 0);
    const pid_t child = ::fork();
    if (child == 0) {
      killThisProcessAfter(std::chrono::microseconds(300 + round * 23));
      for (int number = done;; ++number) {
        Changes::apply(fast, number);
        if (::write(channel[1], "x", 1) != 1) ::_exit(1);
      }
    }
    ::close(channel[1]);
    char answered = 0;
    while (::read(channel[0], &answered, 1) == 1) ++done;
    ::close(channel[0]);
    ::waitpid(child, nullptr, 0);
    const auto content = Changes::contentOf(fast);
    if (content != Changes::after(done)) {
      // The last change was made, and its answer cut off.
      ++done;
      ASSERT_EQ(content, Changes::after(done)) << "round " << round;
    }
  }
  EXPECT_GT(done, 200);
}

TEST_F(SqliteVoicemailStoreTest, WhereItMayNotWriteTheOldTokenStaysAndTheFailureIsLogged) {
  if (::geteuid() != 0) GTEST_SKIP() << "becomes another user";
  store.setToken(&token);
  const pid_t child = ::fork();
  if (child == 0) {
    ASSERT_EQ(::chmod(home.path().c_str(), 0755), 0);
    if (::setresgid(4712, 4712, 4712) != 0 || ::setresuid(4711, 4711, 4711) != 0) ::_exit(9);
    RecordingLog log;
    const std::string other = "other";
    store.setToken(&other);
    store.setTokenForKey("key", other);
    store.setToken(nullptr);
    store.removeAllRecords();
    EXPECT_EQ(log.entries(), std::vector(4, errorLine("The voicemail store could not be written")));
    log.clear();
    EXPECT_EQ(store.copyToken(), std::nullopt);
    EXPECT_EQ(log.entries(), std::vector{errorLine("The voicemail store could not be read")});
    std::fflush(nullptr);
    ::_exit(testing::Test::HasFailure() ? 1 : 0);
  }
  int status = -1;
  ::waitpid(child, &status, 0);
  EXPECT_EQ(status, 0);
  EXPECT_EQ(store.copyToken(), token);
}

TEST_F(SqliteVoicemailStoreTest, InAUserNamespaceWithoutTheAccountNothingIsWrittenAndNothingIsLeft) {
  // Owned by nobody the store may not be; its folder is not made either.
  const uid_t uid = ::geteuid();
  inPrivateMounts([&] {
    if (uid == 0 && ::unshare(CLONE_NEWUSER) != 0) return;
    RecordingLog log;
    StoreAtHome of(home.path(), 501, 501);
    of.setToken(&token);
    EXPECT_EQ(of.copyToken(), std::nullopt);
    EXPECT_EQ(log.entries(), (std::vector{RecordingLog::unifiedLine(
                                 LogLevel::error, "The voicemail store could not be written")}));
    EXPECT_TRUE(std::filesystem::is_empty(home.path()));
  });
}

// ---- the subscription query

TEST(DynamicVisualVoicemailTest, TheQueryIsFoundUnderItsNameWithTheUnderscore) {
  DynamicVisualVoicemail library(BRENVIK_TEST_LIBRARY, "_VisualVoicemailIsSubscribed");
  const SubscriptionQuery query = library.lookUpSubscriptionQuery();
  ASSERT_NE(query, nullptr);
  EXPECT_TRUE(query());
}

TEST(DynamicVisualVoicemailTest, AMissingLibraryOrSymbolGivesNoQuery) {
  EXPECT_EQ(DynamicVisualVoicemail("libno-such-library.so.0", "_x").lookUpSubscriptionQuery(), nullptr);
  EXPECT_EQ(
      DynamicVisualVoicemail(BRENVIK_TEST_LIBRARY, "VisualVoicemailIsSubscribed").lookUpSubscriptionQuery(),
      nullptr);
  EXPECT_EQ(DynamicVisualVoicemail("", "main").lookUpSubscriptionQuery(), nullptr);
}

}  // namespace
}  // namespace brenvik

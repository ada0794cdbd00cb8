// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/preferences/linux/FilePreferences.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <pwd.h>
#include <sched.h>
#include <sys/file.h>
#include <sys/mount.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <cstdio>
#include <span>
#include <string>
#include <thread>
#include <vector>

#include "platform/base/UniqueFd.h"
#include "platform/base/fakes/FailingAllocations.h"
#include "platform/base/fakes/FailingCalls.h"
#include "platform/log/fakes/RecordingLog.h"
#include "platform/plist/EditableDictionary.h"
#include "platform/plist/PropertyListCodec.h"
#include "platform/preferences/linux/TestHome.h"

namespace brenvik {
namespace {

using namespace std::chrono_literals;
namespace fs = std::filesystem;

constexpr auto kUser = UserScope::currentUser;
constexpr auto kHost = HostScope::anyHost;

std::string binary(const PropertyList& value) {
  return *serializePropertyList(value, PropertyListFormat::binary);
}

PropertyList textDictionary(const std::string& key, const std::string& text) {
  return PropertyList::dictionary({{key, PropertyList::string(text)}});
}

// Sets a time that is long past, so that the file does not count as young.
void makeOld(const fs::path& path, long nanoseconds = 0) {
  const timespec old[2] = {{1'000'000, nanoseconds}, {1'000'000, nanoseconds}};
  ASSERT_EQ(::utimensat(AT_FDCWD, path.c_str(), old, 0), 0);
}

mode_t modeOf(const fs::path& path) {
  struct stat facts;
  return ::stat(path.c_str(), &facts) == 0 ? facts.st_mode & 07777 : 0;
}

class FilePreferencesTest : public testing::Test {
 protected:
  static constexpr const char kDomain[] = "com.example.files";

  void set(FilePreferences& store, std::string_view key, std::string_view text) {
    store.setValue(key, PropertyList::string(text), kDomain, kUser, kHost);
  }
  bool setNow(FilePreferences& store, std::string_view key, std::string_view text) {
    set(store, key, text);
    return sync(store);
  }
  bool sync(FilePreferences& store) { return store.synchronize(kDomain, kUser, kHost); }
  std::string get(FilePreferences& store, std::string_view key) {
    const PropertyList value = store.copyValue(key, kDomain, kUser, kHost);
    return value ? std::string(value.asString().value_or("(no string)")) : "(none)";
  }
  PropertyList onDisk() const {
    const std::string bytes = TestHome::read(file);
    return parsePropertyList(std::as_bytes(std::span(bytes)));
  }
  // The one line logged since the last call.
  std::string onlyLine() {
    const auto entries = log.entries();
    log.clear();
    if (entries.size() != 1) return std::to_string(entries.size()) + " lines";
    return entries[0] == RecordingLog::unifiedLine(LogLevel::error, entries[0].line) ? entries[0].line
                                                                                     : "not an error";
  }
  std::string line(const std::string& rest) const { return "Preferences " + file.string() + ": " + rest; }

  // Of the domain's files that are open: the number of names that each has left.
  std::vector<nlink_t> links() const {
    std::vector<nlink_t> found;
    for (const auto& entry : fs::directory_iterator("/proc/self/fd")) {
      std::error_code error;
      const std::string target = fs::read_symlink(entry.path(), error);
      struct stat facts;
      if (target.starts_with(file.string()) && ::stat(entry.path().c_str(), &facts) == 0) {
        found.push_back(facts.st_nlink);
      }
    }
    return found;
  }

  TestHome home;
  const fs::path file = home.file(kDomain);
  RecordingLog log;
  std::unique_ptr<FilePreferences> ours = home.open();
};

// ---- places -----------------------------------------------------------------------------------------------

TEST_F(FilePreferencesTest, EachScopeHasItsPlaceAndOnlyWhatIsForAnyUserCanBeReadByOthers) {
  const mode_t mask = ::umask(077);
  const auto store = [this](UserScope user, HostScope host) {
    ours->setValue("key", PropertyList::boolean(true), "d", user, host);
    return ours->synchronize("d", user, host);
  };
  const std::string byHost = "ByHost/d." + std::string(TestHome::kMachine) + ".plist";
  EXPECT_TRUE(store(UserScope::currentUser, HostScope::anyHost));
  EXPECT_EQ(modeOf(home.folder() / "d.plist"), 0600u);
  EXPECT_TRUE(store(UserScope::currentUser, HostScope::currentHost));
  EXPECT_EQ(modeOf(home.folder() / byHost), 0600u);
  EXPECT_EQ(modeOf(home.home() / "Library"), 0700u);
  EXPECT_EQ(modeOf(home.folder()), 0700u);
  EXPECT_EQ(modeOf(home.folder() / "ByHost"), 0700u);
  EXPECT_TRUE(store(UserScope::anyUser, HostScope::anyHost));
  EXPECT_EQ(modeOf(home.anyUser() / "d.plist"), 0644u);
  EXPECT_TRUE(store(UserScope::anyUser, HostScope::currentHost));
  EXPECT_EQ(modeOf(home.anyUser() / byHost), 0644u);
  EXPECT_EQ(modeOf(home.anyUser()), 0755u);
  ::umask(mask);
  EXPECT_TRUE(log.entries().empty());
}

TEST_F(FilePreferencesTest, ReadingMakesNothing) {
  EXPECT_EQ(get(*ours, "key"), "(none)");
  EXPECT_TRUE(sync(*ours));
  EXPECT_TRUE(ours->synchronizeApplication(kDomain));
  EXPECT_TRUE(fs::is_empty(home.home()));
  EXPECT_TRUE(log.entries().empty());
}

TEST_F(FilePreferencesTest, PlacesThatAreKnownAreAskedForOnceAndNotBeforeTheyAreNeeded) {
  int asked = 0;
  FilePreferences store([&] {
    ++asked;
    return home.places();
  });
  EXPECT_EQ(asked, 0);
  EXPECT_TRUE(setNow(store, "key", "value"));
  store.synchronizeApplication(kDomain);
  EXPECT_EQ(asked, 1);
}

TEST_F(FilePreferencesTest, TheSystemsPlacesAreTheEffectiveUsersHomeAndTheMachinesId) {
  const auto places = FilePreferences::systemPlaces();
  const passwd* const account = ::getpwuid(::geteuid());
  ASSERT_NE(account, nullptr);
  EXPECT_EQ(places.home, account->pw_dir);
  EXPECT_TRUE(places.anyUser.starts_with("/"));
  EXPECT_TRUE(places.machineId.empty() || places.machineId.size() == 32);
}

TEST_F(FilePreferencesTest, AMachineIdIs32LowerCaseHexadecimalDigitsAndNothingElse) {
  SystemCalls calls;
  calls.machineIdFile = home.root() / "machine-id";
  const std::string id = TestHome::kMachine;
  const auto found = [&](const std::string& content) {
    std::ofstream(calls.machineIdFile, std::ios::binary | std::ios::trunc) << content;
    const auto places = FilePreferences::systemPlaces();
    EXPECT_EQ(places.machineIdError, 0) << "it was read: " << content;
    return places.machineId;
  };
  EXPECT_EQ(found(id + "\n"), id);
  EXPECT_EQ(found(id), id);
  for (const std::string& other :
       {std::string(), std::string("\n"), std::string("uninitialized\n"), id.substr(1) + "\n",
        id.substr(1) + "\n\n", id + "0\n", id + "\n\n", "g" + id.substr(1), id.substr(1) + "A",
        "../" + id.substr(3), id + "\n" + std::string(100, '0')}) {
    EXPECT_EQ(found(other), "") << other;
  }
}

TEST_F(FilePreferencesTest, AMachineIdThatCannotBeReadIsNoneWithTheReason) {
  SystemCalls calls;
  calls.machineIdFile = home.root();
  EXPECT_EQ(FilePreferences::systemPlaces().machineId, "");
  EXPECT_EQ(FilePreferences::systemPlaces().machineIdError, EISDIR);
  calls.failOpen = ENFILE;
  EXPECT_EQ(FilePreferences::systemPlaces().machineId, "");
  EXPECT_EQ(FilePreferences::systemPlaces().machineIdError, ENFILE);
}

TEST_F(FilePreferencesTest, AHomeThatCannotBeLookedUpIsNoneWithTheReasonAndALackOfMemoryIsThrown) {
  {
    const FailingCall failing("getpwuid_r", EIO);
    const auto places = FilePreferences::systemPlaces();
    EXPECT_EQ(places.home, "");
    EXPECT_EQ(places.homeError, EIO);
  }
  const FailingCall failing("getpwuid_r", ENOMEM);
  EXPECT_THROW(FilePreferences::systemPlaces(), std::bad_alloc);
}

TEST_F(FilePreferencesTest, WithoutAHomeOrAMachineIdThoseScopesHoldNothing) {
  FilePreferences store([this] { return FilePreferences::Places{"", home.anyUser(), ""}; });
  for (const auto [user, host] : {PreferencesScope{kUser, kHost},
                                  {kUser, HostScope::currentHost},
                                  {UserScope::anyUser, HostScope::currentHost}}) {
    store.setValue("key", PropertyList::boolean(true), kDomain, user, host);
    EXPECT_EQ(onlyLine(),
              std::string("Preferences: no ") +
                  (user == UserScope::currentUser ? "home directory" : "machine id") +
                  " is known (there is none), the value for domain \"com.example.files\" is not stored");
    EXPECT_FALSE(store.synchronize(kDomain, user, host));
    EXPECT_FALSE(store.copyValue("key", kDomain, user, host));
  }
  store.setValue("key", PropertyList::boolean(true), kDomain, UserScope::anyUser, kHost);
  EXPECT_TRUE(store.synchronizeApplication(kDomain));
  EXPECT_TRUE(store.copyApplicationValue("key", kDomain));
}

TEST_F(FilePreferencesTest, WithoutAFolderForAnyUserThatScopeHoldsNothing) {
  FilePreferences store([this] { return FilePreferences::Places{home.home(), "", TestHome::kMachine}; });
  store.setValue("key", PropertyList::boolean(true), kDomain, UserScope::anyUser, kHost);
  ASSERT_EQ(onlyLine(),
            "Preferences: no folder is known (there is none), the value for domain \"com.example.files\" is "
            "not stored");
  EXPECT_FALSE(store.synchronize(kDomain, UserScope::anyUser, kHost));
}

TEST_F(FilePreferencesTest, ApplicationScopeIsNotWholeWhenOneOfItsScopesCannotBeStored) {
  fs::remove(home.home());
  set(*ours, "key", "lost");
  ours->setValue("key", PropertyList::boolean(true), kDomain, UserScope::anyUser, kHost);
  EXPECT_FALSE(ours->synchronizeApplication(kDomain));
  EXPECT_EQ(onlyLine(), line("open home: No such file or directory"));
  EXPECT_TRUE(home.open()->copyValue("key", kDomain, UserScope::anyUser, kHost)) << "the others are stored";
}

TEST_F(FilePreferencesTest, RemovingAKeyWhereThereIsNoFileMakesNone) {
  ours->setValue("key", {}, kDomain, kUser, kHost);
  EXPECT_TRUE(sync(*ours));
  EXPECT_FALSE(fs::exists(file));
}

TEST_F(FilePreferencesTest, AFailedLookUpOfAPlaceIsToldAndTheNextOneDecidesAnew) {
  FilePreferences::Places answer{"", home.anyUser(), "", EMFILE, ENFILE};
  FilePreferences store([&answer] { return answer; });
  EXPECT_EQ(get(store, "key"), "(none)");
  EXPECT_FALSE(setNow(store, "key", "lost"));
  EXPECT_EQ(onlyLine(),
            "Preferences: no home directory is known (Too many open files), the value for domain "
            "\"com.example.files\" is not stored");
  store.setValue("key", PropertyList::boolean(true), kDomain, UserScope::anyUser, HostScope::currentHost);
  EXPECT_EQ(onlyLine(),
            "Preferences: no machine id is known (Too many open files in system), the value for domain "
            "\"com.example.files\" is not stored");

  answer = home.places();
  answer.machineId.clear();
  EXPECT_TRUE(setNow(store, "key", "kept"));
  EXPECT_EQ(onDisk(), textDictionary("key", "kept"));
  // What is known stays known: a look-up for the one does not lose the other.
  answer = {"", "", TestHome::kMachine, EMFILE, 0};
  store.setValue("key", PropertyList::boolean(true), kDomain, kUser, HostScope::currentHost);
  EXPECT_TRUE(store.synchronize(kDomain, kUser, HostScope::currentHost));
  EXPECT_TRUE(
      fs::exists(home.folder() / "ByHost" / (std::string(kDomain) + "." + TestHome::kMachine + ".plist")));
  store.setValue("key", PropertyList::boolean(true), kDomain, UserScope::anyUser, kHost);
  EXPECT_TRUE(store.synchronize(kDomain, UserScope::anyUser, kHost));

  answer = {"", home.anyUser(), TestHome::kMachine, EMFILE, 0};
  FilePreferences other([&answer] { return answer; });
  EXPECT_TRUE(other.copyValue("key", kDomain, UserScope::anyUser, kHost));
  answer = {home.home(), "", "", 0, EMFILE};
  EXPECT_EQ(get(other, "key"), "kept");
  EXPECT_TRUE(other.copyValue("key", kDomain, kUser, HostScope::currentHost));
  EXPECT_TRUE(log.entries().empty());
}

TEST_F(FilePreferencesTest, WithoutADescriptorForTheLookUpASetIsLostWithALineAndTheNextOneIsStored) {
  FilePreferences store([this] {
    auto places = FilePreferences::systemPlaces();
    if (!places.home.empty()) places.home = home.home();
    return places;
  });
  rlimit usual{};
  ASSERT_EQ(::getrlimit(RLIMIT_NOFILE, &usual), 0);
  const rlimit none{0, usual.rlim_max};
  ASSERT_EQ(::setrlimit(RLIMIT_NOFILE, &none), 0);
  const bool isStored = setNow(store, "key", "lost");
  ASSERT_EQ(::setrlimit(RLIMIT_NOFILE, &usual), 0);
  EXPECT_FALSE(isStored);
  EXPECT_EQ(onlyLine(),
            "Preferences: no home directory is known (Too many open files), the value for domain "
            "\"com.example.files\" is not stored");
  EXPECT_TRUE(setNow(store, "key", "kept"));
  EXPECT_EQ(onDisk(), textDictionary("key", "kept"));
}

TEST_F(FilePreferencesTest, AHomeThatDoesNotExistIsNotMade) {
  fs::remove(home.home());
  EXPECT_FALSE(setNow(*ours, "key", "value"));
  EXPECT_EQ(onlyLine(), line("open home: No such file or directory"));
  EXPECT_FALSE(fs::exists(home.home()));
}

TEST_F(FilePreferencesTest, AFileWhereAFolderBelongsFailsTheSetAndIsLeftAlone) {
  std::ofstream(home.home() / "Library") << "a file";
  EXPECT_EQ(get(*ours, "key"), "(none)");
  EXPECT_TRUE(sync(*ours));
  EXPECT_FALSE(setNow(*ours, "key", "value"));
  EXPECT_EQ(onlyLine(), line("open folder: Not a directory"));
  EXPECT_EQ(TestHome::read(home.home() / "Library"), "a file");
}

TEST_F(FilePreferencesTest, WithoutADescriptorForAFolderNoneIsMade) {
  rlimit usual{};
  ASSERT_EQ(::getrlimit(RLIMIT_NOFILE, &usual), 0);
  const auto next = static_cast<rlim_t>(UniqueFd(::dup(STDERR_FILENO)).get());
  set(*ours, "key", "lost");
  const rlimit one{next + 1, usual.rlim_max};  // the home itself
  ASSERT_EQ(::setrlimit(RLIMIT_NOFILE, &one), 0);
  const bool isStored = sync(*ours);
  ASSERT_EQ(::setrlimit(RLIMIT_NOFILE, &usual), 0);
  EXPECT_FALSE(isStored);
  EXPECT_EQ(onlyLine(), line("open folder: Too many open files"));
  EXPECT_TRUE(fs::is_empty(home.home()));
}

TEST_F(FilePreferencesTest, AFolderNameHasAtMost255Bytes) {
  auto places = home.places();
  for (const std::size_t size : {256u, 255u}) {
    places.anyUser = home.root() / std::string(size, 'n');
    FilePreferences any([&places] { return places; });
    any.setValue("key", PropertyList::boolean(true), "d", UserScope::anyUser, kHost);
    EXPECT_EQ(any.synchronize("d", UserScope::anyUser, kHost), size == 255);
    if (size > 255) {
      EXPECT_TRUE(onlyLine().ends_with(": mkdir: File name too long"));
    }
  }
  EXPECT_TRUE(log.entries().empty());
  EXPECT_TRUE(fs::exists(fs::path(places.anyUser) / "d.plist"));
}

TEST_F(FilePreferencesTest, AFolderThatSomeoneElseMakesMeanwhileIsTakenAsItIs) {
  SystemCalls calls;
  calls.hook = [&](std::string_view call) {
    if (call != "mkdir" || fs::exists(home.home() / "Library")) return;
    ASSERT_EQ(::mkdir((home.home() / "Library").c_str(), 0700), 0);
    ASSERT_EQ(::chmod((home.home() / "Library").c_str(), 0750), 0);
  };
  EXPECT_TRUE(setNow(*ours, "key", "value"));
  EXPECT_EQ(modeOf(home.home() / "Library"), 0750u);
  EXPECT_EQ(modeOf(home.folder()), 0700u);
}

TEST_F(FilePreferencesTest, AFolderThatCannotBeMadeAsItShouldBeFailsTheSet) {
  {
    const FailingCall failing("mkdirat", EROFS);
    EXPECT_FALSE(setNow(*ours, "key", "value"));
    EXPECT_EQ(onlyLine(), line("mkdir: Read-only file system"));
  }
  {
    const FailingCall failing("fchmod", EPERM);
    EXPECT_FALSE(setNow(*ours, "key", "value"));
    EXPECT_EQ(onlyLine(), line("mkdir: Operation not permitted"));
  }
  fs::remove(home.home() / "Library");
  {
    SystemCalls calls;
    calls.failFolderSync = EIO;
    EXPECT_FALSE(setNow(*ours, "key", "value"));
    EXPECT_EQ(onlyLine(), line("mkdir: Input/output error"));
  }
  EXPECT_TRUE(setNow(*ours, "key", "value"));
}

TEST_F(FilePreferencesTest, ADomainTooLongForAFileNameReadsAsEmptyAndFailsTheSet) {
  const std::string longest(NAME_MAX - 6, 'd');
  ours->setValue("key", PropertyList::boolean(true), longest, kUser, kHost);
  EXPECT_TRUE(ours->synchronize(longest, kUser, kHost));
  const std::string tooLong = longest + "d";
  EXPECT_FALSE(ours->copyValue("key", tooLong, kUser, kHost));
  EXPECT_TRUE(ours->synchronize(tooLong, kUser, kHost));
  EXPECT_TRUE(log.entries().empty());
  ours->setValue("key", PropertyList::boolean(true), tooLong, kUser, kHost);
  EXPECT_FALSE(ours->synchronize(tooLong, kUser, kHost));
  EXPECT_TRUE(onlyLine().ends_with(": rename: File name too long"));
  EXPECT_EQ(home.files(), std::vector{longest + ".plist"});
}

// ---- what is written
// ----------------------------------------------------------------------------------------

TEST_F(FilePreferencesTest, ASetIsSyncedBeforeItTakesThePlaceAndTheFolderAfter) {
  SystemCalls calls;
  ASSERT_TRUE(setNow(*ours, "key", "value"));
  // The two folders that were made come first, each held fast in its parent.
  EXPECT_EQ(calls.trace, (std::vector<std::string>{"fsync folder", "fsync folder", "write", "fsync file",
                                                   "rename", "fsync folder"}));
  calls.trace.clear();
  ASSERT_TRUE(setNow(*ours, "key", "other"));
  EXPECT_EQ(calls.trace, (std::vector<std::string>{"write", "fsync file", "rename", "fsync folder"}));
  EXPECT_EQ(home.files(), std::vector<std::string>{"com.example.files.plist"});
}

TEST_F(FilePreferencesTest, WhatStandsInAFileOfOursIsNotWrittenAgainAndInAForeignOneItIs) {
  home.write(kDomain, binary(textDictionary("key", "value")));
  SystemCalls calls;
  ASSERT_TRUE(setNow(*ours, "key", "value"));
  EXPECT_EQ(calls.trace.size(), 4u) << "who knows whether the other writer synced it";
  calls.trace.clear();
  ASSERT_TRUE(setNow(*ours, "key", "value"));
  ours->setValue("never there", {}, kDomain, kUser, kHost);
  ASSERT_TRUE(sync(*ours));
  EXPECT_TRUE(calls.trace.empty());
}

TEST_F(FilePreferencesTest, WhatAnotherWriterPutInPlaceOfAFileOfOursIsStoredAgain) {
  ASSERT_TRUE(setNow(*ours, "key", "value"));
  home.write(kDomain, binary(PropertyList::dictionary(
                          {{"key", PropertyList::string("value")}, {"their", PropertyList::string("own")}})));
  SystemCalls calls;
  ASSERT_TRUE(setNow(*ours, "key", "value"));
  EXPECT_EQ(calls.trace.size(), 4u) << "who knows whether the other writer synced it";
}

TEST_F(FilePreferencesTest, AValueTooDeepToBeReadAgainIsNotStoredAndSaidSoAndTheOthersAre) {
  PropertyList deep = PropertyList::integer(1);
  for (std::size_t level = 0; level < kMaxPropertyListDepth; ++level) deep = PropertyList::array({deep});
  set(*ours, "good", "stored");
  ours->setValue("deep", deep, kDomain, kUser, kHost);
  EXPECT_FALSE(sync(*ours));
  EXPECT_EQ(onlyLine(), line("a value is too deep or too large to be stored"));
  EXPECT_EQ(onDisk(), textDictionary("good", "stored"));
}

TEST_F(FilePreferencesTest, AShortWriteIsContinued) {
  SystemCalls calls;
  calls.writeLimit = 7;
  ASSERT_TRUE(setNow(*ours, "key", std::string(100, 'v')));
  EXPECT_EQ(onDisk(), textDictionary("key", std::string(100, 'v')));
}

TEST_F(FilePreferencesTest, AnyFailureOnTheWayLeavesTheOldFileWholeAndNoTemporaryOne) {
  ASSERT_TRUE(setNow(*ours, "key", "old"));
  const std::string before = TestHome::read(file);
  const auto fails = [&](int SystemCalls::*which, int error, const char* what) {
    {
      SystemCalls calls;
      calls.*which = error;
      EXPECT_FALSE(setNow(*ours, "key", "new"));
    }
    EXPECT_EQ(onlyLine(), line(what));
    EXPECT_EQ(TestHome::read(file), before);
    EXPECT_EQ(home.files(), std::vector<std::string>{"com.example.files.plist"});
    EXPECT_EQ(get(*ours, "key"), "old");
    EXPECT_TRUE(sync(*ours)) << "nothing is waiting any more";
  };
  fails(&SystemCalls::failWrite, ENOSPC, "write: No space left on device");
  fails(&SystemCalls::failWrite, EDQUOT, "write: Disk quota exceeded");
  fails(&SystemCalls::failFileSync, EIO, "fsync: Input/output error");
  fails(&SystemCalls::failRename, EACCES, "rename: Permission denied");
  EXPECT_TRUE(setNow(*ours, "key", "new"));
}

TEST_F(FilePreferencesTest, ASetWhoseFolderCannotBeSyncedIsNotAnsweredAsStored) {
  ASSERT_TRUE(setNow(*ours, "key", "old"));
  {
    SystemCalls calls;
    calls.failFolderSync = EIO;
    EXPECT_FALSE(setNow(*ours, "key", "new"));
  }
  EXPECT_EQ(onlyLine(), line("fsync of the folder: Input/output error"));
  EXPECT_EQ(get(*ours, "key"), "new") << "it is in its place, only perhaps not for good";
  SystemCalls calls;
  EXPECT_TRUE(setNow(*ours, "key", "new"));
  EXPECT_EQ(calls.trace.size(), 4u) << "so the next set stores it again";
}

TEST_F(FilePreferencesTest, WhatADeadWriterLeftIsClearedAway) {
  ASSERT_TRUE(setNow(*ours, "key", "value"));
  std::ofstream(home.folder() / ".brenvik-preferences.tmp") << "half a fi";
  ASSERT_TRUE(setNow(*ours, "key", "other"));
  EXPECT_EQ(home.files(), std::vector<std::string>{"com.example.files.plist"});
  EXPECT_EQ(onDisk(), textDictionary("key", "other"));
}

TEST_F(FilePreferencesTest, WhatStandsInTheWayOfATemporaryFileFailsTheSet) {
  fs::create_directories(home.folder() / ".brenvik-preferences.tmp");
  EXPECT_FALSE(setNow(*ours, "key", "value"));
  EXPECT_EQ(onlyLine(), line("remove an old temporary file: Is a directory"));
  EXPECT_FALSE(fs::exists(file));
}

TEST_F(FilePreferencesTest, AUsersFileIsNeverReadableByOthersWhateverTheUmask) {
  const mode_t mask = ::umask(0);
  SystemCalls calls;
  const fs::path temporary = home.folder() / ".brenvik-preferences.tmp";
  calls.hook = [&](std::string_view call) {
    if (call == "write") {
      EXPECT_EQ(modeOf(temporary), 0600u);
    }
  };
  EXPECT_TRUE(setNow(*ours, "key", "value"));
  EXPECT_EQ(modeOf(file), 0600u);
  std::ofstream(temporary) << "half a fi";
  EXPECT_TRUE(setNow(*ours, "key", "other"));
  EXPECT_EQ(modeOf(file), 0600u);
  EXPECT_EQ(modeOf(home.folder() / ".brenvik-preferences.lock"), 0600u);
  ::umask(mask);
}

TEST_F(FilePreferencesTest, AFileForAnyUserThatCannotBeOpenedUpFailsTheSetAndAUsersFileIsNotTried) {
  ASSERT_TRUE(setNow(*ours, "key", "value"));
  ours->setValue("key", PropertyList::integer(1), "d", UserScope::anyUser, kHost);
  ASSERT_TRUE(ours->synchronize("d", UserScope::anyUser, kHost));
  const FailingCall failing("fchmod", EPERM, 0, FailingCall::HowOften::always);
  EXPECT_TRUE(setNow(*ours, "key", "other"));
  EXPECT_EQ(failing.failures(), 0);
  ours->setValue("key", PropertyList::integer(2), "d", UserScope::anyUser, kHost);
  EXPECT_FALSE(ours->synchronize("d", UserScope::anyUser, kHost));
  EXPECT_TRUE(onlyLine().ends_with(": chmod: Operation not permitted"));
  EXPECT_EQ(ours->copyValue("key", "d", UserScope::anyUser, kHost).asInteger(), 1);
  EXPECT_FALSE(fs::exists(home.anyUser() / ".brenvik-preferences.tmp"));
}

TEST_F(FilePreferencesTest, NoDescriptorIsInheritedByAProgramThatIsStartedMeanwhile) {
  const auto inherited = [] {
    std::vector<std::string> found;
    for (int fd = 0; fd < 256; ++fd) {
      const int flags = ::fcntl(fd, F_GETFD);
      if (flags >= 0 && (flags & FD_CLOEXEC) == 0) found.push_back(std::to_string(fd));
    }
    return found;
  };
  const auto before = inherited();
  home.write(kDomain, binary(textDictionary("key", "theirs")));
  std::ofstream(home.folder() / ".brenvik-preferences.tmp") << "half a fi";
  SystemCalls calls;
  std::vector<std::string> seen;
  calls.hook = [&](std::string_view call) {
    seen.emplace_back(call);
    EXPECT_EQ(inherited(), before) << call;
  };
  EXPECT_TRUE(setNow(*ours, "key", "value"));
  EXPECT_TRUE(setNow(*ours, "key", "other"));
  ours->setValue("key", PropertyList::boolean(true), kDomain, UserScope::anyUser, kHost);
  EXPECT_TRUE(ours->synchronize(kDomain, UserScope::anyUser, kHost));
  for (const char* const call : {"flock", "read", "write", "fsync file", "rename", "mkdir"}) {
    EXPECT_NE(std::find(seen.begin(), seen.end(), call), seen.end()) << call;
  }
  EXPECT_EQ(inherited(), before);
}

TEST_F(FilePreferencesTest, NothingIsWrittenThroughLinks) {
  const fs::path victim = home.root() / "victim";
  std::ofstream(victim) << binary(textDictionary("victim", "whole"));
  const std::string before = TestHome::read(victim);
  fs::create_directories(home.folder());
  fs::create_symlink(victim, home.folder() / ".brenvik-preferences.tmp");
  fs::create_symlink(victim, file);
  ASSERT_TRUE(setNow(*ours, "key", "value"));
  EXPECT_EQ(TestHome::read(victim), before);
  EXPECT_FALSE(fs::is_symlink(file));
  EXPECT_EQ(get(*ours, "victim"), "whole") << "a link may stand for the file, so it was read";
  EXPECT_EQ(get(*ours, "key"), "value");

  fs::remove(home.folder() / ".brenvik-preferences.lock");
  fs::create_symlink(victim, home.folder() / ".brenvik-preferences.lock");
  EXPECT_FALSE(setNow(*ours, "key", "other"));
  EXPECT_EQ(onlyLine(), line("lock: Too many levels of symbolic links"));
}

TEST_F(FilePreferencesTest, PythonReadsWhatIsWritten) {
  if (std::system("python3 -c 'import plistlib' 2>/dev/null") != 0)
    GTEST_SKIP() << "no python3 with plistlib";
  for (int i = 0; i < 300; ++i)
    ours->setValue("key" + std::to_string(i), PropertyList::integer(i * i), kDomain, kUser, kHost);
  ours->setValue("gr\xC3\xBC\xC3\x9F", PropertyList::string("\xE2\x82\xAC\xF0\x9F\x98\x80"), kDomain, kUser,
                 kHost);
  const std::byte bytes[] = {std::byte{0}, std::byte{255}};
  const auto nested = PropertyList::dictionary(
      {{"data", PropertyList::data(bytes)},
       {"list", PropertyList::array({PropertyList::integer(-5), PropertyList::unsignedInteger(UINT64_MAX),
                                     PropertyList::real(0.5), PropertyList::boolean(false)})},
       {"when", PropertyList::date(0)}});
  ours->setValue("nested", nested, kDomain, kUser, kHost);
  ASSERT_TRUE(sync(*ours));
  // Changed in place, grown and shrunk.
  ours->setValue("key7", nested, kDomain, kUser, kHost);
  ours->setValue("key8", {}, kDomain, kUser, kHost);
  ours->setValue("key9", PropertyList::string(std::string(1000, 'x')), kDomain, kUser, kHost);
  ASSERT_TRUE(sync(*ours));

  const std::string program = R"(
import plistlib, datetime
d = plistlib.load(open(')" + file.string() +
                              R"(', 'rb'))
n = {'data': b'\x00\xff', 'list': [-5, 2**64 - 1, 0.5, False], 'when': datetime.datetime(2001, 1, 1)}
e = {'key%d' % i: i * i for i in range(300)}
e.update({'gr\u00fc\u00df': '\u20ac\U0001f600', 'nested': n, 'key7': n, 'key9': 'x' * 1000})
del e['key8']
assert d == e, d
)";
  const fs::path script = home.root() / "check.py";
  std::ofstream(script) << program;
  EXPECT_EQ(std::system(("python3 " + script.string()).c_str()), 0);
}

TEST_F(FilePreferencesTest, AFileThatPythonWroteIsReadAndChanged) {
  if (std::system("python3 -c 'import plistlib' 2>/dev/null") != 0)
    GTEST_SKIP() << "no python3 with plistlib";
  fs::create_directories(home.folder());
  for (const char* format : {"FMT_BINARY", "FMT_XML"}) {
    const fs::path script = home.root() / "write.py";
    std::ofstream(script)
        << "import plistlib\nplistlib.dump({'a': [1, 'x', {'b': 2.5}], 'key': 'old'}, open('" << file.string()
        << "', 'wb'), fmt=plistlib." << format << ")\n";
    ASSERT_EQ(std::system(("python3 " + script.string()).c_str()), 0);
    ASSERT_TRUE(sync(*ours));
    EXPECT_EQ(get(*ours, "key"), "old");
    ASSERT_TRUE(setNow(*ours, "key", "new"));
    EXPECT_EQ(onDisk(),
              PropertyList::dictionary(
                  {{"a", PropertyList::array({PropertyList::integer(1), PropertyList::string("x"),
                                              PropertyList::dictionary({{"b", PropertyList::real(2.5)}})})},
                   {"key", PropertyList::string("new")}}));
  }
  EXPECT_TRUE(log.entries().empty());
}

// ---- what others do meanwhile
// -------------------------------------------------------------------------------

TEST_F(FilePreferencesTest, AReplacedFileIsSeenEvenWithTheSameSizeAndTime) {
  home.write(kDomain, binary(textDictionary("key", "one")));
  struct stat facts;
  ASSERT_EQ(::stat(file.c_str(), &facts), 0);
  const timespec old[2] = {{1'000'000, 0}, {1'000'000, 0}};
  ASSERT_EQ(::utimensat(AT_FDCWD, file.c_str(), old, 0), 0);
  ASSERT_TRUE(sync(*ours));
  ASSERT_EQ(get(*ours, "key"), "one");
  // The old inode's number is free again for the new file, unless the store keeps it taken.
  fs::remove(file);
  home.write(kDomain, binary(textDictionary("key", "two")));
  ASSERT_EQ(::utimensat(AT_FDCWD, file.c_str(), old, 0), 0);
  EXPECT_EQ(get(*ours, "key"), "two");
}

TEST_F(FilePreferencesTest, AFileSoYoungThatItsTimeMayStandStillIsReadAgain) {
  home.write(kDomain, binary(textDictionary("key", "one")));
  const timespec future[2] = {{4'000'000'000, 0}, {4'000'000'000, 0}};
  ASSERT_EQ(::utimensat(AT_FDCWD, file.c_str(), future, 0), 0);
  ASSERT_TRUE(sync(*ours));
  ASSERT_EQ(get(*ours, "key"), "one");
  home.write(kDomain, binary(textDictionary("key", "two")));
  ASSERT_EQ(::utimensat(AT_FDCWD, file.c_str(), future, 0), 0);
  ASSERT_TRUE(sync(*ours));
  EXPECT_EQ(get(*ours, "key"), "two");
}

TEST_F(FilePreferencesTest, ASettledFileIsNotReadAgain) {
  ASSERT_TRUE(setNow(*ours, "key", "one"));
  SystemCalls calls;
  calls.failOpen = EIO;  // would be noticed
  for (int i = 0; i < 3; ++i) {
    EXPECT_TRUE(sync(*ours));
    EXPECT_EQ(get(*ours, "key"), "one");
  }
  EXPECT_TRUE(setNow(*ours, "key", "two"));
  EXPECT_TRUE(log.entries().empty());
}

TEST_F(FilePreferencesTest, AForeignFileThatHasSettledIsReadOnceAlsoThroughALink) {
  home.write(kDomain, binary(textDictionary("key", "theirs")));
  makeOld(file);
  for (const bool isLink : {false, true}) {
    if (isLink) {
      fs::rename(file, home.folder() / "target");
      fs::create_symlink("target", file);
      ours = home.open();
    }
    SystemCalls calls;
    for (int i = 0; i < 3; ++i) {
      EXPECT_TRUE(sync(*ours));
      EXPECT_EQ(calls.reads, 1);
      EXPECT_EQ(get(*ours, "key"), "theirs");
    }
    EXPECT_EQ(calls.reads, 1);
  }
}

TEST_F(FilePreferencesTest, AFileWrittenInPlaceWithTheSameSizeIsToldByItsTime) {
  ASSERT_TRUE(setNow(*ours, "key", "one"));
  home.write(kDomain, binary(textDictionary("key", "two")));
  makeOld(file);
  EXPECT_EQ(get(*ours, "key"), "two");
  home.write(kDomain, binary(textDictionary("key", "six")));
  makeOld(file, 1);
  EXPECT_EQ(get(*ours, "key"), "six") << "a nanosecond is enough";
}

TEST_F(FilePreferencesTest, TheFileAsReadOrWrittenIsKeptOpenSoThatItsNumberStaysTaken) {
  const auto expectKeptAfterItsRemoval = [&] {
    EXPECT_EQ(links(), std::vector<nlink_t>{1});
    fs::remove(file);
    EXPECT_EQ(links(), std::vector<nlink_t>{0});
    EXPECT_EQ(get(*ours, "key"), "(none)");
    EXPECT_TRUE(links().empty());
  };
  home.write(kDomain, binary(textDictionary("key", "theirs")));
  makeOld(file);
  ASSERT_EQ(get(*ours, "key"), "theirs");
  expectKeptAfterItsRemoval();

  ASSERT_TRUE(setNow(*ours, "key", "ours"));
  SystemCalls calls;
  calls.hook = [&](std::string_view call) {
    if (call == "rename") {
      EXPECT_TRUE(links().empty()) << "the old file goes with its name, at once";
    }
  };
  ASSERT_TRUE(setNow(*ours, "key", "again"));
  expectKeptAfterItsRemoval();
}

TEST_F(FilePreferencesTest, AFileWrittenInPlaceWhileItIsReadIsReadAgain) {
  home.write(kDomain, binary(textDictionary("key", "old")));
  makeOld(file);
  SystemCalls calls;
  calls.hook = [&](std::string_view call) {
    if (call == "have read" && calls.reads == 1)
      home.write(kDomain, binary(textDictionary("key", "new and longer")));
  };
  EXPECT_EQ(get(*ours, "key"), "new and longer");
  EXPECT_EQ(calls.reads, 2);
  EXPECT_TRUE(log.entries().empty());
  EXPECT_EQ(home.files(), std::vector<std::string>{"com.example.files.plist"});
}

TEST_F(FilePreferencesTest, AFileThatNeverStandsStillIsReadThreeTimes) {
  home.write(kDomain, binary(textDictionary("key", "1")));
  SystemCalls calls;
  calls.hook = [&](std::string_view call) {
    if (call != "have read") return;
    const auto size = static_cast<std::size_t>(calls.reads) + 1;
    home.write(kDomain, binary(textDictionary("key", std::string(size, '1'))));
  };
  EXPECT_EQ(get(*ours, "key"), "111");
  EXPECT_EQ(calls.reads, 3);
  EXPECT_TRUE(log.entries().empty());
}

TEST_F(FilePreferencesTest, AFileThatGetsShorterWhileItIsReadIsNotTakenForDamaged) {
  home.write(kDomain, binary(textDictionary("key", std::string(100, '1'))));
  SystemCalls calls;
  calls.hook = [&](std::string_view call) {
    if (call != "read") return;
    const auto size = static_cast<std::size_t>(std::max(90 - 10 * calls.reads, 1));
    home.write(kDomain, binary(textDictionary("key", std::string(size, '1'))));
  };
  // Each of three rounds reads what there is and then finds the end.
  EXPECT_EQ(get(*ours, "key"), std::string(50, '1'));
  EXPECT_EQ(calls.reads, 6);
  EXPECT_TRUE(log.entries().empty());
  EXPECT_EQ(home.files(), std::vector<std::string>{"com.example.files.plist"});
}

TEST_F(FilePreferencesTest, AFileHasSettledMoreThanFiftyMillisecondsAfterItsTime) {
  home.write(kDomain, binary(textDictionary("key", "value")));
  makeOld(file);
  SystemCalls calls;
  calls.wallTime = 1'000'000s + 50ms;
  for (int i = 1; i <= 3; ++i) {
    EXPECT_EQ(get(*ours, "key"), "value");
    EXPECT_EQ(calls.reads, i) << "it may change within the same tick of the clock";
  }
  *calls.wallTime += 1ns;
  for (int i = 0; i < 3; ++i) EXPECT_EQ(get(*ours, "key"), "value");
  EXPECT_EQ(calls.reads, 4);
}

TEST_F(FilePreferencesTest, AFlushedDomainIsReadAgainThoughNothingTellsThatItsFileChanged) {
  home.write(kDomain, binary(textDictionary("key", "one")));
  makeOld(file);
  ASSERT_EQ(get(*ours, "key"), "one");
  home.write(kDomain, binary(textDictionary("key", "two")));
  makeOld(file);
  const std::string domain = kDomain;
  const std::string unrelated = "com.example.unrelated";
  ours->flushCachesForAnyUser(nullptr);
  ours->flushCachesForAnyUser(&unrelated);
  EXPECT_EQ(get(*ours, "key"), "one");
  EXPECT_EQ(links().size(), 1u);
  ours->flushCachesForAnyUser(&domain);
  EXPECT_TRUE(links().empty());
  EXPECT_EQ(get(*ours, "key"), "two");
}

TEST_F(FilePreferencesTest, AFlushedDomainWhoseFileIsRemovedIsMadeAnew) {
  const std::string domain = kDomain;
  ASSERT_TRUE(setNow(*ours, "key", "old"));
  ours->flushCachesForAnyUser(&domain);
  fs::remove(file);
  EXPECT_TRUE(setNow(*ours, "another", "new"));
  EXPECT_EQ(onDisk(), textDictionary("another", "new"));
}

TEST_F(FilePreferencesTest, ARemovedFileIsAnEmptyDomain) {
  ASSERT_TRUE(setNow(*ours, "key", "value"));
  fs::remove_all(home.home() / "Library");
  EXPECT_EQ(get(*ours, "key"), "(none)");
  ASSERT_TRUE(sync(*ours));
  EXPECT_EQ(get(*ours, "key"), "(none)");
  ASSERT_TRUE(setNow(*ours, "another", "value"));
  EXPECT_EQ(onDisk(), textDictionary("another", "value"));
}

TEST_F(FilePreferencesTest, AWriterThatKeepsTheLockIsWaitedForOnlySoLong) {
  ASSERT_TRUE(setNow(*ours, "key", "old"));
  const auto hasty = home.open(20ms);
  UniqueFd lock(::open((home.folder() / ".brenvik-preferences.lock").c_str(), O_RDWR | O_CLOEXEC));
  ASSERT_EQ(::flock(lock.get(), LOCK_EX), 0);
  const auto start = std::chrono::steady_clock::now();
  EXPECT_FALSE(setNow(*hasty, "key", "new"));
  EXPECT_LT(std::chrono::steady_clock::now() - start, 10s);
  EXPECT_EQ(onlyLine(), line("lock: another writer does not let go of the lock"));
  EXPECT_EQ(get(*hasty, "key"), "old") << "reading needs no lock";
  lock.reset();
  EXPECT_TRUE(setNow(*hasty, "key", "new"));
}

TEST_F(FilePreferencesTest, AWriterLooksForTheLockLessAndLessOftenUntilItsPatienceEnds) {
  ASSERT_TRUE(setNow(*ours, "key", "old"));
  const UniqueFd lock(::open((home.folder() / ".brenvik-preferences.lock").c_str(), O_RDWR | O_CLOEXEC));
  ASSERT_EQ(::flock(lock.get(), LOCK_EX), 0);
  SystemCalls calls;
  calls.steadyTime = 0ns;
  int attempts = 0;
  calls.hook = [&](std::string_view call) {
    if (call == "flock" && ++attempts > 100) *calls.steadyTime += 1h;  // it does not pause
  };
  EXPECT_FALSE(setNow(*home.open(20ms), "key", "new"));
  EXPECT_EQ(onlyLine(), line("lock: another writer does not let go of the lock"));
  std::vector<std::chrono::nanoseconds> expected{50us, 100us, 200us, 400us, 800us, 1600us};
  expected.resize(15, 2000us);
  EXPECT_EQ(calls.pauses, expected);

  calls.pauses.clear();
  EXPECT_FALSE(setNow(*home.open(0ms), "key", "new"));
  EXPECT_TRUE(calls.pauses.empty()) << "without patience it does not wait";
  EXPECT_EQ(onDisk(), textDictionary("key", "old"));
}

TEST_F(FilePreferencesTest, ASignalDoesNotEndTheWaitForTheLockAndAnotherErrorDoes) {
  {
    const FailingCall interrupted("flock", EINTR);
    EXPECT_TRUE(setNow(*ours, "key", "value"));
    EXPECT_EQ(interrupted.failures(), 1);
  }
  const FailingCall refused("flock", ENOLCK, 0, FailingCall::HowOften::always);
  EXPECT_FALSE(setNow(*ours, "key", "other"));
  EXPECT_EQ(refused.failures(), 1);
  EXPECT_EQ(onlyLine(), line("lock: No locks available"));
  EXPECT_EQ(onDisk(), textDictionary("key", "value"));
}

TEST_F(FilePreferencesTest, ALockFileThatIsRemovedBeforeItIsLockedIsNotTheOneThatIsHeld) {
  const fs::path lock = home.folder() / ".brenvik-preferences.lock";
  ASSERT_TRUE(setNow(*ours, "key", "old"));
  SystemCalls calls;
  calls.steadyTime = 0ns;
  int attempts = 0;
  calls.hook = [&](std::string_view call) {
    if (call == "flock" && ++attempts == 1) fs::remove(lock);
  };
  EXPECT_TRUE(setNow(*ours, "key", "new"));
  EXPECT_EQ(attempts, 2);
  EXPECT_TRUE(fs::exists(lock)) << "others find the lock that was held";

  // If that goes on, patience ends, too.
  attempts = 0;
  calls.hook = [&](std::string_view call) {
    if (call != "flock") return;
    ++attempts;
    *calls.steadyTime += 1ms;
    fs::remove(lock);
  };
  EXPECT_FALSE(setNow(*home.open(20ms), "key", "newer"));
  EXPECT_EQ(attempts, 20);
  EXPECT_EQ(onlyLine(), line("lock: another writer does not let go of the lock"));
  EXPECT_EQ(onDisk(), textDictionary("key", "new"));
}

TEST_F(FilePreferencesTest, ALockFileThatWasRemovedIsMadeAnew) {
  ASSERT_TRUE(setNow(*ours, "key", "old"));
  fs::remove(home.folder() / ".brenvik-preferences.lock");
  EXPECT_TRUE(setNow(*ours, "key", "new"));
  EXPECT_EQ(modeOf(home.folder() / ".brenvik-preferences.lock"), 0600u);
}

TEST_F(FilePreferencesTest, ManyDomainsCostOnlySoManyDescriptors) {
  const auto descriptors = [] {
    return std::distance(fs::directory_iterator("/proc/self/fd"), fs::directory_iterator());
  };
  const auto before = descriptors();
  for (int i = 0; i < 60; ++i) {
    const std::string domain = "d" + std::to_string(i);
    ours->setValue("key", PropertyList::integer(i), domain, kUser, kHost);
    ASSERT_TRUE(ours->synchronize(domain, kUser, kHost));
  }
  EXPECT_LE(descriptors() - before, 16);
  for (int i = 0; i < 60; ++i) {
    EXPECT_EQ(ours->copyValue("key", "d" + std::to_string(i), kUser, kHost).asInteger(), i);
  }
  // What waits to be stored is never forgotten.
  set(*ours, "waiting", "still");
  for (int i = 0; i < 60; ++i) ours->copyValue("key", "d" + std::to_string(i), kUser, kHost);
  EXPECT_EQ(get(*ours, "waiting"), "still");
  ours.reset();
  EXPECT_EQ(descriptors(), before);
}

TEST_F(FilePreferencesTest, TheSixteenDomainsThatWereUsedLastAreKept) {
  const auto read = [this](int number) {
    SystemCalls calls;
    EXPECT_TRUE(ours->copyValue("key", "d" + std::to_string(number), kUser, kHost));
    return calls.reads;
  };
  for (int i = 0; i < 18; ++i) {
    home.write("d" + std::to_string(i), binary(textDictionary("key", "value")));
    makeOld(home.file("d" + std::to_string(i)));
  }
  for (int i = 0; i < 16; ++i) EXPECT_EQ(read(i), 1);
  for (int i = 0; i < 16; ++i) EXPECT_EQ(read(i), 0) << i;
  EXPECT_EQ(read(0), 0);
  EXPECT_EQ(read(16), 1) << "in the place of d1, whose last use is the longest ago";
  EXPECT_EQ(read(0), 0);
  EXPECT_EQ(read(2), 0);
  EXPECT_EQ(read(1), 1);
}

TEST_F(FilePreferencesTest, ADomainIsForgottenWhenWhatIsKeptExceedsSixteenMebibytes) {
  const auto domain = [](std::size_t size) {
    return binary(PropertyList::dictionary({{"key", PropertyList::string("value")},
                                            {"large", PropertyList::data(std::vector<std::byte>(size))}}));
  };
  const auto memory = [](const std::string& bytes) {
    auto values = EditableDictionary::of(parsePropertyList(std::as_bytes(std::span(bytes))));
    EXPECT_TRUE(values && values->find("key"));
    return values ? values->memory() : 0;
  };
  constexpr std::size_t kLimit = std::size_t{16} << 20;
  std::size_t size = kLimit / 2;
  size += kLimit - memory(domain(size));
  ASSERT_EQ(memory(domain(size)), kLimit);
  for (const std::size_t more : {0u, 1u}) {
    home.write(kDomain, domain(size + more));
    makeOld(file);
    ASSERT_EQ(get(*ours, "key"), "value");
    ours->copyValue("key", "another" + std::to_string(more), kUser, kHost);
    SystemCalls calls;
    ASSERT_EQ(get(*ours, "key"), "value");
    EXPECT_EQ(calls.reads > 0, more > 0);
  }
}

TEST_F(FilePreferencesTest, AFlushedDomainHasNoMemoryThatCountsAgainstOthers) {
  home.write("small", binary(textDictionary("key", "value")));
  home.write(kDomain, binary(PropertyList::dictionary(
                          {{"large", PropertyList::data(std::vector<std::byte>(std::size_t{17} << 20))}})));
  const std::string domain = kDomain;
  makeOld(home.file("small"));
  makeOld(file);
  EXPECT_TRUE(ours->copyValue("key", "small", kUser, kHost));
  EXPECT_TRUE(ours->copyValue("large", domain, kUser, kHost));
  ours->flushCachesForAnyUser(&domain);
  (void)ours->copyValue("key", "another", kUser, kHost);
  SystemCalls calls;
  EXPECT_TRUE(ours->copyValue("key", "small", kUser, kHost));
  EXPECT_EQ(calls.reads, 0);
}

TEST_F(FilePreferencesTest, ALackOfMemoryIsLoggedAndWhatWasStoredStands) {
  if (!FailingAllocations::kWork) GTEST_SKIP() << "allocations do not fail in this build";
  ASSERT_TRUE(setNow(*ours, "key", "old"));
  const std::string domain = kDomain;
  const PropertyList value = PropertyList::string("new");
  int set = 0;
  int stored = 0;
  for (long next = 0; stored == 0 || set == 0; ++next) {
    const auto failure = [next](auto work) {
      bool isThrown = false;
      std::optional<FailingAllocations> failing(std::in_place, next, FailingAllocations::HowMany::one);
      try {
        work();
      } catch (const std::bad_alloc&) {
        isThrown = true;
      }
      failing.reset();
      return isThrown;
    };
    SCOPED_TRACE(next);
    if (failure([&] { ours->setValue("key", value, kDomain, kUser, kHost); })) {
      EXPECT_EQ(onlyLine(), "Preferences: no memory to set a value");
    } else {
      ++set;
    }
    EXPECT_TRUE(log.entries().empty());
    ours->setValue("key", value, kDomain, kUser, kHost);
    if (failure([&] { EXPECT_TRUE(sync(*ours)); })) {
      EXPECT_EQ(onlyLine(), "Preferences: no memory to store a domain");
      EXPECT_EQ(get(*ours, "key"), "old") << "what was not stored is dropped";
    } else {
      ++stored;
    }
    EXPECT_TRUE(log.entries().empty());
  }
  EXPECT_EQ(onDisk(), textDictionary("key", "new"));
  {
    const FailingAllocations failing(0, FailingAllocations::HowMany::one);
    ours->flushCachesForAnyUser(&domain);
  }
  EXPECT_EQ(onlyLine(), "Preferences: no memory to flush a domain");
}

TEST_F(FilePreferencesTest, AFlushReachesTheDomainInEachScopeWhereNoStampTellsOfAChange) {
  const std::string domain = kDomain;
  const auto read = [&](UserScope user) {
    return std::string(ours->copyValue("key", domain, user, kHost).asString().value_or("(none)"));
  };
  const std::pair<UserScope, fs::path> places[] = {
      {UserScope::currentUser, file}, {UserScope::anyUser, home.anyUser() / (domain + ".plist")}};
  for (const auto& [user, path] : places) {
    ours->setValue("key", PropertyList::string("old"), domain, user, kHost);
    ASSERT_TRUE(ours->synchronize(domain, user, kHost));
    // In place, as long as before, and with the same times.
    std::string bytes = TestHome::read(path);
    ASSERT_NE(bytes.find("old"), std::string::npos);
    bytes.replace(bytes.find("old"), 3, "new");
    const UniqueFd written(::open(path.c_str(), O_WRONLY | O_CLOEXEC));
    struct stat before {};
    ASSERT_EQ(::fstat(written.get(), &before), 0);
    ASSERT_EQ(::pwrite(written.get(), bytes.data(), bytes.size(), 0), static_cast<ssize_t>(bytes.size()));
    const timespec times[] = {before.st_atim, before.st_mtim};
    ASSERT_EQ(::futimens(written.get(), times), 0);
    EXPECT_EQ(read(user), "old");
  }
  ours->flushCachesForAnyUser(&domain);
  for (const auto& [user, path] : places) EXPECT_EQ(read(user), "new") << path;
}

TEST_F(FilePreferencesTest, SeveralThreadsShareAStore) {
  ours = home.open(60s);  // of two domains they wait for each other's lock, and a disk may be slow
  std::vector<std::thread> threads;
  for (int t = 0; t < 4; ++t) {
    threads.emplace_back([this, t] {
      const std::string domain = t % 2 == 0 ? kDomain : "com.example.second";
      for (int i = 0; i < 10; ++i) {
        ours->setValue(std::to_string(t), PropertyList::integer(i), domain, kUser, kHost);
        EXPECT_TRUE(ours->synchronize(domain, kUser, kHost));
        EXPECT_EQ(ours->copyValue(std::to_string(t), domain, kUser, kHost).asInteger(), i);
        ours->flushCachesForAnyUser(&domain);
      }
    });
  }
  for (auto& thread : threads) thread.join();
  const auto other = home.open();
  for (int t = 0; t < 4; ++t) {
    const std::string domain = t % 2 == 0 ? kDomain : "com.example.second";
    EXPECT_EQ(other->copyValue(std::to_string(t), domain, kUser, kHost).asInteger(), 9);
  }
}

// ---- damage
// -------------------------------------------------------------------------------------------------

class DamagedPreferencesTest : public FilePreferencesTest {
 protected:
  // A set on the damaged file: it is stored in a new one, and the old one stands beside it under the new
  // name.
  void expectMovedAside(const std::string& reason, int number = 1) {
    EXPECT_TRUE(setNow(*ours, "key", "value"));
    const std::string aside = "com.example.files.plist.damaged-" + std::to_string(number);
    EXPECT_EQ(onlyLine(), line("damaged (" + reason + "), moved aside to " + aside));
    EXPECT_EQ(onDisk(), textDictionary("key", "value"));
  }
  fs::path aside(int number = 1) const { return file.string() + ".damaged-" + std::to_string(number); }
};

TEST_F(DamagedPreferencesTest, ADamagedFileIsMovedAsideAndNeverWrittenOver) {
  std::string good = binary(textDictionary("key", "old"));
  const std::string damaged[] = {"", "garbage", good.substr(0, good.size() - 1),
                                 "bplist00" + std::string(40, '\xFF'),
                                 "<plist><dict><key>a</key></dict></plist>"};
  int number = 0;
  for (const std::string& bytes : damaged) {
    home.write(kDomain, bytes);
    expectMovedAside("not a property list", ++number);
    EXPECT_EQ(TestHome::read(aside(number)), bytes);
  }
  home.write(kDomain, binary(PropertyList::array({})));
  expectMovedAside("not a dictionary", ++number);
}

TEST_F(DamagedPreferencesTest, AReaderMovesItAsideOnceAndFindsNoValues) {
  home.write(kDomain, "garbage");
  EXPECT_EQ(get(*ours, "key"), "(none)");
  EXPECT_EQ(onlyLine(),
            line("damaged (not a property list), moved aside to com.example.files.plist.damaged-1"));
  EXPECT_TRUE(sync(*ours));
  EXPECT_EQ(get(*ours, "key"), "(none)");
  EXPECT_TRUE(log.entries().empty());
  EXPECT_EQ(TestHome::read(aside()), "garbage");
}

TEST_F(DamagedPreferencesTest, ATooDeepFileIsMovedAside) {
  std::string xml = "<plist version=\"1.0\"><dict><key>a</key>";
  for (int i = 0; i < 100'000; ++i) xml += "<array>";
  for (int i = 0; i < 100'000; ++i) xml += "</array>";
  home.write(kDomain, xml + "</dict></plist>");
  expectMovedAside("not a property list");
}

TEST_F(DamagedPreferencesTest, AHugeFileIsMovedAsideUnread) {
  home.write(kDomain, "");
  ASSERT_EQ(::truncate(file.c_str(), off_t{1} << 30), 0);
  expectMovedAside("too large");
  EXPECT_EQ(fs::file_size(aside()), std::uintmax_t{1} << 30);
}

TEST_F(DamagedPreferencesTest, AFileOfThirtyTwoMebibytesIsReadAndALargerOneIsNot) {
  constexpr off_t kLimit = off_t{32} << 20;
  home.write(kDomain, "");
  ASSERT_EQ(::truncate(file.c_str(), kLimit), 0);
  expectMovedAside("not a property list");
  home.write(kDomain, "");
  ASSERT_EQ(::truncate(file.c_str(), kLimit + 1), 0);
  expectMovedAside("too large", 2);
}

TEST_F(DamagedPreferencesTest, AReaderMovesNothingAsideWhileAnotherWriterHoldsTheLock) {
  home.write(kDomain, "garbage");
  UniqueFd lock(
      ::open((home.folder() / ".brenvik-preferences.lock").c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0600));
  ASSERT_EQ(::flock(lock.get(), LOCK_EX), 0);
  const auto hasty = home.open(0ms);
  EXPECT_EQ(get(*hasty, "key"), "(none)");
  EXPECT_EQ(onlyLine(), line("lock: another writer does not let go of the lock"));
  EXPECT_EQ(TestHome::read(file), "garbage");
  EXPECT_FALSE(fs::exists(aside()));
}

TEST_F(DamagedPreferencesTest, WhatAReaderCouldNotMoveAsideTheNextWriterDoes) {
  home.write(kDomain, "garbage");
  makeOld(file);
  UniqueFd lock(
      ::open((home.folder() / ".brenvik-preferences.lock").c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0600));
  ASSERT_EQ(::flock(lock.get(), LOCK_EX), 0);
  ours = home.open(0ms);
  EXPECT_EQ(get(*ours, "key"), "(none)");
  EXPECT_EQ(onlyLine(), line("lock: another writer does not let go of the lock"));
  lock.reset();
  expectMovedAside("not a property list");
}

TEST_F(DamagedPreferencesTest, AChangeThatIsDroppedForADamagedFileIsToldEachTime) {
  home.write(kDomain, "garbage");
  makeOld(file);
  const FailingCall denied("renameat2", EACCES, 0, FailingCall::HowOften::always);
  EXPECT_EQ(get(*ours, "key"), "(none)");
  const std::string why = line(
      "damaged (not a property list) and cannot be moved aside (Permission denied); nothing is stored there");
  EXPECT_EQ(onlyLine(), why);
  EXPECT_EQ(get(*ours, "key"), "(none)");
  EXPECT_TRUE(log.entries().empty()) << "a reader tells once what is wrong with a file";
  for (int i = 0; i < 2; ++i) {
    EXPECT_FALSE(setNow(*ours, "key", "value"));
    EXPECT_EQ(onlyLine(), why);
  }
  EXPECT_EQ(TestHome::read(file), "garbage");
}

TEST_F(DamagedPreferencesTest, AReadThatFailedForAMomentIsTriedAgain) {
  home.write(kDomain, binary(textDictionary("key", "theirs")));
  makeOld(file);
  for (const bool isDamagedFirst : {false, true}) {
    SystemCalls calls;
    if (isDamagedFirst) {
      home.write(kDomain, "garbage");
      calls.hook = [&](std::string_view call) {
        if (call == "flock") home.write(kDomain, binary(textDictionary("key", "theirs")));
      };
    }
    const FailingCall noMemory("pread", ENOMEM, isDamagedFirst ? 1 : 0);
    EXPECT_EQ(get(*ours, "key"), "(none)");
    EXPECT_EQ(noMemory.failures(), 1);
    EXPECT_EQ(onlyLine(), line("read: Cannot allocate memory"));
    EXPECT_EQ(get(*ours, "key"), "theirs");
  }
  EXPECT_TRUE(setNow(*ours, "key", "ours"));
  EXPECT_EQ(onDisk(), textDictionary("key", "ours"));
}

TEST_F(DamagedPreferencesTest, AGoodFileThatAnotherWriterPutThereMeanwhileIsReadAndStays) {
  home.write(kDomain, "garbage");
  SystemCalls calls;
  calls.hook = [&](std::string_view call) {
    if (call == "flock") home.write(kDomain, binary(textDictionary("key", "theirs")));
  };
  EXPECT_EQ(get(*ours, "key"), "theirs");
  EXPECT_TRUE(log.entries().empty());
  EXPECT_EQ(home.files(), std::vector<std::string>{"com.example.files.plist"});
}

TEST_F(DamagedPreferencesTest, WhatIsNoFileIsMovedAsideAndNothingWaitsForIt) {
  fs::create_directories(file / "inside");
  expectMovedAside("not a regular file");
  EXPECT_TRUE(fs::exists(aside() / "inside"));

  fs::remove(file);
  ASSERT_EQ(::mkfifo(file.c_str(), 0600), 0);
  expectMovedAside("not a regular file", 2);

  fs::remove(file);
  fs::create_symlink(file, file);
  expectMovedAside("Too many levels of symbolic links", 3);
  EXPECT_TRUE(fs::is_symlink(aside(3)));

  fs::remove(file);
  const UniqueFd socket(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  file.string().copy(address.sun_path, sizeof address.sun_path - 1);
  ASSERT_EQ(::bind(socket.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address), 0);
  expectMovedAside("No such device or address", 4);
}

TEST_F(DamagedPreferencesTest, AnUnreadableFileIsMovedAside) {
  home.write(kDomain, binary(textDictionary("key", "old")));
  {
    SystemCalls calls;
    calls.failOpen = EACCES;
    expectMovedAside("Permission denied");
  }
  EXPECT_EQ(TestHome::read(aside()), binary(textDictionary("key", "old")));
}

TEST_F(DamagedPreferencesTest, ALackOfDescriptorsOrMemoryIsNoDamage) {
  home.write(kDomain, binary(textDictionary("key", "old")));
  for (const int error : {EMFILE, ENFILE, ENOMEM, EINTR, EAGAIN}) {
    SystemCalls calls;
    calls.failOpen = error;
    EXPECT_FALSE(setNow(*ours, "key", "new"));
    EXPECT_EQ(log.entries().size(), 1u);
    log.clear();
    EXPECT_EQ(get(*ours, "key"), "(none)");
    log.clear();
  }
  ASSERT_TRUE(sync(*ours));
  EXPECT_EQ(get(*ours, "key"), "old") << "when it is over, all is as it was";
  EXPECT_EQ(home.files(), std::vector<std::string>{"com.example.files.plist"});
}

TEST_F(DamagedPreferencesTest, AFileWhoseContentCannotBeReadIsMovedAside) {
  home.write(kDomain, binary(textDictionary("key", "old")));
  const FailingCall failing("pread", EIO, 0, FailingCall::HowOften::always);
  expectMovedAside("Input/output error");
}

TEST_F(DamagedPreferencesTest, AReadThatASignalInterruptsIsRepeatedAndOneWithoutMemoryIsNoDamage) {
  home.write(kDomain, binary(textDictionary("key", "old")));
  {
    const FailingCall interrupted("pread", EINTR);
    EXPECT_EQ(get(*ours, "key"), "old");
    EXPECT_EQ(interrupted.failures(), 1);
    EXPECT_TRUE(log.entries().empty());
  }
  ours = home.open();
  {
    const FailingCall failing("pread", ENOMEM, 0, FailingCall::HowOften::always);
    EXPECT_FALSE(setNow(*ours, "key", "new"));
  }
  EXPECT_EQ(onlyLine(), line("read: Cannot allocate memory"));
  EXPECT_EQ(get(*ours, "key"), "old");
  EXPECT_EQ(home.files(), std::vector<std::string>{"com.example.files.plist"});
}

TEST_F(DamagedPreferencesTest, WhatCannotBeMovedAsideIsNotWrittenOver) {
  home.write(kDomain, "garbage");
  {
    SystemCalls calls;
    calls.failRenameFlags = EACCES;
    EXPECT_FALSE(setNow(*ours, "key", "value"));
    EXPECT_EQ(onlyLine(),
              line("damaged (not a property list) and cannot be moved aside (Permission denied); nothing is "
                   "stored there"));
    EXPECT_EQ(TestHome::read(file), "garbage");
    const FailingCall failing("renameat2", EACCES, 0, FailingCall::HowOften::always);
    EXPECT_FALSE(setNow(*ours, "key", "value"));
    EXPECT_EQ(failing.failures(), 1) << "other names would not help";
    log.clear();
  }
  {
    SystemCalls calls;
    // File systems that know no flags of rename: looked at first, then renamed.
    calls.failRenameFlags = EINVAL;
    std::ofstream(aside()) << "an earlier one";
    expectMovedAside("not a property list", 2);
  }
  EXPECT_EQ(TestHome::read(aside(2)), "garbage");
  EXPECT_EQ(TestHome::read(aside(1)), "an earlier one");
}

TEST_F(DamagedPreferencesTest, ADamagedFileOfTheLongestNameIsMovedAsideToo) {
  const std::string longest(NAME_MAX - 6, 'd');
  home.write(longest, "garbage");
  ours->setValue("key", PropertyList::boolean(true), longest, kUser, kHost);
  EXPECT_TRUE(ours->synchronize(longest, kUser, kHost));
  EXPECT_EQ(home.files(), (std::vector{longest.substr(0, NAME_MAX - 10) + ".damaged-1", longest + ".plist"}));
}

TEST_F(DamagedPreferencesTest, ADanglingLinkIsAnEmptyDomain) {
  fs::create_directories(home.folder());
  fs::create_symlink("nowhere", file);
  EXPECT_EQ(get(*ours, "key"), "(none)");
  EXPECT_TRUE(setNow(*ours, "key", "value"));
  EXPECT_FALSE(fs::is_symlink(file));
  EXPECT_TRUE(log.entries().empty());
}

// ---- a full disk
// --------------------------------------------------------------------------------------------

// In a mount namespace of its own, so in a process of its own. The exit status says what went wrong; 77: not
// permitted here.
int fillDisk(const TestHome& home) {
  constexpr int kNotPermitted = 77;
  if (::unshare(CLONE_NEWNS) != 0 || ::mount("none", "/", nullptr, MS_REC | MS_PRIVATE, nullptr) != 0 ||
      ::mount("none", home.home().c_str(), "tmpfs", 0, "size=256k,mode=0700") != 0) {
    return kNotPermitted;
  }
  RecordingLog log;
  const auto store = home.open();
  const auto set = [&store](std::string_view text) {
    store->setValue("key", PropertyList::string(text), "d", kUser, kHost);
    return store->synchronize("d", kUser, kHost);
  };
  if (!set("fits") || !log.entries().empty()) return 1;
  const std::string before = TestHome::read(home.file("d"));
  if (set(std::string(400'000, 'x'))) return 2;
  if (log.entries().size() != 1 ||
      log.entries()[0] !=
          RecordingLog::unifiedLine(LogLevel::error, "Preferences " + home.file("d").string() +
                                                         ": write: No space left on device")) {
    return 3;
  }
  if (TestHome::read(home.file("d")) != before) return 4;
  if (home.files() != std::vector<std::string>{"d.plist"}) return 5;
  if (store->copyValue("key", "d", kUser, kHost).asString() != "fits") return 6;
  return set("fits again") ? 0 : 7;
}

TEST_F(FilePreferencesTest, OnAFullDiskASetFailsAndTheOldFileStands) {
  const pid_t child = ::fork();
  if (child == 0) ::_exit(fillDisk(home));
  int status = 0;
  ASSERT_EQ(::waitpid(child, &status, 0), child);
  ASSERT_TRUE(WIFEXITED(status));
  if (WEXITSTATUS(status) == 77) GTEST_SKIP() << "no mount namespace permitted here";
  EXPECT_EQ(WEXITSTATUS(status), 0);
}

}  // namespace
}  // namespace brenvik

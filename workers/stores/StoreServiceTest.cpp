// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
// The stores on both sides of a channel: the helper's end, the service on a thread, and the real program.
#include "workers/stores/StoreService.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/mount.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "platform/files/fakes/ChildProcesses.h"
#include "platform/files/fakes/TemporaryDirectory.h"
#include "platform/log/fakes/RecordingLog.h"
#include "platform/sqlite/Sqlite.h"
#include "platform/stores/RemoteContacts.h"
#include "platform/stores/RemoteVoicemailStore.h"
#include "platform/stores/StoreMessages.h"
#include "platform/stores/linux/PreparedFolder.h"
#include "platform/worker/WorkerFields.h"
#include "platform/worker/fakes/ThreadedWorker.h"
#include "platform/worker/linux/WorkerProgram.h"

namespace brenvik {
namespace {

using namespace std::chrono_literals;
using Clock = std::chrono::steady_clock;
using Error = RecordingLog::Entry;

constexpr auto kForEver = Clock::time_point::max();

Error errorLine(const std::string& text) { return RecordingLog::unifiedLine(LogLevel::error, text); }

class StoresTest : public testing::Test {
 protected:
  explicit StoresTest(std::string path = {}) : homePath(path.empty() ? home.path() : std::move(path)) {}

  PreparedFolder folder(const char* name, const char* file) {
    return {[this] { return PreparedFolder::Account{homePath, ::getuid(), ::getgid()}; }, name, file};
  }
  void run(const std::string& file, const std::string& statements) {
    sqlite3* opened = nullptr;
    ASSERT_EQ(sqlite()->open_v2(file.c_str(), &opened, SQLITE_OPEN_READWRITE | SQLITE_OPEN_CREATE, nullptr),
              SQLITE_OK);
    const SqliteDatabase database(opened);
    ASSERT_EQ(sqlite()->exec(opened, statements.c_str(), nullptr, nullptr, nullptr), SQLITE_OK)
        << sqlite()->errmsg(opened);
  }
  void makeContacts(const std::string& more = "") {
    home.directory("Library/AddressBook");
    run(contactsFile,
        "CREATE TABLE contact_channels(contact_id INTEGER NOT NULL, channel_identifier TEXT NOT NULL);"
        "INSERT INTO contact_channels VALUES(1,'old'),(2,'other');" +
            more);
  }
  static std::string remap(ContactsService& contacts, const std::string& from = "old",
                           const std::string& to = "new") {
    std::unique_ptr<ContactsChannelManager> manager;
    try {
      manager = contacts.makeChannelManager();
    } catch (const std::bad_alloc&) {
      return "no memory";
    }
    if (manager == nullptr) return "no manager";
    std::optional<std::string> error;
    return manager->remapChannelIdentifier(from, to, &error) ? "success" : error.value_or("(none)");
  }

  TemporaryDirectory home;
  const std::string homePath;
  const std::string voicemailFile = home / "Library/Voicemail/voicemail.db";
  const std::string contactsFile = home / "Library/AddressBook/contacts.db";
  PreparedFolder voicemailFolder = folder("Voicemail", stores::kVoicemailFile);
  PreparedFolder contactsFolder = folder("AddressBook", stores::kContactsFile);
  RecordingLog log;
  const std::string token = "token";
};

// ---- over the service on a thread

class StoreServiceTest : public StoresTest {
 protected:
  ThreadedWorker worker{&serveStore};
  RemoteVoicemailStore store{worker, voicemailFolder};
  RemoteContacts contacts{worker, contactsFolder};
};

TEST_F(StoreServiceTest, TokensAreKeptReplacedAndClearedOverOneChannel) {
  const std::string second = "sécond 'quoted' \xF0\x9F\x98\x80";
  store.setToken(&token);
  store.setToken(&second);
  store.setTokenForKey("a", "1");
  store.setTokenForKey("", "empty key");
  store.setTokenForKey("b", "");
  EXPECT_EQ(store.copyToken(), second);
  EXPECT_EQ(store.copyTokenForKey("a"), "1");
  EXPECT_EQ(store.copyTokenForKey(""), "empty key");
  EXPECT_EQ(store.copyTokenForKey("b"), "");
  EXPECT_EQ(store.copyTokenForKey("c"), std::nullopt);
  store.setToken(nullptr);
  EXPECT_EQ(store.copyToken(), std::nullopt);
  store.removeAllRecords();
  EXPECT_EQ(store.copyTokenForKey("a"), std::nullopt);
  EXPECT_EQ(worker.opened(), 1);
  EXPECT_TRUE(log.entries().empty());
  EXPECT_EQ(statOf(voicemailFile).st_mode & 07777U, 0600U);
}

TEST_F(StoreServiceTest, ReadingAStoreThatIsNotThereAsksNobody) {
  EXPECT_EQ(store.copyToken(), std::nullopt);
  EXPECT_EQ(remap(contacts), "no manager");
  EXPECT_EQ(worker.opened(), 0);
  EXPECT_FALSE(isThere(home / "Library"));
  EXPECT_TRUE(log.entries().empty());
}

TEST_F(StoreServiceTest, TheWorkerIsStartedAheadOnceAndOnlyIfThereIsAStore) {
  RemoteVoicemailStore(worker, voicemailFolder).expectUse();
  home.directory("Library/Voicemail");
  RemoteVoicemailStore(worker, voicemailFolder).expectUse();
  EXPECT_EQ(worker.started(), 0) << "a folder is no store";
  store.setToken(&token);
  const int opened = worker.opened();
  RemoteVoicemailStore another(worker, voicemailFolder);
  another.expectUse();
  another.expectUse();
  EXPECT_EQ(worker.started(), 1);
  EXPECT_EQ(worker.opened(), opened) << "nothing is asked";
  EXPECT_EQ(another.copyToken(), token);
}

TEST_F(StoreServiceTest, AFolderThatWasReplacedIsTheOneThatCounts) {
  store.setToken(&token);
  std::filesystem::rename(home / "Library/Voicemail", home / "moved");
  EXPECT_EQ(store.copyToken(), std::nullopt);
  const std::string second = "second";
  store.setToken(&second);
  EXPECT_EQ(store.copyToken(), second);
  std::filesystem::remove_all(home / "Library");
  std::filesystem::create_directory(home / "Library");
  std::filesystem::rename(home / "moved", home / "Library/Voicemail");
  EXPECT_EQ(store.copyToken(), token);
  EXPECT_EQ(worker.opened(), 1);
}

TEST_F(StoreServiceTest, AWorkerThatIsGoneBetweenTwoOperationsIsReplacedAndNobodyNotices) {
  store.setToken(&token);
  for (int i = 0; i < 10; ++i) {
    worker.die();
    EXPECT_EQ(store.copyToken(), token);
  }
  EXPECT_EQ(worker.opened(), 11);
  EXPECT_TRUE(log.entries().empty());
}

TEST_F(StoreServiceTest, AWorkerThatDiesInTheMiddleIsReplacedOnceAndNobodyNotices) {
  makeContacts();
  std::atomic<int> deaths{0};
  ThreadedWorker mortal([&deaths](std::uint32_t work, WorkerChannel channel) {
    if (++deaths % 2 == 0) return serveStore(work, std::move(channel));
    WorkerMessage message;
    (void)channel.receive(&message, kForEver);
  });
  RemoteVoicemailStore mortalStore(mortal, voicemailFolder);
  RemoteContacts mortalContacts(mortal, contactsFolder);
  mortalStore.setToken(&token);
  EXPECT_EQ(mortalStore.copyToken(), token);
  EXPECT_EQ(remap(mortalContacts), "success");
  EXPECT_EQ(deaths, 4);
  EXPECT_TRUE(log.entries().empty());
}

TEST_F(StoreServiceTest, WithoutAWorkerItIsAStoreThatCannotBeOpened) {
  home.directory("Library/Voicemail");
  makeContacts();
  worker.answerWith(WorkerResult::unavailable);
  store.setToken(&token);
  EXPECT_EQ(store.copyToken(), std::nullopt);
  EXPECT_EQ(remap(contacts), "the contacts could not be reached");
  EXPECT_EQ(log.entries(), std::vector({errorLine("The voicemail store could not be written"),
                                        errorLine("The voicemail store could not be read")}));
  worker.answerWith(WorkerResult::outOfMemory);
  EXPECT_THROW(store.setToken(&token), std::bad_alloc);
  EXPECT_EQ(remap(contacts), "no memory");
  worker.answerWith(WorkerResult::done);
  store.setToken(&token);
  EXPECT_EQ(store.copyToken(), token);
  EXPECT_EQ(remap(contacts), "success");
}

TEST_F(StoreServiceTest, ContactsFollowTheirChannelAndFailuresKeepTheirDescription) {
  makeContacts(
      "CREATE TRIGGER t BEFORE UPDATE ON contact_channels WHEN new.channel_identifier = 'refused' "
      "BEGIN SELECT RAISE(FAIL, 'contact 1 is frozen'); END;");
  EXPECT_EQ(remap(contacts), "success");
  EXPECT_EQ(remap(contacts, "new", "refused"), "contact 1 is frozen");
  EXPECT_EQ(remap(contacts, "new", "\xFF"), "a channel identifier is not valid UTF-8");
  const auto manager = contacts.makeChannelManager();
  ASSERT_NE(manager, nullptr);
  std::optional<std::string> error;
  EXPECT_FALSE(manager->remapChannelIdentifier("new", "refused", &error));
  EXPECT_TRUE(manager->remapChannelIdentifier("new", "newer", &error)) << "it works again after a failure";
}

TEST_F(StoreServiceTest, ADescriptionWithoutEndIsCut) {
  makeContacts("CREATE TRIGGER t BEFORE UPDATE ON contact_channels BEGIN SELECT RAISE(FAIL, '" +
               std::string(30'000, 'x') + "'); END;");
  EXPECT_EQ(remap(contacts), std::string(stores::kLongestDescription, 'x'));
}

TEST_F(StoreServiceTest, AMissingDatabaseAndOneThatIsNoneGiveNoManager) {
  home.directory("Library/AddressBook");
  EXPECT_EQ(remap(contacts), "no manager");
  home.file("Library/AddressBook/contacts.db", std::string(4096, 'x'));
  EXPECT_EQ(remap(contacts), "no manager");
}

// ---- over a worker that does not keep to the agreement

class LyingWorkerTest : public StoresTest {
 protected:
  LyingWorkerTest() {
    home.directory("Library/Voicemail");
    makeContacts();
  }
  // Runs all operations; each must come to its end in time, whatever the worker does.
  void expectFailures(const ThreadedWorker::Serve& serve, const std::string& remapError,
                      int givenUpEachTime = 1, std::chrono::milliseconds patience = 5s) {
    ThreadedWorker worker(serve);
    RemoteVoicemailStore store(worker, voicemailFolder, patience);
    RemoteContacts contacts(worker, contactsFolder, patience);
    log.clear();
    const auto before = Clock::now();
    for (int i = 0; i < 10; ++i) {
      (void)store.setToken(&token);
      EXPECT_EQ(store.copyToken(), std::nullopt);
      EXPECT_EQ(remap(contacts), remapError);
    }
    EXPECT_LT(Clock::now() - before, 30s);
    std::vector<Error> expected;
    for (int i = 0; i < 10; ++i) {
      expected.push_back(errorLine("The voicemail store could not be written"));
      expected.push_back(errorLine("The voicemail store could not be read"));
    }
    EXPECT_EQ(log.entries(), expected);
    EXPECT_EQ(worker.givenUp(), 30 * givenUpEachTime);
  }
};

TEST_F(LyingWorkerTest, OneThatDiesAtEachRequest) {
  expectFailures(
      [](std::uint32_t, WorkerChannel channel) {
        WorkerMessage message;
        (void)channel.receive(&message, kForEver);
      },
      "the contacts could not be reached", 2);
}

TEST_F(LyingWorkerTest, OneThatNeverAnswers) {
  expectFailures(
      [](std::uint32_t, WorkerChannel channel) {
        WorkerMessage message;
        while (channel.receive(&message, kForEver) == WorkerResult::done) {
        }
      },
      "the contacts did not answer in time", 1, 50ms);
}

TEST_F(LyingWorkerTest, OneWhoseAnswersAreNone) {
  for (const std::uint32_t kind : {0U, 1U, 3U, 4U, 0xFFFFFFFFU}) {
    expectFailures(
        [kind](std::uint32_t, WorkerChannel channel) {
          WorkerMessage message;
          while (channel.receive(&message, kForEver) == WorkerResult::done) {
            message.kind = kind;
            message.payload.assign(9, std::byte{0xAA});
            message.descriptors.clear();
            if (channel.send(message) != WorkerResult::done) return;
          }
        },
        "the contacts could not be reached");
  }
}

TEST_F(LyingWorkerTest, OneThatFloods) {
  expectFailures(
      [](std::uint32_t, WorkerChannel channel) {
        WorkerMessage message;
        message.payload.resize(WorkerMessage::kLongestPayload);
        for (int i = 0; i < 3; ++i) message.descriptors.emplace_back(::dup(STDERR_FILENO));
        while (channel.send(message) == WorkerResult::done || message.kind == 0) {
          if (channel.receive(&message, Clock::now()) == WorkerResult::closed) return;
          message.payload.resize(WorkerMessage::kLongestPayload);
        }
      },
      "the contacts could not be reached");
}

// An answer that comes too late is not taken for the next one's.
TEST_F(LyingWorkerTest, OneThatAnswersTwice) {
  ThreadedWorker worker([](std::uint32_t, WorkerChannel channel) {
    WorkerMessage message;
    while (channel.receive(&message, kForEver) == WorkerResult::done) {
      const auto request = stores::decodeVoicemailRequest(message);
      const auto answer = stores::encode(stores::VoicemailAnswer{
          .outcome = stores::VoicemailOutcome::done, .serial = request->serial, .token = request->key});
      (void)channel.send(answer);
      (void)channel.send(answer);
    }
  });
  RemoteVoicemailStore store(worker, voicemailFolder);
  EXPECT_EQ(store.copyTokenForKey("first"), "first");
  EXPECT_EQ(store.copyTokenForKey("second"), std::nullopt);
  EXPECT_EQ(store.copyTokenForKey("third"), "third");
}

// ---- what the service makes of requests that are none

TEST_F(StoresTest, WhatIsNoRequestHangsUp) {
  const auto hangsUp = [&](std::uint32_t work, WorkerMessage message) {
    ThreadedWorker worker{&serveStore};
    WorkerChannel channel;
    EXPECT_EQ(worker.open(work, &channel), WorkerResult::done);
    (void)channel.send(message);  // it may have hung up already
    return channel.receive(&message, Clock::now() + 20s) == WorkerResult::closed;
  };
  const auto withFolder = [&](WorkerMessage message, const std::string& path) {
    message.descriptors.emplace_back(::open(path.c_str(), O_RDONLY | O_CLOEXEC));
    return message;
  };
  EXPECT_TRUE(hangsUp(0, {}));
  EXPECT_TRUE(hangsUp(3, {}));
  EXPECT_TRUE(hangsUp(1, {}));
  EXPECT_TRUE(hangsUp(2, {}));
  const stores::VoicemailRequest request;
  EXPECT_TRUE(hangsUp(1, stores::encode(request))) << "without a folder";
  EXPECT_TRUE(hangsUp(1, withFolder(stores::encode(request), "/etc/passwd")));
  EXPECT_TRUE(hangsUp(1, withFolder(withFolder(stores::encode(request), home.path()), home.path())));
  WorkerMessage opening;
  opening.kind = stores::kOpenContacts;
  EXPECT_TRUE(hangsUp(2, withFolder(std::move(opening), "/etc/passwd")));
  EXPECT_TRUE(hangsUp(2, stores::encode(stores::RemapRequest{"a", "b"}))) << "before a folder";
}

TEST_F(StoresTest, WhatTheAccountMayNotDoIsSaidUnlessTheHelperInsists) {
  if (::geteuid() != 0) GTEST_SKIP() << "needs a folder of another account";
#ifdef __SANITIZE_THREAD__
  GTEST_SKIP() << "ThreadSanitizer starts no threads after fork(2)";
#endif
  home.directory("theirs");
  home.directory("own");
  ASSERT_EQ(::chmod(home.path().c_str(), 0755), 0);
  ASSERT_EQ(::chmod((home / "theirs").c_str(), 0755), 0);
  ASSERT_EQ(::chown((home / "own").c_str(), 4711, 4711), 0);
  const pid_t child = ::fork();
  ASSERT_GE(child, 0);
  if (child == 0) {
    if (::setresgid(4711, 4711, 4711) != 0 || ::setresuid(4711, 4711, 4711) != 0) ::_exit(99);
    ThreadedWorker worker{&serveStore};
    WorkerChannel channel;
    if (worker.open(static_cast<std::uint32_t>(stores::Work::voicemail), &channel) != WorkerResult::done)
      ::_exit(98);
    const auto outcome = [&](stores::Operation operation, const char* name, bool insists) {
      WorkerMessage message = stores::encode(stores::VoicemailRequest{
          .operation = operation, .serial = 1, .insists = insists, .key = {}, .token = "token"});
      message.descriptors.emplace_back(::open((home / name).c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
      if (channel.send(message) != WorkerResult::done ||
          channel.receive(&message, Clock::now() + 20s) != WorkerResult::done)
        ::_exit(97);
      return stores::decodeVoicemailAnswer(message)->outcome;
    };
    using stores::Operation;
    using stores::VoicemailOutcome;
    if (outcome(Operation::setToken, "theirs", false) != VoicemailOutcome::notAllowed) ::_exit(1);
    if (outcome(Operation::setToken, "theirs", true) == VoicemailOutcome::notAllowed) ::_exit(2);
    if (outcome(Operation::readToken, "theirs", false) != VoicemailOutcome::done) ::_exit(3);
    if (outcome(Operation::setToken, "own", false) != VoicemailOutcome::done) ::_exit(4);
    ::_exit(0);
  }
  int status = -1;
  ASSERT_EQ(::waitpid(child, &status, 0), child);
  EXPECT_EQ(status, 0);
}

TEST(StoreMessagesTest, ARemapAnswerThatCannotBeIsNone) {
  const auto decoded = [](bool done, std::size_t size) {
    WorkerMessage message = stores::encode(stores::RemapAnswer{});
    message.payload = FieldWriter().boolean(done).optionalText(std::string(size, 'x')).take();
    return stores::decodeRemapAnswer(message).has_value();
  };
  EXPECT_TRUE(decoded(false, stores::kLongestDescription));
  EXPECT_FALSE(decoded(false, stores::kLongestDescription + 1));
  EXPECT_FALSE(decoded(true, 1)) << "what is done has no error";
}

// ---- over the program itself

class StoreWorkerTest : public StoresTest {
 protected:
  static WorkerProgram::Description description(const std::string& bootstrap) {
    return {.service = stores::kService,
            .program = stores::kProgram,
            .bootstrap = bootstrap,
            .folders = {BRENVIK_TEST_WORKER_FOLDER}};
  }
  static bool canRun() {
    // Started by root, it becomes "mobile", which not every machine has.
    return ::geteuid() != 0 || ::system("getent passwd mobile > /dev/null") == 0;
  }
  // With an account of that name for root, too.
  void expectChannelsBeyondTheMostHangUpUntilOneIsFree() {
    if (::geteuid() == 0) {
      const std::string accounts =
          home.file("passwd", "root:x:0:0::/:/bin/sh\nmobile:x:4711:4711::/:/bin/sh\n");
      ASSERT_EQ(::mount(accounts.c_str(), "/etc/passwd", nullptr, MS_BIND, nullptr), 0);
    }
    WorkerProgram worker(description(home.path()));
    const auto open = [&](WorkerChannel* channel) {
      return worker.open(static_cast<std::uint32_t>(stores::Work::voicemail), channel);
    };
    WorkerMessage message;
    std::vector<WorkerChannel> channels(16);
    for (WorkerChannel& each : channels) ASSERT_EQ(open(&each), WorkerResult::done);
    WorkerChannel beyond;
    ASSERT_EQ(open(&beyond), WorkerResult::done);
    EXPECT_EQ(beyond.receive(&message, Clock::now() + 20s), WorkerResult::closed);
    for (WorkerChannel& each : channels)
      EXPECT_EQ(each.receive(&message, Clock::now()), WorkerResult::timedOut);
    channels.pop_back();
    const auto isServed = [&] {  // what is no request hangs up as well, but one with a folder is answered
      WorkerMessage request = stores::encode(
          stores::VoicemailRequest{.operation = stores::Operation::readToken, .key = {}, .token = {}});
      request.descriptors.emplace_back(::open("/", O_RDONLY | O_DIRECTORY | O_CLOEXEC));
      return open(&beyond) == WorkerResult::done && beyond.send(request) == WorkerResult::done &&
             beyond.receive(&message, Clock::now() + 20s) == WorkerResult::done;
    };
    const auto end = Clock::now() + 20s;
    bool served = isServed();
    while (!served && Clock::now() < end) served = isServed();
    EXPECT_TRUE(served);
  }
};

TEST_F(StoreWorkerTest, TheProgramKeepsTheStoresAndLeavesWithItsOwner) {
  if (::geteuid() == 0) GTEST_SKIP() << "the end-to-end tests have an account \"mobile\"";
  WorkerProgram worker(description(home.path()));
  RemoteVoicemailStore store(worker, voicemailFolder, 20s);
  RemoteContacts contacts(worker, contactsFolder, 20s);
  makeContacts();
  store.setToken(&token);
  EXPECT_EQ(store.copyToken(), token);
  EXPECT_EQ(remap(contacts), "success");
}

TEST_F(StoreWorkerTest, WithoutTheAccountItDoesNotRunAndTheStoreCannotBeWritten) {
  if (canRun()) GTEST_SKIP() << "there is an account \"mobile\", or this is not root";
  WorkerProgram worker(description(home.path()));
  RemoteVoicemailStore store(worker, voicemailFolder, 20s);
  store.setToken(&token);
  ASSERT_FALSE(log.entries().empty());
  EXPECT_EQ(log.entries().back(), errorLine("The voicemail store could not be written"));
  EXPECT_FALSE(isThere(voicemailFile));
}

TEST_F(StoreWorkerTest, ChannelsBeyondTheMostHangUpUntilOneIsFree) {
  // In a program started anew: this one has threads that close what earlier tests left, and what they hold at
  // a fork stays held.
  testing::FLAGS_gtest_death_test_style = "threadsafe";
  const auto inMounts = [this] {
    inPrivateMounts([this] { expectChannelsBeyondTheMostHangUpUntilOneIsFree(); });
    std::fflush(nullptr);
    std::_Exit(HasFailure() ? 1 : 0);
  };
  EXPECT_EXIT(inMounts(), testing::ExitedWithCode(0), "");
}

}  // namespace
}  // namespace brenvik

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include <gtest/gtest.h>
#include <poll.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <chrono>
#include <cstdint>
#include <optional>
#include <random>
#include <string>

#include "platform/base/UniqueFd.h"
#include "platform/log/fakes/RecordingLog.h"
#include "platform/preferences/linux/TestHome.h"

// Writers that are processes of their own: killed at any moment, or at work at the same time.
namespace brenvik {
namespace {

using namespace std::chrono_literals;

constexpr auto kUser = UserScope::currentUser;
constexpr auto kHost = HostScope::anyHost;
constexpr const char kDomain[] = "com.example.crash";
constexpr std::uint32_t kKeys = 5;

// To fork takes a sanitizer's program some 50 ms, and it has nothing more to find out about what a kill
// leaves.
#if defined(__SANITIZE_ADDRESS__) || defined(__SANITIZE_THREAD__)
constexpr int kKills = 100;
#else
constexpr int kKills = 1000;
#endif

std::string keyOf(std::uint32_t number) { return "key" + std::to_string(number % kKeys); }

// The number, and text whose length and letters follow from it: a mix of two writes cannot pass for one.
PropertyList valueOf(std::uint32_t number) {
  const std::string text(number * 7919 % 20'000, static_cast<char>('a' + number % 26));
  return PropertyList::dictionary(
      {{"Number", PropertyList::integer(number)}, {"Text", PropertyList::string(text)}});
}

struct Pipe {
  UniqueFd reading;
  UniqueFd writing;
  Pipe() {
    int ends[2];
    if (::pipe(ends) == 0) {
      reading.reset(ends[0]);
      writing.reset(ends[1]);
    }
  }
};

// Sets one number after the other and says so of each that was answered. Never returns.
[[noreturn]] void writeUntilKilled(const TestHome& home, int acknowledgements, std::uint32_t first) {
  const auto store = home.open();
  for (std::uint32_t number = first;; ++number) {
    store->setValue(keyOf(number), valueOf(number), kDomain, kUser, kHost);
    if (!store->synchronize(kDomain, kUser, kHost)) ::_exit(1);
    if (::write(acknowledgements, &number, sizeof number) != ssize_t{sizeof number}) ::_exit(1);
  }
}

std::optional<std::uint32_t> readNumber(int from) {
  std::uint32_t number = 0;
  return ::read(from, &number, sizeof number) == ssize_t{sizeof number} ? std::optional(number)
                                                                        : std::nullopt;
}

// Adds up how many of the kills hit a write half done.
void killWriters(int kills, const TestHome& home, int& killedWithinAWrite) {
  RecordingLog log;
  std::mt19937 random(4711);
  std::array<std::uint32_t, kKeys> answered{};  // the last number of each key that was answered
  std::uint32_t next = 1;
  auto oneWrite = std::chrono::nanoseconds(2ms);  // about; measured as we go
  for (int kill = 0; kill < kills; ++kill) {
    Pipe acknowledgements;
    const pid_t writer = ::fork();
    ASSERT_GE(writer, 0);
    if (writer == 0) {
      acknowledgements.reading.reset();
      setLogSink(nullptr);
      writeUntilKilled(home, acknowledgements.writing.get(), next);
    }
    acknowledgements.writing.reset();
    const auto take = [&](std::uint32_t number) {
      answered[number % kKeys] = number;
      next = number + 1;
    };
    // Up to two answers, then anywhere within the writes that follow.
    for (auto rest = random() % 3; rest > 0; --rest) {
      const auto start = std::chrono::steady_clock::now();
      const auto number = readNumber(acknowledgements.reading.get());
      ASSERT_TRUE(number) << "the writer failed or died by itself";
      take(*number);
      oneWrite = (oneWrite * 7 + (std::chrono::steady_clock::now() - start)) / 8;
    }
    const auto wait =
        std::chrono::nanoseconds(random() % static_cast<std::uint64_t>(2 * oneWrite.count() + 1));
    const timespec pause{wait / 1s, (wait % 1s).count()};
    ASSERT_EQ(::ppoll(nullptr, 0, &pause, nullptr), 0);
    ASSERT_EQ(::kill(writer, SIGKILL), 0);
    int status = 0;
    ASSERT_EQ(::waitpid(writer, &status, 0), writer);
    ASSERT_TRUE(WIFSIGNALED(status));
    while (const auto number = readNumber(acknowledgements.reading.get())) take(*number);

    if (std::filesystem::exists(home.folder() / ".brenvik-preferences.tmp")) ++killedWithinAWrite;
    const auto reader = home.open();
    for (std::uint32_t key = 0; key < kKeys; ++key) {
      const PropertyList value = reader->copyValue(keyOf(key), kDomain, kUser, kHost);
      const auto found = static_cast<std::uint32_t>(value.find("Number").asInteger().value_or(0));
      // The one that was under way may be there or not.
      const bool isUnderWay = found == next && next % kKeys == key;
      ASSERT_TRUE(found == answered[key] || isUnderWay)
          << "after kill " << kill << ": " << found << " instead of " << answered[key];
      ASSERT_EQ(value, found == 0 ? PropertyList() : valueOf(found)) << "torn";
      answered[key] = found;
    }
    if (answered[next % kKeys] == next) ++next;
    ASSERT_TRUE(log.entries().empty()) << log.entries()[0].line;
  }
}

// Most of them on a file system in memory: a killed process leaves the same behind as on a disk, and of each
// write less time is spent waiting for the disk and more between its steps, which is where a kill could hurt.
TEST(PreferencesCrashTest, WritersKilledAtAnyMomentLoseNothingAnsweredAndTearNothing) {
  constexpr int kKillsOnDisk = kKills / 10;
  int killedWithinAWrite = 0;
  killWriters(kKillsOnDisk, TestHome(), killedWithinAWrite);
  const bool hasMemoryFolder = ::access("/dev/shm", W_OK) == 0;
  // Where a sanitizer or other work makes writers slow few kills hit; when none has, more are needed.
  for (int round = 0; round == 0 || (killedWithinAWrite == 0 && round < 10); ++round) {
    killWriters(kKills - kKillsOnDisk, hasMemoryFolder ? TestHome("/dev/shm") : TestHome(),
                killedWithinAWrite);
    if (HasFatalFailure()) return;
  }
  EXPECT_GT(killedWithinAWrite, 0) << "no kill ever hit a write: this has tested nothing";
  RecordProperty("killedWithinAWrite", killedWithinAWrite);
}

TEST(PreferencesCrashTest, SeveralProcessesThatWriteDifferentKeysOfOneDomainKeepThemAll) {
  constexpr int kWriters = 3;
  constexpr int kRounds = 100;
  const TestHome home;
  std::array<pid_t, kWriters> writers{};
  for (int w = 0; w < kWriters; ++w) {
    writers[static_cast<std::size_t>(w)] = ::fork();
    ASSERT_GE(writers[static_cast<std::size_t>(w)], 0);
    if (writers[static_cast<std::size_t>(w)] != 0) continue;
    setLogSink(nullptr);
    const auto store = home.open(60s);  // a slow disk is not what this is about
    for (int round = 0; round < kRounds; ++round) {
      const std::string key = "writer " + std::to_string(w) + " key " + std::to_string(round % 10);
      store->setValue(key, PropertyList::integer(round), kDomain, kUser, kHost);
      if (!store->synchronize(kDomain, kUser, kHost)) ::_exit(1);
      // What this process was told is stored stays so, whatever the others do.
      if (store->copyValue(key, kDomain, kUser, kHost).asInteger() != round) ::_exit(2);
    }
    ::_exit(0);
  }
  for (const pid_t writer : writers) {
    int status = 0;
    ASSERT_EQ(::waitpid(writer, &status, 0), writer);
    EXPECT_EQ(status, 0);
  }
  const auto reader = home.open();
  for (int w = 0; w < kWriters; ++w) {
    for (int round = kRounds - 10; round < kRounds; ++round) {
      const std::string key = "writer " + std::to_string(w) + " key " + std::to_string(round % 10);
      EXPECT_EQ(reader->copyValue(key, kDomain, kUser, kHost).asInteger(), round) << key;
    }
  }
  EXPECT_EQ(home.files(), std::vector<std::string>{"com.example.crash.plist"});
}

}  // namespace
}  // namespace brenvik

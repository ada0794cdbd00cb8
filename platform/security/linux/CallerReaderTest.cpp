// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/security/linux/CallerReader.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <limits.h>
#include <pthread.h>
#include <sys/mman.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <atomic>
#include <functional>
#include <new>
#include <utility>

#include "platform/base/ProcessFacts.h"
#include "platform/security/linux/CallerProcess.h"
#include "platform/security/linux/CallerTestSupport.h"
#include "platform/worker/fakes/ThreadedWorker.h"

namespace brenvik {
namespace {

constexpr auto kForEver = std::chrono::steady_clock::time_point::max();

// Answers each question with the message, until the helper hangs up.
ThreadedWorker::Serve answering(const std::function<WorkerMessage()>& make) {
  return [make](std::uint32_t, WorkerChannel channel) {
    WorkerMessage question;
    while (channel.receive(&question, kForEver) == WorkerResult::done) (void)channel.send(make());
  };
}

class CallerReaderTest : public testing::Test {
 protected:
  std::optional<CallerFacts> ask(RemoteCallerReader& reader) { return reader.read(folder.get()); }
  const UniqueFd folder{::open("/proc/self", O_PATH | O_CLOEXEC)};
};

TEST_F(CallerReaderTest, TheAnswerOfTheWorkerIsTaken) {
  std::atomic<int> questions = 0;
  ThreadedWorker worker([&](std::uint32_t work, WorkerChannel channel) {
    EXPECT_EQ(work, callers::kFacts);
    WorkerMessage question;
    while (channel.receive(&question, kForEver) == WorkerResult::done) {
      EXPECT_TRUE(callers::isQuestion(question));
      EXPECT_EQ(identityAt(question.descriptors[0].get(), "exe"), identityAt(AT_FDCWD, "/proc/self/exe"));
      ++questions;
      (void)channel.send(callers::encode(someFacts()));
    }
  });
  RemoteCallerReader reader(worker);
  for (int i = 0; i < 3; ++i) {
    const auto facts = ask(reader);
    ASSERT_TRUE(facts);
    EXPECT_EQ(facts->executable, (FileIdentity{1, 2}));
    EXPECT_EQ(facts->executablePath, "/usr/bin/program");
    EXPECT_EQ(facts->userNamespace, (FileIdentity{3, 4}));
  }
  EXPECT_EQ(questions, 3);
  EXPECT_EQ(worker.opened(), 3) << "between two questions, others can ask";
}

TEST_F(CallerReaderTest, WhatTheWorkerDoesNotKnowIsNotKnown) {
  ThreadedWorker worker(answering([] { return callers::encode({}); }));
  RemoteCallerReader reader(worker);
  const auto facts = ask(reader);
  ASSERT_TRUE(facts);
  EXPECT_FALSE(facts->executable);
  EXPECT_EQ(facts->executablePath, "");
  EXPECT_FALSE(facts->userNamespace);
}

TEST_F(CallerReaderTest, TheLongestPathIsTaken) {
  CallerFacts longest = someFacts();
  longest.executablePath.assign(PATH_MAX, 'x');
  ThreadedWorker worker(answering([&] { return callers::encode(longest); }));
  RemoteCallerReader reader(worker);
  const auto facts = ask(reader);
  ASSERT_TRUE(facts);
  EXPECT_EQ(facts->executablePath, longest.executablePath);
}

#if !defined(__SANITIZE_ADDRESS__) && !defined(__SANITIZE_THREAD__)
// A process keeps the pages of its stack that were used once.
TEST_F(CallerReaderTest, AQuestionTakesLittleStack) {
  ThreadedWorker worker(answering([] { return callers::encode(someFacts()); }));
  struct Asked {
    RemoteCallerReader reader;
    int folder;
    bool isAnswered = false;
  } asked{RemoteCallerReader(worker), folder.get()};
  constexpr std::size_t kPage = 4096;
  constexpr std::size_t kSize = 64 * kPage;
  void* const stack = ::mmap(nullptr, kSize, PROT_READ | PROT_WRITE, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0);
  ASSERT_NE(stack, MAP_FAILED);
  pthread_attr_t attributes;
  ::pthread_attr_init(&attributes);
  ASSERT_EQ(::pthread_attr_setstack(&attributes, stack, kSize), 0);
  pthread_t thread{};
  ASSERT_EQ(::pthread_create(
                &thread, &attributes,
                [](void* argument) -> void* {
                  auto* const it = static_cast<Asked*>(argument);
                  it->isAnswered = it->reader.read(it->folder).has_value();
                  return nullptr;
                },
                &asked),
            0);
  ::pthread_join(thread, nullptr);
  ::pthread_attr_destroy(&attributes);
  EXPECT_TRUE(asked.isAnswered);
  std::array<unsigned char, kSize / kPage> pages{};
  ASSERT_EQ(::mincore(stack, kSize, pages.data()), 0);
  const auto lowest = std::find_if(pages.begin(), pages.end(), [](unsigned char each) { return each & 1; });
  EXPECT_LE(static_cast<std::size_t>(pages.end() - lowest) * kPage, std::size_t{32} << 10);
  ::munmap(stack, kSize);
}
#endif

TEST_F(CallerReaderTest, AWorkerThatDiedBetweenTwoQuestionsIsReplaced) {
  ThreadedWorker worker(answering([] { return callers::encode(someFacts()); }));
  RemoteCallerReader reader(worker);
  EXPECT_TRUE(ask(reader));
  worker.die();
  EXPECT_TRUE(ask(reader));
  EXPECT_EQ(worker.opened(), 2);
}

TEST_F(CallerReaderTest, AWorkerThatDiesOfAQuestionIsReplacedOnceAndTheNextQuestionHasAnother) {
  std::atomic<int> deaths = 0;
  ThreadedWorker worker([&](std::uint32_t, WorkerChannel channel) {
    WorkerMessage question;
    while (channel.receive(&question, kForEver) == WorkerResult::done) {
      if (deaths++ < 3) return;  // the channel hangs up
      (void)channel.send(callers::encode(someFacts()));
    }
  });
  RemoteCallerReader reader(worker);
  EXPECT_FALSE(ask(reader)) << "two died of it";
  EXPECT_EQ(worker.opened(), 2) << "a question that kills workers is not tried on all of them";
  EXPECT_TRUE(ask(reader)) << "one more died, and its successor answers";
  EXPECT_EQ(worker.opened(), 4);
}

TEST_F(CallerReaderTest, AWorkerThatHangsIsGivenUpInTimeAndTheNextQuestionHasAnother) {
  std::atomic<bool> hangs =
      true;  // not by the order of their threads, of which a late one may be the first's
  ThreadedWorker worker([&](std::uint32_t, WorkerChannel channel) {
    WorkerMessage question;
    while (channel.receive(&question, kForEver) == WorkerResult::done) {
      if (!hangs) (void)channel.send(callers::encode(someFacts()));
    }
  });
  {
    RemoteCallerReader reader(worker, std::chrono::milliseconds(1));
    EXPECT_FALSE(ask(reader));
    EXPECT_EQ(worker.givenUp(), 1);
  }
  hangs = false;
  RemoteCallerReader reader(worker);
  EXPECT_TRUE(ask(reader));
}

TEST_F(CallerReaderTest, ManyQuestionsToAWorkerThatHangsWaitHalfOfTheTimeAtMost) {
  using Clock = RemoteCallerReader::Clock;
  constexpr std::chrono::seconds kPatience{20};
  std::atomic<bool> answers = false;
  ThreadedWorker worker([&](std::uint32_t, WorkerChannel channel) {
    WorkerMessage question;
    while (channel.receive(&question, kForEver) == WorkerResult::done) {
      if (answers) (void)channel.send(callers::encode(someFacts()));
    }
  });
  Clock::duration ahead{};
  RemoteCallerReader reader(worker, kPatience, [&] { return Clock::now() + ahead; });
  const auto began = Clock::now();
  for (int left = 3; left > 0; --left) {
    ahead = -left * kPatience;  // the time of this question is over when it is asked
    EXPECT_FALSE(ask(reader));
  }
  EXPECT_EQ(worker.givenUp(), 3);
  ahead = {};
  for (int i = 0; i < 5; ++i) EXPECT_FALSE(ask(reader));
  EXPECT_LT(Clock::now() - began, kPatience / 2);
  EXPECT_EQ(worker.givenUp(), 3)
      << "one that is starting is not ended by those who wait less than that takes";
  answers = true;
  ahead = kPatience;
  EXPECT_TRUE(ask(reader)) << "waiting is possible again";
}

TEST_F(CallerReaderTest, AnAnswerOfAnotherFormIsNoneAndItsWorkerIsGivenUp) {
  const auto lies = [&](const char* what, const std::function<void(WorkerMessage*)>& change) {
    ThreadedWorker worker(answering([&] {
      WorkerMessage answer = callers::encode(someFacts());
      change(&answer);
      return answer;
    }));
    RemoteCallerReader reader(worker);
    EXPECT_FALSE(ask(reader)) << what;
    EXPECT_EQ(worker.givenUp(), 1) << what;
    EXPECT_EQ(worker.opened(), 1) << what << ": a liar is not asked again";
  };
  lies("another kind", [](WorkerMessage* answer) { answer->kind = 7; });
  lies("nothing in it", [](WorkerMessage* answer) { answer->payload.clear(); });
  lies("cut short", [](WorkerMessage* answer) { answer->payload.pop_back(); });
  lies("more than there should be", [](WorkerMessage* answer) { answer->payload.push_back({}); });
  lies("neither yes nor no", [](WorkerMessage* answer) { answer->payload[0] = std::byte{2}; });
  lies("a descriptor", [](WorkerMessage* answer) {
    answer->descriptors.emplace_back(::open("/dev/null", O_RDONLY | O_CLOEXEC));
  });
  lies("a path that the kernel cannot have told", [](WorkerMessage* answer) {
    CallerFacts facts = someFacts();
    facts.executablePath.assign(PATH_MAX + 1, 'x');
    *answer = callers::encode(facts);
  });
}

TEST_F(CallerReaderTest, WithoutAWorkerThereIsNoAnswer) {
  ThreadedWorker worker(answering([] { return callers::encode(someFacts()); }));
  worker.answerWith(WorkerResult::unavailable);
  RemoteCallerReader reader(worker);
  EXPECT_FALSE(ask(reader));
  worker.answerWith(WorkerResult::done);
  EXPECT_TRUE(ask(reader));
}

TEST_F(CallerReaderTest, ALackOfMemoryOrDescriptorsIsThisProcesssOwn) {
  ThreadedWorker worker(answering([] { return callers::encode(someFacts()); }));
  RemoteCallerReader reader(worker);
  worker.answerWith(WorkerResult::outOfMemory);
  EXPECT_THROW((void)ask(reader), std::bad_alloc);
  EXPECT_THROW((void)reader.read(-1), std::bad_alloc);
  EXPECT_EQ(worker.givenUp(), 0);
  worker.answerWith(WorkerResult::done);
  EXPECT_TRUE(ask(reader));
}

// ----- A process that may not look at others -----

bool knowsNothing(const CallerProcess& process) {
  const CallerFacts facts = process.facts();
  return !facts.executable && !facts.userNamespace && facts.executablePath.empty();
}

TEST(CallerProcessWithAReaderTest, ItsCapabilityTellsWhetherAProcessReadsByItself) {
  EXPECT_EQ(withoutCapabilities([] { return readsCallersByItself() ? 1 : 0; }), 0);
  EXPECT_TRUE(readsCallersByItself() || ::geteuid() != 0);
}

TEST(CallerProcessWithAReaderTest, WhatThisProcessMayReadItReadsByItself) {
  AnsweringReader reader;
  const auto self = CallerProcess::pin("/proc", ::getpid(), processStartTime(::getpid()).value(), &reader);
  ASSERT_TRUE(self);
  EXPECT_EQ(self->executable(), identityAt(AT_FDCWD, "/proc/self/exe"));
  const CallerFacts facts = self->facts();
  EXPECT_EQ(facts.executable, self->executable());
  EXPECT_EQ(facts.userNamespace, CallerProcess::namespaceOfThisProcess("/proc"));
  EXPECT_NE(facts.executablePath, "");
  EXPECT_EQ(reader.asked, 0);
}

TEST(CallerProcessWithAReaderTest, WhatItMayNotReadTheReaderReads) {
  if (!readsCallersByItself()) GTEST_SKIP() << "a process with fewer rights than this one cannot be made";
  const pid_t powerful = ::getpid();
  const auto startTime = processStartTime(powerful).value();
  EXPECT_EQ(withoutCapabilities([&] {
              AnsweringReader reader;
              const auto process = CallerProcess::pin("/proc", powerful, startTime, &reader);
              if (!process) return 1;
              if (process->executable() != someFacts().executable || reader.asked != 1 || !reader.isFolder)
                return 2;
              const CallerFacts facts = process->facts();
              if (facts.executable != someFacts().executable ||
                  facts.userNamespace != someFacts().userNamespace ||
                  facts.executablePath != someFacts().executablePath)
                return 3;
              if (reader.asked != 2) return 4;  // one question for all of them
              reader.answer.reset();
              return process->executable() || !knowsNothing(*process) ? 5 : 0;
            }),
            0);
}

TEST(CallerProcessWithAReaderTest, WithoutAReaderItKnowsNothing) {
  if (!readsCallersByItself()) GTEST_SKIP() << "a process with fewer rights than this one cannot be made";
  const pid_t powerful = ::getpid();
  const auto startTime = processStartTime(powerful).value();
  EXPECT_EQ(withoutCapabilities([&] {
              const auto process = CallerProcess::pin("/proc", powerful, startTime);
              if (!process) return 1;
              return process->executable() || !knowsNothing(*process) ? 2 : 0;
            }),
            0);
}

TEST(CallerProcessWithAReaderTest, NobodyIsAskedAboutAProcessThatHasGone) {
  const pid_t child = ::fork();
  if (child == 0) {
    ::pause();
    ::_exit(0);
  }
  ASSERT_GT(child, 0);
  AnsweringReader reader;
  const auto process = CallerProcess::pin("/proc", child, processStartTime(child).value(), &reader);
  ASSERT_TRUE(process);
  ::kill(child, SIGKILL);
  ASSERT_EQ(::waitpid(child, nullptr, 0), child);
  EXPECT_FALSE(process->executable());
  EXPECT_TRUE(knowsNothing(*process));
  EXPECT_EQ(reader.asked, 0);
}

}  // namespace
}  // namespace brenvik

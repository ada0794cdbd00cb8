// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "workers/callers/CallerService.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include <cstdlib>
#include <filesystem>
#include <thread>
#include <utility>

#include "platform/security/linux/CallerFacts.h"

namespace brenvik {
namespace {

namespace fs = std::filesystem;

class CallerServiceTest : public testing::Test {
 protected:
  void SetUp() override { serve(callers::kFacts); }
  void TearDown() override {
    channel.close();
    server.join();
    if (!folder.empty()) fs::remove_all(folder);
  }
  void serve(std::uint32_t work) {
    WorkerChannel theirs;
    ASSERT_EQ(WorkerChannel::makePair(&channel, &theirs), WorkerResult::done);
    server =
        std::thread([work, theirs = std::move(theirs)]() mutable { serveCallers(work, std::move(theirs)); });
  }
  static WorkerMessage questionAbout(const std::string& path) {
    WorkerMessage question;
    question.kind = callers::kFacts;
    question.descriptors.emplace_back(::open(path.c_str(), O_PATH | O_CLOEXEC));
    return question;
  }
  WorkerResult ask(const WorkerMessage& question, WorkerMessage* answer) {
    EXPECT_EQ(channel.send(question), WorkerResult::done);
    return channel.receive(answer, std::chrono::steady_clock::now() + std::chrono::seconds(20));
  }
  bool hangsUpOn(const WorkerMessage& question) {
    WorkerMessage answer;
    return ask(question, &answer) == WorkerResult::closed;
  }
  const fs::path& madeFolder() {
    std::string name = (fs::temp_directory_path() / "callers-XXXXXX").string();
    EXPECT_NE(::mkdtemp(name.data()), nullptr);
    return folder = name;
  }

  WorkerChannel channel;
  std::thread server;
  fs::path folder;
};

TEST_F(CallerServiceTest, TellsWhatAProcessExecutesAndItsUserNamespaceAsOftenAsItIsAsked) {
  for (int i = 0; i < 3; ++i) {
    WorkerMessage answer;
    ASSERT_EQ(ask(questionAbout("/proc/" + std::to_string(::getpid())), &answer), WorkerResult::done);
    const auto facts = callers::decode(answer);
    ASSERT_TRUE(facts);
    EXPECT_TRUE(facts->executable);
    EXPECT_EQ(facts->executable, identityAt(AT_FDCWD, "/proc/self/exe"));
    EXPECT_EQ(facts->executablePath, fs::read_symlink("/proc/self/exe"));
    EXPECT_TRUE(facts->userNamespace);
    EXPECT_EQ(facts->userNamespace, identityAt(AT_FDCWD, "/proc/self/ns/user"));
  }
}

TEST_F(CallerServiceTest, KnowsNothingOfAFolderThatIsNoProcesss) {
  WorkerMessage answer;
  ASSERT_EQ(ask(questionAbout("/proc"), &answer), WorkerResult::done);
  const auto facts = callers::decode(answer);
  ASSERT_TRUE(facts);
  EXPECT_FALSE(facts->executable);
  EXPECT_EQ(facts->executablePath, "");
  EXPECT_FALSE(facts->userNamespace);
}

TEST_F(CallerServiceTest, FollowsNoLinkThatSomebodyHasMade) {
  fs::create_symlink("/proc/1/root/etc/hostname", madeFolder() / "exe");
  EXPECT_TRUE(hangsUpOn(questionAbout(folder)));
}

TEST_F(CallerServiceTest, HangsUpOnAQuestionWithoutADescriptor) {
  WorkerMessage question;
  question.kind = callers::kFacts;
  EXPECT_TRUE(hangsUpOn(question));
}

TEST_F(CallerServiceTest, HangsUpOnAQuestionWithTwoDescriptors) {
  WorkerMessage question = questionAbout("/proc/self");
  question.descriptors.emplace_back(::open("/proc/self", O_PATH | O_CLOEXEC));
  EXPECT_TRUE(hangsUpOn(question));
}

TEST_F(CallerServiceTest, HangsUpOnAQuestionWithMoreInIt) {
  WorkerMessage question = questionAbout("/proc/self");
  question.payload.resize(1);
  EXPECT_TRUE(hangsUpOn(question));
}

TEST_F(CallerServiceTest, HangsUpOnAnotherQuestion) {
  WorkerMessage question = questionAbout("/proc/self");
  question.kind = callers::kFacts + 1;
  EXPECT_TRUE(hangsUpOn(question));
}

TEST_F(CallerServiceTest, HangsUpOnAnotherWork) {
  channel.close();
  server.join();
  serve(callers::kFacts + 1);
  WorkerMessage answer;
  EXPECT_EQ(channel.receive(&answer, std::chrono::steady_clock::now() + std::chrono::seconds(20)),
            WorkerResult::closed);
}

}  // namespace
}  // namespace brenvik

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/security/linux/CallerFacts.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <cerrno>

#include "platform/base/UniqueFd.h"
#include "platform/security/linux/CallerTestSupport.h"

namespace brenvik {
namespace {

WorkerMessage messageWith(std::uint32_t kind, std::size_t bytes, int descriptors) {
  WorkerMessage message;
  message.kind = kind;
  message.payload.resize(bytes);
  for (int i = 0; i < descriptors; ++i) {
    message.descriptors.emplace_back(::open("/", O_PATH | O_CLOEXEC));
  }
  return message;
}

TEST(CallerQuestionTest, AQuestionIsOneDescriptorAndNothingElse) {
  EXPECT_TRUE(callers::isQuestion(messageWith(callers::kFacts, 0, 1)));
  EXPECT_FALSE(callers::isQuestion(messageWith(callers::kFacts, 0, 0)));
  EXPECT_FALSE(callers::isQuestion(messageWith(callers::kFacts, 0, 2)));
  EXPECT_FALSE(callers::isQuestion(messageWith(callers::kFacts, 1, 1)));
  EXPECT_FALSE(callers::isQuestion(messageWith(callers::kFacts, 1, 0)));
  EXPECT_FALSE(callers::isQuestion(messageWith(callers::kFacts + 1, 0, 1)));
  EXPECT_FALSE(callers::isQuestion(messageWith(callers::kFacts + 1, 1, 1)));
  EXPECT_FALSE(callers::isQuestion(messageWith(0, 0, 1)));
}

TEST(CallerAnswerTest, EachFactArrivesWhetherItIsKnownOrNot) {
  for (int missing = 0; missing < 3; ++missing) {
    CallerFacts facts = someFacts();
    if (missing == 1) facts.executable.reset();
    if (missing == 2) facts.userNamespace.reset();
    const auto arrived = callers::decode(callers::encode(facts));
    ASSERT_TRUE(arrived);
    EXPECT_EQ(arrived->executable, facts.executable) << missing;
    EXPECT_EQ(arrived->executablePath, facts.executablePath) << missing;
    EXPECT_EQ(arrived->userNamespace, facts.userNamespace) << missing;
  }
}

TEST(FileIdentityTest, AFileIsTheOneOfItsDeviceAndItsNumberOnIt) {
  struct stat facts {};
  ASSERT_EQ(::stat("/proc/self/exe", &facts), 0);
  const UniqueFd folder(::open("/proc/self", O_PATH | O_CLOEXEC));
  EXPECT_EQ(identityAt(folder.get(), "exe"), (FileIdentity{facts.st_dev, facts.st_ino}));
  EXPECT_NE(identityAt(folder.get(), "exe"), (FileIdentity{facts.st_dev + 1, facts.st_ino}));
  EXPECT_NE(identityAt(folder.get(), "exe"), (FileIdentity{facts.st_dev, facts.st_ino + 1}));
  errno = 0;
  EXPECT_FALSE(identityAt(folder.get(), "no-such-file"));
  EXPECT_EQ(errno, ENOENT);
}

}  // namespace
}  // namespace brenvik

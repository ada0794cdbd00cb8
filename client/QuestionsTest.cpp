// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "client/Questions.h"

#include <gtest/gtest.h>

namespace brenvik::client {
namespace {

using std::chrono::milliseconds;

constexpr std::int32_t kCivicInfo = 8683567;
constexpr std::int32_t kAddress = 8683569;

class QuestionsTest : public testing::Test {
 protected:
  std::int32_t push(bvmh_event_kind kind) { return questions_.answered(kind, time_, &number_); }

  Questions questions_;
  Questions::Time time_{std::chrono::hours(1)};
  bvmh_call number_ = 99;
};

TEST_F(QuestionsTest, APushAnswersTheOneQuestionOfItsKind) {
  questions_.asked(kCivicInfo, 5, time_);
  questions_.asked(kAddress, 6, time_);
  EXPECT_EQ(push(BVMH_EVENT_LOCAL_ADDRESS), BVMH_OK);
  EXPECT_EQ(number_, 6U);
  EXPECT_EQ(push(BVMH_EVENT_CIVIC_INFO), BVMH_OK);
  EXPECT_EQ(number_, 5U);
}

TEST_F(QuestionsTest, APushThatNobodyAskedForIsAStrangers) {
  EXPECT_EQ(push(BVMH_EVENT_CIVIC_INFO), BVMH_ERROR_NOT_ASKED);
  EXPECT_EQ(number_, 0U);
  questions_.asked(kAddress, 6, time_);
  EXPECT_EQ(push(BVMH_EVENT_CIVIC_INFO), BVMH_ERROR_NOT_ASKED);
  EXPECT_EQ(push(BVMH_EVENT_NOTIFICATION), BVMH_ERROR_NOT_ASKED);
  questions_.asked(8683568, 7, time_);  // no question that a push answers
  EXPECT_EQ(push(BVMH_EVENT_CIVIC_INFO), BVMH_ERROR_NOT_ASKED);
}

TEST_F(QuestionsTest, AQuestionIsAnsweredOnce) {
  questions_.asked(kCivicInfo, 5, time_);
  EXPECT_EQ(push(BVMH_EVENT_CIVIC_INFO), BVMH_OK);
  EXPECT_EQ(push(BVMH_EVENT_CIVIC_INFO), BVMH_ERROR_NOT_ASKED);
}

TEST_F(QuestionsTest, WithSeveralOfAKindNobodyCanTellAndOneAnswerSettlesAll) {
  for (bvmh_call number = 1; number <= 3; ++number) questions_.asked(kCivicInfo, number, time_);
  EXPECT_EQ(push(BVMH_EVENT_CIVIC_INFO), BVMH_ERROR_AMBIGUOUS);
  EXPECT_EQ(number_, 0U);
  EXPECT_EQ(push(BVMH_EVENT_CIVIC_INFO), BVMH_ERROR_NOT_ASKED);
}

TEST_F(QuestionsTest, AQuestionIsOpenForTenSeconds) {
  questions_.asked(kCivicInfo, 5, time_);
  time_ += Questions::kAnswerTime;
  questions_.asked(kAddress, 6, time_);
  EXPECT_EQ(push(BVMH_EVENT_CIVIC_INFO), BVMH_OK);
  time_ += Questions::kAnswerTime + milliseconds(1);
  EXPECT_EQ(push(BVMH_EVENT_LOCAL_ADDRESS), BVMH_ERROR_NOT_ASKED);
  // One that is too old does not stand in the way of a new one.
  questions_.asked(kCivicInfo, 7, time_);
  time_ += Questions::kAnswerTime + milliseconds(1);
  questions_.asked(kCivicInfo, 8, time_);
  EXPECT_EQ(push(BVMH_EVENT_CIVIC_INFO), BVMH_OK);
  EXPECT_EQ(number_, 8U);
}

TEST_F(QuestionsTest, ARefusedQuestionHasNoAnswerAndOneThatIsSentAgainIsStillOne) {
  questions_.asked(kCivicInfo, 5, time_);
  questions_.refused(kCivicInfo, 5);
  EXPECT_EQ(push(BVMH_EVENT_CIVIC_INFO), BVMH_ERROR_NOT_ASKED);
  questions_.asked(kCivicInfo, 6, time_);
  questions_.asked(kCivicInfo, 6, time_);
  EXPECT_EQ(push(BVMH_EVENT_CIVIC_INFO), BVMH_OK);
  EXPECT_EQ(number_, 6U);
}

}  // namespace
}  // namespace brenvik::client

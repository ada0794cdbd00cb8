// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "helper/voicemail/VoicemailOperations.h"

#include <gtest/gtest.h>

#include <array>
#include <string>
#include <vector>

#include "platform/voicemail/fakes/InMemoryVoicemailStore.h"

namespace brenvik {
namespace {

constexpr PortName kPort = 5;

struct Field : std::array<char, 256> {
  explicit Field(std::string_view text = "") : std::array<char, 256>{} { text.copy(data(), size()); }
  std::string text() const { return {data(), ::strnlen(data(), size())}; }
};

struct StubLibrary final : VisualVoicemailLibrary {
  SubscriptionQuery query = nullptr;
  int lookUps = 0;
  SubscriptionQuery lookUpSubscriptionQuery() noexcept override {
    ++lookUps;
    return query;
  }
};

class VoicemailOperationsTest : public testing::Test {
 protected:
  InMemoryVoicemailStore store;
  StubLibrary library;
  VoicemailOperations operations{store, library};
};

TEST_F(VoicemailOperationsTest, ATokenThatWasNeverSetIsAnEmptyStringAndStatus0) {
  Field token("stale");
  EXPECT_EQ(operations.copyVoicemailToken(kPort, token.data()), 0);
  EXPECT_EQ(token.text(), "");
  Field keyed("stale");
  EXPECT_EQ(operations.copyVoicemailTokenForKey(kPort, Field("key").data(), keyed.data()), 0);
  EXPECT_EQ(keyed.text(), "");
}

TEST_F(VoicemailOperationsTest,
       WithoutMemoryForTheStoreATextIsA5AndTheRoutinesWithoutOneHaveTheirOnlyStatus) {
  store.setTokenForKey("key", "value");
  store.exhausted = true;
  Field token("stale");
  EXPECT_EQ(operations.setVoicemailToken(kPort, Field("t").data()), kern::failure);
  EXPECT_EQ(operations.setVoicemailTokenForKey(kPort, Field("key").data(), Field("t").data()), kern::failure);
  EXPECT_EQ(operations.copyVoicemailTokenForKey(kPort, Field("key").data(), token.data()), kern::failure);
  EXPECT_EQ(operations.clearVoicemailToken(kPort), kern::success);
  EXPECT_EQ(operations.resetVoicemailStore(kPort), kern::success);
  EXPECT_EQ(operations.copyVoicemailToken(kPort, token.data()), kern::success);
  EXPECT_EQ(token.text(), "");
  store.exhausted = false;
  EXPECT_EQ(store.copyTokenForKey("key"), "value");
}

TEST_F(VoicemailOperationsTest, AResetWhoseFirstStepFailsStillRemovesTheRecords) {
  const std::string general = "general";
  store.setToken(&general);
  store.setTokenForKey("key", "value");
  store.calls.clear();
  store.failures = 1;
  EXPECT_EQ(operations.resetVoicemailStore(kPort), kern::success);
  EXPECT_EQ(store.calls, (std::vector<std::string>{"clearToken", "removeAllRecords"}));
  EXPECT_EQ(store.copyToken(), general);
  EXPECT_EQ(store.copyTokenForKey("key"), std::nullopt);
}

TEST_F(VoicemailOperationsTest, TokensThatWereSetAreCopied) {
  EXPECT_EQ(operations.setVoicemailToken(kPort, Field("géneral").data()), 0);
  EXPECT_EQ(operations.setVoicemailTokenForKey(kPort, Field("key").data(), Field("value").data()), 0);
  Field token;
  EXPECT_EQ(operations.copyVoicemailToken(kPort, token.data()), 0);
  EXPECT_EQ(token.text(), "géneral");
  EXPECT_EQ(operations.copyVoicemailTokenForKey(kPort, Field("key").data(), token.data()), 0);
  EXPECT_EQ(token.text(), "value");
  EXPECT_EQ(operations.copyVoicemailTokenForKey(kPort, Field("value").data(), token.data()), 0);
  EXPECT_EQ(token.text(), "");
}

TEST_F(VoicemailOperationsTest, ClearingRemovesTheGeneralTokenOnly) {
  (void)operations.setVoicemailToken(kPort, Field("general").data());
  (void)operations.setVoicemailTokenForKey(kPort, Field("key").data(), Field("value").data());
  EXPECT_EQ(operations.clearVoicemailToken(kPort), 0);
  EXPECT_EQ(store.copyToken(), std::nullopt);
  EXPECT_EQ(store.copyTokenForKey("key"), "value");
}

TEST_F(VoicemailOperationsTest, AResetClearsTheGeneralTokenAndThenRemovesAllRecordsEvenWhenThereAreNone) {
  EXPECT_EQ(operations.resetVoicemailStore(kPort), 0);
  EXPECT_EQ(store.calls, (std::vector<std::string>{"clearToken", "removeAllRecords"}));
  (void)operations.setVoicemailToken(kPort, Field("general").data());
  (void)operations.setVoicemailTokenForKey(kPort, Field("key").data(), Field("value").data());
  EXPECT_EQ(operations.resetVoicemailStore(kPort), 0);
  EXPECT_EQ(store.copyToken(), std::nullopt);
  EXPECT_EQ(store.copyTokenForKey("key"), std::nullopt);
}

TEST_F(VoicemailOperationsTest, AKeyWithInvalidUtf8Gives5AndTheStoreIsNotCalled) {
  Field token("untouched");
  EXPECT_EQ(operations.setVoicemailTokenForKey(kPort, Field("\xff").data(), Field("value").data()), 5);
  EXPECT_EQ(operations.copyVoicemailTokenForKey(kPort, Field("\xc3").data(), token.data()), 5);
  EXPECT_TRUE(store.calls.empty());
}

TEST_F(VoicemailOperationsTest, ATokenWithInvalidUtf8Gives5AndTheStoreIsNotCalled) {
  EXPECT_EQ(operations.setVoicemailToken(kPort, Field("\xed\xa0\x80").data()), 5);
  EXPECT_EQ(operations.setVoicemailTokenForKey(kPort, Field("key").data(), Field("\x80").data()), 5);
  EXPECT_TRUE(store.calls.empty());
}

TEST_F(VoicemailOperationsTest, AnUnterminatedFieldIsCutAtItsLastByteAndStillFitsTheReply) {
  Field unterminated(std::string(256, 't'));
  EXPECT_EQ(operations.setVoicemailToken(kPort, unterminated.data()), 0);
  EXPECT_EQ(store.copyToken(), std::string(255, 't'));
  Field token;
  EXPECT_EQ(operations.copyVoicemailToken(kPort, token.data()), 0);
  EXPECT_EQ(token.text(), std::string(255, 't'));
  EXPECT_EQ(token.back(), '\0');
  // Cut inside a character, it is not text any more.
  EXPECT_EQ(operations.setVoicemailToken(kPort, Field(std::string(254, 'a') + "é").data()), 5);
}

TEST_F(VoicemailOperationsTest, ATokenThatDoesNotFitLeavesNoUsableTextAndStatus0) {
  const std::string large(256, 'x');
  store.setToken(&large);
  store.setTokenForKey("key", large);
  Field token("stale");
  EXPECT_EQ(operations.copyVoicemailToken(kPort, token.data()), 0);
  EXPECT_EQ(token.text(), "");
  Field keyed("stale");
  EXPECT_EQ(operations.copyVoicemailTokenForKey(kPort, Field("key").data(), keyed.data()), 0);
  EXPECT_EQ(keyed.text(), "");
}

TEST_F(VoicemailOperationsTest, ATokenThatIsNotTextLeavesNoUsableTextAndStatus0) {
  const std::string binary = "\xfe\xff";
  store.setToken(&binary);
  Field token("stale");
  EXPECT_EQ(operations.copyVoicemailToken(kPort, token.data()), 0);
  EXPECT_EQ(token.text(), "");
}

TEST_F(VoicemailOperationsTest, WithoutVisualVoicemailTheAnswerIs0OnEveryCallAndItIsLookedUpOnce) {
  for (int i = 0; i < 3; ++i) {
    std::uint8_t subscribed = 7;
    EXPECT_EQ(operations.isVoicemailServiceSubscribed(kPort, &subscribed), 0);
    EXPECT_EQ(subscribed, 0);
  }
  EXPECT_EQ(library.lookUps, 1);
  EXPECT_EQ(store.expected, 0);
}

TEST_F(VoicemailOperationsTest, WhoIsSubscribedIsExpectedToUseTheStore) {
  static bool answer;
  library.query = [] { return answer; };
  for (const bool subscribed : {false, true}) {
    answer = subscribed;
    std::uint8_t told = 7;
    EXPECT_EQ(operations.isVoicemailServiceSubscribed(kPort, &told), 0);
    EXPECT_EQ(store.expected, subscribed ? 1 : 0);
  }
  EXPECT_TRUE(store.calls.empty());
}

TEST_F(VoicemailOperationsTest, TheQuerysAnswerIsStoredOnEveryCallAndItIsLookedUpOnce) {
  static bool answer;
  library.query = [] { return answer; };
  for (const bool expected : {true, false, true}) {
    answer = expected;
    std::uint8_t subscribed = 7;
    EXPECT_EQ(operations.isVoicemailServiceSubscribed(kPort, &subscribed), 0);
    EXPECT_EQ(subscribed, expected ? 1 : 0);
  }
  EXPECT_EQ(library.lookUps, 1);
}

}  // namespace
}  // namespace brenvik

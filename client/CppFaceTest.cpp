// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include <gtest/gtest.h>
#include <poll.h>

#include <algorithm>
#include <brenvik/mobile_helper.hpp>
#include <cerrno>
#include <filesystem>
#include <functional>
#include <string>
#include <type_traits>
#include <vector>

#include "client/fakes/ScriptedHelper.h"

// The C++ face: that each method calls its routine with its arguments in order, that results are what came,
// and that objects own what they hold.
namespace brenvik::client {
namespace {

using std::chrono_literals::operator""s;

static_assert(!std::is_copy_constructible_v<bvmh::Client> &&
              std::is_nothrow_move_constructible_v<bvmh::Client>);
static_assert(!std::is_copy_constructible_v<bvmh::Region> &&
              std::is_nothrow_move_constructible_v<bvmh::Region>);
static_assert(!std::is_copy_constructible_v<bvmh::Event> &&
              std::is_nothrow_move_constructible_v<bvmh::Event>);
static_assert(!std::is_copy_constructible_v<bvmh::Listener>);
static_assert(!std::is_constructible_v<bvmh::Text, std::nullptr_t> &&
              !std::is_constructible_v<bvmh::Text, std::string_view>);

struct Call {
  std::int32_t id;
  std::vector<std::pair<std::size_t, std::string>> texts;  // offset in the request
  std::function<Bytes(const Message&)> answer;
  std::function<void(bvmh::Client&)> make;
};

Bytes success(const Message& request) { return statusReply(request, 0); }
Bytes yes(const Message& request) { return withResult(statusReply(request, 0), std::string("\1\0\0\0", 4)); }
Bytes region(const Message& request) { return inLineReply(request, "<plist/>"); }
std::function<Bytes(const Message&)> text(std::size_t size) {
  return [size](const Message& request) {
    std::string field = "DE";
    field.resize(size, '\0');
    return withResult(statusReply(request, 0), field);
  };
}

template <class T>
void expectValue(const bvmh::Result<T>& result, std::string_view wanted) {
  ASSERT_TRUE(result) << result.error().text();
  if constexpr (std::is_same_v<T, bvmh::Region>) {
    EXPECT_EQ(result->text(), wanted);
  } else {
    EXPECT_EQ(*result, wanted);
  }
}

std::vector<Call> calls() {
  const bvmh::Bytes list = "<plist/>";
  return {
      {8683549, {{32, "a"}}, success, [](auto& c) { EXPECT_TRUE(c.setVoicemailToken("a")); }},
      {8683550,
       {{32, "a"}, {288, "b"}},
       success,
       [](auto& c) { EXPECT_TRUE(c.setVoicemailTokenForKey("a", "b")); }},
      {8683551, {}, success, [](auto& c) { EXPECT_TRUE(c.clearVoicemailToken()); }},
      {8683552, {}, success, [](auto& c) { EXPECT_TRUE(c.resetVoicemailStore()); }},
      {8683553, {{32, "a"}}, text(256), [](auto& c) { expectValue(c.copyVoicemailTokenForKey("a"), "DE"); }},
      {8683554, {}, text(256), [](auto& c) { expectValue(c.copyVoicemailToken(), "DE"); }},
      {8683555,
       {{52, "a"}, {308, "b"}, {568, "<plist/>"}},
       success,
       [=](auto& c) { EXPECT_TRUE(c.setPreferenceValue("a", "b", list)); }},
      {8683555,
       {{52, "a"}, {308, "b"}},
       success,
       [](auto& c) { EXPECT_TRUE(c.removePreferenceValue("a", "b")); }},
      {8683556,
       {{32, "a"}, {288, "b"}},
       region,
       [](auto& c) { expectValue(c.copyPreferenceValue("a", "b"), "<plist/>"); }},
      {8683557,
       {{32, "a"}, {288, "b"}},
       region,
       [](auto& c) { expectValue(c.copyAppPreferenceValue("a", "b"), "<plist/>"); }},
      {8683558,
       {{32, "a"}, {1056, "b"}, {2080, "c"}},
       success,
       [](auto& c) { EXPECT_TRUE(c.replaceCarrierSymlink("a", "b", "c")); }},
      {8683559, {{32, "a"}, {1056, "b"}}, success, [](auto& c) { EXPECT_TRUE(c.createSymlink("a", "b")); }},
      {8683560,
       {{32, "a"}, {1056, "b"}},
       success,
       [](auto& c) { EXPECT_TRUE(c.removeCarrierFile("a", "b")); }},
      {8683561, {}, yes, [](auto& c) { EXPECT_TRUE(*c.isVoicemailServiceSubscribed()); }},
      {8683562, {{32, "\1"}}, success, [](auto& c) { EXPECT_TRUE(c.cellularHeartbeat(true)); }},
      {8683563, {{32, "\x04"}}, success, [](auto& c) { EXPECT_TRUE(c.checkLasdUpdate(BVMH_LASD_LTE)); }},
      {8683564,
       {{32, "a"}, {288, "b"}, {544, "c"}},
       yes,
       [](auto& c) { EXPECT_TRUE(*c.copyCarrierFile("a", "b", "c")); }},
      {8683565,
       {{32, "/a"}},
       yes,
       [](auto& c) { EXPECT_TRUE(*c.copyCrashLogs(std::filesystem::path("/a"))); }},
      {8683566,
       {{32, "a"}, {288, "b"}, {544, "c"}},
       yes,
       [](auto& c) { EXPECT_TRUE(*c.moveIntoCarrierBundles("a", "b", "c")); }},
      {8683567,
       {{38, "\xF0\x3F"}},
       success,
       [](auto& c) { EXPECT_TRUE(c.requestCountryCodeFromLocation(1.0, 0.0)); }},
      {8683568, {}, text(64), [](auto& c) { expectValue(c.copyCountryCode(), "DE"); }},
      {8683569, {}, success, [](auto& c) { EXPECT_TRUE(c.requestWanIpFromLocation()); }},
      {8683570, {{32, "\1"}}, success, [](auto& c) { EXPECT_TRUE(c.enableRadioManagerLogs(true)); }},
      {8683571,
       {{32, "a"}, {288, "b"}},
       yes,
       [](auto& c) { EXPECT_TRUE(*c.unpackArchive("a", std::string("b"))); }},
      {8683572, {{32, "a"}}, region, [](auto& c) { expectValue(c.loadPlistFile("a"), "<plist/>"); }},
      {8683573,
       {{80, "one"}, {88, "four"}},
       region,
       [](auto& c) {
         expectValue(c.copyBadgeLabels("one", std::vector<char>{'f', 'o', 'u', 'r'}), "<plist/>");
       }},
      {8683574,
       {{80, "one"}, {88, "four"}},
       region,
       [](auto& c) { expectValue(c.copyLocalizedLabels("one", std::string("four")), "<plist/>"); }},
      {8683575, {{32, "a"}, {96, "b"}}, yes, [](auto& c) { EXPECT_TRUE(*c.remapContactsChannel("a", "b")); }},
  };
}

TEST(CppFaceTest, EachMethodCallsItsRoutineWithItsArgumentsInOrder) {
  std::vector<bool> seen(27);
  for (const Call& each : calls()) {
    Message request;
    ScriptedHelper helper([&](Script& script) {
      const UniqueFd channel = script.checkIn();
      request = script.receive(channel);
      script.send(channel, each.answer(request));
      script.expectEnd(channel);
    });
    {
      auto client = bvmh::Client::connect({.socket = helper.path().c_str(), .timeout = 60s});
      ASSERT_TRUE(client) << client.error().text();
      each.make(*client);
    }
    helper.finish();
    EXPECT_EQ(request.id(), each.id);
    seen.at(static_cast<std::size_t>(request.id() - 8683549)) = true;
    for (const auto& [offset, wanted] : each.texts) {
      EXPECT_EQ(request.bytes.string().substr(offset, wanted.size()), wanted) << each.id << " at " << offset;
    }
  }
  EXPECT_EQ(std::count(seen.begin(), seen.end(), true), 27);
}

TEST(CppFaceTest, AFailureHasItsCodeAndTheErrnoBehindIt) {
  const TemporaryDirectory folder;
  const auto client = bvmh::Client::connect({.socket = (folder.path() + "/none").c_str()});
  ASSERT_FALSE(client);
  EXPECT_EQ(client.error(), bvmh::Error(BVMH_ERROR_UNREACHABLE, ENOENT));
  EXPECT_STREQ(client.error().text(), "no helper answers at its socket");
}

TEST(CppFaceTest, ACodeOfTheHelperIsAnErrorAndTheRegionIsEmpty) {
  ScriptedHelper helper([](Script& script) {
    const UniqueFd channel = script.checkIn();
    script.send(channel, statusReply(script.receive(channel), 9));
    script.expectEnd(channel);
  });
  auto client = bvmh::Client::connect({.socket = helper.path().c_str()});
  ASSERT_TRUE(client);
  const auto plist = client->loadPlistFile("/etc/none");
  ASSERT_FALSE(plist);
  EXPECT_EQ(plist.error().code(), BVMH_MEMORY_FAILURE);
  EXPECT_THROW((void)plist.value(), std::exception);
}

TEST(CppFaceTest, ATextWithANulInsideIsRefusedAndNothingIsSent) {
  ScriptedHelper helper([](Script& script) { script.expectEnd(script.checkIn()); });
  auto client = bvmh::Client::connect({.socket = helper.path().c_str()});
  ASSERT_TRUE(client);
  const auto stored = client->setVoicemailToken(std::string("to\0ken", 6));
  ASSERT_FALSE(stored);
  EXPECT_EQ(stored.error().code(), BVMH_ERROR_INVALID_ARGUMENT);
}

TEST(CppFaceTest, AClientThatWasMovedFromRefusesAndTheOtherOneWorks) {
  ScriptedHelper helper([](Script& script) {
    const UniqueFd channel = script.checkIn();
    script.send(channel, statusReply(script.receive(channel), 0));
    script.expectEnd(channel);
  });
  auto first = bvmh::Client::connect({.socket = helper.path().c_str()});
  ASSERT_TRUE(first);
  bvmh::Client second = std::move(*first);
  const auto stored = first->clearVoicemailToken();
  ASSERT_FALSE(stored);
  EXPECT_EQ(stored.error().code(), BVMH_ERROR_INVALID_ARGUMENT);
  EXPECT_TRUE(second.clearVoicemailToken());
}

TEST(CppFaceTest, RegionsAreFreedOnceHoweverTheyAreMoved) {
  ScriptedHelper helper([](Script& script) {
    const UniqueFd channel = script.checkIn();
    for (int i = 0; i < 2; ++i) {
      const Message request = script.receive(channel);
      const UniqueFd memory = makeMemory("<plist/>", kAllSeals);
      script.send(channel, outOfLineReply(request, 8, 0), {memory.get()});
    }
    script.expectEnd(channel);
  });
  auto client = bvmh::Client::connect({.socket = helper.path().c_str()});
  ASSERT_TRUE(client);
  bvmh::Region kept = client->loadPlistFile("/a").value();
  bvmh::Region other = client->loadPlistFile("/b").value();
  bvmh::Region& same = other;
  other = std::move(same);
  EXPECT_EQ(other.text(), "<plist/>");
  kept = std::move(other);
  EXPECT_EQ(kept.text(), "<plist/>");
  EXPECT_TRUE(other.empty());  // NOLINT: what a move leaves behind is what is asked
}

// {"Address": "192.0.2.7"}
const std::string kAddressList =
    std::string(
        "bplist00\xD1\x01\x02\x57"
        "Address\x59"
        "192.0.2.7\x08\x0B\x13",
        8 + 3 + 8 + 10 + 3) +
    std::string("\0\0\0\0\0\0\1\1\0\0\0\0\0\0\0\3\0\0\0\0\0\0\0\0\0\0\0\0\0\0\0\x1D", 32);

TEST(CppFaceTest, APushIsReceivedReadAndAnswered) {
  const TemporaryDirectory folder;
  auto listener = bvmh::Listener::listen(folder.path().c_str());
  ASSERT_TRUE(listener);
  EXPECT_GE(listener->descriptor(), 0);
  const auto none = listener->next(std::chrono::milliseconds(0));
  ASSERT_TRUE(none);
  EXPECT_FALSE(*none);

  const UniqueFd sender = connectTo(folder.path() + "/com.norvale.brenvik");
  const auto size = static_cast<std::uint32_t>(kAddressList.size());
  const Bytes push = Bytes(56)
                         .u32(0, 0x80000012)
                         .u32(4, 52)
                         .u32(8, 7)
                         .i32(20, 9100002)
                         .u32(24, 1)
                         .u32(28, 56)
                         .u8(37, 1)
                         .u8(39, 1)
                         .u32(40, size)
                         .ndr(44)
                         .append(kAddressList);
  Script script;
  ASSERT_TRUE(script.send(sender, push));
  auto event = listener->next(60s);
  ASSERT_TRUE(event && *event);
  EXPECT_EQ((*event)->kind(), BVMH_EVENT_LOCAL_ADDRESS);
  EXPECT_EQ((*event)->text("Address"), "192.0.2.7");
  EXPECT_EQ((*event)->text("City"), std::nullopt);
  EXPECT_TRUE((*event)->wantsReply());
  EXPECT_TRUE(listener->reply(**event, -5));
  EXPECT_EQ(script.receive(sender).bytes.i32At(32), -5);
}

TEST(CppFaceTest, WithoutSocketsOfTheServiceManagerThereIsNoListener) {
  const auto listener = bvmh::Listener::fromEnvironment();
  ASSERT_FALSE(listener);
  EXPECT_EQ(listener.error().code(), BVMH_ERROR_NOT_HANDED_OVER);
}

TEST(CppFaceTest, ValuesGoThereAndBack) {
  auto value = bvmh::Value::dictionary();
  EXPECT_TRUE(value.set("text", bvmh::Value::text("gr\u00fcn")));
  EXPECT_TRUE(value.set("number", bvmh::Value::integer(-3)));
  EXPECT_TRUE(value.set("large", bvmh::Value::unsignedInteger(UINT64_MAX)));
  EXPECT_TRUE(value.set("real", bvmh::Value::real(0.5)));
  EXPECT_TRUE(value.set("yes", bvmh::Value::boolean(true)));
  EXPECT_TRUE(value.set("data", bvmh::Value::data("raw")));
  const std::chrono::system_clock::time_point when{std::chrono::seconds(1'000'000'000)};
  EXPECT_TRUE(value.set("date", bvmh::Value::date(when)));
  EXPECT_TRUE(value.set("list", bvmh::Value::texts({"a", "b"})));
  const auto bytes = value.write();
  ASSERT_TRUE(bytes);
  const auto read = bvmh::valueOf(*bytes);
  ASSERT_TRUE(read);
  EXPECT_EQ(read->type(), BVMH_VALUE_DICTIONARY);
  EXPECT_EQ(read->size(), 8u);
  EXPECT_EQ(read->find("text").asText(), "gr\u00fcn");
  EXPECT_EQ(read->find("number").asInteger(), -3);
  EXPECT_EQ(read->find("large").asUnsigned(), UINT64_MAX);
  EXPECT_EQ(read->find("large").asInteger(), std::nullopt);
  EXPECT_EQ(read->find("real").asReal(), 0.5);
  EXPECT_EQ(read->find("yes").asBoolean(), true);
  EXPECT_EQ(read->find("date").asDate(), when);
  const bvmh::Value data = read->find("data");
  ASSERT_TRUE(data.asData());
  EXPECT_EQ(data.asData()->size(), 3u);
  EXPECT_EQ(read->find("list").at(1).asText(), "b");
  EXPECT_TRUE(read->keyAt(0));
  EXPECT_EQ(read->keyAt(8), std::nullopt);
  EXPECT_EQ(read->find("none").type(), BVMH_VALUE_NONE);
  EXPECT_EQ(read->find("text").asInteger(), std::nullopt);
}

TEST(CppFaceTest, AValueThatIsNoneIsRefusedAndACopyIsIndependent) {
  auto list = bvmh::Value::array();
  const auto appended = list.append(bvmh::Value::text("\xff"));
  ASSERT_FALSE(appended);
  EXPECT_EQ(appended.error().code(), BVMH_ERROR_INVALID_ARGUMENT);
  bvmh::Value copy = list;
  EXPECT_TRUE(copy.append(bvmh::Value::integer(1)));
  EXPECT_EQ(list.size(), 0u);
  EXPECT_EQ(copy.size(), 1u);
  EXPECT_FALSE(bvmh::Value().write());
  EXPECT_EQ(bvmh::Value::read("no list").error().code(), BVMH_ERROR_NOT_A_VALUE);
  EXPECT_EQ(bvmh::Value::texts({"a", "\xff"}).type(), BVMH_VALUE_NONE);
}

// Processes until the outcome of that call is there.
std::optional<bvmh::Outcome> outcomeOf(bvmh::Client& client, bvmh_call call) {
  for (;;) {
    auto taken = client.take(call);
    if (!taken) return std::nullopt;
    if (*taken) return std::move(*taken);
    pollfd ready{client.descriptor(), POLLIN, 0};
    if (::poll(&ready, 1, 60'000) != 1) return std::nullopt;
    client.process();
  }
}

TEST(CppFaceTest, CallsAreBegunAndTakenInAnyOrder) {
  ScriptedHelper helper([](Script& script) {
    const UniqueFd channel = script.checkIn();
    script.send(channel, text(64)(script.receive(channel)));
    script.send(channel, statusReply(script.receive(channel), 9));
    script.send(channel, region(script.receive(channel)));
    script.expectEnd(channel);
  });
  {
    auto client = bvmh::Client::unconnected({.socket = helper.path().c_str()});
    ASSERT_TRUE(client);
    EXPECT_FALSE(client->beginClearVoicemailToken());  // neither connected nor begun to
    int context = 0;
    ASSERT_TRUE(client->beginConnect());
    const auto country = client->beginCopyCountryCode(&context);
    const auto missing = client->beginLoadPlistFile("/etc/none");
    const auto found = client->beginCopyPreferenceValue("d", "k");
    ASSERT_TRUE(country && missing && found);

    auto last = outcomeOf(*client, *found);
    ASSERT_TRUE(last);
    EXPECT_TRUE(last->done());
    EXPECT_EQ(last->takeRegion().text(), "<plist/>");
    EXPECT_TRUE(last->takeRegion().empty());
    const auto first = outcomeOf(*client, *country);
    ASSERT_TRUE(first);
    EXPECT_STREQ(first->text(), "DE");
    EXPECT_EQ(first->context(), &context);
    EXPECT_EQ(first->messageId(), 8683568);
    const auto second = outcomeOf(*client, *missing);
    ASSERT_TRUE(second);
    EXPECT_EQ(second->done().error().code(), BVMH_MEMORY_FAILURE);
    // Its result was taken.
    EXPECT_EQ(client->take(*missing).error().code(), BVMH_ERROR_NO_SUCH_CALL);
    EXPECT_EQ(client->cancel(*missing).error().code(), BVMH_ERROR_NO_SUCH_CALL);
  }
}

TEST(CppFaceTest, AnInterruptedCallSaysSo) {
  ScriptedHelper helper([](Script& script) {
    const UniqueFd channel = script.checkIn();
    script.expectEnd(channel);
  });
  auto client = bvmh::Client::connect({.socket = helper.path().c_str()});
  ASSERT_TRUE(client);
  client->interrupt();
  const auto cleared = client->clearVoicemailToken();
  ASSERT_FALSE(cleared);
  EXPECT_EQ(cleared.error().code(), BVMH_ERROR_INTERRUPTED);
}

}  // namespace
}  // namespace brenvik::client

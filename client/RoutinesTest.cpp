// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include <gtest/gtest-spi.h>
#include <gtest/gtest.h>
#include <poll.h>

#include <functional>
#include <map>
#include <memory>
#include <set>
#include <string>

#include "client/fakes/ScriptedHelper.h"
#include "client/include/brenvik/mobile_helper.h"
#include "interface/Routines.h"

// What each routine puts on the wire, offset by offset, and what it makes of a good answer. Offsets and sizes
// are written out here, not taken from the structs.
namespace brenvik::client {
namespace {

struct FreeClient {
  void operator()(bvmh_client* client) const { bvmh_client_free(client); }
};
using ClientPointer = std::unique_ptr<bvmh_client, FreeClient>;

ClientPointer connectedTo(const ScriptedHelper& helper) {
  ClientPointer client(bvmh_client_create());
  EXPECT_EQ(bvmh_client_set_socket(client.get(), helper.path().c_str()), BVMH_OK);
  bvmh_client_set_timeout(client.get(), 60'000);
  EXPECT_EQ(bvmh_connect(client.get()), BVMH_OK);
  return client;
}

std::string asText(const bvmh_region& region) {
  return {static_cast<const char*>(region.bytes), region.size};
}

struct RoutineCase {
  const char* name;
  std::int32_t id;
  Bytes body;  // the whole request; header fields are checked apart
  std::function<Bytes(const Message&)> answer;
  std::function<std::int32_t(bvmh_client*)> call;  // also checks what comes out
};

// A field of that size around a text.
std::string field(std::string text, std::size_t size) {
  text.resize(size, '\0');
  return text;
}

Bytes success(const Message& request) { return statusReply(request, 0); }
std::function<Bytes(const Message&)> boolean(char value) {
  return [value](const Message& request) {
    return withResult(statusReply(request, 0), std::string{value, 0, 0, 0});
  };
}
std::function<Bytes(const Message&)> answerText(const char* text, std::size_t size) {
  return [=](const Message& request) { return withResult(statusReply(request, 0), field(text, size)); };
}
std::function<Bytes(const Message&)> answerRegion(const char* text) {
  return [=](const Message& request) { return inLineReply(request, text); };
}

using SuccessCall = std::int32_t (*)(bvmh_client*, bool*);
std::function<std::int32_t(bvmh_client*)> expectBoolean(SuccessCall call, bool wanted) {
  return [=](bvmh_client* client) {
    bool result = !wanted;
    const std::int32_t code = call(client, &result);
    EXPECT_EQ(result, wanted);
    return code;
  };
}

using RegionCall = std::int32_t (*)(bvmh_client*, bvmh_region*);
std::function<std::int32_t(bvmh_client*)> expectRegion(RegionCall call, const char* wanted) {
  return [=](bvmh_client* client) {
    bvmh_region region{};
    const std::int32_t code = call(client, &region);
    EXPECT_EQ(asText(region), wanted);
    bvmh_region_free(&region);
    EXPECT_EQ(region.bytes, nullptr);
    return code;
  };
}

Bytes simple(std::size_t size) { return Bytes(size).ndr(24); }
Bytes integerRequest(std::int32_t value) { return simple(36).i32(32, value); }
Bytes labelsRequest(std::string_view labels, std::string_view languages) {
  // 76 bytes, rounded up to 80 where the first region stands; the second at the next multiple of 8.
  const auto labelsEnd = static_cast<std::uint32_t>(80 + labels.size());
  const std::uint32_t second = (labelsEnd + 7) / 8 * 8;
  return Bytes(second)
      .u32(24, 2)
      .u64(28, 80)
      .u8(37, 1)
      .u8(39, 1)
      .u32(40, static_cast<std::uint32_t>(labels.size()))
      .u64(44, second)
      .u8(53, 1)
      .u8(55, 1)
      .u32(56, static_cast<std::uint32_t>(languages.size()))
      .ndr(60)
      .u32(68, static_cast<std::uint32_t>(labels.size()))
      .u32(72, static_cast<std::uint32_t>(languages.size()))
      .text(80, labels)
      .append(languages);
}

const std::vector<RoutineCase>& cases() {
  static const std::vector<RoutineCase> all{
      {"BVMobileHelperSetVoicemailToken", 8683549, simple(288).text(32, "tok\xC3\xA9n"), success,
       [](bvmh_client* c) { return BVMobileHelperSetVoicemailToken(c, "tok\xC3\xA9n"); }},
      {"BVMobileHelperSetVoicemailTokenForKey", 8683550, simple(544).text(32, "key").text(288, "token"),
       success, [](bvmh_client* c) { return BVMobileHelperSetVoicemailTokenForKey(c, "key", "token"); }},
      {"BVMobileHelperClearVoicemailToken", 8683551, Bytes(24), success, BVMobileHelperClearVoicemailToken},
      {"BVMobileHelperResetVoicemailStore", 8683552, Bytes(24), success, BVMobileHelperResetVoicemailStore},
      {"BVMobileHelperCopyVoicemailTokenForKey", 8683553, simple(288).text(32, "key"),
       answerText("value", 256),
       [](bvmh_client* c) {
         char token[BVMH_TOKEN_SIZE] = "?";
         const std::int32_t code = BVMobileHelperCopyVoicemailTokenForKey(c, "key", token, sizeof token);
         EXPECT_STREQ(token, "value");
         return code;
       }},
      {"BVMobileHelperCopyVoicemailToken", 8683554, Bytes(24), answerText("", 256),
       [](bvmh_client* c) {
         char token[BVMH_TOKEN_SIZE] = "?";
         const std::int32_t code = BVMobileHelperCopyVoicemailToken(c, token, sizeof token);
         EXPECT_STREQ(token, "");
         return code;
       }},
      {"BVMobileHelperSetPreferenceValue", 8683555,
       Bytes(568)
           .u32(24, 1)
           .u64(28, 568)
           .u8(37, 1)
           .u8(39, 1)
           .u32(40, 7)
           .ndr(44)
           .text(52, "com.norvale.carrier")
           .text(308, "Key")
           .u32(564, 7)
           .append("<plist>"),
       success,
       [](bvmh_client* c) {
         return BVMobileHelperSetPreferenceValue(c, "com.norvale.carrier", "Key", "<plist>", 7);
       }},
      {"BVMobileHelperCopyPreferenceValue", 8683556, simple(544).text(32, "domain").text(288, "key"),
       answerRegion("<plist/>"),
       expectRegion([](auto* c, auto* r) { return BVMobileHelperCopyPreferenceValue(c, "domain", "key", r); },
                    "<plist/>")},
      {"BVMobileHelperCopyAppPreferenceValue", 8683557, simple(544).text(32, "domain").text(288, "key"),
       answerRegion(""),
       expectRegion(
           [](auto* c, auto* r) { return BVMobileHelperCopyAppPreferenceValue(c, "domain", "key", r); }, "")},
      {"BVMobileHelperReplaceCarrierSymlink", 8683558,
       simple(3104).text(32, "/target").text(1056, "/link").text(2080, "domain"), success,
       [](bvmh_client* c) { return BVMobileHelperReplaceCarrierSymlink(c, "/target", "/link", "domain"); }},
      {"BVMobileHelperCreateSymlink", 8683559, simple(2080).text(32, "/target").text(1056, "/link"), success,
       [](bvmh_client* c) { return BVMobileHelperCreateSymlink(c, "/target", "/link"); }},
      {"BVMobileHelperRemoveCarrierFile", 8683560, simple(2080).text(32, "/file").text(1056, "domain"),
       success, [](bvmh_client* c) { return BVMobileHelperRemoveCarrierFile(c, "/file", "domain"); }},
      {"BVMobileHelperIsVoicemailServiceSubscribed", 8683561, Bytes(24), boolean(1),
       expectBoolean(BVMobileHelperIsVoicemailServiceSubscribed, true)},
      {"BVMobileHelperCellularHeartbeat", 8683562, integerRequest(-2), success,
       [](bvmh_client* c) { return BVMobileHelperCellularHeartbeat(c, -2); }},
      // This one's success leaves the NDR record of its reply unset.
      {"BVMobileHelperCheckLASDUpdate", 8683563, integerRequest(31),
       [](const Message& request) { return statusReply(request, 0).u64(24, 0xFFFFFFFFFFFFFFFF); },
       [](bvmh_client* c) { return BVMobileHelperCheckLASDUpdate(c, 31); }},
      {"BVMobileHelperCopyCarrierFile", 8683564,
       simple(800).text(32, "/from").text(288, "/to").text(544, "name"), boolean(0),
       expectBoolean(
           [](auto* c, bool* b) { return BVMobileHelperCopyCarrierFile(c, "/from", "/to", "name", b); },
           false)},
      {"BVMobileHelperCopyCrashLogs", 8683565, simple(288).text(32, "/logs"), boolean(1),
       expectBoolean([](auto* c, bool* b) { return BVMobileHelperCopyCrashLogs(c, "/logs", b); }, true)},
      {"BVMobileHelperMoveIntoCarrierBundles", 8683566,
       simple(800).text(32, "/source").text(288, "/destination").text(544, "name"), boolean(1),
       expectBoolean(
           [](auto* c, bool* b) {
             return BVMobileHelperMoveIntoCarrierBundles(c, "/source", "/destination", "name", b);
           },
           true)},
      {"BVMobileHelperRequestCountryCodeFromLocation", 8683567, simple(48).f64(32, 52.5).f64(40, -13.25),
       success, [](bvmh_client* c) { return BVMobileHelperRequestCountryCodeFromLocation(c, 52.5, -13.25); }},
      {"BVMobileHelperCopyCountryCode", 8683568, Bytes(24), answerText("DE", 64),
       [](bvmh_client* c) {
         char country[BVMH_COUNTRY_CODE_SIZE] = "?";
         const std::int32_t code = BVMobileHelperCopyCountryCode(c, country, sizeof country);
         EXPECT_STREQ(country, "DE");
         return code;
       }},
      {"BVMobileHelperRequestWanIPFromLocation", 8683569, Bytes(24), success,
       BVMobileHelperRequestWanIPFromLocation},
      {"BVMobileHelperEnableRadioManagerLogs", 8683570, integerRequest(2), success,
       [](bvmh_client* c) { return BVMobileHelperEnableRadioManagerLogs(c, 2); }},
      {"BVMobileHelperUnpackArchive", 8683571, simple(544).text(32, "/a.zip").text(288, "/to"), boolean(0),
       expectBoolean([](auto* c, bool* b) { return BVMobileHelperUnpackArchive(c, "/a.zip", "/to", b); },
                     false)},
      {"BVMobileHelperLoadPlistFile", 8683572, simple(288).text(32, "/a.plist"),
       answerRegion("<plist>x</plist>"),
       expectRegion([](auto* c, auto* r) { return BVMobileHelperLoadPlistFile(c, "/a.plist", r); },
                    "<plist>x</plist>")},
      {"BVMobileHelperCopyBadgeLabels", 8683573, labelsRequest("[label]", "[de]"), answerRegion("[B]"),
       expectRegion(
           [](auto* c, auto* r) { return BVMobileHelperCopyBadgeLabels(c, "[label]", 7, "[de]", 4, r); },
           "[B]")},
      {"BVMobileHelperCopyLocalizedLabels", 8683574, labelsRequest("[eightby]", "[]"),
       answerRegion("[Haupt]"),
       expectRegion(
           [](auto* c, auto* r) { return BVMobileHelperCopyLocalizedLabels(c, "[eightby]", 9, "[]", 2, r); },
           "[Haupt]")},
      {"BVMobileHelperRemapContactsChannel", 8683575, simple(160).text(32, "from").text(96, "to"), boolean(1),
       expectBoolean([](auto* c, bool* b) { return BVMobileHelperRemapContactsChannel(c, "from", "to", b); },
                     true)},
  };
  return all;
}

// The same calls, begun.
using Begin = std::int32_t (*)(bvmh_client*, bvmh_call*);
const std::map<std::string, Begin>& begins() {
  static const std::map<std::string, Begin> all{
      {"BVMobileHelperSetVoicemailToken",
       [](auto* c, auto* n) { return BVMobileHelperSetVoicemailTokenBegin(c, "tok\xC3\xA9n", nullptr, n); }},
      {"BVMobileHelperSetVoicemailTokenForKey",
       [](auto* c, auto* n) {
         return BVMobileHelperSetVoicemailTokenForKeyBegin(c, "key", "token", nullptr, n);
       }},
      {"BVMobileHelperClearVoicemailToken",
       [](auto* c, auto* n) { return BVMobileHelperClearVoicemailTokenBegin(c, nullptr, n); }},
      {"BVMobileHelperResetVoicemailStore",
       [](auto* c, auto* n) { return BVMobileHelperResetVoicemailStoreBegin(c, nullptr, n); }},
      {"BVMobileHelperCopyVoicemailTokenForKey",
       [](auto* c, auto* n) { return BVMobileHelperCopyVoicemailTokenForKeyBegin(c, "key", nullptr, n); }},
      {"BVMobileHelperCopyVoicemailToken",
       [](auto* c, auto* n) { return BVMobileHelperCopyVoicemailTokenBegin(c, nullptr, n); }},
      {"BVMobileHelperSetPreferenceValue",
       [](auto* c, auto* n) {
         return BVMobileHelperSetPreferenceValueBegin(c, "com.norvale.carrier", "Key", "<plist>", 7, nullptr,
                                                      n);
       }},
      {"BVMobileHelperCopyPreferenceValue",
       [](auto* c, auto* n) {
         return BVMobileHelperCopyPreferenceValueBegin(c, "domain", "key", nullptr, n);
       }},
      {"BVMobileHelperCopyAppPreferenceValue",
       [](auto* c, auto* n) {
         return BVMobileHelperCopyAppPreferenceValueBegin(c, "domain", "key", nullptr, n);
       }},
      {"BVMobileHelperReplaceCarrierSymlink",
       [](auto* c, auto* n) {
         return BVMobileHelperReplaceCarrierSymlinkBegin(c, "/target", "/link", "domain", nullptr, n);
       }},
      {"BVMobileHelperCreateSymlink",
       [](auto* c, auto* n) { return BVMobileHelperCreateSymlinkBegin(c, "/target", "/link", nullptr, n); }},
      {"BVMobileHelperRemoveCarrierFile",
       [](auto* c, auto* n) {
         return BVMobileHelperRemoveCarrierFileBegin(c, "/file", "domain", nullptr, n);
       }},
      {"BVMobileHelperIsVoicemailServiceSubscribed",
       [](auto* c, auto* n) { return BVMobileHelperIsVoicemailServiceSubscribedBegin(c, nullptr, n); }},
      {"BVMobileHelperCellularHeartbeat",
       [](auto* c, auto* n) { return BVMobileHelperCellularHeartbeatBegin(c, -2, nullptr, n); }},
      {"BVMobileHelperCheckLASDUpdate",
       [](auto* c, auto* n) { return BVMobileHelperCheckLASDUpdateBegin(c, 31, nullptr, n); }},
      {"BVMobileHelperCopyCarrierFile",
       [](auto* c, auto* n) {
         return BVMobileHelperCopyCarrierFileBegin(c, "/from", "/to", "name", nullptr, n);
       }},
      {"BVMobileHelperCopyCrashLogs",
       [](auto* c, auto* n) { return BVMobileHelperCopyCrashLogsBegin(c, "/logs", nullptr, n); }},
      {"BVMobileHelperMoveIntoCarrierBundles",
       [](auto* c, auto* n) {
         return BVMobileHelperMoveIntoCarrierBundlesBegin(c, "/source", "/destination", "name", nullptr, n);
       }},
      {"BVMobileHelperRequestCountryCodeFromLocation",
       [](auto* c, auto* n) {
         return BVMobileHelperRequestCountryCodeFromLocationBegin(c, 52.5, -13.25, nullptr, n);
       }},
      {"BVMobileHelperCopyCountryCode",
       [](auto* c, auto* n) { return BVMobileHelperCopyCountryCodeBegin(c, nullptr, n); }},
      {"BVMobileHelperRequestWanIPFromLocation",
       [](auto* c, auto* n) { return BVMobileHelperRequestWanIPFromLocationBegin(c, nullptr, n); }},
      {"BVMobileHelperEnableRadioManagerLogs",
       [](auto* c, auto* n) { return BVMobileHelperEnableRadioManagerLogsBegin(c, 2, nullptr, n); }},
      {"BVMobileHelperUnpackArchive",
       [](auto* c, auto* n) { return BVMobileHelperUnpackArchiveBegin(c, "/a.zip", "/to", nullptr, n); }},
      {"BVMobileHelperLoadPlistFile",
       [](auto* c, auto* n) { return BVMobileHelperLoadPlistFileBegin(c, "/a.plist", nullptr, n); }},
      {"BVMobileHelperCopyBadgeLabels",
       [](auto* c, auto* n) {
         return BVMobileHelperCopyBadgeLabelsBegin(c, "[label]", 7, "[de]", 4, nullptr, n);
       }},
      {"BVMobileHelperCopyLocalizedLabels",
       [](auto* c, auto* n) {
         return BVMobileHelperCopyLocalizedLabelsBegin(c, "[eightby]", 9, "[]", 2, nullptr, n);
       }},
      {"BVMobileHelperRemapContactsChannel", [](auto* c, auto* n) {
         return BVMobileHelperRemapContactsChannelBegin(c, "from", "to", nullptr, n);
       }}};
  return all;
}

class RoutineTest : public testing::TestWithParam<RoutineCase> {};

void expectBytes(const RoutineCase& routine, const Message& seen) {
  ASSERT_GE(seen.bytes.size(), 24U);
  EXPECT_NE(seen.replyPort(), 0U);
  EXPECT_TRUE(seen.descriptors.empty());
  const bool isComplex = routine.id == 8683555 || routine.id == 8683573 || routine.id == 8683574;
  const std::size_t messageSize = routine.id == 8683555 ? 568 : isComplex ? 76 : routine.body.size();
  Bytes wanted = routine.body;
  wanted.u32(0, isComplex ? 0x80000012 : 18)
      .u32(4, static_cast<std::uint32_t>(messageSize))
      .u32(8, seen.replyPort())
      .i32(20, routine.id);
  EXPECT_EQ(testing::PrintToString(seen.bytes.string()), testing::PrintToString(wanted.string()));
}

TEST_P(RoutineTest, SendsExactlyItsBytesAndReadsItsReply) {
  const RoutineCase& routine = GetParam();
  Message seen;
  {
    ScriptedHelper helper([&](Script& script) {
      const UniqueFd channel = script.checkIn();
      seen = script.receive(channel);
      script.send(channel, routine.answer(seen));
      script.expectEnd(channel);
    });
    const ClientPointer client = connectedTo(helper);
    EXPECT_EQ(routine.call(client.get()), BVMH_OK);
  }
  expectBytes(routine, seen);
}

// The result holds what the blocking call gives out.
void expectSame(const bvmh_result& result, const Bytes& reply) {
  const std::string rest = reply.string().substr(36);
  if (result.message_id == 8683553 || result.message_id == 8683554 || result.message_id == 8683568) {
    EXPECT_STREQ(result.text, rest.c_str());
  } else if ((reply.u32At(0) & 0x80000000) != 0) {
    EXPECT_EQ(asText(result.region), reply.string().substr(56));
  } else {
    EXPECT_EQ(result.boolean, !rest.empty() && rest[0] != 0);
  }
}

TEST_P(RoutineTest, BegunItSendsTheSameBytesAndItsResultIsTheSame) {
  const RoutineCase& routine = GetParam();
  Message seen;
  Bytes reply;
  bvmh_result result{};
  {
    ScriptedHelper helper([&](Script& script) {
      const UniqueFd channel = script.checkIn();
      seen = script.receive(channel);
      reply = routine.answer(seen);
      script.send(channel, reply);
      script.expectEnd(channel);
    });
    const ClientPointer client = connectedTo(helper);
    bvmh_call call = 0;
    ASSERT_EQ(begins().at(routine.name)(client.get(), &call), BVMH_OK);
    pollfd ready{bvmh_client_fd(client.get()), POLLIN, 0};
    ASSERT_EQ(::poll(&ready, 1, 60'000), 1);
    bvmh_process(client.get());
    ASSERT_EQ(bvmh_take_result(client.get(), call, &result), BVMH_OK);
    EXPECT_EQ(result.code, BVMH_OK);
    EXPECT_EQ(result.message_id, routine.id);
  }
  // The helper's thread has ended: what it wrote down may be read.
  expectSame(result, reply);
  bvmh_result_free(&result);
  expectBytes(routine, seen);
}

TEST_P(RoutineTest, ReturnsTheHelpersRefusal) {
  const RoutineCase& routine = GetParam();
  for (const std::int32_t refusal : {5, 8, 46, -304, 12345}) {
    ScriptedHelper helper([&](Script& script) {
      const UniqueFd channel = script.checkIn();
      const Message request = script.receive(channel);
      script.send(channel, statusReply(request, refusal));
      script.expectEnd(channel);
    });
    const ClientPointer client = connectedTo(helper);
    std::int32_t code = 0;
    {
      // Out-values are checked in the good case; here the check of them is expected to fail.
      testing::TestPartResultArray ignored;
      const testing::ScopedFakeTestPartResultReporter reporter(
          testing::ScopedFakeTestPartResultReporter::INTERCEPT_ONLY_CURRENT_THREAD, &ignored);
      code = routine.call(client.get());
    }
    EXPECT_EQ(code, refusal);
  }
}

INSTANTIATE_TEST_SUITE_P(All, RoutineTest, testing::ValuesIn(cases()),
                         [](const auto& each) { return std::string(each.param.name); });

TEST(RoutinesTest, EveryRowOfTheTableHasItsFunction) {
  ASSERT_EQ(cases().size(), kRequestRoutines.size());
  for (std::size_t i = 0; i < cases().size(); ++i) {
    EXPECT_EQ(cases()[i].name, kRequestRoutines[i].name);
    EXPECT_EQ(cases()[i].id, kRequestRoutines[i].id);
  }
}

}  // namespace
}  // namespace brenvik::client

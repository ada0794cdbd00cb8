// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include <gtest/gtest.h>

#include <cstdint>
#include <limits>
#include <nlohmann/json.hpp>
#include <string>
#include <vector>

#include "platform/plist/PropertyListCodec.h"
#include "tools/support/Base64.h"
#include "tools/support/EventStream.h"
#include "tools/support/PropertyListText.h"

namespace brenvik::tools {
namespace {

using Bytes = std::vector<std::byte>;

Bytes bytesOf(std::string_view text) {
  const auto bytes = std::as_bytes(std::span(text));
  return {bytes.begin(), bytes.end()};
}

TEST(Base64Test, WritesTheVectorsOfRfc4648) {
  for (const auto& [plain, coded] : {std::pair{"", ""},
                                     {"f", "Zg=="},
                                     {"fo", "Zm8="},
                                     {"foo", "Zm9v"},
                                     {"foob", "Zm9vYg=="},
                                     {"fooba", "Zm9vYmE="},
                                     {"foobar", "Zm9vYmFy"}}) {
    EXPECT_EQ(toBase64(bytesOf(plain)), coded);
    EXPECT_EQ(fromBase64(coded), bytesOf(plain));
  }
}

TEST(Base64Test, RefusesWhatIsNotBase64) {
  for (const char* wrong :
       {"Z", "Zg", "Zg=", "Zg===", "Z===", "Zm9v=", "=", "Zg==Zg==", "Z-==", "Zm8*", "Zm9vY"}) {
    EXPECT_EQ(fromBase64(wrong), std::nullopt) << wrong;
  }
  EXPECT_EQ(fromBase64(" Zm\n9v\t"), bytesOf("foo"));
}

PropertyList example() {
  return PropertyList::dictionary(
      {{"Name", PropertyList::string("Norvale\nMobil\x1B[31m")},
       {"Version", PropertyList::integer(-7)},
       {"Huge", PropertyList::unsignedInteger(std::numeric_limits<std::uint64_t>::max())},
       {"Ratio", PropertyList::real(0.25)},
       {"On", PropertyList::boolean(true)},
       {"When", PropertyList::date(-0.5)},
       {"Icon", PropertyList::data(bytesOf("foob"))},
       {"Empty", PropertyList::dictionary({})},
       {"None", PropertyList::array({})},
       {"List", PropertyList::array({PropertyList::string("a"),
                                     PropertyList::dictionary({{"k", PropertyList::string("v")}})})}});
}

TEST(PropertyListTextTest, ShowsAContainerIndented) {
  EXPECT_EQ(humanText(example()),
            "Name: Norvale\\nMobil\\x1b[31m\n"
            "Version: -7\n"
            "Huge: 18446744073709551615\n"
            "Ratio: 0.25\n"
            "On: true\n"
            "When: 2000-12-31T23:59:59.500Z\n"
            "Icon: <4 bytes: 66 6f 6f 62>\n"
            "Empty: {}\n"
            "None: []\n"
            "List:\n"
            "  - a\n"
            "  -\n"
            "    k: v");
}

TEST(PropertyListTextTest, ShowsAScalarAsItStands) {
  EXPECT_EQ(humanText(PropertyList::string("just this")), "just this");
  EXPECT_EQ(humanText(PropertyList()), "(no value)");
  EXPECT_EQ(humanText(PropertyList::data(bytesOf("0123456789abcdefg"))),
            "<17 bytes: 30 31 32 33 34 35 36 37 38 39 61 62 63 64 65 66 ...>");
  EXPECT_EQ(humanText(PropertyList::date(0)), "2001-01-01T00:00:00Z");
}

TEST(PropertyListTextTest, KeepsTheOrderAndTheTypesInJson) {
  EXPECT_EQ(
      jsonLine(jsonOf(example())),
      R"({"Name":"Norvale\nMobil\u001b[31m","Version":-7,"Huge":18446744073709551615,"Ratio":0.25,"On":true,)"
      R"("When":{"date":"2000-12-31T23:59:59.500Z"},"Icon":{"base64":"Zm9vYg=="},"Empty":{},"None":[],)"
      R"("List":["a",{"k":"v"}]})");
  EXPECT_EQ(jsonLine(jsonOf(PropertyList())), "null");
  EXPECT_EQ(jsonLine(jsonOf(PropertyList::real(std::numeric_limits<double>::infinity()))),
            R"({"real":"inf"})");
}

TEST(PropertyListTextTest, WhatJsonHasNotIsTakenForNothingElse) {
  const auto shown = [](const PropertyList& value) { return jsonLine(jsonOf(value)); };
  EXPECT_EQ(shown(PropertyList::string("nan")), "\"nan\"");
  EXPECT_EQ(shown(PropertyList::real(std::numeric_limits<double>::quiet_NaN())), R"({"real":"nan"})");
  EXPECT_EQ(shown(PropertyList::real(1)), "1.0");
  EXPECT_EQ(shown(PropertyList::date(1e300)), R"({"secondsSince2001":"1e+300"})");
  EXPECT_EQ(shown(PropertyList::date(253402300800.0 - 978307200.0 - 1)),
            R"({"date":"9999-12-31T23:59:59Z"})");
  for (const char* key : {"base64", "date", "secondsSince2001", "real", "dictionary"}) {
    const std::string plain = "{\"" + std::string(key) + "\":\"x\"}";
    EXPECT_EQ(shown(PropertyList::dictionary({{key, PropertyList::string("x")}})),
              "{\"dictionary\":" + plain + "}");
  }
  EXPECT_EQ(
      shown(PropertyList::dictionary({{"date", PropertyList::string("x")}, {"k", PropertyList::integer(1)}})),
      R"({"date":"x","k":1})");
  EXPECT_EQ(jsonLine(jsonOfText("K\xC3\xB6ln")), "\"K\xC3\xB6ln\"");
  EXPECT_EQ(jsonLine(jsonOfText("\xFF")), R"({"base64":"/w=="})");
}

TEST(PropertyListTextTest, NothingOnATerminalCanSteerIt) {
  EXPECT_EQ(printable("\x1B]0;title\x07\x7F\t"), "\\x1b]0;title\\x07\\x7f\\t");
  EXPECT_EQ(printable("\xC2\x9B\x33m K\xC3\xB6ln"), "\\xc2\\x9b3m K\xC3\xB6ln");
  EXPECT_EQ(printable("\xFF\xC3\xB6"), "\\xff\\xc3\\xb6");
}

bvmh_event eventOf(bvmh_event_kind kind, const std::string& payload) {
  bvmh_event event{};
  event.kind = kind;
  event.payload = {payload.data(), payload.size(), nullptr, nullptr};
  event.wants_reply = kind != BVMH_EVENT_NOTIFICATION;
  event.sender_pid = 12;
  return event;
}

TEST(EventStreamTest, WritesOneLineForAPush) {
  const auto payload = serializePropertyList(
      PropertyList::dictionary(
          {{"Client", PropertyList::array({PropertyList::string("BrenvikMobileHelper")})},
           {"City", PropertyList::string("K\xC3\xB6ln\n")}}),
      PropertyListFormat::binary);
  const bvmh_event event = eventOf(BVMH_EVENT_CIVIC_INFO, *payload);
  EXPECT_EQ(eventLine(event, "refused with 13", false),
            "civic-info Client=BrenvikMobileHelper City=\"K\xC3\xB6ln\\n\" (answer: refused with 13)");
  EXPECT_EQ(eventLine(event, "success", true),
            "{\"event\":\"civic-info\",\"values\":{\"Client\":[\"BrenvikMobileHelper\"],\"City\":"
            "\"K\xC3\xB6ln\\n\"},"
            "\"sender\":{\"uid\":0,\"pid\":12},\"answer\":\"success\"}");
}

TEST(EventStreamTest, SaysWhenThePayloadIsNoPropertyList) {
  const std::string payload = "bplist00 and no more";
  const bvmh_event event = eventOf(BVMH_EVENT_NOTIFICATION, payload);
  EXPECT_EQ(eventLine(event, "none", false), "notification: the payload of 20 bytes is no dictionary");
  EXPECT_EQ(eventLine(event, "none", true),
            R"({"event":"notification","error":"not a property list","size":20,"sender":{"uid":0,"pid":12},)"
            R"("answer":"none"})");
}

}  // namespace
}  // namespace brenvik::tools

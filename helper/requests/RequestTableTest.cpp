// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "helper/requests/RequestTable.h"

#include <gtest/gtest.h>

#include <array>
#include <cctype>
#include <cstring>
#include <new>
#include <string>
#include <vector>

#include "helper/requests/fakes/RecordingAreas.h"
#include "interface/Routines.h"
#include "platform/log/Log.h"
#include "platform/log/LogContext.h"
#include "platform/log/fakes/RecordingLog.h"

namespace brenvik {
namespace {

constexpr PortName kPort = 0x903;

// Areas of a table that tells when it is read behind its end.
struct CheckedAreas {};
struct CheckedHandlers {
  static std::size_t size() noexcept { return kRequestRoutines.size(); }
  RoutineTable::Handler operator[](std::size_t index) const {
    EXPECT_LT(index, size());
    return [](void*, const Request&, Reply&) { return Outcome::refused; };
  }
};

}  // namespace

template <>
inline constexpr CheckedHandlers kRowHandlers<CheckedAreas>{};

namespace {

class RequestTableTest : public testing::Test {
 protected:
  // A request of the row's own form, with each string field filled with its own letter to the last byte.
  void makeRequest(const RoutineFacts& facts) {
    std::memset(message, 0, sizeof message);
    auto& header = *reinterpret_cast<MessageHeader*>(message);
    header.bits = kReplyDisposition;
    header.size = facts.requestSize;
    header.replyPort = 5;
    header.localPort = kPort;
    header.id = facts.id;
    if (facts.descriptors == 0) {
      for (std::size_t i = 32; i < facts.requestSize; ++i) message[i] = static_cast<std::byte>('a');
      return;
    }
    header.bits |= kComplexBit;
    write(kDescriptorCountOffset, facts.descriptors);
    for (std::uint32_t i = 0; i < facts.descriptors; ++i) {
      auto& region = descriptor(i);
      region.address = reinterpret_cast<std::uint64_t>(i == 0 ? "first" : "other");
      region.type = kOutOfLineDescriptorType;
      region.size = 5;
      write(facts.lengthsOffset + i * 4, 5);
    }
  }
  void write(std::size_t offset, std::uint32_t value) { std::memcpy(message + offset, &value, sizeof value); }
  OutOfLineDescriptor& descriptor(std::uint32_t i) {
    return *reinterpret_cast<OutOfLineDescriptor*>(message + kDescriptorsOffset +
                                                   i * sizeof(OutOfLineDescriptor));
  }

  // Delivers `size` bytes; the status reply's code, or 0 for a reply of another form.
  KernelReturn deliver(std::int32_t id, std::uint32_t size) {
    std::memset(answer, 0, sizeof answer);
    const MessageTrailer trailer{};
    const Request request(message, size, &trailer);
    Reply reply(answer);
    const auto handler = table.find(id);
    EXPECT_NE(handler, nullptr);
    outcome = handler(table.context(), request, reply);
    const auto& status = *reinterpret_cast<const StatusReply*>(answer);
    return (status.header.bits & kComplexBit) != 0 ? kern::success : status.returnCode;
  }
  KernelReturn deliver(const RoutineFacts& facts) { return deliver(facts.id, facts.requestSize); }
  void expectRefusedWith(const RoutineFacts& facts, std::uint32_t size, KernelReturn code) {
    areas.called.clear();
    EXPECT_EQ(deliver(facts.id, size), code) << facts.name << " of " << size << " bytes";
    EXPECT_EQ(areas.called, "") << facts.name;
    EXPECT_EQ(outcome, Outcome::refused);
    const auto& status = *reinterpret_cast<const StatusReply*>(answer);
    EXPECT_EQ(status.header.size, 36U);
    EXPECT_EQ(status.header.bits, kReplyDisposition);
    EXPECT_EQ(std::memcmp(&status.ndr, &kNdrRecord, sizeof kNdrRecord), 0);
  }

  RecordingAreas areas;
  int made = 0;
  bool isExhausted = false;
  RequestTable<RecordingAreas> table{[this] {
    if (isExhausted) throw std::bad_alloc();
    ++made;
    return &areas;
  }};
  Outcome outcome = Outcome::refused;
  alignas(16) std::byte message[4096];
  alignas(16) std::byte answer[512];
};

TEST_F(RequestTableTest, EveryRowReachesItsOwnRoutineWithThePortItArrivedOn) {
  for (const auto& facts : kRequestRoutines) {
    makeRequest(facts);
    EXPECT_EQ(deliver(facts), kern::success) << facts.name;
    // The routine of the area has the routine's own name, in lowerCamel.
    std::string name(facts.name.substr(std::strlen("BVMobileHelper")));
    name[0] = static_cast<char>(std::tolower(static_cast<unsigned char>(name[0])));
    EXPECT_EQ(areas.called, name);
    EXPECT_EQ(areas.port, kPort);
    EXPECT_EQ(outcome, Outcome::accepted);
  }
}

TEST_F(RequestTableTest, LinesOfARoutineCarryItsNameAndTheCallerOfItsPortAndLaterOnesDoNot) {
  RecordingLog log;
  LogCallers::shared().add(kPort, std::make_shared<LogCaller>(LogCaller{9, 0, "/usr/bin/x", ""}));
  areas.whenCalled = [] { logUnified(LogLevel::info, "line"); };
  for (const auto& facts : kRequestRoutines) {
    makeRequest(facts);
    EXPECT_EQ(deliver(facts), kern::success);
    EXPECT_EQ(log.fields().back(),
              (std::map<std::string, std::string>{{"BRENVIK_CALLER_PID", "9"},
                                                  {"BRENVIK_CALLER_UID", "0"},
                                                  {"BRENVIK_CALLER_EXE", "/usr/bin/x"},
                                                  {"BRENVIK_ROUTINE", std::string(facts.name)}}));
  }
  LogCallers::shared().remove(kPort);
  logUnified(LogLevel::info, "line");
  EXPECT_TRUE(log.fields().back().empty());
}

TEST_F(RequestTableTest, IdsOutsideTheRangeHaveNoHandler) {
  EXPECT_EQ(table.find(8683548), nullptr);
  EXPECT_EQ(table.find(8683576), nullptr);
  EXPECT_EQ(table.find(4792174), nullptr) << "a check-in sent to a client port is an unknown id";
  EXPECT_EQ(table.find(0), nullptr);
  EXPECT_EQ(table.find(-1), nullptr);
  EXPECT_EQ(table.find(INT32_MIN), nullptr);
}

TEST_F(RequestTableTest, TheRowsAreNotReadBehindTheirEnd) {
  CheckedAreas checked;
  const RequestTable<CheckedAreas> rows([&] { return &checked; });
  EXPECT_EQ(rows.find(8683548), nullptr);
  EXPECT_NE(rows.find(8683549), nullptr);
  EXPECT_NE(rows.find(8683575), nullptr);
  EXPECT_EQ(rows.find(8683576), nullptr);
}

TEST_F(RequestTableTest, ARequestOneByteLongerOrShorterThanItsRowGetsMinus304AndHasNoEffect) {
  for (const auto& facts : kRequestRoutines) {
    makeRequest(facts);
    expectRefusedWith(facts, facts.requestSize - 1, mig::badArguments);
    expectRefusedWith(facts, facts.requestSize + 1, mig::badArguments);
  }
}

TEST_F(RequestTableTest, TheComplexFlagMustBeClearInASimpleRequestAndSetInAComplexOne) {
  for (const auto& facts : kRequestRoutines) {
    makeRequest(facts);
    reinterpret_cast<MessageHeader*>(message)->bits ^= kComplexBit;
    expectRefusedWith(facts, facts.requestSize, mig::badArguments);
  }
}

TEST_F(RequestTableTest, ADescriptorCountOtherThanTheRowsGetsMinus304) {
  for (const auto& facts : kRequestRoutines) {
    if (facts.descriptors == 0) continue;
    for (const std::uint32_t count : {0U, facts.descriptors - 1, facts.descriptors + 1, ~0U}) {
      makeRequest(facts);
      write(kDescriptorCountOffset, count);
      expectRefusedWith(facts, facts.requestSize, mig::badArguments);
    }
  }
}

TEST_F(RequestTableTest, LabelsSentWithOneDescriptorInsteadOfTwoGetMinus304) {
  makeRequest(kRequestRoutines[24]);
  write(kDescriptorCountOffset, 1);
  expectRefusedWith(kRequestRoutines[24], 76, -304);
}

TEST_F(RequestTableTest, APreferenceWhoseLengthFieldDiffersFromTheDescriptorsSizeGetsMinus300) {
  for (const std::uint32_t length : {4U, 6U}) {
    makeRequest(kRequestRoutines[6]);
    write(564, length);
    expectRefusedWith(kRequestRoutines[6], 568, -300);
  }
}

TEST_F(RequestTableTest, EveryDescriptorMustBeOutOfLineAndAgreeWithItsLengthField) {
  for (const auto& facts : kRequestRoutines) {
    for (std::uint32_t i = 0; i < facts.descriptors; ++i) {
      makeRequest(facts);
      descriptor(i).type = 2;
      expectRefusedWith(facts, facts.requestSize, mig::typeError);
      for (const std::uint32_t size : {4U, 6U}) {
        makeRequest(facts);
        descriptor(i).size = size;
        expectRefusedWith(facts, facts.requestSize, mig::typeError);
      }
    }
  }
}

TEST_F(RequestTableTest, ARoutinesOwnStatusIsPassedOnInAStatusReplyWhateverTheRowsForm) {
  areas.answer = 8;
  for (const auto& facts : kRequestRoutines) {
    makeRequest(facts);
    EXPECT_EQ(deliver(facts), 8) << facts.name;
    EXPECT_EQ(outcome, Outcome::refused);
    const auto& status = *reinterpret_cast<const StatusReply*>(answer);
    EXPECT_EQ(status.header.size, 36U);
    EXPECT_EQ(std::memcmp(&status.ndr, &kNdrRecord, sizeof kNdrRecord), 0) << facts.name;
  }
}

TEST_F(RequestTableTest, RepliesHaveTheFormOfTheirRow) {
  for (const auto& facts : kRequestRoutines) {
    makeRequest(facts);
    ASSERT_EQ(deliver(facts), kern::success);
    const auto& status = *reinterpret_cast<const StatusReply*>(answer);
    EXPECT_EQ(status.header.size, sizeOfReply(facts.reply)) << facts.name;
    if (facts.reply == ReplyForm::outOfLine) {
      const auto& reply = *reinterpret_cast<const OutOfLineReply*>(answer);
      EXPECT_EQ(reply.header.bits, kComplexBit | kReplyDisposition);
      EXPECT_EQ(reply.descriptorCount, 1U);
      EXPECT_EQ(std::uint64_t{reply.payload.address}, reinterpret_cast<std::uint64_t>(areas.region));
      EXPECT_EQ(reply.payload.deallocate, 1);
      EXPECT_EQ(reply.payload.copy, 1);
      EXPECT_EQ(reply.payload.pad, 0);
      EXPECT_EQ(reply.payload.type, 1);
      EXPECT_EQ(reply.payload.size, 5U);
      EXPECT_EQ(reply.byteCount, 5U);
      EXPECT_EQ(std::memcmp(&reply.ndr, &kNdrRecord, sizeof kNdrRecord), 0);
    } else {
      EXPECT_EQ(status.header.bits, kReplyDisposition);
    }
    if (facts.reply == ReplyForm::integer) {
      const auto& reply = *reinterpret_cast<const IntegerReply*>(answer);
      EXPECT_EQ(reply.result[0], 1) << facts.name;
      EXPECT_EQ(reply.result[1] | reply.result[2] | reply.result[3], 0) << facts.name;
    }
  }
}

TEST_F(RequestTableTest, TheUpdateChecksReplyLeavesTheNdrRecordToTheSourceOnSuccessOnly) {
  const auto& facts = kRequestRoutines[14];
  ASSERT_EQ(facts.id, 8683563);
  makeRequest(facts);
  ASSERT_EQ(deliver(facts), kern::success);
  const NdrRecord untouched{};
  EXPECT_EQ(std::memcmp(answer + 24, &untouched, sizeof untouched), 0);
  expectRefusedWith(facts, facts.requestSize + 1, mig::badArguments);  // asserts the NDR record
  for (const auto& other : kRequestRoutines) {
    if (other.id == facts.id) continue;
    makeRequest(other);
    ASSERT_EQ(deliver(other), kern::success);
    const std::size_t at = other.reply == ReplyForm::outOfLine ? 44 : 24;
    EXPECT_EQ(std::memcmp(answer + at, &kNdrRecord, sizeof kNdrRecord), 0) << other.name;
  }
}

TEST_F(RequestTableTest, AReplyIsCompletedWhateverStoodInItsFixedFieldsAndItsResultIsLeftAlone) {
  for (const ReplyForm form : {ReplyForm::status, ReplyForm::integer, ReplyForm::string64,
                               ReplyForm::string256, ReplyForm::outOfLine}) {
    for (const ReplyNdr ndr : {ReplyNdr::ours, ReplyNdr::ofTheSource}) {
      std::memset(answer, 0xEE, sizeof answer);
      Reply reply(answer);
      buildReply(form, ndr, reply);
      EXPECT_EQ(reply.header().size, sizeOfReply(form));
      if (form == ReplyForm::outOfLine) {
        const auto& full = reply.as<OutOfLineReply>();
        EXPECT_EQ(full.header.bits, kComplexBit | kReplyDisposition);
        EXPECT_EQ(full.descriptorCount, 1U);
        EXPECT_EQ(std::uint64_t{full.payload.address}, 0xEEEEEEEEEEEEEEEEU);
        EXPECT_EQ(full.payload.size, 0xEEEEEEEEU);
        EXPECT_EQ(full.payload.deallocate, 1);
        EXPECT_EQ(full.payload.copy, 1);
        EXPECT_EQ(full.payload.type, 1);
        EXPECT_EQ(full.byteCount, 0xEEEEEEEEU);
        continue;
      }
      const auto& full = reply.as<StatusReply>();
      EXPECT_EQ(full.header.bits, kReplyDisposition);
      EXPECT_EQ(full.returnCode, kern::success);
      EXPECT_EQ(std::memcmp(&full.ndr, &kNdrRecord, sizeof kNdrRecord) == 0, ndr == ReplyNdr::ours);
      for (std::size_t i = sizeof(StatusReply); i < sizeof answer; ++i) {
        ASSERT_EQ(answer[i], std::byte{0xEE}) << i;
      }
    }
  }
}

// Where each routine's texts stand in its request, as the protocol has them.
struct TextField {
  std::size_t offset;
  std::size_t size;
};
const std::array<std::vector<TextField>, 27> kTexts{{
    {{32, 256}},                               // SetVoicemailToken
    {{32, 256}, {288, 256}},                   // SetVoicemailTokenForKey
    {},                                        // ClearVoicemailToken
    {},                                        // ResetVoicemailStore
    {{32, 256}},                               // CopyVoicemailTokenForKey
    {},                                        // CopyVoicemailToken
    {{52, 256}, {308, 256}},                   // SetPreferenceValue
    {{32, 256}, {288, 256}},                   // CopyPreferenceValue
    {{32, 256}, {288, 256}},                   // CopyAppPreferenceValue
    {{32, 1024}, {1056, 1024}, {2080, 1024}},  // ReplaceCarrierSymlink
    {{32, 1024}, {1056, 1024}},                // CreateSymlink
    {{32, 1024}, {1056, 1024}},                // RemoveCarrierFile
    {},                                        // IsVoicemailServiceSubscribed
    {},                                        // CellularHeartbeat
    {},                                        // CheckLASDUpdate
    {{32, 256}, {288, 256}, {544, 256}},       // CopyCarrierFile
    {{32, 256}},                               // CopyCrashLogs
    {{32, 256}, {288, 256}, {544, 256}},       // MoveIntoCarrierBundles
    {},                                        // RequestCountryCodeFromLocation
    {},                                        // CopyCountryCode
    {},                                        // RequestWanIPFromLocation
    {},                                        // EnableRadioManagerLogs
    {{32, 256}, {288, 256}},                   // UnpackArchive
    {{32, 256}},                               // LoadPlistFile
    {},                                        // CopyBadgeLabels
    {},                                        // CopyLocalizedLabels
    {{32, 64}, {96, 64}},                      // RemapContactsChannel
}};

TEST_F(RequestTableTest, TextsOfEveryRowArriveInOrderFromTheirOffsets) {
  for (std::size_t row = 0; row < kRequestRoutines.size(); ++row) {
    const auto& facts = kRequestRoutines[row];
    makeRequest(facts);
    std::vector<std::string> wanted;
    for (const auto& [offset, size] : kTexts[row]) {
      const char letter = static_cast<char>('p' + wanted.size());
      std::memset(message + offset, letter, size);
      wanted.emplace_back(size, letter);
    }
    deliver(facts);
    EXPECT_EQ(areas.texts, wanted) << facts.name;
  }
}

TEST_F(RequestTableTest, RegionsNumbersAndCoordinatesArriveFromTheirOffsets) {
  using Regions = std::vector<std::string>;
  using Numbers = std::vector<double>;
  using Integers = std::vector<std::int32_t>;
  makeRequest(kRequestRoutines[6]);
  deliver(kRequestRoutines[6]);
  EXPECT_EQ(areas.regions, Regions{"first"});

  for (const std::size_t row : {24U, 25U}) {
    makeRequest(kRequestRoutines[row]);
    descriptor(1).size = 4;
    write(72, 4);
    deliver(kRequestRoutines[row]);
    EXPECT_EQ(areas.regions, (Regions{"first", "othe"})) << row;
  }

  makeRequest(kRequestRoutines[18]);
  const double latitude = 59.91;
  const double longitude = -10.75;
  std::memcpy(message + 32, &latitude, 8);
  std::memcpy(message + 40, &longitude, 8);
  deliver(kRequestRoutines[18]);
  EXPECT_EQ(areas.numbers, (Numbers{latitude, longitude}));

  std::int32_t number = -2;
  for (const std::size_t row : {13U, 14U, 21U}) {
    makeRequest(kRequestRoutines[row]);
    write(32, static_cast<std::uint32_t>(number));
    deliver(kRequestRoutines[row]);
    EXPECT_EQ(areas.integers, Integers{number--}) << row;
  }
}

TEST_F(RequestTableTest, TextResultsAreWrittenStraightIntoTheReply) {
  for (const auto& [row, size] : {std::pair{4U, 256U}, {5U, 256U}, {19U, 64U}}) {
    for (const std::string& text : {std::string("a token"), std::string(size, 'x')}) {
      areas.text = text;
      makeRequest(kRequestRoutines[row]);
      deliver(kRequestRoutines[row]);
      EXPECT_EQ(std::string(reinterpret_cast<const char*>(answer) + 36, size),
                text + std::string(size - text.size(), '\0'))
          << row;
    }
  }
}

TEST_F(RequestTableTest, AnEmptyPayloadIsSuccessWithAddressAndLengthZero) {
  areas.payload = {};
  makeRequest(kRequestRoutines[7]);
  ASSERT_EQ(deliver(kRequestRoutines[7]), kern::success);
  const auto& reply = *reinterpret_cast<const OutOfLineReply*>(answer);
  EXPECT_EQ(reply.header.size, 56U);
  EXPECT_EQ(std::uint64_t{reply.payload.address}, 0U);
  EXPECT_EQ(reply.payload.size, 0U);
  EXPECT_EQ(reply.byteCount, 0U);
}

TEST_F(RequestTableTest, APayloadThatAFailedRoutineLeftBehindIsNotSent) {
  areas.answer = kern::noSpace;
  makeRequest(kRequestRoutines[23]);
  EXPECT_EQ(deliver(kRequestRoutines[23]), kern::noSpace);
  for (std::size_t i = 36; i < sizeof answer; ++i) EXPECT_EQ(answer[i], std::byte{0});
}

// ---- the areas are made with the first request ----

TEST_F(RequestTableTest, TheAreasAreMadeForTheFirstRequestAndOnce) {
  EXPECT_EQ(table.context(), nullptr);
  EXPECT_EQ(made, 0);
  makeRequest(kRequestRoutines[2]);
  EXPECT_EQ(deliver(kRequestRoutines[2]), kern::success);
  EXPECT_EQ(deliver(kRequestRoutines[2]), kern::success);
  EXPECT_EQ(made, 1);
}

TEST_F(RequestTableTest, WithoutMemoryForTheAreasEveryRequestGets6AndTheNextTriesAgain) {
  isExhausted = true;
  makeRequest(kRequestRoutines[2]);
  expectRefusedWith(kRequestRoutines[2], 24, kern::resourceShortage);
  EXPECT_EQ(deliver(0, 24), kern::resourceShortage) << "an unknown id, too";
  isExhausted = false;
  EXPECT_EQ(deliver(kRequestRoutines[2]), kern::success);
  EXPECT_EQ(areas.called, "clearVoicemailToken");
  EXPECT_EQ(made, 1);
}

}  // namespace
}  // namespace brenvik

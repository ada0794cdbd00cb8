// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/files/archive/ArchiveFrames.h"

#include <gtest/gtest.h>

#include <cerrno>
#include <cstring>
#include <string>
#include <vector>

namespace brenvik {
namespace {

using archive_frame::EntryHead;
using archive_frame::Kind;
using archive_frame::Refusal;
using archive_frame::Type;

template <typename Plain>
std::string bytesOf(const Plain& value) {
  std::string bytes(sizeof value, '\0');
  std::memcpy(bytes.data(), &value, sizeof value);
  return bytes;
}

std::string head(Type type, std::size_t length) {
  return bytesOf(archive_frame::Head{type, static_cast<std::uint32_t>(length)});
}

std::string frame(Type type, const std::string& content = "") { return head(type, content.size()) + content; }

// An entry frame whose head tells the true lengths, unless a test changes it.
EntryHead headOf(Kind kind, const std::string& path, const std::string& target = "") {
  EntryHead head{};
  head.size = 7;
  head.modified = -5;
  head.pathLength = static_cast<std::uint16_t>(path.size());
  head.targetLength = static_cast<std::uint16_t>(target.size());
  head.kind = kind;
  head.mode = 0640;
  return head;
}

std::string entry(Kind kind, const std::string& path, const std::string& target = "") {
  return frame(Type::entry, bytesOf(headOf(kind, path, target)) + path + target);
}

std::string refusal(Type type, int code, const std::string& path = "") {
  return frame(type, bytesOf(Refusal{code}) + path);
}

// Notes each call as a line of text; pieces of data that follow each other make one line.
class NotingSink final : public ArchiveFrameSink {
 public:
  int beginEntry(const ArchiveEntry& entry) override {
    lines.push_back("entry " + std::to_string(static_cast<int>(entry.kind)) + " " +
                    std::to_string(entry.mode) + " " + std::to_string(entry.size) + " " +
                    std::to_string(entry.modified) + " " + entry.path + ">" + entry.target);
    return answer("entry");
  }
  int entryData(std::string_view bytes) override { return add("data ", bytes); }
  int entryCompanion(std::string_view bytes) override { return add("companion ", bytes); }
  int endEntry() override {
    lines.push_back("end");
    return answer("end");
  }
  int refuseEntry(const std::string& path, int code) override {
    lines.push_back("refused " + path + " " + std::to_string(code));
    return answer("refused");
  }

  std::vector<std::string> lines;
  std::string failing;  // the calls whose line begins so answer EXDEV

 private:
  int answer(std::string_view call) const { return call == failing ? EXDEV : 0; }
  int add(const std::string& call, std::string_view bytes) {
    if (lines.empty() || !lines.back().starts_with(call)) lines.push_back(call);
    lines.back() += bytes;
    return answer(std::string_view(call).substr(0, call.size() - 1));
  }
};

using Lines = std::vector<std::string>;

constexpr std::string_view kFileLine = "entry 0 416 7 -5 a/b>";

struct Parsed {
  Lines lines;
  int result;
  bool hasFinished;
};

Parsed parse(std::string_view bytes, std::size_t piece = std::string_view::npos, const char* failing = "") {
  NotingSink sink;
  sink.failing = failing;
  ArchiveFrameParser parser(sink);
  int result = 0;
  while (!bytes.empty() && result == 0) {
    const std::string_view part = bytes.substr(0, piece);
    bytes.remove_prefix(part.size());
    result = parser.take(part);
  }
  return {sink.lines, result, parser.hasFinished()};
}

int resultOf(std::string_view bytes) { return parse(bytes).result; }

const std::string kFile = entry(Kind::file, "a/b");
const std::string kFolder = entry(Kind::directory, "a");
const std::string kEndOfEntry = frame(Type::endOfEntry);
const std::string kEnd = frame(Type::end);

TEST(ArchiveFramesTest, TheContentsArriveInOrderHoweverThePipeCutsThem) {
  const std::string all = kFile + frame(Type::data, "12345") + frame(Type::data) + frame(Type::data, "67") +
                          frame(Type::companion, "abc") + kEndOfEntry +
                          refusal(Type::refused, EPERM, "no/good") + entry(Kind::link, "link", "target") +
                          kEndOfEntry + kFolder + frame(Type::companion, "d") + kEndOfEntry + kEnd;
  const Lines expected = {std::string(kFileLine),
                          "data 1234567",
                          "companion abc",
                          "end",
                          "refused no/good 1",
                          "entry 2 416 7 -5 link>target",
                          "end",
                          "entry 1 416 7 -5 a>",
                          "companion d",
                          "end"};
  for (std::size_t piece = 1; piece <= all.size(); ++piece) {
    const Parsed parsed = parse(all, piece);
    ASSERT_EQ(parsed.result, 0) << piece;
    ASSERT_EQ(parsed.lines, expected) << piece;
    ASSERT_TRUE(parsed.hasFinished) << piece;
  }
  EXPECT_FALSE(parse(all.substr(0, all.size() - 1)).hasFinished);
  EXPECT_FALSE(parse(kFile + kEndOfEntry).hasFinished);
}

TEST(ArchiveFramesTest, AfterTheEndNoByteMayFollow) {
  EXPECT_EQ(resultOf(kEnd), 0);
  EXPECT_EQ(resultOf(kEnd + "x"), EPROTO);
  EXPECT_EQ(parse(kEnd + "x", kEnd.size()).result, EPROTO);
}

TEST(ArchiveFramesTest, AFrameOutOfItsPlaceIsRefused) {
  const std::string data = frame(Type::data, "x");
  for (const std::string& bytes :
       {kFile + kFile, data, kFolder + data, entry(Kind::link, "l", "t") + data, kFile + kEndOfEntry + data,
        frame(Type::companion, "x"), kFile + kEndOfEntry + frame(Type::companion, "x"), kEndOfEntry,
        kFile + kEndOfEntry + kEndOfEntry, kFile + kEnd, kFile + refusal(Type::refused, 1, "x"),
        head(Type{0}, 0), head(Type{8}, 0), kFile + head(Type{0}, 0)}) {
    EXPECT_EQ(resultOf(bytes), EPROTO) << testing::PrintToString(bytes);
  }
}

TEST(ArchiveFramesTest, AFrameOfAWrongLengthIsRefusedAtItsHead) {
  using archive_frame::kLargestChunk;
  using archive_frame::kLongestPath;
  const struct {
    std::string before;
    Type type;
    std::size_t shortest, longest;
  } all[] = {{"", Type::entry, sizeof(EntryHead), sizeof(EntryHead) + 2 * kLongestPath},
             {kFile, Type::data, 0, kLargestChunk},
             {kFile, Type::companion, 0, kLargestChunk},
             {kFile, Type::endOfEntry, 0, 0},
             {"", Type::end, 0, 0},
             {"", Type::refused, sizeof(Refusal), sizeof(Refusal) + kLongestPath},
             {"", Type::failed, sizeof(Refusal), sizeof(Refusal)},
             {kFile, Type::failed, sizeof(Refusal), sizeof(Refusal)}};
  for (const auto& each : all) {
    const auto type = static_cast<int>(each.type);
    EXPECT_EQ(resultOf(each.before + head(each.type, each.shortest)), 0) << type;
    EXPECT_EQ(resultOf(each.before + head(each.type, each.longest)), 0) << type;
    EXPECT_EQ(resultOf(each.before + head(each.type, each.longest + 1)), EPROTO) << type;
    if (each.shortest > 0) {
      EXPECT_EQ(resultOf(each.before + head(each.type, each.shortest - 1)), EPROTO) << type;
      EXPECT_EQ(resultOf(each.before + head(each.type, 0)), EPROTO) << type;
    }
  }
}

TEST(ArchiveFramesTest, TheLimitsAreThoseThatTheReaderKeeps) {
  EXPECT_EQ(archive_frame::kLongestPath, 1024u);
  EXPECT_EQ(archive_frame::kLargestChunk, 1048576u);
  EXPECT_EQ(archive_frame::kLargestCompanion, 4194304u);
}

TEST(ArchiveFramesTest, AnEntryThatContradictsItselfIsRefused) {
  const auto resultWith = [](const EntryHead& head, std::size_t following) {
    return resultOf(frame(Type::entry, bytesOf(head) + std::string(following, 'p')));
  };
  EntryHead head = headOf(Kind::file, "abc");
  EXPECT_EQ(resultWith(head, 3), 0);
  EXPECT_EQ(resultWith(head, 2), EPROTO);
  EXPECT_EQ(resultWith(head, 4), EPROTO);
  head.mode = 0777;
  EXPECT_EQ(resultWith(head, 3), 0);
  head.mode = 01000;  // sticky; the set-id bits lie above it
  EXPECT_EQ(resultWith(head, 3), EPROTO);
  head = headOf(Kind::file, "abc");
  head.kind = Kind{3};
  EXPECT_EQ(resultWith(head, 3), EPROTO);
  for (const Kind kind : {Kind::file, Kind::directory, Kind::link}) {
    head = headOf(kind, "abc", "t");
    EXPECT_EQ(resultWith(head, 4), kind == Kind::link ? 0 : EPROTO);
    EXPECT_EQ(resultWith(head, 5), EPROTO);
  }
  head = headOf(Kind::link, std::string(1024, 'p'), std::string(1024, 't'));
  EXPECT_EQ(resultWith(head, 2048), 0);
  head = headOf(Kind::link, std::string(1025, 'p'), std::string(1, 't'));
  EXPECT_EQ(resultWith(head, 1026), EPROTO);
  head = headOf(Kind::link, std::string(1, 'p'), std::string(1025, 't'));
  EXPECT_EQ(resultWith(head, 1026), EPROTO);
}

TEST(ArchiveFramesTest, TheCompanionOfOneEntryHasALimit) {
  using archive_frame::kLargestChunk;
  const std::string chunk = frame(Type::companion, std::string(kLargestChunk, 'c'));
  const std::string most = kFile + chunk + chunk + chunk + chunk;
  EXPECT_EQ(resultOf(most + kEndOfEntry), 0);
  EXPECT_EQ(resultOf(most + frame(Type::companion, "x")), EPROTO);
  EXPECT_EQ(resultOf(kFile + chunk + chunk + chunk + frame(Type::companion, "x") + chunk), EPROTO);
  // The next entry starts anew.
  EXPECT_EQ(resultOf(most + kEndOfEntry + most + kEndOfEntry + kEnd), 0);
}

TEST(ArchiveFramesTest, AFailureOfTheReaderIsTheResultAndAnImplausibleCodeIsEio) {
  const struct {
    int said, meant;
  } codes[] = {{1, 1},      {EPERM, EPERM}, {ENOSPC, ENOSPC}, {4095, 4095},
               {4096, EIO}, {0, EIO},       {-1, EIO},        {INT32_MIN, EIO}};
  for (const auto& each : codes) {
    EXPECT_EQ(resultOf(refusal(Type::failed, each.said)), each.meant) << each.said;
    const Parsed refused = parse(refusal(Type::refused, each.said, "p"));
    EXPECT_EQ(refused.result, 0);
    EXPECT_EQ(refused.lines, Lines{"refused p " + std::to_string(each.meant)});
  }
  EXPECT_EQ(resultOf(kFile + refusal(Type::failed, ENOSPC)), ENOSPC);
}

TEST(ArchiveFramesTest, WhatTheSinkAnswersEndsIt) {
  const std::string all = kFile + frame(Type::data, "1") + frame(Type::companion, "c") + kEndOfEntry +
                          refusal(Type::refused, 1, "p") + kEnd;
  const struct {
    const char* call;
    std::size_t lines;
  } calls[] = {{"entry", 1}, {"data", 2}, {"companion", 3}, {"end", 4}, {"refused", 5}};
  for (const auto& each : calls) {
    const Parsed parsed = parse(all, std::string_view::npos, each.call);
    EXPECT_EQ(parsed.result, EXDEV) << each.call;
    EXPECT_EQ(parsed.lines.size(), each.lines) << each.call;
    EXPECT_FALSE(parsed.hasFinished) << each.call;
  }
}

TEST(ArchiveFramesTest, DataThatWasWrittenElsewhereIsNotGivenToTheSink) {
  NotingSink sink;
  ArchiveFrameParser parser(sink);
  EXPECT_EQ(parser.dataAhead(), 0u);
  ASSERT_EQ(parser.take(kFile + head(Type::data, 10)), 0);
  EXPECT_EQ(parser.dataAhead(), 10u);
  ASSERT_EQ(parser.take("123"), 0);
  EXPECT_EQ(parser.dataAhead(), 7u);
  parser.pass(2);
  EXPECT_EQ(parser.dataAhead(), 5u);
  parser.pass(5);
  EXPECT_EQ(parser.dataAhead(), 0u);
  ASSERT_EQ(parser.take(head(Type::companion, 4)), 0);
  EXPECT_EQ(parser.dataAhead(), 0u);  // not data
  ASSERT_EQ(parser.take("comp" + kEndOfEntry + kEnd), 0);
  EXPECT_TRUE(parser.hasFinished());
  EXPECT_EQ(sink.lines, (Lines{std::string(kFileLine), "data 123", "companion comp", "end"}));
}

TEST(ArchiveFramesTest, ALargeChunkIsAskedForAlone) {
  using archive_frame::kLargeChunk;
  using archive_frame::kLargestChunk;
  NotingSink sink;
  ArchiveFrameParser parser(sink);
  EXPECT_EQ(parser.bestPiece(), kLargestChunk);
  ASSERT_EQ(parser.take(kFile + head(Type::data, kLargeChunk)), 0);
  EXPECT_EQ(parser.bestPiece(), kLargeChunk);
  ASSERT_EQ(parser.take(std::string(kLargeChunk, 'd')), 0);
  // The next head, and nothing behind it.
  EXPECT_EQ(parser.bestPiece(), 8u);
  ASSERT_EQ(parser.take(head(Type::data, kLargeChunk + 5).substr(0, 3)), 0);
  EXPECT_EQ(parser.bestPiece(), 5u);
  ASSERT_EQ(parser.take(head(Type::data, kLargeChunk + 5).substr(3)), 0);
  EXPECT_EQ(parser.bestPiece(), kLargeChunk + 5);
  ASSERT_EQ(parser.take(std::string(6, 'd')), 0);
  EXPECT_EQ(parser.bestPiece(), kLargestChunk);  // what is left is small
  ASSERT_EQ(parser.take(std::string(kLargeChunk - 1, 'd')), 0);
  EXPECT_EQ(parser.bestPiece(), 8u);
  ASSERT_EQ(parser.take(head(Type::data, kLargeChunk - 1)), 0);
  EXPECT_EQ(parser.bestPiece(), kLargestChunk);
  ASSERT_EQ(parser.take(std::string(kLargeChunk - 1, 'd')), 0);
  EXPECT_EQ(parser.bestPiece(), kLargestChunk);
}

}  // namespace
}  // namespace brenvik

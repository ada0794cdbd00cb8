// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "tools/support/CommandLineParser.h"

#include <gtest/gtest.h>

#include <string>
#include <vector>

#include "brenvik/mobile_helper.h"
#include "tools/support/ExitStatus.h"

namespace brenvik::tools {
namespace {

const std::vector<Group> kGroups{{"prefs", "preference values"}};
const std::vector<Parameter> kGlobals{
    {"--json", "", ValueKind::text, 0, {}, false, nullptr},
    {"--timeout", "", ValueKind::seconds},
    {"--help", "", ValueKind::text, 0, {}, false, nullptr},
    {"--version", "", ValueKind::text, 0, {}, false, nullptr},
};
const std::vector<Parameter> kNone;
const std::vector<Parameter> kPositionals{{"KEY", ""}, {"VALUE", ""}};
const std::vector<Parameter> kOptions{{"--type", "", ValueKind::text, 0, {}, true, "TYPE"}};

ProgramSyntax syntax() {
  return {"program",
          "does things",
          &kGroups,
          {{"", "ping", "", &kNone, &kNone}, {"prefs", "set", "", &kPositionals, &kOptions}},
          &kGlobals};
}

ParsedLine parse(std::vector<const char*> words) {
  words.insert(words.begin(), "program");
  return parseCommandLine(syntax(), static_cast<int>(words.size()), words.data());
}

void expectRefused(const std::vector<const char*>& words, const std::string& message) {
  try {
    (void)parse(words);
    ADD_FAILURE() << message << ": was taken";
  } catch (const UsageError& error) {
    EXPECT_EQ(error.message, message);
    EXPECT_TRUE(error.isAboutSyntax);
  }
}

using Given = std::vector<std::pair<std::string, std::string>>;
Given listOf(const Values& values) { return {values.all().begin(), values.all().end()}; }

TEST(CommandLineParserTest, OptionsMayStandAnywhereAndKeepTheirOrder) {
  for (const auto& words : std::vector<std::vector<const char*>>{
           {"--json", "prefs", "set", "--type", "a", "k", "v", "--type=b"},
           {"prefs", "--json", "set", "--type", "a", "k", "v", "--type", "b"},
           {"prefs", "set", "--type=a", "k", "v", "--type", "b", "--json", "--json"}}) {
    const ParsedLine line = parse(words);
    EXPECT_EQ(line.command, 1u);
    EXPECT_EQ(listOf(line.given), (Given{{"--type", "a"}, {"KEY", "k"}, {"VALUE", "v"}, {"--type", "b"}}));
    EXPECT_TRUE(line.globals.has("--json"));
  }
}

TEST(CommandLineParserTest, WordsThatLookLikeOptionsCanBeGiven) {
  EXPECT_EQ(listOf(parse({"prefs", "set", "-1", "-.5"}).given), (Given{{"KEY", "-1"}, {"VALUE", "-.5"}}));
  EXPECT_EQ(listOf(parse({"prefs", "set", "-", ""}).given), (Given{{"KEY", "-"}, {"VALUE", ""}}));
  EXPECT_EQ(listOf(parse({"prefs", "set", "--", "--json", "--"}).given),
            (Given{{"KEY", "--json"}, {"VALUE", "--"}}));
  EXPECT_EQ(listOf(parse({"prefs", "set", "--type", "--json", "k", "v"}).given)[0],
            (std::pair<std::string, std::string>{"--type", "--json"}));
  expectRefused({"prefs", "set", "k", "-x"}, "not expected: -x");
}

TEST(CommandLineParserTest, MistakesAreNamed) {
  expectRefused({}, "a command is required");
  expectRefused({"prefs"}, "\"prefs\" needs one of these behind it: set");
  expectRefused({"prefs", "set", "k"}, "VALUE is required");
  expectRefused({"ping", "pong"}, "not expected: pong");
  expectRefused({"--type", "a", "ping"}, "not expected: --type");
  expectRefused({"ping", "--timeout"}, "--timeout: VALUE is missing");
  expectRefused({"ping", "--timeout", "1", "--timeout", "2"}, "--timeout is given twice");
  expectRefused({"ping", "--json=1"}, "--json takes no value");
  expectRefused({"pong"}, "unknown command \"pong\"; did you mean \"ping\"?");
  expectRefused({"set"}, "unknown command \"set\"; did you mean \"prefs set\"?");
  expectRefused({"prefs", "sett"}, "unknown command \"prefs sett\"; did you mean \"prefs set\"?");
  expectRefused({"\x1B"}, "unknown command \"\\x1b\"");
  expectRefused({"ping", "--jsno"}, "not expected: --jsno; did you mean \"--json\"?");
}

TEST(CommandLineParserTest, HelpAndVersionEndTheLine) {
  EXPECT_EQ(parse({"--help", "nonsense"}).wish, ParsedLine::Wish::help);
  EXPECT_EQ(parse({"--version"}).wish, ParsedLine::Wish::version);
  const ParsedLine ofGroup = parse({"prefs", "-h"});
  EXPECT_EQ(ofGroup.group, "prefs");
  EXPECT_EQ(ofGroup.command, std::nullopt);
  EXPECT_EQ(parse({"prefs", "set", "--help"}).command, 1u);
}

TEST(CommandLineParserTest, SimilarNamesAreTheNearestOnly) {
  EXPECT_EQ(similarNames("pign", {"ping", "pin", "prefs"}), (std::vector<std::string>{"ping", "pin"}));
  EXPECT_EQ(similarNames("frobnicate", {"ping"}), std::vector<std::string>{});
  EXPECT_EQ(similarNames("", {"ping"}), std::vector<std::string>{});
  EXPECT_EQ(similarNames("locatoin", {"location", "lasd"}), std::vector<std::string>{"location"});
}

TEST(ExitStatusTest, EveryCodeOfTheLibraryHasItsStatus) {
  const std::vector<std::pair<std::int32_t, ExitStatus>> wanted{
      {BVMH_OK, ExitStatus::done},
      {BVMH_NO_SPACE, ExitStatus::failed},
      {BVMH_FAILURE, ExitStatus::failed},
      {BVMH_RESOURCE_SHORTAGE, ExitStatus::failed},
      {BVMH_NO_ACCESS, ExitStatus::refused},
      {BVMH_MEMORY_FAILURE, ExitStatus::failed},
      {BVMH_INVALID_SECURITY, ExitStatus::refused},
      {BVMH_NOT_SUPPORTED, ExitStatus::failed},
      {BVMH_TYPE_ERROR, ExitStatus::protocol},
      {BVMH_BAD_ID, ExitStatus::protocol},
      {BVMH_BAD_ARGUMENTS, ExitStatus::protocol},
      {BVMH_TRAILER_ERROR, ExitStatus::protocol},
      {BVMH_ERROR_SYSTEM, ExitStatus::failed},
      {BVMH_ERROR_PROTOCOL, ExitStatus::protocol},
      {BVMH_ERROR_ANSWER_LOST, ExitStatus::protocol},
      {BVMH_ERROR_HELPER_GONE, ExitStatus::unreachable},
      {BVMH_ERROR_TIMED_OUT, ExitStatus::timedOut},
      {BVMH_ERROR_UNREACHABLE, ExitStatus::unreachable},
      {BVMH_ERROR_NOT_CONNECTED, ExitStatus::unreachable},
      {BVMH_ERROR_NO_MEMORY, ExitStatus::failed},
      {BVMH_ERROR_INVALID_ARGUMENT, ExitStatus::usage},
      {4711, ExitStatus::failed},
  };
  for (const auto& [code, status] : wanted) EXPECT_EQ(statusOfCode(code), status) << code;
}

TEST(ExitStatusTest, TheTableIsInOrderAndWhole) {
  for (std::size_t i = 0; i < kExitStatuses.size(); ++i) {
    EXPECT_EQ(static_cast<std::size_t>(kExitStatuses[i].status), i);
  }
  EXPECT_EQ(kExitStatuses.back().status, ExitStatus::outputLost);
}

}  // namespace
}  // namespace brenvik::tools

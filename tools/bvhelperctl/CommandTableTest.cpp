// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "tools/bvhelperctl/CommandTable.h"

#include <gtest/gtest.h>

#include <filesystem>
#include <set>
#include <string>

#include "interface/Routines.h"

namespace brenvik::tools {
namespace {

TEST(CommandTableTest, EveryRoutineHasItsCommand) {
  std::set<std::string> called;
  for (const Command& each : commandTable()) called.insert(each.routines.begin(), each.routines.end());
  std::set<std::string> wanted{std::string(kCheckInRoutine.name)};
  for (const RoutineFacts& each : kRequestRoutines) wanted.emplace(each.name);
  EXPECT_EQ(called, wanted);
}

TEST(CommandTableTest, EveryCommandHasWordsOfItsOwnAndAGroupThatExists) {
  std::set<std::string> groups{""};
  for (const Group& each : commandGroups()) groups.insert(each.name);
  std::set<std::string> words;
  for (const Command& each : commandTable()) {
    EXPECT_TRUE(words.insert(wordsOf(each)).second) << wordsOf(each);
    EXPECT_TRUE(groups.contains(each.group)) << each.group;
    EXPECT_TRUE(each.run != nullptr || each.isLocal) << each.name;
    for (const Parameter& parameter : each.options) EXPECT_EQ(std::string(parameter.name).substr(0, 2), "--");
    for (const Parameter& parameter : each.positionals) EXPECT_NE(parameter.name[0], '-');
  }
}

void expectRefused(const Parameter& parameter, const std::string& given, const std::string& message) {
  try {
    (void)checkedValue(parameter, given);
    ADD_FAILURE() << given << " was taken";
  } catch (const UsageError& error) {
    EXPECT_EQ(error.message, message);
  }
}

TEST(CommandTableTest, ValuesAreCheckedBeforeTheyAreSent) {
  const Parameter latitude{"LATITUDE", "", ValueKind::latitude};
  EXPECT_EQ(checkedValue(latitude, "-90"), "-90");
  expectRefused(latitude, "90.001", "LATITUDE: \"90.001\" is not a latitude, -90 to 90");
  expectRefused(latitude, "nan", "LATITUDE: \"nan\" is not a latitude, -90 to 90");
  expectRefused(latitude, "", "LATITUDE: \"\" is not a latitude, -90 to 90");
  expectRefused({"LONGITUDE", "", ValueKind::longitude}, "181",
                "LONGITUDE: \"181\" is not a longitude, -180 to 180");
  const Parameter state{"STATE", "", ValueKind::choice, 0, {"on", "off"}};
  EXPECT_EQ(checkedValue(state, "off"), "off");
  expectRefused(state, "maybe\n", "STATE: \"maybe\\n\" is not one of: on, off");
  expectRefused({"--mask", "", ValueKind::integer}, "4294967296",
                "--mask: \"4294967296\" is not an integer of 32 bits");
  expectRefused({"--count", "", ValueKind::count}, "0", "--count: \"0\" is not a number of at least 1");
  const Parameter text{"KEY", "", ValueKind::text, 255};
  EXPECT_EQ(checkedValue(text, std::string(255, 'x')), std::string(255, 'x'));
  expectRefused(text, std::string(256, 'x'), "KEY: at most 255 bytes");
  expectRefused(text, "\xff", "KEY: \"\\xff\" is not UTF-8");
  EXPECT_EQ(checkedValue({"TARGET", "", ValueKind::bytes}, "\xff"), "\xff");
  const Parameter user{"--helper-uid", "", ValueKind::user};
  EXPECT_EQ(checkedValue(user, "4294967294"), "4294967294");
  expectRefused(user, "-1", "--helper-uid: \"-1\" is not a user's number");
  const Parameter timeout{"--timeout", "", ValueKind::seconds};
  EXPECT_EQ(secondsIn(checkedValue(timeout, "0.25")), 0.25);
  for (const char* wrong : {"nan", "inf", "-1", "0", "4000001", "1s", ""}) {
    expectRefused(timeout, wrong,
                  "--timeout: \"" + std::string(wrong) + "\" is not a number of seconds, 0.001 to 4000000");
  }
}

TEST(CommandTableTest, PathsAreMadeAbsolute) {
  const Parameter path{"PATH", "", ValueKind::path, 255};
  EXPECT_EQ(checkedValue(path, "/a/b"), "/a/b");
  EXPECT_EQ(checkedValue(path, "b"), (std::filesystem::current_path() / "b").string());
  expectRefused(path, "", "PATH: \"\" is not a path");
  expectRefused(path, "/" + std::string(255, 'x'), "PATH: at most 255 bytes");
}

}  // namespace
}  // namespace brenvik::tools

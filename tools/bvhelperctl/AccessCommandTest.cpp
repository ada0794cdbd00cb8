// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "tools/bvhelperctl/AccessCommand.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <string>

namespace brenvik::tools {
namespace {

namespace fs = std::filesystem;
using testing::EndsWith;
using testing::HasSubstr;

constexpr const char* kAllow = "com.norvale.Teravox.BrenvikHelper.allow";

class AccessCommandTest : public testing::Test {
 protected:
  void SetUp() override {
    if (::geteuid() != 0) GTEST_SKIP() << "files owned by root are made by root";
    std::string name = (fs::temp_directory_path() / "access-XXXXXX").string();
    ASSERT_NE(::mkdtemp(name.data()), nullptr);
    root = fs::canonical(name);
    fs::create_directory(root / "etc");
    ASSERT_EQ(::chmod((root / "etc").c_str(), 0755), 0);
    program = (root / "program").string();
    fs::copy_file("/bin/cat", program);
    ASSERT_EQ(::chmod(program.c_str(), 0755), 0);
  }
  void TearDown() override {
    if (!root.empty()) fs::remove_all(root);
  }

  static std::string quoted(const std::string& key, const std::string& text) {
    return "<key>" + key + "</key><string>" + text + "</string>";
  }
  fs::path write(const char* name, const std::string& keys, const char* value = "<true/>") {
    const fs::path path = root / "etc" / name;
    std::ofstream(path) << "<plist version=\"1.0\"><dict>" << keys << "<key>Entitlements</key><dict><key>"
                        << kAllow << "</key>" << value << "</dict></dict></plist>";
    EXPECT_EQ(::chmod(path.c_str(), 0644), 0);
    return path;
  }

  // The exit status; what is printed is in `printed`.
  int run(const std::vector<std::pair<std::string, std::string>>& given, bool asJson = false) {
    Values values;
    for (const auto& [name, value] : given) values.add(name, value);
    const Outcome outcome = explainAccess(values, {(root / "etc").string(), (root / "lib").string()});
    printed = (asJson ? outcome.fields.dump() : outcome.text) + '\n';
    EXPECT_EQ(*outcome.routine, '\0');
    EXPECT_TRUE(outcome.isDone);
    return static_cast<int>(outcome.status.value());
  }
  std::string messageOf(const std::vector<std::pair<std::string, std::string>>& given) {
    try {
      (void)run(given);
    } catch (const UsageError& error) {
      return error.message;
    }
    return "taken";
  }

  fs::path root;
  std::string program;
  std::string printed;
};

TEST_F(AccessCommandTest, EachStepIsShownUpToTheFileThatDecides) {
  const auto other = write("a.plist", quoted("Executable", "/bin/sh") + quoted("User", "nobody"));
  const auto decisive = write(
      "b.plist", quoted("Executable", program) + quoted("Unit", "x.service") + quoted("unit", "misspelt"));
  write("c.plist", quoted("Executable", program), "<false/>");
  EXPECT_EQ(run({{"--exe", program}, {"--user", "root"}, {"--unit", "x.service"}}), 0);
  EXPECT_EQ(printed, "executable  " + program +
                         "\n"
                         "account     root (0)\n"
                         "unit        x.service\n"
                         "asks for    com.norvale.Teravox.BrenvikHelper.allow\n"
                         "\n" +
                         (root / "etc").string() +
                         "\n"
                         "  note     is read\n"
                         "\n" +
                         other.string() +
                         "\n"
                         "  differs  User is nobody (65534), and the caller is 0\n"
                         "  differs  Executable is /bin/sh, and the caller runs another file\n"
                         "  holds    Entitlements has com.norvale.Teravox.BrenvikHelper.allow\n"
                         "\n" +
                         decisive.string() +
                         "\n"
                         "  note     unit is not a key of these files, and is not looked at\n"
                         "  holds    User is root\n"
                         "  holds    Executable is " +
                         program +
                         "\n"
                         "  holds    Entitlements has com.norvale.Teravox.BrenvikHelper.allow\n"
                         "  holds    Unit is x.service\n"
                         "\n"
                         "let in: " +
                         decisive.string() + " gives it\n");
}

TEST_F(AccessCommandTest, WhatIsWrongIsShownWithItsKeyAndTheReasonNamesTheNearestFile) {
  const auto type = write("a.plist", quoted("Executable", "/bin/sh") + "<key>User</key><integer>0</integer>");
  const auto account = write("b.plist", quoted("Executable", "/bin/sh") + quoted("User", "no-such-account"));
  const auto dead = write("c.plist", quoted("Executable", "/no/such/program"));
  const auto changeable = write("d.plist", quoted("Executable", program));
  ASSERT_EQ(::chmod(changeable.c_str(), 0666), 0);
  const auto nearest = write("e.plist", quoted("Executable", program) + quoted("Unit", "x.service"));
  EXPECT_EQ(run({{"--exe", program}, {"--user", "0"}}), 4);
  for (const std::string& shown :
       {type.string() + "\n  wrong    User is an integer, not a string\n",
        account.string() + "\n  wrong    User is \"no-such-account\", and there is no such account\n",
        std::string("differs  Executable is /no/such/program: No such file or directory\n"),
        changeable.string() + "\n  wrong    not owned by root, or others may write to it\n",
        (root / "lib").string() + "\n  note     does not exist\n"}) {
    EXPECT_THAT(printed, HasSubstr(shown));
  }
  EXPECT_THAT(printed,
              EndsWith("\nrefused: " + nearest.string() +
                       " came nearest, but its Unit is x.service, and the caller runs in no unit of the "
                       "system's service manager\n"));
}

TEST_F(AccessCommandTest, AScriptIsAskedAboutAsItsInterpreter) {
  const fs::path script = root / "script";
  std::ofstream(script) << "#! " << program << " -x\n";
  write("a.plist", quoted("Executable", program));
  EXPECT_EQ(run({{"--exe", script.string()}, {"--user", "root"}}), 0);
  EXPECT_THAT(printed, testing::StartsWith(script.string() + " is a script: what runs is its interpreter\n" +
                                           "executable  " + program + "\n"));
}

TEST_F(AccessCommandTest, JsonHasTheSameStepsInOneLine) {
  const auto file = write("a.plist", quoted("Executable", program), "<integer>1</integer>");
  EXPECT_EQ(run({{"--exe", program}, {"--user", "root"}}, true), 4);
  const auto line = nlohmann::ordered_json::parse(printed);
  EXPECT_EQ(line["ok"], true);
  EXPECT_EQ(line["granted"], false);
  EXPECT_EQ(line["caller"],
            (nlohmann::ordered_json{{"executable", program}, {"uid", 0}, {"account", "root"}, {"unit", ""}}));
  EXPECT_EQ(line["entitlement"], kAllow);
  EXPECT_EQ(line["reason"], file.string() + " gives it as an integer, not a boolean");
  ASSERT_EQ(line["steps"].size(), 4U);
  EXPECT_EQ(line["steps"][3]["text"], "has " + std::string(kAllow) + " as an integer, not a boolean");
  EXPECT_EQ(
      line["steps"][2],
      (nlohmann::ordered_json{
          {"path", file.string()}, {"key", "Executable"}, {"result", "holds"}, {"text", "is " + program}}));
  EXPECT_THAT(printed, EndsWith("}\n"));
}

TEST_F(AccessCommandTest, WithoutOptionsItAsksForItself) {
  write("a.plist", quoted("Executable", fs::read_symlink("/proc/self/exe").string()));
  (void)run({});
  EXPECT_THAT(printed, HasSubstr("account     root (0)\n"));
  EXPECT_THAT(printed, HasSubstr("executable  " + fs::read_symlink("/proc/self/exe").string() + "\n"));
}

TEST_F(AccessCommandTest, AProgramOrAccountThatDoesNotExistIsAMistake) {
  EXPECT_EQ(messageOf({{"--exe", "/no/such/program"}}), "--exe: /no/such/program: No such file or directory");
  EXPECT_EQ(messageOf({{"--exe", root.string()}}), "--exe: " + root.string() + " is not a regular file");
  for (const char* const wrong : {"no-such-account", "", "-1", "4294967296", "1x"}) {
    EXPECT_EQ(messageOf({{"--exe", program}, {"--user", wrong}}),
              "--user: there is no account named \"" + std::string(wrong) + "\"");
  }
}

}  // namespace
}  // namespace brenvik::tools

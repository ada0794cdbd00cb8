// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <array>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <string>

#include "platform/accounts/fakes/FakeAccountDirectory.h"
#include "platform/log/Log.h"
#include "platform/log/fakes/RecordingLog.h"

// For tests with entitlement files of their own.
namespace brenvik {

inline constexpr const char* kName = "com.example.allow";

inline std::string quoted(const std::string& key, const std::string& text) {
  return "<key>" + key + "</key><string>" + text + "</string>";
}
inline std::string held(const std::string& value = "<true/>") {
  return std::string("<key>Entitlements</key><dict><key>") + kName + "</key>" + value + "</dict>";
}
inline std::string document(const std::string& keys) {
  return "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<plist version=\"1.0\"><dict>" + keys +
         "</dict></plist>\n";
}

inline std::string hexOf(std::uint8_t byte) {
  std::array<char, 3> two;
  std::snprintf(two.data(), two.size(), "%02x", byte);
  return two.data();
}

// A folder of root's with a program and two folders for entitlement files, etc and lib.
class EntitlementFolderTest : public testing::Test {
 protected:
  void SetUp() override {
    if (::geteuid() != 0) GTEST_SKIP() << "files owned by root are made by root";
    std::string name = (std::filesystem::temp_directory_path() / "entitlements-XXXXXX").string();
    root = ::mkdtemp(name.data());
    // Umask and a link in the path of the temporary folder are not what is tested.
    root = std::filesystem::canonical(root);
    for (const char* const folder : {"etc", "lib"}) {
      std::filesystem::create_directory(root / folder);
      ASSERT_EQ(::chmod((root / folder).c_str(), 0755), 0);
    }
    program = (root / "program").string();
    std::filesystem::copy_file("/bin/cat", program);
    ASSERT_EQ(::chmod(program.c_str(), 0755), 0);
  }
  void TearDown() override {
    if (!root.empty()) std::filesystem::remove_all(root);
  }

  std::filesystem::path write(const char* name, const std::string& content) {
    const std::filesystem::path path = root / name;
    std::ofstream(path, std::ios::binary) << content;
    EXPECT_EQ(::chmod(path.c_str(), 0644), 0);
    return path;
  }
  std::filesystem::path grant(const char* name, const std::string& value = "<true/>",
                              const std::string& more = "") {
    return write(name, document(quoted("Executable", program) + more + held(value)));
  }

  std::string line(const char* before, const std::filesystem::path& path, const char* after) {
    return before + path.string() + after;
  }
  std::string passedOver(const char* name, const std::string& why) {
    return "entitlement file " + (root / name).string() + " passed over: " + why;
  }
  void expectOneError(const std::string& text) {
    EXPECT_THAT(log.entries(), testing::ElementsAre(RecordingLog::unifiedLine(LogLevel::error, text)));
    log.clear();
  }

  std::filesystem::path root;
  std::string program;
  FakeAccountDirectory accounts;
  RecordingLog log;
};

}  // namespace brenvik

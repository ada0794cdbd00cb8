// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <gtest/gtest.h>

#include <algorithm>
#include <chrono>
#include <cstdint>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <functional>
#include <iterator>
#include <memory>
#include <string>
#include <vector>

#include "platform/preferences/linux/FilePreferences.h"

// For the tests of this folder only.
namespace brenvik {

// A home of its own for a test, removed with everything in it.
class TestHome {
 public:
  explicit TestHome(std::string below = "/tmp") {
    below += "/brenvik-preferences.XXXXXX";
    root_ = ::mkdtemp(below.data());
    std::filesystem::create_directory(home());
  }
  TestHome(const TestHome&) = delete;
  TestHome& operator=(const TestHome&) = delete;
  ~TestHome() { std::filesystem::remove_all(root_); }

  static constexpr const char kMachine[] = "0123456789abcdef0123456789abcdef";

  const std::filesystem::path& root() const { return root_; }
  std::filesystem::path home() const { return root_ / "home"; }
  std::filesystem::path folder() const { return home() / "Library/Preferences"; }
  std::filesystem::path anyUser() const { return root_ / "var/any user"; }
  std::filesystem::path file(const std::string& domain) const { return folder() / (domain + ".plist"); }

  FilePreferences::Places places() const { return {home(), anyUser(), kMachine}; }

  // Another process's store, as far as files can tell.
  std::unique_ptr<FilePreferences> open(
      std::chrono::milliseconds patience = FilePreferences::kPatience) const {
    return std::make_unique<FilePreferences>([places = places()] { return places; }, patience);
  }

  // Puts a file where the domain's belongs.
  void write(const std::string& domain, std::string_view bytes) const {
    std::filesystem::create_directories(folder());
    std::ofstream(file(domain), std::ios::binary | std::ios::trunc) << bytes;
  }
  static std::string read(const std::filesystem::path& path) {
    std::ifstream in(path, std::ios::binary);
    return {std::istreambuf_iterator<char>(in), {}};
  }
  // Names in the domain folder, the lock aside.
  std::vector<std::string> files() const {
    std::vector<std::string> names;
    for (const auto& entry : std::filesystem::directory_iterator(folder())) {
      if (entry.path().filename() != ".brenvik-preferences.lock") names.push_back(entry.path().filename());
    }
    std::sort(names.begin(), names.end());
    return names;
  }

 private:
  std::filesystem::path root_;
};

// What the store asks of the system: noted, and made to fail. Stands in for the C library's functions in the
// test program.
struct SystemCalls {
  std::vector<std::string> trace;     // "write", "fsync file", "fsync folder", "rename"
  int failWrite = 0;                  // errno, or 0
  std::size_t writeLimit = SIZE_MAX;  // bytes that one call takes at most
  int failFileSync = 0;
  int failFolderSync = 0;
  int failRename = 0;
  int failOpen = 0;         // of existing files, for reading
  int failRenameFlags = 0;  // of renames that must not replace anything
  std::function<void()> beforeLocking;

  SystemCalls();
  SystemCalls(const SystemCalls&) = delete;
  SystemCalls& operator=(const SystemCalls&) = delete;
  ~SystemCalls();
};

}  // namespace brenvik

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <string>
#include <string_view>

namespace brenvik {

// A directory of a test's own, with what the test needs to fill it and to look into it. Removed at the end.
class TemporaryDirectory {
 public:
  TemporaryDirectory() : TemporaryDirectory(std::filesystem::temp_directory_path()) {}
  explicit TemporaryDirectory(const std::filesystem::path& parent) {
    path_ = (parent / "brenvik-test-XXXXXX").string();
    if (::mkdtemp(path_.data()) == nullptr) std::abort();
    // Links on the way would make two paths of one place.
    path_ = std::filesystem::canonical(path_).string();
  }
  TemporaryDirectory(const TemporaryDirectory&) = delete;
  TemporaryDirectory& operator=(const TemporaryDirectory&) = delete;
  ~TemporaryDirectory() {
    std::error_code ignored;
    std::filesystem::remove_all(path_, ignored);
  }

  const std::string& path() const { return path_; }
  std::string operator/(std::string_view name) const { return path_ + "/" + std::string(name); }

  // Each makes the directories above it, and returns the whole path.
  std::string file(std::string_view name, std::string_view content = "") const {
    const std::string whole = *this / name;
    std::filesystem::create_directories(std::filesystem::path(whole).parent_path());
    std::ofstream(whole, std::ios::binary) << content;
    return whole;
  }
  std::string directory(std::string_view name) const {
    const std::string whole = *this / name;
    std::filesystem::create_directories(whole);
    return whole;
  }
  std::string link(std::string_view name, const std::string& target) const {
    const std::string whole = *this / name;
    std::filesystem::create_directories(std::filesystem::path(whole).parent_path());
    std::filesystem::create_symlink(target, whole);
    return whole;
  }

 private:
  std::string path_;
};

// The whole content; "(none)" when the file cannot be read, which no test writes into one.
inline std::string contentOf(const std::string& path) {
  std::ifstream file(path, std::ios::binary);
  if (!file) return "(none)";
  return {std::istreambuf_iterator<char>(file), {}};
}

// Of the item itself, links not followed; st_mode 0 when there is none.
inline struct stat statOf(const std::string& path) {
  struct stat info {};
  if (::lstat(path.c_str(), &info) != 0) info.st_mode = 0;
  return info;
}

inline bool isThere(const std::string& path) { return statOf(path).st_mode != 0; }

}  // namespace brenvik

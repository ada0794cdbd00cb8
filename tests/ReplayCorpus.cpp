// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
//
// main() of a fuzz target in a build without libFuzzer: runs the target over every file of the folders given,
// in the order of their names. Fails when a folder is missing or holds no file, so that a corpus that went
// astray does not look like a success.
#include <algorithm>
#include <cstdint>
#include <cstdio>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <system_error>
#include <vector>

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size);

namespace {

bool replay(const std::filesystem::path& folder) {
  std::error_code error;
  std::vector<std::filesystem::path> files;
  for (std::filesystem::recursive_directory_iterator at(folder, error), end; !error && at != end;
       at.increment(error)) {
    if (at->is_regular_file()) files.push_back(at->path());
  }
  if (error) {
    std::fprintf(stderr, "%s: %s\n", folder.c_str(), error.message().c_str());
    return false;
  }
  if (files.empty()) {
    std::fprintf(stderr, "%s: no files\n", folder.c_str());
    return false;
  }
  std::sort(files.begin(), files.end());
  for (const auto& file : files) {
    std::ifstream stream(file, std::ios::binary);
    const std::vector<char> bytes{std::istreambuf_iterator<char>(stream), {}};
    if (!stream.is_open() || stream.bad()) {
      std::fprintf(stderr, "%s: cannot be read\n", file.c_str());
      return false;
    }
    // A copy of exactly this size, so that a sanitizer sees the first byte read beyond it. The name goes out
    // first: it is the last line before a crash.
    std::printf("%s\n", file.c_str());
    std::fflush(stdout);
    const std::vector<std::uint8_t> input(bytes.begin(), bytes.end());
    (void)LLVMFuzzerTestOneInput(input.data(), input.size());
  }
  std::printf("%zu files\n", files.size());
  return true;
}

}  // namespace

int main(int argc, char** argv) {
  if (argc < 2) {
    std::fprintf(stderr, "usage: %s FOLDER...\n", argv[0]);
    return 2;
  }
  return std::all_of(argv + 1, argv + argc, [](const char* folder) { return replay(folder); }) ? 0 : 1;
}

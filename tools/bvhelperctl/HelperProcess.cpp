// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "tools/bvhelperctl/HelperProcess.h"

#include <algorithm>
#include <system_error>

#include "tools/support/Parameters.h"

namespace brenvik::tools {
namespace {

// As the kernel shows it: cut to 15 characters.
constexpr const char* kHelperProcessName = "BrenvikMobileHe";

}  // namespace

std::string factsIn(const std::filesystem::path& path) {
  try {
    return contentOf(path.string());
  } catch (const UsageError&) {
    return "";
  }
}

std::vector<std::string> wordsAfter(const std::string& text, const std::string& name) {
  std::vector<std::string> words;
  std::size_t at = name.empty() ? 0 : text.find('\n' + name);
  if (at == std::string::npos) return words;
  at += name.empty() ? 0 : name.size() + 1;
  const std::string line = text.substr(at, text.find('\n', at) - at);
  for (std::size_t start = 0; (start = line.find_first_not_of(" \t", start)) != std::string::npos;) {
    const std::size_t end = std::min(line.find_first_of(" \t", start), line.size());
    words.push_back(line.substr(start, end - start));
    start = end;
  }
  return words;
}

std::vector<HelperProcess> helperProcesses() {
  std::vector<HelperProcess> found;
  std::error_code error;
  for (auto entry = std::filesystem::directory_iterator("/proc", error);
       !error && entry != std::filesystem::directory_iterator(); entry.increment(error)) {
    const auto id = numberIn<int>(entry->path().filename().string());
    if (!id || factsIn(entry->path() / "comm") != std::string(kHelperProcessName) + '\n') continue;
    HelperProcess process{*id, factsIn(entry->path() / "status")};
    const std::vector<std::string> state = wordsAfter(process.status, "State:");
    if (state.empty() || state[0] == "Z") continue;  // it has gone, or its maker has not noticed that yet
    // Its number in each process table that it is in, from this one inwards.
    process.isOfThisSystem = wordsAfter(process.status, "NSpid:").size() <= 1;
    found.push_back(std::move(process));
  }
  return found;
}

}  // namespace brenvik::tools

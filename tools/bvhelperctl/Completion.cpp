// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "tools/bvhelperctl/Completion.h"

#include <pwd.h>

#include <algorithm>
#include <array>
#include <cstring>
#include <filesystem>
#include <set>
#include <string>
#include <system_error>

#include "platform/plist/PropertyListCodec.h"
#include "tools/support/Output.h"
#include "tools/support/Parameters.h"

namespace brenvik::tools {
namespace {

namespace fs = std::filesystem;

constexpr std::string_view kEnding = ".plist";

// Where the values are that the helper, which runs as root, sets and returns; then those of every user, which
// application scope adds.
std::array<fs::path, 2> preferenceFolders() {
  const passwd* root = ::getpwuid(0);
  return {fs::path(root == nullptr ? "/root" : root->pw_dir) / "Library" / "Preferences",
          fs::path(BRENVIK_ANY_USER_PREFERENCES)};
}

bool isPlainWord(const std::string& name) {
  constexpr std::string_view kPlain =
      "abcdefghijklmnopqrstuvwxyzABCDEFGHIJKLMNOPQRSTUVWXYZ0123456789._-+@%,:/=";
  return !name.empty() && name[0] != '-' && name.find_first_not_of(kPlain) == std::string::npos;
}

std::set<std::string> domains() {
  std::set<std::string> names;
  for (const fs::path& folder : preferenceFolders()) {
    std::error_code error;
    for (auto entry = fs::directory_iterator(folder, error); !error && entry != fs::directory_iterator();
         entry.increment(error)) {
      std::string name = entry->path().filename().string();
      if (!name.ends_with(kEnding)) continue;
      name.resize(name.size() - kEnding.size());
      names.insert(std::move(name));
    }
  }
  return names;
}

std::set<std::string> keys(const std::string& domain) {
  std::set<std::string> names;
  if (domain.find('/') != std::string::npos) return names;
  for (const fs::path& folder : preferenceFolders()) {
    try {
      const std::string content = contentOf(folder / (domain + std::string(kEnding)));
      const PropertyList values = parsePropertyList(std::as_bytes(std::span(content)));
      if (!values.is(PropertyList::Type::dictionary)) continue;
      for (std::size_t i = 0; i < values.size(); ++i) names.emplace(values.keyAt(i));
    } catch (const UsageError&) {
      continue;  // not there, or not for this account: nothing to offer
    }
  }
  return names;
}

}  // namespace

bool isCompletionRequest(int argc, const char* const* argv) {
  return argc >= 2 && std::strcmp(argv[1], "__complete") == 0;
}

ExitStatus printOffers(int argc, const char* const* argv) {
  std::set<std::string> names;
  const std::string_view what = argc >= 3 ? argv[2] : "";
  if (argc == 3 && what == "domains") {
    names = domains();
  } else if (argc == 4 && what == "keys") {
    names = keys(argv[3]);
  } else {
    return ExitStatus::usage;
  }
  for (const std::string& each : names) {
    if (isPlainWord(each)) (void)printOut(each + '\n');  // a loss is told at the end
  }
  return ExitStatus::done;
}

}  // namespace brenvik::tools

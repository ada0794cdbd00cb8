// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/files/linux/TreeWalk.h"

#include <dirent.h>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include <cerrno>
#include <filesystem>
#include <functional>
#include <string>
#include <utility>

#include "platform/files/fakes/TemporaryDirectory.h"

namespace brenvik {
namespace {

// Goes into every directory, and does something at the file "end".
class WalkForTests final : public TreeWalk {
 public:
  std::function<void()> atTheEnd = [] {};
  int lefts = 0;

  int run(const std::string& path) {
    Level top;
    top.directory = HeldDirectory(UniqueFd(::open(path.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC)));
    return walk(std::move(top));
  }

 private:
  int visit(Level&, const DirectoryNames::Entry& entry, bool* descend) override {
    *descend = entry.type == DT_DIR;
    if (!*descend) atTheEnd();
    return 0;
  }
  int left(Level&, Level*) override {
    ++lefts;
    return 0;
  }
};

// A directory so deep that those at its top are no longer held when the walk is at its end.
constexpr int kDepth = static_cast<int>(kHeldLevels) + 10;
std::string deepTree(const TemporaryDirectory& dir) {
  std::string path = "top";
  for (int i = 0; i < kDepth; ++i) path += "/d";
  dir.file(path + "/end", "x");
  return dir / "top";
}

TEST(TreeWalkTest, ADeepTreeIsLeftTheWayItWasEntered) {
  const TemporaryDirectory dir;
  WalkForTests walk;
  EXPECT_EQ(walk.run(deepTree(dir)), 0);
  EXPECT_EQ(walk.lefts, kDepth + 1);
}

TEST(TreeWalkTest, WhoMovesADirectoryMeanwhileDoesNotLeadTheWalkOutOfTheTree) {
  const TemporaryDirectory dir;
  WalkForTests walk;
  dir.directory("elsewhere");
  const std::string top = deepTree(dir);
  walk.atTheEnd = [&] { std::filesystem::rename(top + "/d/d", dir / "elsewhere/d"); };
  EXPECT_EQ(walk.run(top), ESTALE);
  EXPECT_EQ(walk.lefts, kDepth - 2) << "not the one that was moved, nor what is above it";
}

}  // namespace
}  // namespace brenvik

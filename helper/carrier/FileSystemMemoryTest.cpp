// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
//
// Each allocation of a file operation fails once: the operation tells of it, or all is done.
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <filesystem>
#include <functional>
#include <string>

#include "helper/carrier/FileSystemManager.h"
#include "platform/base/fakes/FailingAllocations.h"
#include "platform/files/fakes/TemporaryDirectory.h"
#include "platform/files/linux/LinuxFileManager.h"

namespace brenvik {
namespace {

// Longer than what a string holds without memory of its own.
constexpr const char* kFolder = "a folder with a name of some length";
constexpr const char* kFile = "a file with a name of some length as well";

class FileSystemMemoryTest : public testing::Test {
 protected:
  void SetUp() override {
    if (!FailingAllocations::kWork) GTEST_SKIP() << "nothing fails under this sanitizer";
  }

  // The operation, in a directory of its own each time, with one allocation after the other failing. Tells
  // how often the operation told of it.
  int withEachFailure(const std::function<void(const TemporaryDirectory&)>& prepare,
                      const std::function<int(const TemporaryDirectory&)>& operation,
                      const std::function<void(const TemporaryDirectory&, int code)>& check) {
    int told = 0;
    for (long number = 0;; ++number) {
      SCOPED_TRACE("allocation " + std::to_string(number));
      const TemporaryDirectory dir;
      prepare(dir);
      int code = 0;
      bool hasFailed = false;
      {
        const FailingAllocations failing(number, FailingAllocations::HowMany::one);
        code = operation(dir);
        hasFailed = FailingAllocations::failures() > 0;
      }
      check(dir, code);
      told += code == ENOMEM;
      if (!hasFailed) {
        EXPECT_EQ(code, 0);
        return told;
      }
    }
  }

  LinuxFileManager files;
  FileSystemManager manager{files};
};

void makeTwoTrees(const TemporaryDirectory& dir) {
  dir.file("from/" + std::string(kFolder) + "/" + kFile, "new");
  dir.file("from/" + std::string(kFile), "new");
  dir.file("to/from/" + std::string(kFolder) + "/" + kFile, "old");
}

void expectWhole(const TemporaryDirectory& dir, int code) {
  for (const std::string& name : {kFolder + std::string("/") + kFile, std::string(kFile)}) {
    const std::string there = contentOf(dir / ("to/from/" + name));
    if (code == 0) {
      EXPECT_EQ(there, "new") << name;
    } else {
      EXPECT_EQ(code, ENOMEM);
      EXPECT_TRUE(there == "new" || there == "old" || there == "(none)") << there;
      EXPECT_TRUE(there == "new" || contentOf(dir / ("from/" + name)) == "new") << name << " is lost";
    }
  }
}

TEST_F(FileSystemMemoryTest, AMergeThatAnswers0HasCopiedOrMovedAll) {
  for (const auto merge : {&FileSystemManager::copyItem, &FileSystemManager::moveItem}) {
    std::string from;
    std::string to;
    const int told = withEachFailure(
        [&](const TemporaryDirectory& dir) {
          makeTwoTrees(dir);
          from = dir / "from";
          to = dir / "to";
        },
        [&](const TemporaryDirectory&) { return (manager.*merge)(from, to); }, expectWhole);
    EXPECT_GT(told, 5);
  }
}

TEST_F(FileSystemMemoryTest, NothingIsToldToBeGivenWhenTheCopyFailed) {
  std::string from;
  std::string to;
  const std::string name = kFile;
  bool given = false;
  const int told = withEachFailure(
      [&](const TemporaryDirectory& dir) {
        dir.file("from/" + name, "new");
        from = dir / "from";
        to = dir.directory("to");
        given = true;
      },
      [&](const TemporaryDirectory&) {
        return manager.copyFileAndGive(from, to, name, ::getuid(), ::getgid(), &given);
      },
      [&](const TemporaryDirectory&, int code) {
        EXPECT_TRUE(code == 0 || !given);
        EXPECT_TRUE(!given || contentOf(to + "/" + name) == "new");
      });
  EXPECT_GT(told, 2);
}

TEST_F(FileSystemMemoryTest, ADictionaryIsWrittenWholeOrNotAtAll) {
  const PropertyList dictionary =
      PropertyList::dictionary({{"a key of some length, longer than most", PropertyList::string("a value")}});
  std::string file;
  int failures = 0;
  (void)withEachFailure(
      [&](const TemporaryDirectory& dir) { file = dir.file(kFile, "old"); },
      [&](const TemporaryDirectory&) { return manager.writeDictionary(file, dictionary) ? 0 : EIO; },
      [&](const TemporaryDirectory&, int code) {
        failures += code != 0;
        EXPECT_EQ(contentOf(file) == "old", code != 0);
      });
  EXPECT_GT(failures, 2);
}

}  // namespace
}  // namespace brenvik

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "helper/carrier/FileSystemManager.h"

#include <gtest/gtest.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <climits>
#include <cstring>
#include <string>
#include <vector>

#include "platform/files/fakes/FaultyFileManager.h"
#include "platform/files/fakes/TemporaryDirectory.h"
#include "platform/files/linux/LinuxFileManager.h"

namespace brenvik {
namespace {

class FileSystemManagerTest : public testing::Test {
 protected:
  TemporaryDirectory dir;
  LinuxFileManager real;
  FaultyFileManager files{real};
  FileSystemManager manager{files};
};

// The slot of a virtual operation in the table. By the Itanium C++ ABI the first word of a pointer to the
// operation is the offset in the table, and 1 is added to it where no function stands at an odd address. On
// ARM one may, so there the second word tells that the operation is virtual, and the first is the offset as
// it is.
template <typename Method>
std::size_t slotOf(Method method) {
  std::size_t words[2];
  static_assert(sizeof method == sizeof words);
  std::memcpy(words, &method, sizeof words);
#if defined(__arm__) || defined(__aarch64__)
  EXPECT_EQ(words[1] & 1, 1U) << "not virtual";
  return words[0] / sizeof(void*);
#else
  EXPECT_EQ(words[0] & 1, 1U) << "not virtual";
  return (words[0] - 1) / sizeof(void*);
#endif
}

TEST(FileSystemInterfaceTest, ItsOperationsStandInSlots2To27InOrderBehindTheDestructorPair) {
  using I = FileSystemInterface;
  const std::vector<std::size_t> slots{slotOf(&I::moveItem),
                                       slotOf(&I::moveItemWithOwner),
                                       slotOf(&I::moveDirectory),
                                       slotOf(&I::copyItem),
                                       slotOf(&I::copyFileIntoDirectory),
                                       slotOf(&I::setPermissions),
                                       slotOf(&I::setOwner),
                                       slotOf(&I::createDirectory),
                                       slotOf(&I::createDirectoryWithOwner),
                                       slotOf(&I::itemExists),
                                       slotOf(&I::listDirectory),
                                       slotOf(&I::findEntry),
                                       slotOf(&I::removeItem),
                                       slotOf(&I::baseName),
                                       slotOf(&I::directoryName),
                                       slotOf(&I::resolvePath),
                                       slotOf(&I::readLink),
                                       slotOf(&I::readDictionary),
                                       slotOf(&I::readData),
                                       slotOf(&I::writeDictionary),
                                       slotOf(&I::writePropertyList),
                                       slotOf(&I::writeData),
                                       slotOf(&I::isSymbolicLink),
                                       slotOf(&I::createSymbolicLink),
                                       slotOf(&I::isDirectory),
                                       slotOf(&I::createEmptyFile)};
  for (std::size_t i = 0; i < slots.size(); ++i) EXPECT_EQ(slots[i], i + 2);
}

TEST(FileSystemScopeTest, TheReleaseScopeIsOpenExactlyAsLongAsTheObjectLives) {
  LinuxFileManager real;
  FaultyFileManager files(real);
  {
    const auto fileSystem = FileSystemManager::factory(files)();
    EXPECT_EQ(files.openScopes, 1);
    FileSystemManager second(files);
    EXPECT_EQ(files.openScopes, 2);
  }
  EXPECT_EQ(files.openScopes, 0);
}

// ---- copy or move

TEST_F(FileSystemManagerTest, CopyingAFileOntoADirectoryPutsItInsideReplacingAFileOfThatName) {
  const std::string source = dir.file("from/name", "new");
  dir.file("to/name", "old and longer");
  EXPECT_EQ(manager.copyItem(source, dir / "to"), 0);
  EXPECT_EQ(contentOf(dir / "to/name"), "new");
  EXPECT_EQ(contentOf(source), "new");
}

TEST_F(FileSystemManagerTest, CopyingADirectoryOntoAFileGives17AndChangesNothing) {
  dir.file("from/name", "new");
  const std::string file = dir.file("file", "kept");
  EXPECT_EQ(manager.copyItem(dir / "from", file), 17);
  EXPECT_EQ(manager.moveItem(dir / "from", file), 17);
  EXPECT_EQ(manager.moveItemWithOwner(dir / "from", file, 4711, 4712), 17);
  EXPECT_EQ(statOf(dir / "from").st_uid, ::getuid()) << "nobody is given what stays";
  EXPECT_EQ(contentOf(file), "kept");
  EXPECT_EQ(contentOf(dir / "from/name"), "new");
  EXPECT_TRUE(files.calls.empty());
}

TEST_F(FileSystemManagerTest, AFailedStatOfTheSourceGivesMinus1BeforeAnythingIsChanged) {
  const std::string file = dir.file("file", "kept");
  dir.link("dangling", "nowhere");
  for (const std::string& source : {dir / "missing", dir / "dangling"}) {
    EXPECT_EQ(manager.copyItem(source, file), -1);
    EXPECT_EQ(manager.moveItem(source, file), -1);
    EXPECT_EQ(manager.moveItemWithOwner(source, file, 0, 0), -1);
    EXPECT_EQ(manager.moveDirectory(source, dir / "new"), -1);
    EXPECT_EQ(manager.copyFileIntoDirectory(dir.path(), dir.path(), "missing"), -1);
  }
  EXPECT_EQ(contentOf(file), "kept");
  EXPECT_TRUE(files.calls.empty());
}

TEST_F(FileSystemManagerTest, WithNothingAtTheDestinationTheItemIsTakenWhole) {
  dir.file("from/sub/file", "x");
  EXPECT_EQ(manager.copyItem(dir / "from", dir / "copy"), 0);
  EXPECT_EQ(manager.moveItem(dir / "from", dir / "moved"), 0);
  EXPECT_EQ(contentOf(dir / "copy/sub/file"), "x");
  EXPECT_EQ(contentOf(dir / "moved/sub/file"), "x");
  EXPECT_FALSE(isThere(dir / "from"));
  EXPECT_EQ(files.durabilities.size(), 2u);  // copies and moves
}

TEST_F(FileSystemManagerTest, AFailureWithNothingAtTheDestinationGivesTheCodeOr5) {
  const std::string source = dir.file("file", "x");
  files.fail("copyItem", FileOutcome::failure(ENOSPC));
  EXPECT_EQ(manager.copyItem(source, dir / "new"), ENOSPC);
  files.fail("copyItem", FileOutcome::failureWithoutCode());
  EXPECT_EQ(manager.copyItem(source, dir / "new"), 5);
  files.fail("moveItem", FileOutcome::failureWithoutCode());
  EXPECT_EQ(manager.moveItem(source, dir / "new"), 5);
}

TEST_F(FileSystemManagerTest, ADanglingLinkAtTheDestinationCountsAsMissingAndIsNotWrittenThrough) {
  const std::string source = dir.file("file", "x");
  const std::string link = dir.link("link", dir / "through");
  EXPECT_EQ(manager.copyItem(source, link), EEXIST);
  EXPECT_EQ(manager.moveItem(source, link), EEXIST);
  EXPECT_FALSE(isThere(dir / "through"));
  EXPECT_TRUE(S_ISLNK(statOf(link).st_mode));
  // Inside a directory the same link ends a merge that reports nothing.
  dir.link("to/file", dir / "through");
  EXPECT_EQ(manager.copyItem(source, dir / "to"), 0);
  EXPECT_FALSE(isThere(dir / "through"));
}

TEST_F(FileSystemManagerTest, ALinkToAFileAtTheDestinationIsReplacedAndTheFileIsNot) {
  const std::string source = dir.file("file", "new");
  const std::string pointedTo = dir.file("precious", "kept");
  const std::string link = dir.link("link", pointedTo);
  EXPECT_EQ(manager.copyItem(source, link), 0);
  EXPECT_TRUE(S_ISREG(statOf(link).st_mode));
  EXPECT_EQ(contentOf(link), "new");
  EXPECT_EQ(contentOf(pointedTo), "kept");
}

TEST_F(FileSystemManagerTest, ALinkGivenAsSourceStaysALink) {
  dir.file("file", "x");
  const std::string link = dir.link("link", "file");
  EXPECT_EQ(manager.copyItem(link, dir / "copy"), 0);
  EXPECT_EQ(std::filesystem::read_symlink(dir / "copy"), "file");
  EXPECT_EQ(manager.moveItem(link, dir / "moved"), 0);
  EXPECT_EQ(std::filesystem::read_symlink(dir / "moved"), "file");
}

TEST_F(FileSystemManagerTest, AFailureOfTheMergeIsNotReported) {
  const std::string source = dir.file("file", "new");
  const std::string there = dir.file("there", "old");
  files.fail("copyItem", FileOutcome::failure(ENOSPC));
  EXPECT_EQ(manager.copyItem(source, there), 0);
  EXPECT_EQ(contentOf(there), "old");
}

TEST_F(FileSystemManagerTest, AFileCopiedOrMovedOntoItselfSurvives) {
  const std::string file = dir.file("file", "x");
  EXPECT_EQ(manager.copyItem(file, file), 0);
  EXPECT_EQ(manager.moveItem(file, file), 0);
  EXPECT_EQ(manager.moveItem(file, dir.path()), 0);
  EXPECT_EQ(contentOf(file), "x");
}

TEST_F(FileSystemManagerTest, ADirectoryCopiedOntoItselfEndsAndKeepsItsFiles) {
  dir.file("tree/file", "x");
  EXPECT_EQ(manager.copyItem(dir / "tree", dir / "tree"), 0);
  EXPECT_EQ(contentOf(dir / "tree/file"), "x");
  EXPECT_EQ(contentOf(dir / "tree/tree/file"), "x");
  EXPECT_FALSE(isThere(dir / "tree/tree/tree"));
}

TEST_F(FileSystemManagerTest, ADirectoryCopiedIntoADirectoryBelowItIsNotCopiedOnAndOn) {
  dir.file("home/Library/Preferences/file", "x");
  dir.file("home/Library/Logs/other", "o");
  const std::string reports = dir.directory("home/Library/Logs/Reports");
  dir.file("home/Library/Logs/Reports/report", "r");
  const auto items = [&](const std::string& path) {
    return std::distance(std::filesystem::recursive_directory_iterator(path), {});
  };
  const auto before = items(dir / "home/Library");
  for (int round = 0; round < 3; ++round) {
    EXPECT_EQ(manager.copyItem(dir / "home/Library", reports), 0);
    EXPECT_EQ(contentOf(reports + "/Library/Preferences/file"), "x");
    EXPECT_EQ(contentOf(reports + "/Library/Logs/other"), "o");
    EXPECT_EQ(contentOf(reports + "/Library/Logs/Reports/report"), "r");
    EXPECT_FALSE(isThere(reports + "/Library/Logs/Reports/Library"));
    // Each item once more, and the copy's own top.
    EXPECT_EQ(items(dir / "home/Library"), 2 * before + 1) << round;
  }
}

TEST_F(FileSystemManagerTest, TheSourceItselfIsGivenToTheOwnerBeforeItIsMoved) {
  if (::geteuid() != 0) GTEST_SKIP() << "needs root to give files away";
  const std::string file = dir.file("file", "x");
  EXPECT_EQ(manager.moveItemWithOwner(file, dir / "moved", 4711, 4712), 0);
  EXPECT_EQ(statOf(dir / "moved").st_uid, 4711u);
  EXPECT_EQ(statOf(dir / "moved").st_gid, 4712u);

  dir.file("tree/below", "x");
  ASSERT_EQ(::chown((dir / "tree").c_str(), 4711, 4712), 0);
  ASSERT_EQ(::chown((dir / "tree/below").c_str(), 4711, 4712), 0);
  EXPECT_EQ(manager.copyItem(dir / "tree", dir / "copy"), 0);
  EXPECT_EQ(statOf(dir / "tree").st_uid, ::getuid());  // the source was given away, too
  EXPECT_EQ(statOf(dir / "copy").st_uid, ::getuid());
  EXPECT_EQ(statOf(dir / "copy/below").st_uid, 4711u);  // but nothing below it
}

TEST_F(FileSystemManagerTest, TheSourceOfAMergeIsGivenToTheOwnerBefore) {
  if (::geteuid() != 0) GTEST_SKIP() << "needs root to give files away";
  const std::string there = dir.file("there", "old");
  EXPECT_EQ(manager.moveItemWithOwner(dir.file("file", "new"), there, 4711, 4712), 0);
  EXPECT_EQ(contentOf(there), "new");
  EXPECT_EQ(statOf(there).st_uid, 4711u);
  EXPECT_EQ(statOf(there).st_gid, 4712u);

  EXPECT_EQ(manager.moveItemWithOwner(dir.file("other", "x"), dir.directory("to"), 4713, 4714), 0);
  EXPECT_EQ(statOf(dir / "to/other").st_uid, 4713u);
  EXPECT_EQ(statOf(dir / "to/other").st_gid, 4714u);

  // Of a directory that both have it is the source that changes hands; this one stays, for a file in it
  // cannot be taken.
  dir.file("from/tree/file", "x");
  dir.directory("to/tree");
  files.failAt("moveItem", "tree/file", FileOutcome::failure(EIO));
  EXPECT_EQ(manager.moveItemWithOwner(dir / "from/tree", dir / "to", 4715, 4716), 0);
  EXPECT_EQ(statOf(dir / "from/tree").st_uid, 4715u);
  EXPECT_EQ(statOf(dir / "from/tree").st_gid, 4716u);
}

TEST_F(FileSystemManagerTest, AMergeReplacesFilesAndKeepsWhatOnlyTheDestinationHas) {
  dir.file("from/tree/both", "new");
  dir.file("from/tree/sub/only-new", "n");
  dir.file("to/tree/both", "old");
  dir.file("to/tree/sub/only-old", "o");
  EXPECT_EQ(manager.copyItem(dir / "from/tree", dir / "to"), 0);
  EXPECT_EQ(contentOf(dir / "to/tree/both"), "new");
  EXPECT_EQ(contentOf(dir / "to/tree/sub/only-new"), "n");
  EXPECT_EQ(contentOf(dir / "to/tree/sub/only-old"), "o");
  EXPECT_EQ(contentOf(dir / "from/tree/both"), "new");
}

TEST_F(FileSystemManagerTest, AMergeThatIsToLastWaitsForTheDiskWhenAllIsInIt) {
  class Watching final : public FaultyFileManager {
   public:
    using FaultyFileManager::FaultyFileManager;
    FileOutcome syncItem(const std::string& path) noexcept override {
      callsBefore.push_back(calls.size());
      return FaultyFileManager::syncItem(path);
    }
    std::vector<std::size_t> callsBefore;
  } watching{real};
  dir.file("from/tree/one", "1");
  dir.file("from/tree/two", "2");
  dir.directory("to/tree");
  FileSystemManager merging{watching};
  EXPECT_EQ(merging.copyFileIntoDirectory(dir / "from", dir / "to", "tree"), 0);
  EXPECT_EQ(contentOf(dir / "to/tree/tree/two"), "2");
  dir.file("from/tree/three", "3");
  EXPECT_EQ(merging.copyFileIntoDirectory(dir / "from", dir / "to", "tree"), 0);
  EXPECT_EQ(contentOf(dir / "to/tree/tree/three"), "3");
  EXPECT_EQ(watching.callsBefore, std::vector<std::size_t>{watching.calls.size()});
}

TEST_F(FileSystemManagerTest, AMergeInMoveModeLeavesOnlyEmptiedDirectoriesBehind) {
  dir.file("from/tree/both", "new");
  dir.file("from/tree/fresh/file", "f");
  dir.file("to/tree/both", "old");
  EXPECT_EQ(manager.moveItem(dir / "from/tree", dir / "to"), 0);
  EXPECT_EQ(contentOf(dir / "to/tree/both"), "new");
  EXPECT_EQ(contentOf(dir / "to/tree/fresh/file"), "f");
  EXPECT_FALSE(isThere(dir / "from/tree"));

  // A directory that both have is emptied but stays, and so its parent cannot be removed either.
  dir.file("from/tree/sub/file", "x");
  dir.directory("to/tree/sub");
  EXPECT_EQ(manager.moveItem(dir / "from/tree", dir / "to"), 0);
  EXPECT_EQ(contentOf(dir / "to/tree/sub/file"), "x");
  EXPECT_TRUE(isThere(dir / "from/tree/sub"));
  EXPECT_FALSE(isThere(dir / "from/tree/sub/file"));
}

TEST_F(FileSystemManagerTest, ACopyMergedIntoADirectoryRemovesAnEmptySourceDirectory) {
  dir.directory("from/tree");
  dir.directory("to/tree");
  EXPECT_EQ(manager.copyItem(dir / "from/tree", dir / "to"), 0);
  EXPECT_FALSE(isThere(dir / "from/tree"));
}

TEST_F(FileSystemManagerTest, AMergeMakesSureOfADirectoryOnceForAllFilesInIt) {
  for (const char* name : {"1", "2", "3", "4"}) dir.file(std::string("from/below/") + name, "x");
  dir.directory("to/from/below");
  EXPECT_EQ(manager.copyItem(dir / "from", dir / "to"), 0);
  EXPECT_EQ(std::ranges::count(files.calls, "createDirectory " + (dir / "to/from/below")), 1);
}

TEST_F(FileSystemManagerTest, AMergeGoesOnPastAnItemThatFails) {
  dir.file("from/tree/a", "1");
  dir.file("from/tree/b", "2");
  dir.file("from/tree/c", "3");
  dir.directory("to/tree");
  files.failAt("copyItem", "tree/b", FileOutcome::failure(EIO));
  EXPECT_EQ(manager.copyItem(dir / "from/tree", dir / "to"), 0);
  EXPECT_EQ(contentOf(dir / "to/tree/a"), "1");
  EXPECT_FALSE(isThere(dir / "to/tree/b"));
  EXPECT_EQ(contentOf(dir / "to/tree/c"), "3");
}

TEST_F(FileSystemManagerTest, AMergeDoesNotWriteThroughALinkInTheDestination) {
  dir.file("from/tree/sub/file", "new");
  dir.directory("outside");
  dir.link("to/tree/sub", dir / "outside");
  EXPECT_EQ(manager.copyItem(dir / "from/tree", dir / "to"), 0);
  EXPECT_FALSE(isThere(dir / "outside/file"));
  EXPECT_TRUE(S_ISLNK(statOf(dir / "to/tree/sub").st_mode));
}

TEST_F(FileSystemManagerTest, ADirectoryTakesTheNameOfAFileInsideADirectory) {
  dir.file("from/name/file", "new");
  dir.file("to/name", "old");
  EXPECT_EQ(manager.copyItem(dir / "from/name", dir / "to"), 0);
  EXPECT_EQ(contentOf(dir / "to/name/file"), "new");
  dir.file("to2/name", "old");
  EXPECT_EQ(manager.moveItem(dir / "from/name", dir / "to2"), 0);
  EXPECT_EQ(contentOf(dir / "to2/name/file"), "new");
  EXPECT_FALSE(isThere(dir / "from/name"));
}

TEST_F(FileSystemManagerTest, AFullDiskKeepsTheFileInADirectorysWay) {
  dir.file("from/name/file", "new");
  dir.file("to/name", "old");
  for (const int code : {ENOSPC, EDQUOT}) {
    files.fail("copyItem", FileOutcome::failure(code));
    EXPECT_EQ(manager.copyItem(dir / "from/name", dir / "to"), 0);
    EXPECT_EQ(contentOf(dir / "to/name"), "old");
  }
}

TEST_F(FileSystemManagerTest, MoveDirectoryGivesTheWholeTreeToThisUserAndMovesIt) {
  dir.file("tree/sub/file", "x");
  dir.link("tree/link", dir.file("outside", "o"));
  const bool root = ::geteuid() == 0;
  if (root) {
    for (const char* name : {"tree", "tree/sub", "tree/sub/file", "outside"}) {
      ASSERT_EQ(::lchown((dir / name).c_str(), 4711, 4711), 0);
    }
    ASSERT_EQ(::lchown((dir / "tree/link").c_str(), 4711, 4711), 0);
  }
  EXPECT_EQ(manager.moveDirectory(dir / "tree", dir / "moved"), 0);
  for (const char* name : {"moved", "moved/sub", "moved/sub/file"}) {
    EXPECT_EQ(statOf(dir / name).st_uid, ::getuid()) << name;
    EXPECT_EQ(statOf(dir / name).st_gid, ::getgid()) << name;
  }
  if (!root) return;
  // What a link points to is not part of the tree, and a link that became root's would be followed one day.
  EXPECT_EQ(statOf(dir / "outside").st_uid, 4711u);
  EXPECT_EQ(statOf(dir / "moved/link").st_uid, 4711u);
}

TEST_F(FileSystemManagerTest, MoveDirectoryOntoSomethingGives17AndOntoAnUnexplainedFailure5) {
  dir.directory("tree");
  dir.directory("there");
  EXPECT_EQ(manager.moveDirectory(dir / "tree", dir / "there"), 17);
  files.fail("moveItem", FileOutcome::failureWithoutCode());
  EXPECT_EQ(manager.moveDirectory(dir / "tree", dir / "new"), 5);
}

TEST_F(FileSystemManagerTest, MoveDirectoryMovesWhatKeepsItsOwnerButNotWhatNoMemoryWasThereToGive) {
  dir.file("tree/file", "x");
  files.fail("setAttributesOfTree", FileOutcome::failure(ENOMEM));
  EXPECT_EQ(manager.moveDirectory(dir / "tree", dir / "moved"), ENOMEM);
  EXPECT_TRUE(manager.itemExists(dir / "tree/file"));
  EXPECT_FALSE(manager.itemExists(dir / "moved"));
  files.fail("setAttributesOfTree", FileOutcome::failure(EPERM));
  EXPECT_EQ(manager.moveDirectory(dir / "tree", dir / "moved"), 0);
  EXPECT_TRUE(manager.itemExists(dir / "moved/file"));
}

TEST_F(FileSystemManagerTest, MoveDirectoryInsideOneFileSystemIsOneRename) {
  dir.file("tree/file", "x");
  const ino_t before = statOf(dir / "tree/file").st_ino;
  EXPECT_EQ(manager.moveDirectory(dir / "tree", dir / "moved"), 0);
  EXPECT_EQ(statOf(dir / "moved/file").st_ino, before);
}

TEST_F(FileSystemManagerTest, CopyFileIntoDirectoryMakesTheDirectoryWithMode0755) {
  dir.file("from/file", "x");
  const mode_t before = ::umask(0077);
  EXPECT_EQ(manager.copyFileIntoDirectory(dir / "from", dir / "a/b", "file"), 0);
  ::umask(before);
  EXPECT_EQ(contentOf(dir / "a/b/file"), "x");
  EXPECT_EQ(statOf(dir / "a/b").st_mode & 07777, 0755u);
  EXPECT_EQ(statOf(dir / "a").st_mode & 07777, 0755u);
}

TEST_F(FileSystemManagerTest, CopyFileIntoDirectoryReturnsMinus1WhenTheDirectoryCannotBeMade) {
  dir.file("from/file", "x");
  dir.file("in-the-way", "x");
  EXPECT_EQ(manager.copyFileIntoDirectory(dir / "from", dir / "in-the-way/b", "file"), -1);
}

// ---- attributes

TEST_F(FileSystemManagerTest, SetOwnerRecursiveOnAMissingPathGives5) {
  EXPECT_EQ(manager.setOwner(dir / "missing", 0, 0, true), 5);
  EXPECT_EQ(manager.setPermissions(dir / "missing", 0700, true), 5);
}

TEST_F(FileSystemManagerTest, NotRecursiveTheAttributeCallsReturnWhatPosixReturned) {
  EXPECT_EQ(manager.setOwner(dir / "missing", 0, 0, false), -1);
  EXPECT_EQ(manager.setPermissions(dir / "missing", 0700, false), -1);
  const std::string file = dir.file("file");
  EXPECT_EQ(manager.setPermissions(file, 0640, false), 0);
  EXPECT_EQ(statOf(file).st_mode & 07777, 0640u);
  EXPECT_EQ(manager.setOwner(file, ::getuid(), ::getgid(), false), 0);
  if (::geteuid() != 0) return;  // root alone gives files away
  EXPECT_EQ(manager.setOwner(file, 4711, 4712, false), 0);
  EXPECT_EQ(statOf(file).st_uid, 4711U);
  EXPECT_EQ(statOf(file).st_gid, 4712U);
}

TEST_F(FileSystemManagerTest, RecursiveAttributesReachTheDirectoryAndEverythingBelow) {
  dir.file("tree/sub/file");
  EXPECT_EQ(manager.setPermissions(dir / "tree", 0750, true), 0);
  for (const char* name : {"tree", "tree/sub", "tree/sub/file"}) {
    EXPECT_EQ(statOf(dir / name).st_mode & 07777, 0750u) << name;
  }
}

TEST_F(FileSystemManagerTest, RecursiveAttributesOnAFileAreSetOnItAlone) {
  const std::string file = dir.file("file");
  EXPECT_EQ(manager.setPermissions(file, 0600, true), 0);
  EXPECT_EQ(statOf(file).st_mode & 07777, 0600u);
}

TEST_F(FileSystemManagerTest, RecursiveAttributesGiveTheCodeOfAFailureOr0WithoutOne) {
  dir.file("tree/a");
  files.fail("setAttributesOfTree", FileOutcome::failure(EPERM));
  EXPECT_EQ(manager.setOwner(dir / "tree", 0, 0, true), EPERM);
  files.fail("setAttributesOfTree", FileOutcome::failureWithoutCode());
  EXPECT_EQ(manager.setOwner(dir / "tree", 0, 0, true), 0);
}

// ---- directories

TEST_F(FileSystemManagerTest, CreateDirectoryMakesWhatIsMissingOnTheWayOnlyWhenAsked) {
  EXPECT_EQ(manager.createDirectory(dir / "a/b/c", 0711, false), ENOENT);
  EXPECT_EQ(manager.createDirectory(dir / "a/b/c", 0711, true), 0);
  EXPECT_EQ(statOf(dir / "a/b/c").st_mode & 07777, 0711u);
  EXPECT_EQ(manager.createDirectory(dir / "a/b/c", 0700, true), 0);
  EXPECT_EQ(statOf(dir / "a/b/c").st_mode & 07777, 0711u);
  EXPECT_EQ(manager.createDirectory(dir / "a/b/c", 0700, false), EEXIST);
  EXPECT_EQ(manager.createDirectory(dir / "slashes//and/", 0755, true), 0);
  EXPECT_TRUE(manager.isDirectory(dir / "slashes/and"));
  dir.file("file");
  EXPECT_EQ(manager.createDirectory(dir / "file", 0755, true), EEXIST);
  EXPECT_EQ(manager.createDirectory(dir / "file/below", 0755, true), ENOTDIR);
}

TEST_F(FileSystemManagerTest, CreateDirectoryReturns0WhenThePlatformFailsWithoutSayingWhy) {
  files.fail("createDirectory", FileOutcome::failureWithoutCode());
  EXPECT_EQ(manager.createDirectory(dir / "a", 0755, true), 0);
  EXPECT_FALSE(manager.itemExists(dir / "a"));
}

TEST_F(FileSystemManagerTest, CreateDirectoryHasNoOwnerNamesAndWithOwnerHandsThemOn) {
  EXPECT_EQ(manager.createDirectory(dir / "a", 0755, false), 0);
  EXPECT_EQ(files.createdWith, (std::pair<std::string, std::string>("", "")));
  (void)manager.createDirectoryWithOwner(dir / "b", 0755, "root", "root", false);
  EXPECT_EQ(files.createdWith, (std::pair<std::string, std::string>("root", "root")));
  EXPECT_EQ(manager.createDirectoryWithOwner(dir / "c", 0755, "no such account", "", false), EINVAL);
  EXPECT_FALSE(manager.itemExists(dir / "c"));
}

TEST_F(FileSystemManagerTest, ItemExistsFollowsLinks) {
  dir.file("file");
  dir.link("good", "file");
  dir.link("bad", "nowhere");
  EXPECT_TRUE(manager.itemExists(dir / "file"));
  EXPECT_TRUE(manager.itemExists(dir / "good"));
  EXPECT_FALSE(manager.itemExists(dir / "bad"));
  EXPECT_FALSE(manager.itemExists(dir / "file/x"));
}

TEST_F(FileSystemManagerTest, ListDirectoryClearsTheListAndGivesNamesOrWholePaths) {
  dir.file("d/a");
  dir.file("d/.hidden");
  dir.file("d/sub/below");
  std::vector<std::string> entries{"stale"};
  EXPECT_EQ(manager.listDirectory(dir / "d", &entries, false), 0);
  std::sort(entries.begin(), entries.end());
  EXPECT_EQ(entries, (std::vector<std::string>{".hidden", "a", "sub"}));
  for (const std::string& path : {dir / "d", dir / "d/"}) {
    EXPECT_EQ(manager.listDirectory(path, &entries, true), 0);
    std::sort(entries.begin(), entries.end());
    EXPECT_EQ(entries, (std::vector<std::string>{dir / "d/.hidden", dir / "d/a", dir / "d/sub"}));
  }
  EXPECT_EQ(manager.listDirectory(dir / "none", &entries, false), ENOENT);
  EXPECT_TRUE(entries.empty());
}

TEST_F(FileSystemManagerTest, FindEntryGivesTheFirstNameWithThePrefix) {
  dir.file("d/beta");
  dir.file("d/bell");
  dir.file("d/alpha");
  std::string path = "stale";
  EXPECT_EQ(manager.findEntry(dir / "d", "be", &path), 0);
  EXPECT_EQ(path, dir / "d/bell");
  EXPECT_EQ(manager.findEntry(dir / "d", "gamma", &path), ENOENT);
  EXPECT_EQ(path, "");
  EXPECT_EQ(manager.findEntry(dir / "none", "a", &path), ENOENT);
}

TEST_F(FileSystemManagerTest, RemoveItemRemovesTreesAndGivesTheCodeForWhatIsMissing) {
  dir.file("tree/sub/file");
  dir.link("tree/out", dir.file("outside", "kept"));
  EXPECT_EQ(manager.removeItem(dir / "tree"), 0);
  EXPECT_FALSE(isThere(dir / "tree"));
  EXPECT_EQ(contentOf(dir / "outside"), "kept");
  EXPECT_EQ(manager.removeItem(dir / "tree"), ENOENT);
}

// ---- paths and links

TEST_F(FileSystemManagerTest, BaseAndDirectoryNamesAreThoseOfThePathCutAt1023Bytes) {
  EXPECT_EQ(manager.baseName("/a/b/c"), "c");
  EXPECT_EQ(manager.baseName("/a/b/c/"), "c");
  EXPECT_EQ(manager.baseName("/"), "/");
  EXPECT_EQ(manager.baseName(""), ".");
  EXPECT_EQ(manager.directoryName("/a/b/c"), "/a/b");
  EXPECT_EQ(manager.directoryName("c"), ".");
  const std::string longPath = "/d/" + std::string(1100, 'n') + "/tail";
  EXPECT_EQ(manager.baseName(longPath), std::string(1020, 'n'));
  EXPECT_EQ(manager.directoryName(longPath), "/d");
}

TEST_F(FileSystemManagerTest, ResolvePathGivesTheRealPathOrNothing) {
  dir.file("real/file");
  dir.link("link", "real");
  EXPECT_EQ(manager.resolvePath(dir / "link/../link/file"), dir / "real/file");
  EXPECT_EQ(manager.resolvePath(dir / "missing"), "");
}

TEST_F(FileSystemManagerTest, ReadLinkGivesAtMost1023BytesOfTheTarget) {
  dir.link("link", "target");
  dir.link("long", std::string(1500, 't'));
  EXPECT_EQ(manager.readLink(dir / "link"), "target");
  EXPECT_EQ(manager.readLink(dir / "long"), std::string(1023, 't'));
  EXPECT_EQ(manager.readLink(dir.file("file")), "");
  EXPECT_EQ(manager.readLink(dir / "missing"), "");
}

TEST_F(FileSystemManagerTest, IsSymbolicLinkIsFalseForAMissingPathAndForARegularFile) {
  EXPECT_FALSE(manager.isSymbolicLink(dir / "missing"));
  EXPECT_FALSE(manager.isSymbolicLink(dir.file("file")));
  EXPECT_FALSE(manager.isSymbolicLink(dir.directory("directory")));
  ASSERT_EQ(::mknod((dir / "socket").c_str(), S_IFSOCK | 0600, 0), 0);
  EXPECT_FALSE(manager.isSymbolicLink(dir / "socket"));  // 0xC000: all the bits are compared here
  EXPECT_TRUE(manager.isSymbolicLink(dir.link("link", "nowhere")));
}

TEST_F(FileSystemManagerTest, CreateSymbolicLinkReturnsErrno) {
  EXPECT_EQ(manager.createSymbolicLink(dir / "link", "target"), 0);
  EXPECT_EQ(manager.readLink(dir / "link"), "target");
  EXPECT_EQ(manager.createSymbolicLink(dir / "link", "target"), EEXIST);
}

TEST_F(FileSystemManagerTest, IsDirectoryIsTrueOnlyForDirectories) {
  EXPECT_TRUE(manager.isDirectory(dir.directory("d")));
  EXPECT_TRUE(manager.isDirectory(dir.link("l", "d")));
  EXPECT_FALSE(manager.isDirectory(dir.file("f")));
  EXPECT_FALSE(manager.isDirectory(dir / "missing"));
}

TEST_F(FileSystemManagerTest, CreateEmptyFileTruncatesOrMakesAFile) {
  EXPECT_TRUE(manager.createEmptyFile(dir / "new"));
  EXPECT_EQ(contentOf(dir / "new"), "");
  EXPECT_TRUE(manager.createEmptyFile(dir.file("full", "content")));
  EXPECT_EQ(contentOf(dir / "full"), "");
  EXPECT_FALSE(manager.createEmptyFile(dir / "no/such/directory/file"));
}

// ---- contents

TEST_F(FileSystemManagerTest, DictionariesAreWrittenAsXmlAndReadBackFromEitherFormat) {
  const PropertyList dictionary = PropertyList::dictionary({{"Carrier", PropertyList::string("Häkå")}});
  EXPECT_TRUE(manager.writeDictionary(dir / "d.plist", dictionary));
  EXPECT_TRUE(contentOf(dir / "d.plist").starts_with("<?xml"));
  EXPECT_EQ(manager.readDictionary(dir / "d.plist"), dictionary);
  EXPECT_TRUE(manager.writePropertyList(dir / "b.plist", dictionary, PropertyListFormat::binary));
  EXPECT_TRUE(contentOf(dir / "b.plist").starts_with("bplist00"));
  EXPECT_EQ(manager.readDictionary(dir / "b.plist"), dictionary);
}

TEST_F(FileSystemManagerTest, ReadDictionaryGivesNothingForWhatIsNoDictionaryFile) {
  EXPECT_FALSE(manager.readDictionary(dir / "missing"));
  EXPECT_FALSE(manager.readDictionary(dir.file("text", "no property list")));
  EXPECT_FALSE(manager.readDictionary(dir.directory("directory")));
  EXPECT_TRUE(manager.writePropertyList(dir / "array", PropertyList::array({PropertyList::boolean(true)}),
                                        PropertyListFormat::xml));
  EXPECT_FALSE(manager.readDictionary(dir / "array"));
  // A FIFO would wait for a writer, a device has no end.
  ASSERT_EQ(::mkfifo((dir / "fifo").c_str(), 0600), 0);
  EXPECT_FALSE(manager.readDictionary(dir / "fifo"));
  EXPECT_FALSE(manager.readDictionary("/dev/zero"));
}

TEST_F(FileSystemManagerTest, ReadDataGivesTheBytesOrNothing) {
  EXPECT_EQ(manager.readData(dir.file("file", std::string("a\0b", 3))), std::string("a\0b", 3));
  EXPECT_EQ(manager.readData(dir.file("empty")), "");
  EXPECT_EQ(manager.readData(dir / "missing"), std::nullopt);
}

TEST_F(FileSystemManagerTest, WritingWithoutADictionaryOrDataIsFalseAndTouchesNothing) {
  const std::string file = dir.file("file", "kept");
  EXPECT_FALSE(manager.writeDictionary(file, PropertyList()));
  EXPECT_FALSE(manager.writeDictionary(file, PropertyList::boolean(true)));
  EXPECT_FALSE(manager.writePropertyList(file, PropertyList(), PropertyListFormat::xml));
  EXPECT_FALSE(manager.writeData(file, nullptr));
  EXPECT_EQ(contentOf(file), "kept");
}

TEST_F(FileSystemManagerTest, WriteDataReplacesTheFileAndKeepsItsMode) {
  const std::string file = dir.file("file", "old");
  ASSERT_EQ(::chmod(file.c_str(), 0640), 0);
  const std::string data = "new";
  EXPECT_TRUE(manager.writeData(file, &data));
  EXPECT_EQ(contentOf(file), "new");
  EXPECT_EQ(statOf(file).st_mode & 07777, 0640u);
  files.fail("writeFileAtomically", FileOutcome::failure(EIO));
  files.fail("writeFile", FileOutcome::failure(EIO));
  EXPECT_FALSE(manager.writeData(file, &data));
  EXPECT_FALSE(manager.writeDictionary(file, PropertyList::dictionary({})));
  EXPECT_FALSE(manager.writePropertyList(file, PropertyList::boolean(true), PropertyListFormat::xml));
}

}  // namespace
}  // namespace brenvik

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
//
// File systems that know less than the usual ones: no files without a name, no flags of rename, no link to an
// open file. The calls are refused here, because no such file system is to be had everywhere.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <algorithm>
#include <cstdarg>

#include "platform/base/fakes/FailingCalls.h"
#include "platform/files/fakes/TemporaryDirectory.h"
#include "platform/files/linux/LinuxFileManager.h"

extern "C" int openat(int directory, const char* path, int flags, ...) {
  const bool isUnnamed = (flags & O_TMPFILE) == O_TMPFILE;
  if (isUnnamed && brenvik::FailingCall::failsNow("openat(O_TMPFILE)")) return -1;
  mode_t mode = 0;
  if (isUnnamed || (flags & O_CREAT) != 0) {
    va_list arguments;
    va_start(arguments, flags);
    mode = va_arg(arguments, mode_t);
    va_end(arguments);
  }
  return static_cast<int>(::syscall(SYS_openat, directory, path, flags, mode));
}
extern "C" int renameat2(int fromFolder, const char* from, int toFolder, const char* to,
                         unsigned flags) noexcept {
  if (brenvik::FailingCall::failsNow("renameat2")) return -1;
  return static_cast<int>(::syscall(SYS_renameat2, fromFolder, from, toFolder, to, flags));
}
extern "C" int linkat(int fromFolder, const char* from, int toFolder, const char* to, int flags) noexcept {
  if ((flags & AT_EMPTY_PATH) != 0 && brenvik::FailingCall::failsNow("linkat(AT_EMPTY_PATH)")) return -1;
  return static_cast<int>(::syscall(SYS_linkat, fromFolder, from, toFolder, to, flags));
}

namespace brenvik {
namespace {

constexpr FileOutcome kSuccess = FileOutcome::success();
constexpr auto kAlways = FailingCall::HowOften::always;

class PlainFileSystemTest : public testing::Test {
 protected:
  FileOutcome copy(const char* from, const char* to, IfPresent ifPresent = IfPresent::fail) {
    return files.copyItem(dir / from, dir / to, ifPresent);
  }
  FileOutcome move(const char* from, const char* to, IfPresent ifPresent = IfPresent::fail) {
    return files.moveItem(dir / from, dir / to, ifPresent);
  }
  // What stands in the directory, hidden leftovers included.
  std::vector<std::string> names() {
    std::vector<std::string> found;
    EXPECT_EQ(files.listDirectory(dir.path(), &found), kSuccess);
    std::sort(found.begin(), found.end());
    return found;
  }
  using Names = std::vector<std::string>;

  TemporaryDirectory dir;
  LinuxFileManager files;
};

TEST_F(PlainFileSystemTest, WithoutUnnamedFilesACopyIsMadeUnderAHiddenNameOfWhichNothingStays) {
  for (const int error : {EOPNOTSUPP, EISDIR, EINVAL, ENOENT}) {
    const FailingCall unknown("openat(O_TMPFILE)", error, 0, kAlways);
    dir.file("source", "new");
    EXPECT_EQ(copy("source", "copy"), kSuccess) << error;
    EXPECT_EQ(contentOf(dir / "copy"), "new");
    EXPECT_EQ(copy("source", "copy"), FileOutcome::failure(EEXIST)) << error;
    dir.file("source", "newer");
    EXPECT_EQ(copy("source", "copy", IfPresent::replaceNonDirectory), kSuccess) << error;
    EXPECT_EQ(contentOf(dir / "copy"), "newer");
    EXPECT_EQ(names(), (Names{"copy", "source"}));
    EXPECT_EQ(unknown.failures(), 2);
    EXPECT_EQ(files.removeItem(dir / "copy"), kSuccess);
  }
}

TEST_F(PlainFileSystemTest, AnyOtherRefusalOfAnUnnamedFileIsTheCopysFailure) {
  dir.file("source", "new");
  const FailingCall full("openat(O_TMPFILE)", ENOSPC);
  EXPECT_EQ(copy("source", "copy"), FileOutcome::failure(ENOSPC));
  EXPECT_EQ(names(), (Names{"source"}));
}

TEST_F(PlainFileSystemTest, AHiddenFileThatCannotBeShownIsRemoved) {
  const FailingCall unknown("openat(O_TMPFILE)", EOPNOTSUPP, 0, kAlways);
  const FailingCall stuck("renameat2", EIO);
  dir.file("source", "new");
  EXPECT_EQ(copy("source", "copy"), FileOutcome::failure(EIO));
  EXPECT_EQ(names(), (Names{"source"}));
}

TEST_F(PlainFileSystemTest, WithoutTheFlagsOfRenameNothingThatIsThereIsLost) {
  for (const int error : {EINVAL, ENOSYS}) {
    const FailingCall unknown("renameat2", error, 0, kAlways);
    dir.file("tree/file", "content");
    dir.file("old", "old");
    EXPECT_EQ(copy("tree", "copy"), kSuccess) << error;
    EXPECT_EQ(contentOf(dir / "copy/file"), "content");
    EXPECT_EQ(copy("tree", "old"), FileOutcome::failure(EEXIST)) << error;
    EXPECT_EQ(contentOf(dir / "old"), "old");
    EXPECT_EQ(move("tree", "old"), FileOutcome::failure(EEXIST)) << error;
    EXPECT_EQ(contentOf(dir / "old"), "old");
    EXPECT_EQ(move("tree", "moved"), kSuccess) << error;
    EXPECT_EQ(names(), (Names{"copy", "moved", "old"}));
    EXPECT_EQ(contentOf(dir / "moved/file"), "content");
    for (const char* const name : {"copy", "moved", "old"}) EXPECT_EQ(files.removeItem(dir / name), kSuccess);
  }
}

TEST_F(PlainFileSystemTest, WithoutTheFlagsOfRenameADirectoryStillTakesTheNameOfAFile) {
  const FailingCall unknown("renameat2", EINVAL, 0, kAlways);
  dir.file("tree/file", "content");
  dir.file("old", "old");
  EXPECT_EQ(copy("tree", "old", IfPresent::replaceNonDirectory), kSuccess);
  EXPECT_EQ(contentOf(dir / "old/file"), "content");
  EXPECT_EQ(copy("tree", "old", IfPresent::replaceNonDirectory), FileOutcome::failure(EEXIST));
  EXPECT_EQ(names(), (Names{"old", "tree"}));
}

TEST_F(PlainFileSystemTest, AnOpenFileThatMayNotBeLinkedIsLinkedByItsPathInProc) {
  const FailingCall notPermitted("linkat(AT_EMPTY_PATH)", ENOENT, 0, kAlways);
  dir.file("source", "new");
  dir.file("old", "old");
  EXPECT_EQ(copy("source", "copy"), kSuccess);
  EXPECT_EQ(contentOf(dir / "copy"), "new");
  EXPECT_EQ(copy("source", "old"), FileOutcome::failure(EEXIST));
  EXPECT_EQ(copy("source", "old", IfPresent::replaceNonDirectory), kSuccess);
  EXPECT_EQ(contentOf(dir / "old"), "new");
  EXPECT_EQ(names(), (Names{"copy", "old", "source"}));
}

}  // namespace
}  // namespace brenvik

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
//
// File systems that know less than the usual ones: no files without a name, no flags of rename, no link to an
// open file. The calls are refused here, because no such file system is to be had everywhere. And disks that
// do not keep what they were given, processes that are killed between two calls, and strangers who rename
// between two calls.
#include <dlfcn.h>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <linux/fs.h>
#include <sys/ioctl.h>
#include <sys/mount.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <algorithm>
#include <cstdarg>
#include <functional>

#include "platform/base/fakes/FailingCalls.h"
#include "platform/files/fakes/ChildProcesses.h"
#include "platform/files/fakes/TemporaryDirectory.h"
#include "platform/files/linux/LinuxFileManager.h"

namespace {

// Is told of each directory before it is opened by its name.
std::function<void(const char*)> beforeOpening;  // NOLINT
// Is told of each item before it is held fast on the disk.
std::function<void(int)> beforeSyncing;  // NOLINT

}  // namespace

extern "C" int openat(int directory, const char* path, int flags, ...) {
  if (beforeOpening && (flags & (O_DIRECTORY | O_PATH)) == O_DIRECTORY) beforeOpening(path);
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
// What openat() without a mode becomes where the C library's headers check calls (_FORTIFY_SOURCE).
extern "C" int checkedOpenat(int directory, const char* path, int flags) __asm__("__openat_2");
extern "C" int checkedOpenat(int directory, const char* path, int flags) {
  return openat(directory, path, flags, 0);
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

extern "C" int renameat(int fromFolder, const char* from, int toFolder, const char* to) noexcept {
  if (brenvik::FailingCall::failsNow("renameat, and death")) ::_exit(9);
  return static_cast<int>(::syscall(SYS_renameat2, fromFolder, from, toFolder, to, 0));
}
extern "C" int fchownat(int folder, const char* path, uid_t uid, gid_t gid, int flags) noexcept {
  if (brenvik::FailingCall::failsNow("fchownat") || brenvik::FailingCall::failsNow("fchownat again"))
    return -1;
  return static_cast<int>(::syscall(SYS_fchownat, folder, path, uid, gid, flags));
}
extern "C" int fsync(int file) {
  if (beforeSyncing) beforeSyncing(file);
  if (brenvik::FailingCall::failsNow("fsync")) return -1;
  return static_cast<int>(::syscall(SYS_fsync, file));
}
extern "C" int syncfs(int file) noexcept {
  if (brenvik::FailingCall::failsNow("syncfs")) return -1;
  return static_cast<int>(::syscall(SYS_syncfs, file));
}
extern "C" ssize_t copy_file_range(int from, off64_t* fromOffset, int to, off64_t* toOffset, std::size_t size,
                                   unsigned flags) {
  if (brenvik::FailingCall::failsNow("copy_file_range")) return -1;
  return ::syscall(SYS_copy_file_range, from, fromOffset, to, toOffset, size, flags);
}
extern "C" int ioctl(int file, unsigned long request, ...) noexcept {
  va_list arguments;
  va_start(arguments, request);
  const unsigned long argument = va_arg(arguments, unsigned long);
  va_end(arguments);
  if (request == FICLONE && brenvik::FailingCall::failsNow("ioctl(FICLONE)")) return -1;
  return static_cast<int>(::syscall(SYS_ioctl, file, request, argument));
}
extern "C" int fsetxattr(int file, const char* name, const void* value, std::size_t size,
                         int flags) noexcept {
  if (brenvik::FailingCall::failsNow("fsetxattr")) return -1;
  return static_cast<int>(::syscall(SYS_fsetxattr, file, name, value, size, flags));
}
extern "C" int unlinkat(int folder, const char* name, int flags) noexcept {
  if (flags == 0 && brenvik::FailingCall::failsNow("unlinkat of no directory")) return -1;
  return static_cast<int>(::syscall(SYS_unlinkat, folder, name, flags));
}
extern "C" int mkdirat(int folder, const char* name, mode_t mode) noexcept {
  if (brenvik::FailingCall::failsNow("mkdirat")) return -1;
  return static_cast<int>(::syscall(SYS_mkdirat, folder, name, mode));
}
extern "C" int fchmod(int file, mode_t mode) noexcept {
  if (brenvik::FailingCall::failsNow("fchmod")) return -1;
  return static_cast<int>(::syscall(SYS_fchmod, file, mode));
}
extern "C" int fchmodat(int folder, const char* name, mode_t mode, int flags) noexcept {
  if (brenvik::FailingCall::failsNow("fchmodat")) return -1;
  // Not every kernel has a call that knows the flags.
  static const auto next = reinterpret_cast<decltype(&fchmodat)>(::dlsym(RTLD_NEXT, "fchmodat"));
  return next(folder, name, mode, flags);
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

TEST_F(PlainFileSystemTest, WithoutUnnamedFilesAnAtomicWriteStillReplacesNoDirectory) {
  const FailingCall unknown("openat(O_TMPFILE)", EOPNOTSUPP, 0, kAlways);
  dir.directory("directory");
  EXPECT_FALSE(files.writeFileAtomically(dir / "directory", "new"));
  EXPECT_EQ(names(), (Names{"directory"}));
  dir.file("file", "old");
  EXPECT_TRUE(files.writeFileAtomically(dir / "file", "new"));
  EXPECT_EQ(contentOf(dir / "file"), "new");
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

TEST_F(PlainFileSystemTest, WhatTheKernelCannotCopyIsReadAndWrittenAndAnyOtherFailureIsTheCopys) {
  // Too long to be read at once, too short for a mapping.
  const std::string content(200'000, 'c');
  dir.file("source", content);
  const auto expectAfter = [&](int cloning, int copying, const FileOutcome& expected) {
    const FailingCall clone("ioctl(FICLONE)", cloning);
    const FailingCall range("copy_file_range", copying);
    EXPECT_EQ(copy("source", "copy"), expected) << cloning << ", " << copying;
    EXPECT_EQ(clone.failures(), 1);
    if (expected.succeeded()) {
      EXPECT_EQ(range.failures(), 1);
      EXPECT_TRUE(contentOf(dir / "copy") == content) << cloning << ", " << copying;
      EXPECT_EQ(files.removeItem(dir / "copy"), kSuccess);
    }
    EXPECT_EQ(names(), (Names{"source"}));
  };
  for (const int unsupported : {EXDEV, EINVAL, ENOSYS, EOPNOTSUPP, ENOTTY, EPERM, ETXTBSY}) {
    expectAfter(unsupported, unsupported, kSuccess);
  }
  expectAfter(EXDEV, EINTR, kSuccess);
  for (const int other : {EIO, ENOSPC, EDQUOT, EFBIG}) {
    expectAfter(other, EXDEV, FileOutcome::failure(other));
    expectAfter(EXDEV, other, FileOutcome::failure(other));
  }
}

TEST_F(PlainFileSystemTest, AKernelThatCannotCopyIsAskedOncePerTree) {
  const std::string content(200'000, 'c');
  for (const char* const name : {"tree/a", "tree/b", "tree/c"}) dir.file(name, content);
  const FailingCall clone("ioctl(FICLONE)", EOPNOTSUPP, 0, kAlways);
  const FailingCall range("copy_file_range", ENOSYS, 0, kAlways);
  EXPECT_EQ(copy("tree", "copy"), kSuccess);
  EXPECT_EQ(clone.failures(), 1);
  EXPECT_EQ(range.failures(), 1);
  for (const char* const name : {"copy/a", "copy/b", "copy/c"}) EXPECT_TRUE(contentOf(dir / name) == content);
}

TEST_F(PlainFileSystemTest, AnAttributeThatTheDiskCannotTakeEndsTheCopyAndOneThatItDoesNotKnowDoesNot) {
  const std::string source = dir.file("source", "x");
  if (::setxattr(source.c_str(), "user.note", "value", 5, 0) != 0) GTEST_SKIP() << "no attributes here";
  for (const int error : {ENOSPC, EDQUOT, EIO}) {
    const FailingCall full("fsetxattr", error);
    EXPECT_EQ(copy("source", "copy"), FileOutcome::failure(error));
    EXPECT_EQ(names(), (Names{"source"}));
  }
  for (const int error : {ENOTSUP, EPERM, EACCES, E2BIG}) {
    const FailingCall unknown("fsetxattr", error);
    EXPECT_EQ(copy("source", "copy"), kSuccess) << error;
    EXPECT_EQ(unknown.failures(), 1);
    EXPECT_EQ(files.removeItem(dir / "copy"), kSuccess);
  }
}

TEST_F(PlainFileSystemTest, APipeWhoseModeCannotBeSetIsNotCopied) {
  ASSERT_EQ(::mkfifo((dir / "pipe").c_str(), 0640), 0);
  const FailingCall broken("fchmodat", EIO);
  EXPECT_EQ(copy("pipe", "copy"), FileOutcome::failure(EIO));
  EXPECT_EQ(names(), (Names{"pipe"}));
}

TEST_F(PlainFileSystemTest, AnOrdinaryUsersClosedDirectoryIsOpenOnlyUntilItHasItsName) {
  ASSERT_EQ(::chmod(dir.path().c_str(), 0777), 0);
  dir.directory("closed");
  ASSERT_EQ(::chmod((dir / "closed").c_str(), 0555), 0);
  const pid_t child = ::fork();
  if (child == 0) {
    if (::geteuid() == 0 && (::setresgid(4712, 4712, 4712) != 0 || ::setresuid(4711, 4711, 4711) != 0)) {
      ::_exit(9);
    }
    EXPECT_EQ(copy("closed", "copy"), kSuccess);
    EXPECT_EQ(statOf(dir / "copy").st_mode & 07777, 0555u);
    {
      // The copy's own mode comes first, then the opening.
      const FailingCall broken("fchmod", EIO, 1);
      EXPECT_EQ(copy("closed", "second"), FileOutcome::failure(EIO));
      EXPECT_EQ(names(), (Names{"closed", "copy"}));
    }
    const FailingCall broken("fchmod", EIO, 2);
    EXPECT_EQ(copy("closed", "second"), FileOutcome::failure(EIO));
    EXPECT_EQ(broken.failures(), 1);
    std::fflush(nullptr);
    ::_exit(HasFailure() ? 1 : 0);
  }
  int status = -1;
  ::waitpid(child, &status, 0);
  EXPECT_EQ(status, 0);
}

TEST_F(PlainFileSystemTest, ADescriptorThatIsZeroIsAsGoodAsAnyOther) {
  dir.file("tree/sub/file", "x");
  const pid_t child = ::fork();
  if (child == 0) {
    int wanted = 0;
    for (int opened = 1; opened > wanted; ++wanted) {
      opened = 0;
      beforeOpening = [&](const char*) {
        if (opened++ == wanted) ::close(STDIN_FILENO);
      };
      EXPECT_EQ(copy("tree", "copy"), kSuccess) << wanted;
      beforeOpening = nullptr;
      EXPECT_EQ(contentOf(dir / "copy/sub/file"), "x") << wanted;
      EXPECT_EQ(files.removeItem(dir / "copy"), kSuccess);
      EXPECT_TRUE(::fcntl(STDIN_FILENO, F_GETFD) == -1 || opened <= wanted) << "is still open";
      (void)::open("/dev/null", O_RDONLY | O_CLOEXEC);
    }
    EXPECT_GT(wanted, 5);
    std::fflush(nullptr);
    ::_exit(HasFailure() ? 1 : 0);
  }
  int status = -1;
  ::waitpid(child, &status, 0);
  EXPECT_EQ(status, 0);
}

// ---- killed between two calls

TEST_F(PlainFileSystemTest, WhatAProcessKilledBeforeItsLastRenameLeftGoesWithTheNextOperation) {
  dir.file("source", "new");
  dir.file("old", "old");
  const auto dieWithin = [&](const std::function<void()>& work) {
    const pid_t child = ::fork();
    if (child == 0) {
      const FailingCall death("renameat, and death", EIO);
      work();
      ::_exit(0);
    }
    int status = 0;
    ::waitpid(child, &status, 0);
    EXPECT_EQ(WEXITSTATUS(status), 9);
    EXPECT_EQ(names().size(), 3u);  // the leftover
    EXPECT_EQ(contentOf(dir / "old"), "old");
    EXPECT_EQ(copy("source", "another"), kSuccess);
    EXPECT_EQ(names(), (Names{"another", "old", "source"}));
    EXPECT_EQ(files.removeItem(dir / "another"), kSuccess);
  };
  dieWithin([&] { (void)files.placeLink(dir / "old", "target"); });
  dieWithin([&] { (void)copy("source", "old", IfPresent::replaceNonDirectory); });
  const FailingCall unknown("openat(O_TMPFILE)", EOPNOTSUPP, 0, kAlways);
  dieWithin([&] { (void)copy("source", "old", IfPresent::replaceNonDirectory); });
}

// ---- disks that fail

TEST_F(PlainFileSystemTest, ACopyThatDoesNotReachTheDiskShowsNothing) {
  dir.file("source", "new");
  dir.file("tree/file", "new");
  dir.file("old", "old");
  const auto durably = [&](const char* from, const char* to, IfPresent ifPresent = IfPresent::fail) {
    return files.copyItem(dir / from, dir / to, ifPresent, Durability::onReturn);
  };
  {
    const FailingCall broken("fsync", EIO);
    EXPECT_EQ(durably("source", "copy"), FileOutcome::failure(EIO));
  }
  {
    const FailingCall broken("fsync", EIO);
    EXPECT_EQ(durably("source", "old", IfPresent::replaceNonDirectory), FileOutcome::failure(EIO));
    EXPECT_EQ(contentOf(dir / "old"), "old");
  }
  {
    const FailingCall broken("syncfs", EIO);
    EXPECT_EQ(durably("tree", "copy"), FileOutcome::failure(EIO));
  }
  EXPECT_EQ(names(), (Names{"old", "source", "tree"}));
  // A file system that has nothing to wait for.
  const FailingCall unknown("fsync", EINVAL, 0, kAlways);
  EXPECT_EQ(durably("source", "copy"), kSuccess);
  EXPECT_EQ(unknown.failures(), 2);  // the file and its name
}

TEST_F(PlainFileSystemTest, AnAnswerWaitsForTheNamesAndSaysWhenTheyAreLost) {
  dir.file("source", "x");
  dir.directory("to");
  const auto failsWithout = [&](const char* what, int earlier, const std::function<FileOutcome()>& work) {
    const FailingCall broken("fsync", EIO, earlier);
    EXPECT_EQ(work(), FileOutcome::failure(EIO)) << what;
    EXPECT_EQ(broken.failures(), 1) << what;
  };
  failsWithout("copy", 1, [&] {
    return files.copyItem(dir / "source", dir / "copy", IfPresent::fail, Durability::onReturn);
  });
  failsWithout("move", 0, [&] {
    return files.moveItem(dir / "copy", dir / "to/moved", IfPresent::fail, Durability::onReturn);
  });
  failsWithout("move, the folder it left", 1, [&] {
    return files.moveItem(dir / "to/moved", dir / "moved", IfPresent::fail, Durability::onReturn);
  });
  failsWithout("directory", 0,
               [&] { return files.createDirectory(dir / "made", {}, Intermediates::mustExist); });
  failsWithout("directories", 1,
               [&] { return files.createDirectory(dir / "a/b", {}, Intermediates::create); });
  failsWithout("link", 0, [&] { return files.placeLink(dir / "link", "target"); });
  failsWithout("replaced link", 0, [&] { return files.placeLink(dir / "link", "other"); });
  failsWithout("removal", 0, [&] { return files.removeEntry(dir / "link"); });
  failsWithout("file", 0, [&] { return files.syncItem(dir / "source"); });
  failsWithout("file's name", 1, [&] { return files.syncItem(dir / "source"); });
}

TEST_F(PlainFileSystemTest, AMovesNewNameIsOnTheDiskBeforeItsOldOneMayGoThere) {
  dir.file("from/item", "x");
  dir.directory("to");
  std::vector<ino_t> synced;
  beforeSyncing = [&](int item) {
    struct stat info {};
    EXPECT_EQ(::fstat(item, &info), 0);
    synced.push_back(info.st_ino);
  };
  EXPECT_EQ(files.moveItem(dir / "from/item", dir / "to/item", IfPresent::fail, Durability::onReturn),
            kSuccess);
  beforeSyncing = nullptr;
  EXPECT_EQ(synced, (std::vector<ino_t>{statOf(dir / "to").st_ino, statOf(dir / "from").st_ino}));
}

TEST_F(PlainFileSystemTest, AMoveAcrossWhoseCopyDoesNotReachTheDiskKeepsTheSource) {
  dir.file("tree/file", "x");
  dir.file("single", "s");
  dir.directory("disk");
  inPrivateMounts([&] {
    mountSmallDisk(dir / "disk", 1024);
    dir.file("disk/old", "old");
    const auto staysWhole = [&](const char* call, int earlier, const char* from, const char* to) {
      const FailingCall broken(call, EIO, earlier);
      EXPECT_EQ(move(from, to, IfPresent::replaceNonDirectory), FileOutcome::failure(EIO))
          << call << from << to;
      EXPECT_EQ(broken.failures(), 1);
      EXPECT_EQ(contentOf(dir / "tree/file"), "x");
      EXPECT_EQ(contentOf(dir / "single"), "s");
      EXPECT_EQ(contentOf(dir / "disk/old"), "old");
      EXPECT_EQ(names(), (Names{"disk", "single", "tree"}));
      EXPECT_EQ(std::distance(std::filesystem::directory_iterator(dir / "disk"), {}), 1);
    };
    for (const char* const to : {"disk/new", "disk/old"}) {
      staysWhole("syncfs", 0, "tree", to);  // the tree's data
      staysWhole("fsync", 0, "tree", to);   // its name
      staysWhole("fsync", 0, "single", to);
      staysWhole("fsync", 1, "single", to);
    }
    EXPECT_EQ(move("tree", "disk/old", IfPresent::replaceNonDirectory), kSuccess);
    EXPECT_EQ(contentOf(dir / "disk/old/file"), "x");
    EXPECT_EQ(names(), (Names{"disk", "single"}));
    // The last thing on the way: it is there, and may be at its old place again after a power cut.
    const FailingCall broken("fsync", EIO, 2);
    EXPECT_EQ(move("single", "disk/single"), FileOutcome::failure(EIO));
    EXPECT_EQ(broken.failures(), 1);
    EXPECT_EQ(contentOf(dir / "disk/single"), "s");
    EXPECT_EQ(names(), (Names{"disk"}));
  });
}

TEST_F(PlainFileSystemTest, AMoveAwayFromAFullDiskTellsWhatItCouldNotFinish) {
  dir.directory("disk");
  inPrivateMounts([&] {
    ASSERT_EQ(::mount("tmpfs", (dir / "disk").c_str(), "tmpfs", 0, "nr_inodes=3"), 0);
    dir.file("disk/first", "x");
    dir.file("disk/second", "y");
    ASSERT_EQ(::mkdir((dir / "disk/no-more").c_str(), 0700), -1);
    {
      const FailingCall stuck("unlinkat of no directory", EIO);
      EXPECT_EQ(move("disk/first", "moved"), FileOutcome::failure(EIO));
      EXPECT_EQ(stuck.failures(), 1);
      EXPECT_EQ(contentOf(dir / "disk/first"), "x");
      EXPECT_EQ(files.removeItem(dir / "moved"), kSuccess);
    }
    // The file, its new name, and then the name that went.
    const FailingCall broken("fsync", EIO, 2);
    EXPECT_EQ(move("disk/first", "moved"), FileOutcome::failure(EIO));
    EXPECT_EQ(broken.failures(), 1);
    EXPECT_EQ(contentOf(dir / "moved"), "x");
    EXPECT_FALSE(isThere(dir / "disk/first"));
  });
}

TEST_F(PlainFileSystemTest, ALinkThatCannotReplaceADirectoryLeavesNoHiddenOne) {
  dir.file("full/file", "x");
  EXPECT_EQ(files.placeLink(dir / "full", "target"), FileOutcome::failure(ENOTEMPTY));
  EXPECT_EQ(names(), (Names{"full"}));
}

// ---- renames between two calls

TEST_F(PlainFileSystemTest, ALinkThatTakesAFoldersPlaceLeadsNoWalkOutOfTheTree) {
  struct Visitor final : ItemVisitor {
    Next visit(const std::string& subpath, bool) noexcept override {
      seen.push_back(subpath);
      return Next::descend;
    }
    std::vector<std::string> seen;
  } visitor;
  dir.file("outside/theirs", "kept");
  dir.file("tree/sub/own", "x");
  ASSERT_EQ(::chmod((dir / "outside/theirs").c_str(), 0600), 0);
  dir.link("link", dir / "outside");
  // The very moment before the folder is entered, the link stands in its place.
  const auto swapped = [&](const std::function<FileOutcome()>& work) {
    bool isSwapped = false;
    const auto exchange = [&] {
      EXPECT_EQ(::syscall(SYS_renameat2, AT_FDCWD, (dir / "tree/sub").c_str(), AT_FDCWD,
                          (dir / "link").c_str(), RENAME_EXCHANGE),
                0);
    };
    beforeOpening = [&](const char* name) {
      if (isSwapped || std::string_view(name) != "sub") return;
      isSwapped = true;
      exchange();
    };
    const FileOutcome outcome = work();
    beforeOpening = nullptr;
    EXPECT_TRUE(isSwapped);
    EXPECT_EQ(contentOf(dir / "outside/theirs"), "kept");
    EXPECT_EQ(statOf(dir / "outside/theirs").st_mode & 07777, 0600u);
    exchange();
    return outcome;
  };
  EXPECT_EQ(swapped([&] { return files.setAttributesOfTree(dir / "tree", {0700, {}, {}}); }), kSuccess);
  EXPECT_EQ(swapped([&] { return files.enumerateBelow(dir / "tree", visitor); }),
            FileOutcome::failure(ENOTDIR));
  EXPECT_EQ(visitor.seen, Names{"sub"});
  EXPECT_EQ(swapped([&] { return copy("tree", "copied"); }), FileOutcome::failure(ENOTDIR));
  EXPECT_EQ(names(), (Names{"link", "outside", "tree"}));
  EXPECT_EQ(swapped([&] { return files.removeItem(dir / "tree"); }), FileOutcome::failure(ENOTDIR));
  EXPECT_EQ(contentOf(dir / "tree/sub/own"), "x");
}

TEST_F(PlainFileSystemTest, OfATreeTheTopsFailureCountsElseTheLastOneBelow) {
  dir.file("tree/a");
  dir.file("tree/b");
  const ItemAttributes mine{{}, ::getuid(), ::getgid()};
  {
    const FailingCall first("fchownat", EIO);
    const FailingCall second("fchownat again", EDQUOT);
    EXPECT_EQ(files.setAttributesOfTree(dir / "tree", mine), FileOutcome::failure(EDQUOT));
  }
  const FailingCall second("fchownat again", EDQUOT, 1);
  const FailingCall top("fchownat", EIO, 2);
  EXPECT_EQ(files.setAttributesOfTree(dir / "tree", mine), FileOutcome::failure(EIO));
  EXPECT_EQ(second.failures(), 1);
}

}  // namespace
}  // namespace brenvik

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/files/linux/LinuxFileManager.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <linux/fs.h>
#include <sys/file.h>
#include <sys/ioctl.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <sys/sysmacros.h>
#include <sys/wait.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <csignal>
#include <cstdio>
#include <cstring>
#include <functional>
#include <set>
#include <string>
#include <utility>
#include <vector>

#include "platform/base/UniqueFd.h"
#include "platform/files/fakes/ChildProcesses.h"
#include "platform/files/fakes/TemporaryDirectory.h"
#include "platform/files/linux/DirectoryNames.h"

namespace brenvik {
namespace {

constexpr FileOutcome kSuccess = FileOutcome::success();

constexpr FileOutcome failure(int code) { return FileOutcome::failure(code); }

class LinuxFileManagerTest : public testing::Test {
 protected:
  FileOutcome copy(const std::string& from, const std::string& to, IfPresent present = IfPresent::fail) {
    return files.copyItem(dir / from, dir / to, present);
  }
  FileOutcome move(const std::string& from, const std::string& to, IfPresent present = IfPresent::fail) {
    return files.moveItem(dir / from, dir / to, present);
  }
  std::vector<std::string> names(const std::string& of) {
    std::vector<std::string> found;
    EXPECT_EQ(files.listDirectory(dir / of, &found), kSuccess);
    std::sort(found.begin(), found.end());
    return found;
  }

  TemporaryDirectory dir;
  LinuxFileManager files;
};

std::string attributeOf(const std::string& path, const char* name) {
  char value[256];
  const ssize_t size = ::getxattr(path.c_str(), name, value, sizeof value);
  return size < 0 ? "(none)" : std::string(value, static_cast<std::size_t>(size));
}

void setTimes(const std::string& path, time_t accessed, time_t modified) {
  const timespec times[2] = {{accessed, 123}, {modified, 456}};
  ASSERT_EQ(::utimensat(AT_FDCWD, path.c_str(), times, AT_SYMLINK_NOFOLLOW), 0);
}

// ---- copies

TEST_F(LinuxFileManagerTest, ACopiedFileHasTheDataTheModeTheTimesAndTheExtendedAttributes) {
  const std::string source = dir.file("source", std::string("a\0b", 3));
  ASSERT_EQ(::chmod(source.c_str(), 06741), 0);
  const bool attributes = ::setxattr(source.c_str(), "user.note", "value", 5, 0) == 0;
  setTimes(source, 1000, 2000);
  EXPECT_EQ(copy("source", "copy"), kSuccess);
  const struct stat info = statOf(dir / "copy");
  EXPECT_EQ(contentOf(dir / "copy"), std::string("a\0b", 3));
  EXPECT_EQ(info.st_mode & 07777, 06741u);
  EXPECT_EQ(info.st_mtim.tv_sec, 2000);
  EXPECT_EQ(info.st_mtim.tv_nsec, 456);
  EXPECT_EQ(info.st_atim.tv_sec, 1000);
  if (attributes) {
    EXPECT_EQ(attributeOf(dir / "copy", "user.note"), "value");
  }
}

TEST_F(LinuxFileManagerTest, TheUmaskAndASetGroupDirectoryChangeNoPromisedMode) {
  dir.file("tree/file", "x");
  ASSERT_EQ(::chmod((dir / "tree/file").c_str(), 0666), 0);
  ASSERT_EQ(::chmod((dir / "tree").c_str(), 0777), 0);
  dir.directory("to");
  ASSERT_EQ(::chmod((dir / "to").c_str(), 02755), 0);
  for (const mode_t mask : {0077u, 0000u, 0777u}) {
    const mode_t before = ::umask(mask);
    EXPECT_EQ(copy("tree", "to/tree"), kSuccess);
    EXPECT_EQ(copy("tree/file", "to/file"), kSuccess);
    EXPECT_EQ(files.createDirectory(dir / "to/made", {02711, "", ""}, Intermediates::mustExist), kSuccess);
    ::umask(before);
    EXPECT_EQ(statOf(dir / "to/tree").st_mode & 07777, 0777u);
    EXPECT_EQ(statOf(dir / "to/tree/file").st_mode & 07777, 0666u);
    EXPECT_EQ(statOf(dir / "to/file").st_mode & 07777, 0666u);
    EXPECT_EQ(statOf(dir / "to/made").st_mode & 07777, 02711u);
    for (const char* made : {"to/tree", "to/file", "to/made"}) {
      EXPECT_EQ(files.removeItem(dir / made), kSuccess);
    }
  }
}

TEST_F(LinuxFileManagerTest, ADefaultAccessListAboveChangesNoPromisedMode) {
  // Version 2; user rwx, a named user rwx, group ---, mask ---, other ---.
  const unsigned char list[] = {2, 0,  0,   0,   1,   0,   7,  0, 255, 255, 255, 255, 2,   0,  7,
                                0, 77, 0,   0,   0,   4,   0,  0, 0,   255, 255, 255, 255, 16, 0,
                                0, 0,  255, 255, 255, 255, 32, 0, 0,   0,   255, 255, 255, 255};
  dir.file("tree/file", "x");
  ASSERT_EQ(::chmod((dir / "tree/file").c_str(), 0644), 0);
  dir.directory("to");
  if (::setxattr((dir / "to").c_str(), "system.posix_acl_default", list, sizeof list, 0) != 0) {
    GTEST_SKIP() << "no access lists on this file system";
  }
  EXPECT_EQ(copy("tree", "to/tree"), kSuccess);
  EXPECT_EQ(copy("tree/file", "to/file"), kSuccess);
  EXPECT_EQ(statOf(dir / "to/tree/file").st_mode & 07777, 0644u);
  EXPECT_EQ(statOf(dir / "to/file").st_mode & 07777, 0644u);
  EXPECT_EQ(attributeOf(dir / "to/tree/file", "system.posix_acl_access"), "(none)");
}

TEST_F(LinuxFileManagerTest, ACopiedTreeKeepsModesTimesLinksFifosAndSockets) {
  dir.file("tree/sub/file", "x");
  dir.link("tree/link", "../outside");
  dir.directory("tree/empty");
  ASSERT_EQ(::mkfifo((dir / "tree/fifo").c_str(), 0640), 0);
  ASSERT_EQ(::mknod((dir / "tree/socket").c_str(), S_IFSOCK | 0600, 0), 0);
  ASSERT_EQ(::chmod((dir / "tree/sub").c_str(), 0500), 0);
  for (const char* name : {"tree/sub/file", "tree/link", "tree/empty", "tree/fifo", "tree/sub", "tree"}) {
    setTimes(dir / name, 3000, 4000);
  }
  EXPECT_EQ(copy("tree", "copy"), kSuccess);
  EXPECT_EQ(std::filesystem::read_symlink(dir / "copy/link"), "../outside");
  EXPECT_EQ(statOf(dir / "copy/fifo").st_mode, S_IFIFO | 0640u);
  EXPECT_EQ(statOf(dir / "copy/socket").st_mode, S_IFSOCK | 0600u);
  EXPECT_EQ(statOf(dir / "copy/sub").st_mode, S_IFDIR | 0500u);
  for (const char* name : {"copy/sub/file", "copy/link", "copy/empty", "copy/fifo", "copy/sub", "copy"}) {
    EXPECT_EQ(statOf(dir / name).st_mtim.tv_sec, 4000) << name;
  }
  EXPECT_EQ(names("copy"), (std::vector<std::string>{"empty", "fifo", "link", "socket", "sub"}));
  ASSERT_EQ(::chmod((dir / "tree/sub").c_str(), 0700), 0);
  ASSERT_EQ(::chmod((dir / "copy/sub").c_str(), 0700), 0);
}

TEST_F(LinuxFileManagerTest, OwnersAreKeptWhereThatIsPermitted) {
  if (::geteuid() != 0) GTEST_SKIP() << "needs root to give files away";
  dir.file("tree/file", "x");
  ASSERT_EQ(::chown((dir / "tree/file").c_str(), 4711, 4712), 0);
  ASSERT_EQ(::chmod((dir / "tree/file").c_str(), 04755), 0);
  EXPECT_EQ(copy("tree", "copy"), kSuccess);
  EXPECT_EQ(statOf(dir / "copy/file").st_uid, 4711u);
  EXPECT_EQ(statOf(dir / "copy/file").st_gid, 4712u);
  EXPECT_EQ(statOf(dir / "copy/file").st_mode & 07777, 04755u);
  // Also where only one of the two is another's, in files and in folders.
  const struct {
    uid_t uid;
    gid_t gid;
  } owners[] = {{4711, ::getegid()}, {0, 4712}};
  for (const auto& owner : owners) {
    for (const char* const name : {"tree/file", "tree"}) {
      ASSERT_EQ(::chown((dir / name).c_str(), owner.uid, owner.gid), 0);
    }
    dir.file("above/plain", "x");
    std::filesystem::rename(dir / "tree", dir / "above/tree");
    EXPECT_EQ(files.removeItem(dir / "copy"), kSuccess);
    EXPECT_EQ(copy("above", "copy"), kSuccess);
    for (const char* const name : {"copy/tree", "copy/tree/file"}) {
      EXPECT_EQ(statOf(dir / name).st_uid, owner.uid) << name;
      EXPECT_EQ(statOf(dir / name).st_gid, owner.gid) << name;
    }
    std::filesystem::rename(dir / "above/tree", dir / "tree");
  }
}

TEST_F(LinuxFileManagerTest, ATreesFilesOfThisUserKeepAllTheirModeBits) {
  for (const auto& [name, mode] : {std::pair{"set-id", 06755}, {"sticky", 01644}, {"open", 0666}}) {
    ASSERT_EQ(::chmod(dir.file(std::string("tree/") + name, "x").c_str(), static_cast<mode_t>(mode)), 0);
  }
  EXPECT_EQ(copy("tree", "copy"), kSuccess);
  EXPECT_EQ(statOf(dir / "copy/set-id").st_mode & 07777, 06755u);
  EXPECT_EQ(statOf(dir / "copy/sticky").st_mode & 07777, 01644u);
  EXPECT_EQ(statOf(dir / "copy/open").st_mode & 07777, 0666u);
}

TEST_F(LinuxFileManagerTest, AnOrdinaryUsersCopyHasNoSetIdBitOfAnotherOwner) {
  const std::string source = dir.file("source", "x");
  ASSERT_EQ(::chmod(dir.path().c_str(), 0777), 0);
  if (::geteuid() != 0) GTEST_SKIP() << "needs root to prepare another's file";
  ASSERT_EQ(::chmod(source.c_str(), 06755), 0);
  ASSERT_EQ(::mkfifo((dir / "pipe").c_str(), 0600), 0);
  ASSERT_EQ(::chmod((dir / "pipe").c_str(), 06755), 0);
  const pid_t child = ::fork();
  if (child == 0) {
    if (::setresgid(4712, 4712, 4712) != 0 || ::setresuid(4711, 4711, 4711) != 0) ::_exit(9);
    ::_exit(copy("source", "copy").succeeded() && copy("pipe", "copiedPipe").succeeded() ? 0 : 1);
  }
  int status = -1;
  ::waitpid(child, &status, 0);
  EXPECT_EQ(status, 0);
  EXPECT_EQ(statOf(dir / "copy").st_mode & 07777, 0755u);
  EXPECT_EQ(statOf(dir / "copy").st_uid, 4711u);
  EXPECT_EQ(statOf(dir / "copiedPipe").st_mode & 07777, 0755u);
}

TEST_F(LinuxFileManagerTest, HardLinksInsideATreeStayHardLinks) {
  dir.file("tree/a", "shared");
  dir.directory("tree/sub");
  ASSERT_EQ(::link((dir / "tree/a").c_str(), (dir / "tree/sub/b").c_str()), 0);
  ASSERT_EQ(::link((dir / "tree/a").c_str(), (dir / "outside").c_str()), 0);
  EXPECT_EQ(copy("tree", "copy"), kSuccess);
  EXPECT_EQ(statOf(dir / "copy/a").st_ino, statOf(dir / "copy/sub/b").st_ino);
  EXPECT_EQ(statOf(dir / "copy/a").st_nlink, 2u);
  EXPECT_EQ(contentOf(dir / "copy/sub/b"), "shared");
}

TEST_F(LinuxFileManagerTest, ADirectoryOfManyFilesIsCopiedWhole) {
  std::set<std::string> expected;
  for (int i = 0; i < 500; ++i) {
    const std::string name = "f" + std::to_string(i);
    dir.file("tree/" + name, "content of " + name);
    expected.insert(name);
  }
  ASSERT_EQ(::link((dir / "tree/f7").c_str(), (dir / "tree/second").c_str()), 0);
  files.openScope();
  EXPECT_EQ(copy("tree", "copy"), kSuccess);
  files.closeScope();
  for (const std::string& name : expected) EXPECT_EQ(contentOf(dir / ("copy/" + name)), "content of " + name);
  EXPECT_EQ(statOf(dir / "copy/f7").st_ino, statOf(dir / "copy/second").st_ino);
  EXPECT_EQ(names("copy").size(), 501u);
}

// Many directories, one in the other and side by side.
class LargeTreeTest : public LinuxFileManagerTest {
 protected:
  static constexpr int kDirectories = 24;
  static constexpr int kFilesEach = 40;

  static std::string directoryName(int i) {
    return "tree/" + std::string(i % 3 == 0 ? "" : "deep/er/") + std::to_string(i);
  }
  LargeTreeTest() {
    for (int i = 0; i < kDirectories; ++i) {
      for (int k = 0; k < kFilesEach; ++k) {
        const std::string name = directoryName(i) + "/" + std::to_string(k);
        dir.file(name, name);
      }
      dir.link(directoryName(i) + "/link", std::to_string(i));
    }
    // Names of one file in two directories.
    for (int i = 0; i + 1 < kDirectories; i += 2) {
      const std::string first = dir / (directoryName(i) + "/7");
      EXPECT_EQ(::link(first.c_str(), (dir / (directoryName(i + 1) + "/again")).c_str()), 0);
    }
    for (int i = 0; i < kDirectories; ++i) {
      EXPECT_EQ(::chmod((dir / directoryName(i)).c_str(), i % 2 == 0 ? 0555 : 0711), 0);
      setTimes(dir / directoryName(i), 3000, 4000 + i);
    }
    setTimes(dir / "tree", 3000, 5000);
  }
  // An ordinary user removes nothing from a directory closed to writing.
  ~LargeTreeTest() override {
    for (int i = 0; i < kDirectories; ++i) (void)::chmod((dir / directoryName(i)).c_str(), 0755);
  }
};

TEST_F(LargeTreeTest, ATreeOfManyDirectoriesIsCopiedWithEverythingAndRemoved) {
  EXPECT_EQ(copy("tree", "copy"), kSuccess);
  for (int i = 0; i < kDirectories; ++i) {
    const std::string from = directoryName(i);
    const std::string to = "copy" + from.substr(4);
    for (int k = 0; k < kFilesEach; ++k) {
      const std::string name = "/" + std::to_string(k);
      ASSERT_EQ(contentOf(dir / (to + name)), from + name);
      ASSERT_EQ(statOf(dir / (to + name)).st_mtim.tv_nsec, statOf(dir / (from + name)).st_mtim.tv_nsec);
    }
    EXPECT_EQ(std::filesystem::read_symlink(dir / (to + "/link")), std::to_string(i));
    EXPECT_EQ(statOf(dir / to).st_mode & 07777, i % 2 == 0 ? 0555u : 0711u);
    EXPECT_EQ(statOf(dir / to).st_mtim.tv_sec, 4000 + i);
  }
  for (int i = 0; i + 1 < kDirectories; i += 2) {
    const struct stat again = statOf(dir / ("copy" + directoryName(i + 1).substr(4) + "/again"));
    EXPECT_EQ(again.st_ino, statOf(dir / ("copy" + directoryName(i).substr(4) + "/7")).st_ino);
    EXPECT_EQ(again.st_nlink, 2u);
  }
  EXPECT_EQ(statOf(dir / "copy").st_mtim.tv_sec, 5000);
  for (int i = 0; i < kDirectories; ++i) {
    EXPECT_EQ(::chmod((dir / ("copy" + directoryName(i).substr(4))).c_str(), 0755), 0);
  }
  EXPECT_EQ(files.removeItem(dir / "copy"), kSuccess);
  EXPECT_EQ(names(""), (std::vector<std::string>{"tree"}));
}

TEST_F(LargeTreeTest, OnAFullDiskNothingOfTheTreeStaysAndTheSourceIsWhole) {
  dir.directory("disk");
  inPrivateMounts([&] {
    for (const int kibibytes : {200, 1000, 2500, 3500}) {  // it takes 4 KiB a file, and some
      mountSmallDisk(dir / "disk", kibibytes);
      EXPECT_EQ(copy("tree", "disk/copy"), failure(ENOSPC)) << kibibytes;
      EXPECT_EQ(move("tree", "disk/copy"), failure(ENOSPC)) << kibibytes;
      EXPECT_TRUE(names("disk").empty()) << kibibytes;
    }
    for (int i = 0; i < kDirectories; ++i) {
      EXPECT_EQ(names(directoryName(i)).size(), static_cast<std::size_t>(kFilesEach + 1 + i % 2)) << i;
    }
  });
}

TEST_F(LargeTreeTest, AMoveToAnotherMountTakesEverything) {
  dir.directory("disk");
  inPrivateMounts([&] {
    mountSmallDisk(dir / "disk", 16 << 10);
    EXPECT_EQ(move("tree", "disk/copy"), kSuccess);
    EXPECT_FALSE(isThere(dir / "tree"));
    for (int i = 0; i < kDirectories; ++i) {
      const std::string there = "disk/copy" + directoryName(i).substr(4);
      EXPECT_EQ(names(there).size(), static_cast<std::size_t>(kFilesEach + 1 + i % 2)) << i;
      EXPECT_EQ(statOf(dir / there).st_mtim.tv_sec, 4000 + i);
    }
  });
  EXPECT_FALSE(isThere(dir / "tree"));
}

TEST_F(LargeTreeTest, WhatCannotBeRemovedIsPassedOverAndItsDirectoriesStay) {
  if (::geteuid() != 0) GTEST_SKIP() << "mounts on what it removes";
  inPrivateMounts([&] {
    const std::string held = dir / (directoryName(5) + "/7");
    ASSERT_EQ(::mount((dir / (directoryName(4) + "/1")).c_str(), held.c_str(), nullptr, MS_BIND, nullptr), 0);
    EXPECT_EQ(files.removeItem(dir / "tree"), failure(EBUSY));
    EXPECT_EQ(names("tree"), (std::vector<std::string>{"deep"}));
    EXPECT_EQ(names("tree/deep/er"), (std::vector<std::string>{"5"}));
    EXPECT_EQ(names(directoryName(5)), (std::vector<std::string>{"7"}));
  });
}

TEST_F(LinuxFileManagerTest, LargeAndSparseFilesAreCopiedByteForByte) {
  std::string large(3'000'001, '\0');
  for (std::size_t i = 0; i < large.size(); ++i) large[i] = static_cast<char>(i * 2654435761u >> 13);
  dir.file("large", large);
  EXPECT_EQ(copy("large", "large-copy"), kSuccess);
  EXPECT_TRUE(contentOf(dir / "large-copy") == large);
  // The same between two file systems, whatever each of them can do.
  if (::access("/dev/shm", W_OK) == 0) {
    TemporaryDirectory memory("/dev/shm");
    EXPECT_EQ(files.copyItem(dir / "large", memory / "there", IfPresent::fail), kSuccess);
    EXPECT_EQ(files.copyItem(memory / "there", dir / "back", IfPresent::fail), kSuccess);
    EXPECT_TRUE(contentOf(dir / "back") == large);
  }
  // One that shrinks and grows meanwhile: the copy ends, and nobody is killed.
  const std::string changing = dir.file("changing", large);
  const pid_t child = ::fork();
  if (child == 0) {
    for (;;) {
      if (::truncate(changing.c_str(), 100) != 0 || ::truncate(changing.c_str(), 3'000'001) != 0) ::_exit(1);
    }
  }
  for (int i = 0; i < 20; ++i) {
    EXPECT_EQ(copy("changing", "changing-copy"), kSuccess);
    EXPECT_EQ(files.removeItem(dir / "changing-copy"), kSuccess);
  }
  ::kill(child, SIGKILL);
  ::waitpid(child, nullptr, 0);

  const int fd = ::open((dir / "sparse").c_str(), O_WRONLY | O_CREAT | O_CLOEXEC, 0600);
  ASSERT_EQ(::pwrite(fd, "begin", 5, 0), 5);
  ASSERT_EQ(::pwrite(fd, "middle", 6, 5 << 20), 6);
  ASSERT_EQ(::ftruncate(fd, 20 << 20), 0);
  ::close(fd);
  EXPECT_EQ(copy("sparse", "sparse-copy"), kSuccess);
  EXPECT_TRUE(contentOf(dir / "sparse-copy") == contentOf(dir / "sparse"));
  EXPECT_LT(statOf(dir / "sparse-copy").st_blocks * 512, 2 << 20);
}

TEST_F(LinuxFileManagerTest, AFileThatSaysItIsEmptyOrLongerIsCopiedToItsEnd) {
  for (const char* const source :
       {"/proc/version", "/sys/kernel/mm/transparent_hugepage/enabled", "/proc/sys/kernel/ostype"}) {
    const std::string content = contentOf(source);
    if (content == "(none)") continue;
    const std::string name = std::to_string(names("").size());
    EXPECT_EQ(files.copyItem(source, dir / name, IfPresent::fail), kSuccess) << source;
    EXPECT_EQ(contentOf(dir / name), content) << source;
  }
  EXPECT_FALSE(names("").empty());
  dir.file("empty");
  EXPECT_EQ(copy("empty", "empty-copy"), kSuccess);
  EXPECT_EQ(contentOf(dir / "empty-copy"), "");
}

TEST_F(LinuxFileManagerTest, ATreeDeeperThanTheProcessHasDescriptorsIsCopiedListedAndRemoved) {
  constexpr int kDepth = 1500;
  const std::string top = dir.directory("deep");
  int fd = ::open(top.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
  for (int i = 0; i < kDepth; ++i) {
    ASSERT_EQ(::mkdirat(fd, "d", 0755), 0);
    const int next = ::openat(fd, "d", O_RDONLY | O_DIRECTORY | O_CLOEXEC);
    ::close(fd);
    fd = next;
  }
  ASSERT_EQ(::symlinkat("bottom", fd, "end"), 0);
  ::close(fd);
  rlimit usual{};
  ASSERT_EQ(::getrlimit(RLIMIT_NOFILE, &usual), 0);
  const rlimit few{256, usual.rlim_max};
  ASSERT_EQ(::setrlimit(RLIMIT_NOFILE, &few), 0);
  EXPECT_EQ(copy("deep", "copy"), kSuccess);
  struct Counter final : ItemVisitor {
    int count = 0;
    std::string last;
    Next visit(const std::string& subpath, bool) noexcept override {
      ++count;
      last = subpath.substr(subpath.rfind('/') + 1);
      return Next::descend;
    }
  } counter;
  EXPECT_EQ(files.enumerateBelow(dir / "copy", counter), kSuccess);
  EXPECT_EQ(counter.count, kDepth + 1);
  EXPECT_EQ(counter.last, "end");
  EXPECT_EQ(files.removeItem(dir / "deep"), kSuccess);
  EXPECT_EQ(files.removeItem(dir / "copy"), kSuccess);
  ASSERT_EQ(::setrlimit(RLIMIT_NOFILE, &usual), 0);
  EXPECT_TRUE(names("").empty());
}

TEST_F(LinuxFileManagerTest, DevicesAreRefusedAndLeaveNothingBehind) {
  if (::geteuid() != 0) GTEST_SKIP() << "needs root to make a device node";
  dir.file("tree/file", "x");
  if (::mknod((dir / "tree/null").c_str(), S_IFCHR | 0666, makedev(1, 3)) != 0)
    GTEST_SKIP() << "no nodes here";
  EXPECT_EQ(copy("tree", "copy"), failure(EPERM));
  EXPECT_EQ(copy("tree/null", "null"), failure(EPERM));
  EXPECT_EQ(names(""), (std::vector<std::string>{"tree"}));
}

TEST_F(LinuxFileManagerTest, ACopyFailsWithEExistWhenAnythingIsThere) {
  dir.file("file", "new");
  dir.file("there", "old");
  dir.directory("directory");
  dir.link("dangling", "nowhere");
  for (const char* destination : {"there", "directory", "dangling", "directory/", ".", "directory/.."}) {
    EXPECT_EQ(copy("file", destination), failure(EEXIST)) << destination;
  }
  EXPECT_EQ(copy("directory", "there"), failure(EEXIST));
  EXPECT_EQ(contentOf(dir / "there"), "old");
  EXPECT_EQ(copy("file", "no/such/place"), failure(ENOENT));
  EXPECT_EQ(copy("file", "there/below"), failure(ENOTDIR));
  EXPECT_EQ(copy("missing", "new"), failure(ENOENT));
  EXPECT_EQ(files.copyItem(dir / "file", "", IfPresent::fail), failure(ENOENT));
  EXPECT_EQ(files.copyItem(dir / "file", "/", IfPresent::fail), failure(EEXIST));
}

TEST_F(LinuxFileManagerTest, AReplacingCopyTakesTheNameOfAFileOrALinkButNotOfADirectory) {
  dir.file("file", "new");
  dir.file("tree/below", "tree");
  dir.file("precious", "kept");
  dir.link("link", "precious");
  dir.directory("directory");
  EXPECT_EQ(copy("file", "link", IfPresent::replaceNonDirectory), kSuccess);
  EXPECT_TRUE(S_ISREG(statOf(dir / "link").st_mode));
  EXPECT_EQ(contentOf(dir / "precious"), "kept");
  EXPECT_EQ(copy("file", "directory", IfPresent::replaceNonDirectory), failure(EEXIST));
  EXPECT_EQ(copy("tree", "directory", IfPresent::replaceNonDirectory), failure(EEXIST));
  EXPECT_EQ(copy("tree", "precious", IfPresent::replaceNonDirectory), kSuccess);
  EXPECT_EQ(contentOf(dir / "precious/below"), "tree");
  dir.link("source-link", "elsewhere");
  EXPECT_EQ(copy("source-link", "link", IfPresent::replaceNonDirectory), kSuccess);
  EXPECT_EQ(std::filesystem::read_symlink(dir / "link"), "elsewhere");
  EXPECT_EQ(names(""),
            (std::vector<std::string>{"directory", "file", "link", "precious", "source-link", "tree"}));
}

TEST_F(LinuxFileManagerTest, ADirectoryCannotComeToStandInsideItself) {
  dir.file("tree/sub/file", "x");
  dir.link("alias", "tree/sub");
  for (const char* destination : {"tree/copy", "tree/sub/copy", "alias/copy"}) {
    EXPECT_EQ(copy("tree", destination), failure(EINVAL)) << destination;
    EXPECT_EQ(move("tree", destination), failure(EINVAL)) << destination;
  }
  EXPECT_EQ(names("tree"), (std::vector<std::string>{"sub"}));
  EXPECT_EQ(copy("tree", "tree-copy"), kSuccess);
}

// ---- links on the way

class WayTest : public LinuxFileManagerTest {
 protected:
  WayTest() {
    dir.file("outside/file", "kept");
    dir.file("source", "x");
    dir.directory("folder");
  }
  // Every operation by way of folder/link.
  std::vector<FileOutcome> outcomes() {
    const std::string way = dir / "folder/link";
    const auto written = files.writeFileAtomically(way + "/written", "x") ? kSuccess : failure(ENOENT);
    return {copy("source", "folder/link/copy"),
            files.createDirectory(way + "/fresh/below", {}, Intermediates::create),
            files.placeLink(way + "/link", "target"),
            files.setAttributes(way + "/file", {0604, {}, {}}),
            written,
            move("folder/link/file", "moved"),
            move("moved", "folder/link/file"),
            files.removeEntry(way + "/written"),
            files.removeItem(way + "/copy"),
            files.removeItem(way + "/fresh"),
            files.removeItem(way + "/link")};
  }
  void expectRefused() {
    const struct stat before = statOf(dir / "outside/file");
    dir.file("outside/written", "theirs");
    dir.file("outside/copy", "theirs");
    dir.file("outside/link", "theirs");
    dir.file("moved", "x");
    for (const FileOutcome& outcome : outcomes()) EXPECT_EQ(outcome, failure(ENOENT));
    EXPECT_EQ(names("outside"), (std::vector<std::string>{"copy", "file", "link", "written"}));
    for (const char* name : {"written", "copy", "link"}) {
      EXPECT_EQ(contentOf(dir / ("outside/" + std::string(name))), "theirs");
    }
    EXPECT_EQ(statOf(dir / "outside/file").st_mode, before.st_mode);
    EXPECT_TRUE(isThere(dir / "moved"));
  }
};

TEST_F(WayTest, ALinkThatOnlyThisAccountCanHaveMadeIsFollowed) {
  for (const std::string& target :
       {dir / "outside", std::string("../outside"), std::string("../folder/../outside/")}) {
    std::filesystem::remove(dir / "folder/link");
    dir.link("folder/link", target);
    for (const FileOutcome& outcome : outcomes()) EXPECT_EQ(outcome, kSuccess) << target;
    EXPECT_EQ(contentOf(dir / "outside/file"), "kept");
    EXPECT_EQ(statOf(dir / "outside/file").st_mode & 0777, 0604u);
    EXPECT_EQ(names("outside"), (std::vector<std::string>{"file"}));
  }
  std::filesystem::remove(dir / "folder/link");
  dir.link("folder/link", "link");
  EXPECT_EQ(copy("source", "folder/link/copy"), failure(ELOOP));
}

TEST_F(WayTest, ALinkOfAnotherAccountIsNoWay) {
  if (::geteuid() != 0) GTEST_SKIP() << "needs root to give links away";
  ASSERT_EQ(::lchown(dir.link("folder/link", dir / "outside").c_str(), 4711, 4711), 0);
  expectRefused();
}

TEST_F(WayTest, ALinkInAFolderThatAnotherAccountMayWriteIsNoWay) {
  dir.link("folder/link", dir / "outside");
  for (const mode_t mode : {0775u, 0757u, 01777u}) {
    ASSERT_EQ(::chmod((dir / "folder").c_str(), mode), 0);
    expectRefused();
  }
  ASSERT_EQ(::chmod((dir / "folder").c_str(), 0755), 0);
  if (::geteuid() != 0) return;
  ASSERT_EQ(::chown((dir / "folder").c_str(), 4711, 4711), 0);
  expectRefused();
}

TEST_F(WayTest, ToASourceOnlyOwnLinksLead) {
  struct Nobody final : ItemVisitor {
    Next visit(const std::string&, bool) noexcept override { return Next::descend; }
  } nobody;
  std::vector<std::string> listed;
  // Everything that reads by way of folder/link, or lists it.
  const auto outcomes = [&] {
    std::filesystem::remove_all(dir / "copied");
    bool isDirectory = false;
    const bool exists = files.itemExists(dir / "folder/link/file", &isDirectory);
    const bool isRead = files.readFile(dir / "folder/link/file", 100) == "kept";
    return std::vector{copy("folder/link/file", "copied"), exists ? kSuccess : failure(ENOENT),
                       isRead ? kSuccess : failure(ENOENT),
                       files.listDirectory(dir / "folder/link/sub", &listed),
                       files.enumerateBelow(dir / "folder/link", nobody)};
  };
  const auto expectAll = [&](const FileOutcome& wanted, const std::string& what) {
    for (const FileOutcome& outcome : outcomes()) EXPECT_EQ(outcome, wanted) << what;
  };
  dir.directory("outside/sub");
  dir.link("folder/link", dir / "outside");
  expectAll(kSuccess, "own link in an own folder");
  for (const mode_t mode : {0775u, 01777u}) {
    ASSERT_EQ(::chmod((dir / "folder").c_str(), mode), 0);
    expectAll(kSuccess, "own link that others may move, but that says the same everywhere");
  }
  std::filesystem::remove(dir / "folder/link");
  dir.link("folder/link", "../outside");
  expectAll(failure(ENOENT), "own link that others may move to where it leads elsewhere");
  ASSERT_EQ(::chmod((dir / "folder").c_str(), 0755), 0);
  expectAll(kSuccess, "own link that leads up, in an own folder");
  if (::geteuid() != 0) return;
  std::filesystem::remove(dir / "folder/link");
  ASSERT_EQ(::lchown(dir.link("folder/link", dir / "outside").c_str(), 4711, 4711), 0);
  expectAll(failure(ENOENT), "a link of somebody else");
}

TEST_F(WayTest, ASourceThatIsItselfALinkIsCopiedAsALinkAndReadThrough) {
  dir.directory("outside/sub");
  const std::string link = dir.link("folder/link", "../outside/sub");
  const std::string fileLink = dir.link("folder/file", "../outside/file");
  if (::geteuid() == 0) {
    ASSERT_EQ(::lchown(link.c_str(), 4711, 4711), 0);
    ASSERT_EQ(::lchown(fileLink.c_str(), 4711, 4711), 0);
  }
  EXPECT_EQ(copy("folder/link", "copied"), kSuccess);
  EXPECT_EQ(std::filesystem::read_symlink(dir / "copied"), "../outside/sub");
  EXPECT_EQ(files.readFile(fileLink, 100), "kept");
  EXPECT_TRUE(files.itemExists(fileLink, nullptr));
  EXPECT_TRUE(names("folder/link").empty());
}

// ---- leftovers

class LeftoversTest : public LinuxFileManagerTest {
 protected:
  LeftoversTest() { dir.file("tree/file", "x"); }

  // Has a process die in the middle of a copy into the folder; the hidden name of what it left.
  std::string leaveOne(const std::string& folder) {
    dir.directory(folder);
    const pid_t child = ::fork();
    if (child == 0) {
      // The first byte written is its end: between staging and publishing.
      const rlimit none{0, 0};
      ::setrlimit(RLIMIT_CORE, &none);
      ::setrlimit(RLIMIT_FSIZE, &none);
      (void)copy("tree", folder + "/copy");
      ::_exit(0);
    }
    int status = 0;
    ::waitpid(child, &status, 0);
    EXPECT_TRUE(WIFSIGNALED(status));
    EXPECT_FALSE(isThere(dir / (folder + "/copy")));
    std::string left;
    for (const std::string& name : names(folder)) {
      if (name.starts_with(".brenvik-")) left = name;
    }
    EXPECT_FALSE(left.empty());
    return left;
  }
};

TEST_F(LeftoversTest, AnyOperationInTheFolderRemovesThemWhateverItsName) {
  const std::string file = dir.file("file", "x");
  const std::string folder = dir.directory("to");
  const std::vector<std::pair<const char*, std::function<FileOutcome()>>> operations{
      {"copy", [&] { return copy("file", "to/other"); }},
      {"replacing copy", [&] { return copy("file", "to/other", IfPresent::replaceNonDirectory); }},
      {"move into", [&] { return move("file", "to/moved"); }},
      {"move out of", [&] { return move("to/moved", "file"); }},
      {"directory", [&] { return files.createDirectory(folder + "/made", {}, Intermediates::mustExist); }},
      {"link", [&] { return files.placeLink(folder + "/link", "target"); }},
      {"write",
       [&] { return files.writeFileAtomically(folder + "/written", "x") ? kSuccess : failure(EIO); }},
      {"remove", [&] { return files.removeEntry(folder + "/link"); }}};
  for (const auto& [what, operation] : operations) {
    const std::string left = leaveOne("to");
    EXPECT_EQ(operation(), kSuccess) << what;
    EXPECT_FALSE(isThere(folder + "/" + left)) << what;
  }
  EXPECT_EQ(names("to"), (std::vector<std::string>{"made", "other", "written"}));
}

TEST_F(LeftoversTest, InARequestAFolderIsLookedThroughOnce) {
  files.openScope();
  EXPECT_EQ(copy("tree/file", "to-be"), kSuccess);
  const std::string left = leaveOne(".");
  EXPECT_EQ(copy("tree/file", "second"), kSuccess);
  EXPECT_TRUE(isThere(dir / left));
  files.closeScope();
  files.openScope();
  EXPECT_EQ(copy("tree/file", "third"), kSuccess);
  EXPECT_FALSE(isThere(dir / left));
  files.closeScope();
}

TEST_F(LeftoversTest, AFolderFullOfThemCostsOneOperationNoMoreThanAThousand) {
  char name[64];
  for (int i = 0; i < 1'500; ++i) {
    (void)std::snprintf(name, sizeof name, "to/.brenvik-%016x", i);
    ASSERT_EQ(::chmod(dir.directory(name).c_str(), 0700), 0);
  }
  EXPECT_EQ(copy("tree/file", "to/file"), kSuccess);
  EXPECT_EQ(names("to").size(), 501U);
  EXPECT_EQ(copy("tree/file", "to/more"), kSuccess);
  EXPECT_EQ(names("to"), (std::vector<std::string>{"file", "more"}));
}

TEST_F(LeftoversTest, OfAFolderThatSomebodyFilledNotAllIsRead) {
  for (int i = 0; i < 3'000; ++i) {
    const std::string path = dir.path() + "/full" + std::to_string(i);
    ASSERT_GE(UniqueFd(::open(path.c_str(), O_WRONLY | O_CREAT | O_CLOEXEC, 0600)).get(), 0);
  }
  const UniqueFd folder(::open(dir.path().c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  DirectoryNames some;
  ASSERT_EQ(some.load(folder.get(), 1'000), 0);
  int count = 0;
  for (DirectoryNames::Entry entry{}; some.next(&entry);) ++count;
  EXPECT_GE(count, 1'000);
  EXPECT_LT(count, 3'000);
}

TEST_F(LeftoversTest, WhatALivingProcessWorksAtIsNotTouched) {
  const std::string left = leaveOne("to");
  const UniqueFd held(::open((dir / ("to/" + left)).c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  ASSERT_EQ(::flock(held.get(), LOCK_EX | LOCK_NB), 0);
  EXPECT_EQ(copy("tree", "to/copy"), kSuccess);
  EXPECT_TRUE(isThere(dir / ("to/" + left + "/new")));
  EXPECT_EQ(contentOf(dir / "to/copy/file"), "x");
}

TEST_F(LeftoversTest, ARoomThatAnybodyElseMayEnterIsNoLeftover) {
  const std::string room = dir.directory("folder/.brenvik-0123456789abcdef");
  for (const mode_t mode : {0701u, 0702u, 0704u, 0710u, 0720u, 0740u}) {
    ASSERT_EQ(::chmod(room.c_str(), mode), 0);
    EXPECT_EQ(files.placeLink(dir / "folder/link", "target"), kSuccess);
    EXPECT_TRUE(isThere(room)) << mode;
  }
  ASSERT_EQ(::chmod(room.c_str(), 0700), 0);
  EXPECT_EQ(files.placeLink(dir / "folder/link", "target"), kSuccess);
  EXPECT_FALSE(isThere(room));
}

TEST_F(LeftoversTest, WhatAStrangerMadeUnderSuchANameIsNeverRemoved) {
  const std::string left = leaveOne("to");
  std::filesystem::remove_all(dir / ("to/" + left));
  std::vector<std::string> planted;
  const auto plant = [&](const std::string& name) { return planted.emplace_back("to/" + name); };
  const auto closed = [&](const std::string& path) { ASSERT_EQ(::chmod((dir / path).c_str(), 0700), 0); };

  dir.file(plant(left) + "/theirs", "kept");  // even under a name that has been ours
  closed("to/" + left);
  dir.file(plant(".brenvik-0123456789abcdef") + "/new", "open to others");
  ASSERT_EQ(::chmod((dir / planted.back()).c_str(), 0755), 0);
  dir.file(plant(".brenvik-0123456789abcde0") + "/new", "and");
  dir.file(planted.back() + "/more", "kept");
  closed(planted.back());
  dir.file(plant(".brenvik-0123456789abcde1"), "a file of a room's name");
  dir.file(plant(".brenvik-0123456789abcdef-01234567"), "a file with another number");
  dir.link(plant(".brenvik-0123456789abcde2-01234567"), "target");
  dir.file(plant(".brenvik-"), "kept");
  dir.directory(plant(".brenvik-notsixteendigits"));
  closed(planted.back());
  dir.link(plant(".brenvik-link-0"), "target");
  for (int i = 1; i < 4; ++i) dir.file(plant(".brenvik-link-" + std::to_string(i)), "kept");
  // A file under its own number that has another name, too: somebody else's.
  char name[64];
  dir.file("to/precious", "kept");
  (void)std::snprintf(name, sizeof name, ".brenvik-%016llx-01234567",
                      static_cast<unsigned long long>(statOf(dir / "to/precious").st_ino));
  ASSERT_EQ(::link((dir / "to/precious").c_str(), (dir / plant(name)).c_str()), 0);
  if (::geteuid() == 0) {
    dir.file(plant(".brenvik-0123456789abcde3") + "/new", "another account's");
    closed(planted.back());
    ASSERT_EQ(::chown((dir / planted.back()).c_str(), 4711, 4711), 0);
    // A link that says of itself that it is ours, as anybody can work out.
    std::uint64_t hash = 0xcbf29ce484222325 ^ 0x01234567;
    for (const char c : std::string("target")) hash = (hash ^ static_cast<unsigned char>(c)) * 0x100000001b3;
    (void)std::snprintf(name, sizeof name, ".brenvik-%016llx-01234567",
                        static_cast<unsigned long long>(hash));
    dir.link(plant(name), "target");
    ASSERT_EQ(::lchown((dir / planted.back()).c_str(), 4711, 4711), 0);
  }
  EXPECT_EQ(copy("tree", "to/copy"), kSuccess);
  EXPECT_EQ(copy("tree/file", "to/copied"), kSuccess);
  EXPECT_EQ(copy("tree/file", "to/copied", IfPresent::replaceNonDirectory), kSuccess);
  EXPECT_EQ(files.placeLink(dir / "to/copied", "target"), kSuccess);
  for (const std::string& path : planted) EXPECT_TRUE(isThere(dir / path)) << path;
  EXPECT_EQ(names("to").size(), planted.size() + 3);
  EXPECT_EQ(contentOf(dir / "to/.brenvik-0123456789abcdef/new"), "open to others");
  EXPECT_EQ(contentOf(dir / "to/.brenvik-0123456789abcde0/new"), "and");
  EXPECT_EQ(contentOf(dir / ("to/" + left + "/theirs")), "kept");
}

// ---- moves

TEST_F(LinuxFileManagerTest, WhatIsNoDirectoryIsInTheWayOfOneAndADirectoryIsNot) {
  const auto make = [&](const std::string& path) {
    return files.createDirectory(path, {}, Intermediates::create);
  };
  const std::string file = dir.file("file", "kept");
  EXPECT_EQ(make(file), failure(EEXIST));
  EXPECT_EQ(make(file + "/below"), failure(ENOTDIR));
  EXPECT_EQ(make(dir.link("link", "file")), failure(EEXIST));
  EXPECT_EQ(make(dir.directory("directory")), kSuccess);
  EXPECT_EQ(make(dir.link("way", "directory")), kSuccess);
  EXPECT_EQ(make(dir / "new/below"), kSuccess);
  EXPECT_EQ(contentOf(file), "kept");
}

TEST_F(LinuxFileManagerTest, AMoveInsideOneFileSystemKeepsTheInode) {
  dir.file("tree/file", "x");
  const ino_t before = statOf(dir / "tree").st_ino;
  EXPECT_EQ(move("tree", "moved"), kSuccess);
  EXPECT_EQ(statOf(dir / "moved").st_ino, before);
  EXPECT_FALSE(isThere(dir / "tree"));
}

TEST_F(LinuxFileManagerTest, AMoveFailsWithEExistWhenAnythingIsThere) {
  dir.file("file", "new");
  dir.directory("empty");
  dir.link("dangling", "nowhere");
  EXPECT_EQ(move("file", "empty"), failure(EEXIST));
  EXPECT_EQ(move("file", "dangling"), failure(EEXIST));
  EXPECT_EQ(move("empty", "file"), failure(EEXIST));
  EXPECT_EQ(move("missing", "new"), failure(ENOENT));
  EXPECT_EQ(contentOf(dir / "file"), "new");
}

TEST_F(LinuxFileManagerTest, AReplacingMoveTakesTheNameOfAFileOrALinkButNotOfADirectory) {
  dir.file("file", "new");
  dir.file("there", "old");
  dir.file("tree/below", "tree");
  dir.directory("directory");
  EXPECT_EQ(move("file", "directory", IfPresent::replaceNonDirectory), failure(EEXIST));
  EXPECT_EQ(move("file", "there", IfPresent::replaceNonDirectory), kSuccess);
  EXPECT_EQ(contentOf(dir / "there"), "new");
  EXPECT_EQ(move("tree", "there", IfPresent::replaceNonDirectory), kSuccess);
  EXPECT_EQ(contentOf(dir / "there/below"), "tree");
  EXPECT_EQ(names(""), (std::vector<std::string>{"directory", "there"}));
}

TEST_F(LinuxFileManagerTest, TwoNamesOfOneFileBecomeOneAndOneNameStays) {
  const std::string first = dir.file("first", "x");
  ASSERT_EQ(::link(first.c_str(), (dir / "second").c_str()), 0);
  EXPECT_EQ(move("first", "second", IfPresent::replaceNonDirectory), kSuccess);
  EXPECT_EQ(names(""), (std::vector<std::string>{"second"}));
  EXPECT_EQ(move("second", "./second", IfPresent::replaceNonDirectory), kSuccess);
  EXPECT_EQ(contentOf(dir / "second"), "x");
}

TEST_F(LinuxFileManagerTest, AMoveBetweenTwoMountsCopiesThenRemovesTheSource) {
  dir.file("tree/sub/file", "x");
  ASSERT_EQ(::chmod((dir / "tree/sub").c_str(), 0711), 0);
  dir.link("tree/link", "target");
  dir.file("single", "s");
  dir.directory("disk");
  inPrivateMounts([&] {
    mountSmallDisk(dir / "disk", 1024);
    EXPECT_EQ(move("tree", "disk/tree"), kSuccess);
    EXPECT_EQ(contentOf(dir / "disk/tree/sub/file"), "x");
    EXPECT_EQ(statOf(dir / "disk/tree/sub").st_mode & 07777, 0711u);
    EXPECT_EQ(std::filesystem::read_symlink(dir / "disk/tree/link"), "target");
    EXPECT_FALSE(isThere(dir / "tree"));
    dir.file("disk/single", "old");
    EXPECT_EQ(move("single", "disk/single"), failure(EEXIST));
    EXPECT_EQ(move("single", "disk/single", IfPresent::replaceNonDirectory), kSuccess);
    EXPECT_EQ(contentOf(dir / "disk/single"), "s");
    EXPECT_FALSE(isThere(dir / "single"));
    EXPECT_EQ(names("disk"), (std::vector<std::string>{"single", "tree"}));
  });
}

class MoveAcrossTest : public LinuxFileManagerTest {
 protected:
  MoveAcrossTest() {
    dir.file("from/tree/sub/file", "x");
    dir.file("from/tree/other", "y");
    dir.directory("disk");
  }
  // Mounts the other file system, and on it the source if that is to have one of its own.
  void expectNotMoved(const std::string& source, const FileOutcome& outcome) {
    EXPECT_EQ(move(source, "disk/moved", IfPresent::fail), outcome);
    EXPECT_TRUE(names("disk").empty());
    EXPECT_EQ(names("from"), (std::vector<std::string>{"tree"}));
    EXPECT_EQ(names("from/tree"), (std::vector<std::string>{"other", "sub"}));
    EXPECT_EQ(names("from/tree/sub"), (std::vector<std::string>{"file"}));
  }
};

TEST_F(MoveAcrossTest, ASourceThatEndsInDotsIsRefusedBeforeAnythingIsCopied) {
  inPrivateMounts([&] {
    mountSmallDisk(dir / "disk", 1024);
    for (const char* const source : {"from/tree/.", "from/tree/..", "from/tree/sub/../.", "from/tree/./"}) {
      expectNotMoved(source, failure(EBUSY));
    }
    EXPECT_EQ(files.moveItem("/", dir / "disk/moved", IfPresent::fail), failure(EBUSY));
    EXPECT_EQ(files.moveItem(".", dir / "disk/moved", IfPresent::fail), failure(EBUSY));
  });
  // Nor inside one file system.
  EXPECT_EQ(move("from/tree/.", "moved"), failure(EBUSY));
  EXPECT_EQ(contentOf(dir / "from/tree/sub/file"), "x");
}

TEST_F(MoveAcrossTest, ASourceWithAMountInsideStaysWhole) {
  dir.directory("elsewhere");
  dir.file("single", "mounted");
  inPrivateMounts([&] {
    mountSmallDisk(dir / "disk", 1024);
    const std::string sub = dir / "from/tree/sub";
    const std::string file = dir / "from/tree/sub/file";
    ASSERT_EQ(::mount(sub.c_str(), sub.c_str(), nullptr, MS_BIND, nullptr), 0);
    expectNotMoved("from/tree", failure(EBUSY));
    expectNotMoved("from/tree/sub", failure(EBUSY));  // the mount itself
    ASSERT_EQ(::umount(sub.c_str()), 0);
    ASSERT_EQ(::mount((dir / "single").c_str(), file.c_str(), nullptr, MS_BIND, nullptr), 0);
    expectNotMoved("from/tree", failure(EBUSY));
    expectNotMoved("from/tree/sub/file", failure(EBUSY));
    ASSERT_EQ(::umount(file.c_str()), 0);
    EXPECT_EQ(move("from/tree", "disk/moved"), kSuccess);
    EXPECT_TRUE(names("from").empty());
    EXPECT_EQ(contentOf(dir / "disk/moved/sub/file"), "x");
  });
}

TEST_F(MoveAcrossTest, AReadOnlySourceStaysAndNothingIsCopied) {
  inPrivateMounts([&] {
    mountSmallDisk(dir / "disk", 1024);
    const std::string from = dir / "from";
    ASSERT_EQ(::mount(from.c_str(), from.c_str(), nullptr, MS_BIND, nullptr), 0);
    ASSERT_EQ(::mount(nullptr, from.c_str(), nullptr, MS_BIND | MS_REMOUNT | MS_RDONLY, nullptr), 0);
    expectNotMoved("from/tree", failure(EROFS));
    expectNotMoved("from/tree/sub/file", failure(EROFS));
  });
}

TEST_F(MoveAcrossTest, ASourceWithAnImmutableItemStaysWhole) {
  const auto mark = [&](const std::string& name, int flag) {
    const UniqueFd item(::open((dir / name).c_str(), O_RDONLY | O_CLOEXEC));
    return ::ioctl(item.get(), FS_IOC_SETFLAGS, &flag) == 0;
  };
  for (const int flag : {FS_IMMUTABLE_FL, FS_APPEND_FL}) {
    for (const char* const name : {"from/tree/sub/file", "from/tree/sub", "from/tree"}) {
      if (!mark(name, flag)) GTEST_SKIP() << "nothing can be made immutable here";
      inPrivateMounts([&] {
        mountSmallDisk(dir / "disk", 1024);
        expectNotMoved("from/tree", failure(EPERM));
      });
      EXPECT_TRUE(mark(name, 0));
    }
  }
}

TEST_F(MoveAcrossTest, AnImmutableFolderAroundTheSourceKeepsIt) {
  const UniqueFd folder(::open((dir / "from").c_str(), O_RDONLY | O_CLOEXEC));
  int flag = FS_IMMUTABLE_FL;
  if (::ioctl(folder.get(), FS_IOC_SETFLAGS, &flag) != 0)
    GTEST_SKIP() << "nothing can be made immutable here";
  inPrivateMounts([&] {
    mountSmallDisk(dir / "disk", 1024);
    expectNotMoved("from/tree", failure(EPERM));
  });
  flag = 0;
  EXPECT_EQ(::ioctl(folder.get(), FS_IOC_SETFLAGS, &flag), 0);
}

TEST_F(MoveAcrossTest, AwayFromAFullDiskItWorksAllTheSame) {
  inPrivateMounts([&] {
    ASSERT_EQ(::mount("tmpfs", (dir / "disk").c_str(), "tmpfs", 0, "nr_inodes=4"), 0);
    dir.file("disk/tree/file", "x");
    dir.file("disk/last", "y");
    ASSERT_EQ(::mkdir((dir / "disk/no-more").c_str(), 0700), -1);
    EXPECT_EQ(move("disk/tree", "moved"), kSuccess);
    EXPECT_EQ(contentOf(dir / "moved/file"), "x");
    EXPECT_EQ(names("disk"), (std::vector<std::string>{"last"}));
  });
}

TEST_F(MoveAcrossTest, KilledAtAnyMomentItIsWholeAtOneOfTheTwoPlaces) {
  const std::string content(20'000, 'c');
  inPrivateMounts([&] {
    mountSmallDisk(dir / "disk", 4096);
    const auto isWhole = [&](const std::string& tree) {
      return contentOf(dir / (tree + "/other")) == content &&
             contentOf(dir / (tree + "/sub/file")) == content;
    };
    for (int round = 0; round < 60; ++round) {
      std::filesystem::remove_all(dir / "disk/moved");
      dir.file("from/tree/sub/file", content);
      dir.file("from/tree/other", content);
      const pid_t child = ::fork();
      if (child == 0) {
        killThisProcessAfter(std::chrono::microseconds(100 + round * 61));
        (void)move("from/tree", "disk/moved");
        ::_exit(0);
      }
      ::waitpid(child, nullptr, 0);
      ASSERT_TRUE(isWhole("from/tree") || isWhole("disk/moved")) << round;
      ASSERT_TRUE(isWhole("from/tree") || !isThere(dir / "from/tree")) << round;
      ASSERT_TRUE(isWhole("disk/moved") || !isThere(dir / "disk/moved")) << round;
    }
    EXPECT_EQ(files.placeLink(dir / "from/link", "target"), kSuccess);
    EXPECT_EQ(files.placeLink(dir / "disk/link", "target"), kSuccess);
    for (const char* const folder : {"from", "disk"}) {
      for (const std::string& name : names(folder)) EXPECT_FALSE(name.starts_with(".brenvik")) << name;
    }
  });
}

TEST_F(MoveAcrossTest, IntoItselfByWayOfAnotherMountItStaysWhole) {
  inPrivateMounts([&] {
    const std::string sub = dir / "from/tree/sub";
    ASSERT_EQ(::mount(sub.c_str(), (dir / "disk").c_str(), nullptr, MS_BIND, nullptr), 0);
    EXPECT_EQ(move("from/tree", "disk/moved"), failure(EINVAL));
    EXPECT_EQ(copy("from/tree", "disk/moved"), failure(EINVAL));
    EXPECT_EQ(names("from/tree/sub"), (std::vector<std::string>{"file"}));
    EXPECT_EQ(contentOf(dir / "from/tree/other"), "y");
  });
}

// ---- a full disk

TEST_F(LinuxFileManagerTest, OnAFullDiskACopyLeavesTheOldFileAndNothingElse) {
  dir.file("big", std::string(200'000, 'b'));
  dir.file("tree/a", std::string(40'000, 'a'));
  dir.file("tree/b", std::string(90'000, 'b'));
  dir.directory("disk");
  inPrivateMounts([&] {
    mountSmallDisk(dir / "disk", 100);
    dir.file("disk/big", "old");
    EXPECT_EQ(copy("big", "disk/big", IfPresent::replaceNonDirectory), failure(ENOSPC));
    EXPECT_EQ(contentOf(dir / "disk/big"), "old");
    EXPECT_EQ(copy("big", "disk/new"), failure(ENOSPC));
    EXPECT_EQ(copy("tree", "disk/tree"), failure(ENOSPC));
    EXPECT_EQ(move("tree", "disk/tree"), failure(ENOSPC));
    EXPECT_EQ(names("disk"), (std::vector<std::string>{"big"}));
    EXPECT_EQ(statOf(dir / "tree/b").st_size, 90'000);
    EXPECT_FALSE(files.writeFileAtomically(dir / "disk/big", std::string(200'000, 'n')));
    EXPECT_EQ(contentOf(dir / "disk/big"), "old");
    EXPECT_EQ(names("disk"), (std::vector<std::string>{"big"}));
  });
}

TEST_F(LinuxFileManagerTest, WhereWritingIsForbiddenNothingChanges) {
  if (::geteuid() != 0) GTEST_SKIP() << "becomes another user";
  const mode_t mask = ::umask(022);
  dir.file("file", "new");
  dir.file("locked/file", "old");
  ::umask(mask);
  ASSERT_EQ(::chmod(dir.path().c_str(), 0755), 0);
  const pid_t child = ::fork();
  if (child == 0) {
    if (::setresgid(4712, 4712, 4712) != 0 || ::setresuid(4711, 4711, 4711) != 0) ::_exit(9);
    EXPECT_EQ(copy("file", "locked/file", IfPresent::replaceNonDirectory), failure(EACCES));
    EXPECT_EQ(copy("file", "locked/new"), failure(EACCES));
    EXPECT_EQ(move("file", "locked/file", IfPresent::replaceNonDirectory), failure(EACCES));
    EXPECT_EQ(files.removeItem(dir / "locked"), failure(EACCES));
    EXPECT_EQ(files.createDirectory(dir / "locked/new", {}, Intermediates::mustExist), failure(EACCES));
    EXPECT_FALSE(files.writeFileAtomically(dir / "locked/file", "new"));
    EXPECT_FALSE(files.writeFile(dir / "locked/file", "new"));
    ::_exit(testing::Test::HasFailure() ? 1 : 0);
  }
  int status = -1;
  ::waitpid(child, &status, 0);
  EXPECT_EQ(status, 0);
  EXPECT_EQ(contentOf(dir / "locked/file"), "old");
  EXPECT_EQ(names("locked"), (std::vector<std::string>{"file"}));
}

// ---- removal and listing

TEST_F(LinuxFileManagerTest, RemovalDoesNotFollowLinksAndGoesOnPastWhatStays) {
  dir.file("outside/file", "kept");
  dir.file("tree/sub/file", "x");
  dir.link("tree/link", dir / "outside");
  EXPECT_EQ(files.removeItem(dir.link("alias", "outside")), kSuccess);
  EXPECT_EQ(files.removeItem(dir / "tree"), kSuccess);
  EXPECT_EQ(contentOf(dir / "outside/file"), "kept");
  EXPECT_EQ(files.removeItem(dir / "tree"), failure(ENOENT));
  if (::geteuid() != 0) return;
  dir.file("tree/a/file", "x");
  dir.directory("tree/held");
  inPrivateMounts([&] {
    mountSmallDisk(dir / "tree/held", 64);
    EXPECT_EQ(files.removeItem(dir / "tree"), failure(EBUSY));
    EXPECT_EQ(names("tree"), (std::vector<std::string>{"held"}));
  });
}

TEST_F(LinuxFileManagerTest, TheVisitorMaySkipAndMayTakeItemsAway) {
  dir.file("tree/keep/file", "x");
  dir.file("tree/skip/file", "x");
  dir.file("tree/gone/file", "x");
  dir.link("tree/link", "keep");
  struct Visitor final : ItemVisitor {
    const TemporaryDirectory& dir;
    std::set<std::string> seen;
    explicit Visitor(const TemporaryDirectory& d) : dir(d) {}
    Next visit(const std::string& subpath, bool isDirectory) noexcept override {
      seen.insert(subpath + (isDirectory ? "/" : ""));
      if (subpath == "gone") std::filesystem::remove_all(dir / "tree/gone");
      return subpath == "skip" ? Next::skipBelow : Next::descend;
    }
  } visitor(dir);
  EXPECT_EQ(files.enumerateBelow(dir / "tree", visitor), kSuccess);
  EXPECT_EQ(visitor.seen, (std::set<std::string>{"keep/", "keep/file", "skip/", "gone/", "link"}));
  EXPECT_EQ(files.enumerateBelow(dir / "missing", visitor), failure(ENOENT));
  EXPECT_EQ(files.enumerateBelow(dir / "tree/keep/file", visitor), failure(ENOTDIR));
}

// ---- attributes

TEST_F(LinuxFileManagerTest, AttributesGoToALinkItselfOrNotAtAll) {
  const std::string file = dir.file("file");
  ASSERT_EQ(::chmod(file.c_str(), 0600), 0);
  const std::string link = dir.link("link", "file");
  dir.link("dangling", "nowhere");
  EXPECT_EQ(files.setAttributes(link, {0777, {}, {}}), kSuccess);
  EXPECT_EQ(statOf(file).st_mode & 07777, 0600u);
  EXPECT_EQ(files.setAttributes(dir / "dangling", {0777, ::getuid(), ::getgid()}), kSuccess);
  EXPECT_EQ(files.setAttributes(dir / "missing", {0777, {}, {}}), failure(ENOENT));
  EXPECT_EQ(files.setAttributes(dir / "missing", {{}, 0, 0}), failure(ENOENT));
  EXPECT_EQ(files.setAttributes(file, {0644, {}, {}}), kSuccess);
  EXPECT_EQ(statOf(file).st_mode & 07777, 0644u);
}

TEST_F(LinuxFileManagerTest, WhatACopyIsGivenItHasWhenItShows) {
  if (::geteuid() != 0) GTEST_SKIP() << "needs root to give items away";
  dir.file("file", "x");
  dir.file("tree/below", "x");
  dir.link("link", dir / "file");
  ASSERT_EQ(::mkfifo((dir / "fifo").c_str(), 0600), 0);
  for (const char* name : {"file", "tree", "link", "fifo"}) {
    Gift gift{{0640, 4711, 4712}};
    const std::string copied = dir / (std::string("copied-") + name);
    EXPECT_EQ(files.copyItem(dir / name, copied, IfPresent::fail, Durability::onReturn, &gift), kSuccess);
    EXPECT_EQ(gift.outcome, kSuccess) << name;
    EXPECT_EQ(statOf(copied).st_uid, 4711u) << name;
    EXPECT_EQ(statOf(copied).st_gid, 4712u) << name;
    if (std::string_view(name) != "link") {
      EXPECT_EQ(statOf(copied).st_mode & 07777, 0640u) << name;
    }
    EXPECT_EQ(statOf(dir / name).st_uid, 0u) << name;
    EXPECT_EQ(files.copyItem(dir / name, copied, IfPresent::fail, Durability::eventual, &gift),
              failure(EEXIST));
    EXPECT_EQ(gift.outcome, failure(EEXIST)) << name;
  }
  EXPECT_EQ(statOf(dir / "copied-tree/below").st_uid, 0u);
}

TEST_F(LinuxFileManagerTest, OfAKindThatIsNotWantedNothingIsChanged) {
  const std::string file = dir.file("file");
  ASSERT_EQ(::chmod(file.c_str(), 0600), 0);
  EXPECT_EQ(files.setAttributes(file, {0644, {}, {}}, ItemKinds::noFiles), failure(EINVAL));
  EXPECT_EQ(statOf(file).st_mode & 07777, 0600u);
  EXPECT_EQ(files.setAttributes(dir.directory("directory"), {0711, {}, {}}, ItemKinds::noFiles), kSuccess);
  EXPECT_EQ(statOf(dir / "directory").st_mode & 07777, 0711u);
}

TEST_F(LinuxFileManagerTest, AFileWithFurtherNamesIsChangedOnlyWhereItsOwnerAloneCanHavePutThem) {
  const std::string elsewhere = dir.file("elsewhere", "x");
  dir.directory("tree/sub");
  ASSERT_EQ(::chmod(elsewhere.c_str(), 0600), 0);
  ASSERT_EQ(::link(elsewhere.c_str(), (dir / "tree/sub/name").c_str()), 0);
  const auto change = [&](mode_t mode) {
    // First: changing the tree may close the folder to others.
    const FileOutcome alone = files.setAttributes(dir / "tree/sub/name", {mode, {}, {}});
    return std::pair(files.setAttributesOfTree(dir / "tree", {mode, {}, {}}), alone);
  };
  EXPECT_EQ(change(0700), std::pair(kSuccess, kSuccess));  // the owner's own folder
  EXPECT_EQ(statOf(elsewhere).st_mode & 07777, 0700u);
  ASSERT_EQ(::chmod((dir / "tree/sub").c_str(), 0777), 0);
  EXPECT_EQ(change(0755).first, failure(EPERM));  // anybody's
  EXPECT_EQ(statOf(elsewhere).st_mode & 07777, 0700u);
  EXPECT_EQ(statOf(dir / "tree/sub").st_mode & 07777, 0755u);
  if (::geteuid() != 0) return;
  ASSERT_EQ(::chown((dir / "tree/sub").c_str(), 4711, 4711), 0);
  EXPECT_EQ(change(0750), std::pair(failure(EPERM), failure(EPERM)));  // somebody else's
  EXPECT_EQ(statOf(elsewhere).st_mode & 07777, 0700u);
  // A tree of one owner goes with both names of its files.
  ASSERT_EQ(::chown(elsewhere.c_str(), 4711, 4711), 0);
  dir.file("tree/sub/one", "x");
  ASSERT_EQ(::chown((dir / "tree/sub/one").c_str(), 4711, 4711), 0);
  ASSERT_EQ(::link((dir / "tree/sub/one").c_str(), (dir / "tree/sub/two").c_str()), 0);
  EXPECT_EQ(files.setAttributesOfTree(dir / "tree", {{}, 0, 0}), kSuccess);
  EXPECT_EQ(statOf(dir / "tree/sub/one").st_uid, 0u);
}

TEST_F(LinuxFileManagerTest, OfATreeTheTopsFailureCountsBeforeTheLastOneBelowAndTheRestIsChanged) {
  if (::geteuid() != 0) GTEST_SKIP() << "needs root to make a file immutable";
  dir.file("tree/a/stays");
  dir.file("tree/b/changes");
  const auto mark = [&](const char* name, int flag) {
    const UniqueFd item(::open((dir / name).c_str(), O_RDONLY | O_CLOEXEC));
    return ::ioctl(item.get(), FS_IOC_SETFLAGS, &flag) == 0;
  };
  if (!mark("tree/a/stays", FS_IMMUTABLE_FL)) GTEST_SKIP() << "nothing can be made immutable here";
  EXPECT_EQ(files.setAttributesOfTree(dir / "tree", {{}, 4711, 4711}), failure(EPERM));
  EXPECT_TRUE(mark("tree/a/stays", 0));
  EXPECT_EQ(statOf(dir / "tree/a/stays").st_uid, 0u);
  for (const char* name : {"tree", "tree/a", "tree/b", "tree/b/changes"}) {
    EXPECT_EQ(statOf(dir / name).st_uid, 4711u) << name;
  }
  EXPECT_EQ(files.setAttributesOfTree(dir / "missing", {{}, 0, 0}), failure(ENOENT));
}

TEST_F(LinuxFileManagerTest, NamedOwnersAreLookedUp) {
  EXPECT_EQ(files.createDirectory(dir / "a", {0755, "root", "root"}, Intermediates::mustExist),
            ::geteuid() == 0 ? kSuccess : failure(EPERM));
  EXPECT_EQ(files.createDirectory(dir / "b", {0755, "", "no such group"}, Intermediates::mustExist),
            failure(EINVAL));
  EXPECT_FALSE(isThere(dir / "b"));
}

TEST_F(LinuxFileManagerTest, AnItemIsThereOrNotAndADirectoryOrNot) {
  dir.file("tree/file", "x");
  dir.link("to-tree", "tree");
  dir.link("to-file", "tree/file");
  dir.link("to-nothing", "missing");
  const struct {
    const char* name;
    bool exists, isDirectory;
  } items[] = {{"tree", true, true},
               {"tree/", true, true},
               {"tree/file", true, false},
               {"to-tree", true, true},
               {"to-tree/file", true, false},
               {"to-file", true, false},
               {"to-nothing", false, false},
               {"missing", false, false},
               {"missing/below", false, false},
               {"tree/file/below", false, false}};
  for (const auto& each : items) {
    bool isDirectory = !each.isDirectory;
    EXPECT_EQ(files.itemExists(dir / each.name, &isDirectory), each.exists) << each.name;
    EXPECT_EQ(isDirectory, each.isDirectory) << each.name;
    EXPECT_EQ(files.itemExists(dir / each.name, nullptr), each.exists) << each.name;
  }
}

// ---- reading and writing

TEST_F(LinuxFileManagerTest, ReadingStopsAtTheLimitAndNeverWaits) {
  dir.file("file", "12345");
  EXPECT_EQ(files.readFile(dir / "file", 5), "12345");
  EXPECT_EQ(files.readFile(dir / "file", 4), std::nullopt);
  EXPECT_NE(files.readFile("/proc/self/status", 1 << 20), std::nullopt);  // says it is empty, and is not
  EXPECT_EQ(files.readFile("/proc/self/status", 10), std::nullopt);
  EXPECT_EQ(files.readFile(dir.path(), 10), std::nullopt);
  ASSERT_EQ(::mkfifo((dir / "fifo").c_str(), 0600), 0);
  EXPECT_EQ(files.readFile(dir / "fifo", 10), std::nullopt);
}

TEST_F(LinuxFileManagerTest, AnAtomicWriteReplacesALinkAndNotItsTarget) {
  dir.file("precious", "kept");
  dir.link("link", "precious");
  EXPECT_TRUE(files.writeFileAtomically(dir / "link", "new"));
  EXPECT_EQ(contentOf(dir / "link"), "new");
  EXPECT_EQ(contentOf(dir / "precious"), "kept");
  EXPECT_TRUE(files.writeFileAtomically(dir / "fresh", ""));
  EXPECT_EQ(statOf(dir / "fresh").st_mode & 07777, 0644u);
  EXPECT_FALSE(files.writeFileAtomically(dir / "no/such", "x"));
  EXPECT_FALSE(files.writeFileAtomically(dir.directory("directory"), "x"));
  EXPECT_EQ(names(""), (std::vector<std::string>{"directory", "fresh", "link", "precious"}));
}

TEST_F(LinuxFileManagerTest, AnAtomicWriteKeepsTheModeAndTheOwnerButNoSetIdBit) {
  const std::string file = dir.file("file", "old");
  ASSERT_EQ(::chmod(file.c_str(), 06751), 0);
  EXPECT_TRUE(files.writeFileAtomically(file, "new"));
  EXPECT_EQ(statOf(file).st_mode & 07777, 0751u);
  if (::geteuid() != 0) return;
  ASSERT_EQ(::chown(file.c_str(), 4713, 4714), 0);
  EXPECT_TRUE(files.writeFileAtomically(file, "newer"));
  EXPECT_EQ(statOf(file).st_uid, 4713u);
  EXPECT_EQ(statOf(file).st_gid, 4714u);
  EXPECT_EQ(statOf(file).st_mode & 07777, 0751u);
  // Who cannot give it to its owner keeps it for himself: the mode spoke of others.
  ASSERT_EQ(::chmod(dir.path().c_str(), 0777), 0);
  const pid_t child = ::fork();
  if (child == 0) {
    if (::setresgid(4712, 4712, 4712) != 0 || ::setresuid(4711, 4711, 4711) != 0) ::_exit(9);
    ::_exit(files.writeFileAtomically(file, "theirs") ? 0 : 1);
  }
  int status = -1;
  ::waitpid(child, &status, 0);
  EXPECT_EQ(status, 0);
  EXPECT_EQ(statOf(file).st_uid, 4711u);
  EXPECT_EQ(statOf(file).st_mode & 07777, 0700u);
}

TEST_F(LinuxFileManagerTest, AWriteInPlaceRefusesALinkAndDoesNotWaitForAReader) {
  dir.file("precious", "kept");
  dir.link("link", "precious");
  EXPECT_FALSE(files.writeFile(dir / "link", "new"));
  EXPECT_EQ(contentOf(dir / "precious"), "kept");
  EXPECT_TRUE(files.writeFile(dir / "precious", "new"));
  EXPECT_EQ(contentOf(dir / "precious"), "new");
  ASSERT_EQ(::mkfifo((dir / "fifo").c_str(), 0600), 0);
  EXPECT_FALSE(files.writeFile(dir / "fifo", "x"));
}

// ---- killed at any moment

TEST_F(LinuxFileManagerTest, KilledAtAnyMomentADirectoryShowsWithItsModeOrNotAtAll) {
  for (int round = 0; round < 100; ++round) {
    const pid_t child = ::fork();
    if (child == 0) {
      killThisProcessAfter(std::chrono::microseconds(50 + round * 3));
      for (int i = 0;; ++i) {
        (void)files.createDirectory(dir / ("work/" + std::to_string(i) + "/below"), {0755, "", ""},
                                    Intermediates::create);
      }
    }
    ::waitpid(child, nullptr, 0);
    auto entry = std::filesystem::recursive_directory_iterator(dir.path());
    for (; entry != std::filesystem::recursive_directory_iterator(); ++entry) {
      if (entry->path().filename().string().starts_with(".brenvik-")) {
        entry.disable_recursion_pending();
        continue;
      }
      ASSERT_EQ(statOf(entry->path()).st_mode, S_IFDIR | 0755u) << entry->path() << " in round " << round;
    }
    std::filesystem::remove_all(dir / "work");
  }
}

TEST_F(LinuxFileManagerTest, KilledAtAnyMomentTheOldFileOrTheNewOneStandsAndNeverHalf) {
  const std::string oldContent(300'000, 'o');
  const std::string newContent(300'000, 'n');
  dir.file("old", oldContent);
  dir.file("new", newContent);
  dir.file("tree/a", newContent);
  dir.file("tree/b", newContent);
  dir.directory("work");
  for (int round = 0; round < 40; ++round) {
    dir.file("work/file", oldContent);
    const pid_t child = ::fork();
    if (child == 0) {
      killThisProcessAfter(std::chrono::microseconds(500 + round * 173));
      for (;;) {
        (void)copy("new", "work/file", IfPresent::replaceNonDirectory);
        (void)files.writeFileAtomically(dir / "work/file", oldContent);
        (void)copy("tree", "work/tree");
        (void)files.removeItem(dir / "work/tree/b");
        (void)copy("new", "work/tree/b");
        (void)move("work/tree", "work/second");
        (void)files.removeItem(dir / "work/second");
      }
    }
    ::waitpid(child, nullptr, 0);
    const std::string after = contentOf(dir / "work/file");
    ASSERT_TRUE(after == oldContent || after == newContent) << "round " << round << ": " << after.size();
    for (const char* name : {"work/tree/a", "work/tree/b", "work/second/a", "work/second/b"}) {
      if (isThere(dir / name)) {
        ASSERT_EQ(contentOf(dir / name).size(), newContent.size()) << name;
      }
    }
    std::filesystem::remove_all(dir / "work");
    dir.directory("work");
  }
}

}  // namespace
}  // namespace brenvik

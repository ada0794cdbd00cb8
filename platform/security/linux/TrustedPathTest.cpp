// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/security/linux/TrustedPath.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <cerrno>
#include <filesystem>
#include <string>

#include "platform/base/UniqueFd.h"
#include "platform/base/fakes/FailingCalls.h"
#include "platform/security/linux/EntitlementTestSupport.h"

// A link that cannot be read or, with the error 0, has no target.
extern "C" {
ssize_t failingReadlink(const char* path, char* target, std::size_t size) noexcept __asm__("readlink");
ssize_t failingCheckedReadlink(const char* path, char* target, std::size_t size, std::size_t room) noexcept
    __asm__("__readlink_chk");

ssize_t failingReadlink(const char* path, char* target, std::size_t size) noexcept {
  if (brenvik::FailingCall::failsNow("readlink")) return errno == 0 ? 0 : -1;
  return ::syscall(SYS_readlinkat, AT_FDCWD, path, target, size);
}
ssize_t failingCheckedReadlink(const char* path, char* target, std::size_t size,
                               std::size_t /*room*/) noexcept {
  return failingReadlink(path, target, size);
}
}

namespace brenvik {
namespace {

namespace fs = std::filesystem;
using Outcome = TrustedPath::Outcome;

class TrustedPathTest : public EntitlementFolderTest {
 protected:
  void expectTrusted(const fs::path& path, const fs::path& place) {
    const TrustedPath walked = walkTrustedPath(path.string());
    EXPECT_EQ(walked.outcome, Outcome::trusted) << path;
    EXPECT_EQ(walked.place, place.string()) << path;
    struct stat facts {};
    ASSERT_EQ(::stat(path.c_str(), &facts), 0) << path;
    EXPECT_EQ(walked.facts.st_dev, facts.st_dev) << path;
    EXPECT_EQ(walked.facts.st_ino, facts.st_ino) << path;
  }
  void expectMissing(const fs::path& path, int error) {
    const TrustedPath walked = walkTrustedPath(path.string());
    EXPECT_EQ(walked.outcome, Outcome::missing) << path;
    EXPECT_EQ(walked.error, error) << path;
  }
};

TEST_F(TrustedPathTest, ThePlaceIsThePathWithoutLinksDotsAndDoubleSlashes) {
  fs::create_directory_symlink(root / "etc", root / "lib/absolute");
  fs::create_directory_symlink("../etc/.", root / "lib/relative");
  write("etc/file", "");
  const fs::path file = root / "etc/file";
  expectTrusted(file, file);
  expectTrusted(root / "etc/./file", file);
  expectTrusted(root / "lib/../etc/file", file);
  expectTrusted(root / "lib/absolute/file", file);
  expectTrusted(root / "lib/relative/file", file);
  expectTrusted(root.string() + "//etc///file", file);
  expectTrusted(root.string() + "/etc/", root / "etc");
  expectTrusted(root.string() + "/etc/.", root / "etc");
  expectTrusted(root.string() + "/etc/..", root);
  expectTrusted("/", "/");
  expectTrusted("/.", "/");
  expectTrusted("/..", "/");
  expectTrusted("/../.." + file.string(), file);
}

TEST_F(TrustedPathTest, NothingStandsBelowAFileNotEvenItself) {
  for (const char* const below : {"/", "/.", "/..", "/../program", "/x"}) {
    expectMissing(program + below, ENOTDIR);
  }
  fs::create_symlink(program, root / "link");
  expectMissing((root / "link").string() + "/.", ENOTDIR);
}

TEST_F(TrustedPathTest, AsManyLinksAreFollowedAsTheKernelFollows) {
  write("link0", "");
  std::string longest;
  for (int i = 1; i <= 50; ++i) {
    const std::string link = (root / ("link" + std::to_string(i))).string();
    fs::create_symlink("link" + std::to_string(i - 1), link);
    const UniqueFd opened(::open(link.c_str(), O_RDONLY | O_CLOEXEC));
    if (opened.isValid()) {
      expectTrusted(link, root / "link0");
      longest = link;
    } else {
      EXPECT_EQ(errno, ELOOP);
      expectMissing(link, ELOOP);
    }
  }
  EXPECT_EQ(longest, (root / "link40").string());
}

TEST_F(TrustedPathTest, ALinkWithoutATargetLeadsNowhere) {
  fs::create_symlink(program, root / "link");
  const FailingCall empty("readlink", 0);
  expectMissing(root / "link", ENOENT);
  EXPECT_EQ(empty.failures(), 1);
}

TEST_F(TrustedPathTest, OnlyAShortageLeavesItUnknownWhatIsThere) {
  fs::create_symlink(program, root / "link");
  for (const char* const call : {"lstat", "readlink"}) {
    for (const int error : {ENOMEM, EIO, EMFILE, ENFILE}) {
      const FailingCall failing(call, error);
      const TrustedPath walked = walkTrustedPath((root / "link").string());
      EXPECT_EQ(walked.outcome, Outcome::unknown) << call << ' ' << error;
      EXPECT_EQ(walked.error, error) << call;
    }
    for (const int error : {ENOENT, EACCES, ENOTDIR, ELOOP, ENAMETOOLONG}) {
      const FailingCall failing(call, error);
      expectMissing(root / "link", error);
    }
  }
}

TEST_F(TrustedPathTest, TheFileItselfIsShownWhoseverItIsAndWhoeverMayWriteIt) {
  ASSERT_EQ(::chmod(program.c_str(), 0666), 0);
  ASSERT_EQ(::chown(program.c_str(), 65534, 65534), 0);
  expectTrusted(program, program);
  EXPECT_FALSE(isRootsAlone(walkTrustedPath(program).facts));
}

TEST(RootsAloneTest, AFileIsRootsAloneWhenItIsRootsAndNobodyElseMayWriteIt) {
  const auto isIt = [](uid_t owner, mode_t mode) {
    struct stat facts {};
    facts.st_uid = owner;
    facts.st_mode = mode;
    return isRootsAlone(facts);
  };
  for (const mode_t type : {mode_t{S_IFREG}, mode_t{S_IFDIR}, mode_t{S_IFSOCK}}) {
    EXPECT_TRUE(isIt(0, type | 0755));
    EXPECT_TRUE(isIt(0, type | 06755));
    EXPECT_FALSE(isIt(0, type | 0775));
    EXPECT_FALSE(isIt(0, type | 0757));
    EXPECT_FALSE(isIt(0, type | 01777));
    EXPECT_FALSE(isIt(1, type | 0755));
    EXPECT_FALSE(isIt(65534, type | 0400));
  }
}

}  // namespace
}  // namespace brenvik

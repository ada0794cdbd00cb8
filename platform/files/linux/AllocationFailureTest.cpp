// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
//
// Every allocation fails once, and then all from each one on: in this process, where the operations answer
// ENOMEM and leave nothing, and in the archive reader, which may die of it.
// Not under ThreadSanitizer, which has operator new to itself.
#ifndef __SANITIZE_THREAD__
#include <dirent.h>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <cstdlib>
#include <fstream>
#include <functional>
#include <new>
#include <set>
#include <string>

#include "platform/base/UniqueFd.h"
#include "platform/base/fakes/FailingCalls.h"
#include "platform/files/fakes/TemporaryDirectory.h"
#include "platform/files/fakes/ZipBuilder.h"
#include "platform/files/linux/LinuxFileManager.h"
#include "platform/files/linux/TreeRemover.h"
#include "platform/files/linux/ZipArchiveCopier.h"

namespace {

std::atomic<bool> isArmed{false};
std::atomic<bool> failAll{false};
std::atomic<long> failAt{0};
std::atomic<long> made{0};

bool failsNow() {
  if (!isArmed) return false;
  const long number = made++;
  return number == failAt || (failAll && number > failAt);
}

}  // namespace

// Not inlined: g++ would see a free() of what new has made.
[[gnu::noinline]] void* operator new(std::size_t size) {
  if (!failsNow()) {
    if (void* const block = std::malloc(size == 0 ? 1 : size)) return block;
  }
  throw std::bad_alloc();
}
[[gnu::noinline]] void* operator new(std::size_t size, const std::nothrow_t&) noexcept {
  return failsNow() ? nullptr : std::malloc(size == 0 ? 1 : size);
}
[[gnu::noinline]] void operator delete(void* block) noexcept { std::free(block); }
[[gnu::noinline]] void operator delete(void* block, std::size_t) noexcept { std::free(block); }

// Of each listing only the first entries are shown: one file at least.
static bool cutsListings = false;  // NOLINT
extern "C" ssize_t getdents64(int directory, void* entries, std::size_t size) noexcept {
  const bool isFirst = ::lseek(directory, 0, SEEK_CUR) == 0;
  if (cutsListings && !isFirst) return 0;
  const ssize_t all = ::syscall(SYS_getdents64, directory, entries, size);
  if (!cutsListings) return all;
  ssize_t shown = 0;
  for (int i = 0; i < 3 && shown < all; ++i) {
    shown += reinterpret_cast<const dirent64*>(static_cast<const char*>(entries) + shown)->d_reclen;
  }
  return shown;
}

namespace brenvik {
namespace {

enum class Which { one, allFromThere };

// Does the work with allocation number `number` failing. False when it made no more than that many.
bool withFailure(long number, Which which, const std::function<void()>& work) {
  failAt = number;
  failAll = which == Which::allFromThere;
  made = 0;
  isArmed = true;
  work();
  isArmed = false;
  return made > number;
}

class AllocationFailureTest : public testing::TestWithParam<Which> {
 protected:
  std::set<std::string> everything() const {
    std::set<std::string> found;
    for (const auto& entry : std::filesystem::recursive_directory_iterator(dir.path())) {
      found.insert(entry.path().string().substr(dir.path().size() + 1));
    }
    return found;
  }
  // Without memory a hidden leftover may have to stay for the next attempt.
  void expectNothingNew(const std::set<std::string>& before, long number) {
    for (const std::string& name : everything()) {
      if (GetParam() == Which::allFromThere && name.starts_with(".brenvik-")) continue;
      EXPECT_TRUE(before.contains(name)) << name << " stayed after failure " << number;
    }
  }

  TemporaryDirectory dir;
  LinuxFileManager files;
};

TEST_P(AllocationFailureTest, ACopyIsWholeOrAnswersEnomemAndLeavesNothing) {
  for (int i = 0; i < 90; ++i) {
    dir.file("tree/" + std::to_string(i % 3) + "/" + std::to_string(i), "content");
  }
  dir.link("tree/link", "target");
  ASSERT_EQ(::link((dir / "tree/0/0").c_str(), (dir / "tree/1/again").c_str()), 0);
  const std::string from = dir / "tree";
  const std::string to = dir / "copy";
  const std::set<std::string> before = everything();
  int failures = 0;
  for (long number = 0;; ++number) {
    FileOutcome outcome = FileOutcome::success();
    const bool reached =
        withFailure(number, GetParam(), [&] { outcome = files.copyItem(from, to, IfPresent::fail); });
    if (outcome.succeeded()) {
      ASSERT_EQ(contentOf(to + "/2/89"), "content") << number;
      ASSERT_EQ(everything().size(), 2 * before.size()) << number;
      ASSERT_EQ(files.removeItem(to), FileOutcome::success());
      if (!reached) break;
    } else {
      ASSERT_EQ(outcome, FileOutcome::failure(ENOMEM)) << number;
      ++failures;
    }
    expectNothingNew(before, number);
  }
  EXPECT_GT(failures, 5);
}

TEST_P(AllocationFailureTest, ARemovalThatLacksMemoryCanBeRepeated) {
  const std::string tree = dir / "tree";
  for (long number = 0;; ++number) {
    for (int i = 0; i < 90; ++i) dir.file("tree/" + std::to_string(i % 3) + "/" + std::to_string(i));
    FileOutcome outcome = FileOutcome::success();
    const bool reached = withFailure(number, GetParam(), [&] { outcome = files.removeItem(tree); });
    if (outcome.succeeded()) {
      ASSERT_FALSE(isThere(tree)) << number;
      if (!reached) break;
    } else {
      ASSERT_EQ(outcome, FileOutcome::failure(ENOMEM)) << number;
      ASSERT_EQ(files.removeItem(tree), FileOutcome::success()) << number;
    }
  }
}

class RemovalWithoutMemoryTest : public testing::Test {
 protected:
  RemovalWithoutMemoryTest() {
    for (int i = 0; i < 12; ++i) dir.file("tree/" + std::to_string(i));
  }
  // Nothing can be allocated from its first moment on.
  int remove() {
    const UniqueFd folder(::open(dir.path().c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    int error = 0;
    withFailure(0, Which::allFromThere, [&] { error = removeTree(folder.get(), "tree"); });
    return error;
  }

  TemporaryDirectory dir;
};

TEST_F(RemovalWithoutMemoryTest, WhatAListingDidNotShowIsRemovedWithTheNextOne) {
  cutsListings = true;
  EXPECT_EQ(remove(), 0);
  cutsListings = false;
  EXPECT_FALSE(isThere(dir / "tree"));
}

TEST_F(RemovalWithoutMemoryTest, WhatCannotBeRemovedIsTheAnswerAndTheRestGoes) {
  {
    // The first two calls are for the directory itself, before and after memory was missed.
    const FailingCall stuck("unlinkat of no directory", EBUSY, 5, FailingCall::HowOften::always);
    EXPECT_EQ(remove(), EBUSY);
  }
  EXPECT_EQ(std::distance(std::filesystem::directory_iterator(dir / "tree"), {}), 9);
  // One that somebody else removes meanwhile is no failure.
  const FailingCall gone("unlinkat of no directory", ENOENT, 3);
  EXPECT_EQ(remove(), 0);
  EXPECT_EQ(gone.failures(), 1);
  EXPECT_FALSE(isThere(dir / "tree"));
}

TEST_P(AllocationFailureTest, WritesAndDirectoriesAreThereOrNot) {
  dir.file("file", "old");
  const std::string file = dir / "file";
  const std::string directory = dir / "made/below";
  for (long number = 0;; ++number) {
    bool written = false;
    FileOutcome outcome = FileOutcome::success();
    const bool reached = withFailure(number, GetParam(), [&] {
      written = files.writeFileAtomically(file, "new");
      outcome = files.createDirectory(directory, {}, Intermediates::create);
    });
    ASSERT_EQ(contentOf(file), written ? "new" : "old") << number;
    if (outcome.succeeded()) {
      ASSERT_TRUE(isThere(directory)) << number;
    } else {
      ASSERT_EQ(outcome, FileOutcome::failure(ENOMEM)) << number;
    }
    std::filesystem::remove_all(dir / "made");
    dir.file("file", "old");
    expectNothingNew({"file"}, number);
    if (!reached) break;
  }
}

class UnpackingAllocationFailureTest : public AllocationFailureTest {
 protected:
  UnpackingAllocationFailureTest() {
    ZipBuilder zip;
    zip.file("a", std::string(5000, 'a'))
        .file("sub/größe", "b", 0100755)
        .link("link", "a")
        .directory("empty");
    archive = dir.file("archive.zip", zip.build());
  }
  int unpack(const std::string& reader) { return ZipArchiveCopier(reader).copy(archive, to, options); }
  void expectWhole(long number) {
    ASSERT_EQ(contentOf(to + "/a"), std::string(5000, 'a')) << number;
    ASSERT_EQ(contentOf(to + "/sub/größe"), "b") << number;
    ASSERT_EQ(std::filesystem::read_symlink(to + "/link"), "a") << number;
    ASSERT_TRUE(std::filesystem::is_empty(to + "/empty")) << number;
  }

  std::string archive;
  const std::string to = dir / "out";
  const PropertyList options =
      PropertyList::dictionary({{"extractPKZip", PropertyList::boolean(true)},
                                {"copyExtendedAttributes", PropertyList::boolean(true)},
                                {"copyResources", PropertyList::boolean(true)}});
};

TEST_P(UnpackingAllocationFailureTest, TheWriterUnpacksAllOrAnswersEnomemAndLeavesNothing) {
  const std::string reader = BRENVIK_TEST_READER;
  const std::set<std::string> before = everything();
  for (long number = 0;; ++number) {
    int result = 0;
    ZipArchiveCopier copier(reader);
    const bool reached = withFailure(number, GetParam(), [&] { result = copier.copy(archive, to, options); });
    if (result == 0) {
      ASSERT_NO_FATAL_FAILURE(expectWhole(number));
      std::filesystem::remove_all(to);
      if (!reached) break;
    } else {
      ASSERT_EQ(result, ENOMEM) << number;
    }
    expectNothingNew(before, number);
  }
  EXPECT_EQ(::waitpid(-1, nullptr, WNOHANG), -1);  // no reader stays
}

TEST_P(UnpackingAllocationFailureTest, AReaderWithoutMemoryIsAFailedCopyAndNeverAnIncompleteOne) {
  const std::string reader = dir / "reader";
  const std::string count = dir / "count";
  const auto prepare = [&](long number) {
    dir.file("reader", "#!/bin/sh\nBRENVIK_COUNT=" + count + " BRENVIK_FAIL_AT=" + std::to_string(number) +
                           (GetParam() == Which::allFromThere ? " BRENVIK_FAIL_ALL=1" : "") +
                           " LD_PRELOAD=" BRENVIK_TEST_FAILING_MALLOC " exec " BRENVIK_TEST_READER "\n");
    ASSERT_EQ(::chmod(reader.c_str(), 0755), 0);
  };
  ASSERT_NO_FATAL_FAILURE(prepare(-1 + (1L << 30)));
  ASSERT_EQ(unpack(reader), 0);
  std::filesystem::remove_all(to);
  long total = 0;
  std::ifstream(count, std::ios::binary).read(reinterpret_cast<char*>(&total), sizeof total);
  ASSERT_GT(total, 50);
  const std::set<std::string> before = everything();
  // All of them take a minute; the way through them is another one in each of the two runs.
  const char* const all = std::getenv("BRENVIK_EVERY_ALLOCATION");
  const long step = all != nullptr ? 1 : std::max(1L, total / 40);
  int failures = 0;
  for (long number = GetParam() == Which::one ? 0 : step / 2; number < total; number += step) {
    ASSERT_NO_FATAL_FAILURE(prepare(number));
    if (unpack(reader) == 0) {
      ASSERT_NO_FATAL_FAILURE(expectWhole(number));
      std::filesystem::remove_all(to);
    } else {
      ++failures;
    }
    ASSERT_EQ(everything(), before) << number;
  }
  EXPECT_GT(failures, 5);
}

std::string nameOf(const testing::TestParamInfo<Which>& info) {
  return info.param == Which::one ? "One" : "AllFromThere";
}
INSTANTIATE_TEST_SUITE_P(Failing, AllocationFailureTest, testing::Values(Which::one, Which::allFromThere),
                         nameOf);
INSTANTIATE_TEST_SUITE_P(Failing, UnpackingAllocationFailureTest,
                         testing::Values(Which::one, Which::allFromThere), nameOf);

}  // namespace
}  // namespace brenvik
#endif

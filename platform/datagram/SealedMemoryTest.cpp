// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/datagram/SealedMemory.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/mman.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <utility>
#include <vector>

#include "platform/base/UniqueFd.h"

namespace brenvik {
namespace {

UniqueFd memoryOf(off_t size) {
  UniqueFd memory(::memfd_create("test", MFD_CLOEXEC | MFD_ALLOW_SEALING));
  EXPECT_EQ(::ftruncate(memory.get(), size), 0);
  return memory;
}

TEST(SealedMemoryTest, WhatIsSealedHasASizeForGood) {
  const UniqueFd memory = memoryOf(5000);
  EXPECT_EQ(sizeOfSealedMemory(memory.get()), -1);
  EXPECT_TRUE(sealMemory(memory.get()));
  EXPECT_EQ(sizeOfSealedMemory(memory.get()), 5000);
  EXPECT_NE(::ftruncate(memory.get(), 4999), 0);
  EXPECT_NE(::ftruncate(memory.get(), 5001), 0);
  EXPECT_NE(::pwrite(memory.get(), "x", 1, 0), 1);
  EXPECT_FALSE(sealMemory(memory.get())) << "no further seals";
}

TEST(SealedMemoryTest, EachOfTheThreeSealsIsNeeded) {
  constexpr int kAll = F_SEAL_SHRINK | F_SEAL_GROW | F_SEAL_WRITE;
  for (const int missing : {F_SEAL_SHRINK, F_SEAL_GROW, F_SEAL_WRITE}) {
    const UniqueFd memory = memoryOf(10);
    ASSERT_EQ(::fcntl(memory.get(), F_ADD_SEALS, kAll & ~missing), 0);
    EXPECT_EQ(sizeOfSealedMemory(memory.get()), -1) << missing;
    ASSERT_EQ(::fcntl(memory.get(), F_ADD_SEALS, missing), 0);
    EXPECT_EQ(sizeOfSealedMemory(memory.get()), 10);
  }
}

TEST(SealedMemoryTest, NothingElseHasASize) {
  EXPECT_EQ(sizeOfSealedMemory(-1), -1);
  const UniqueFd file(::open("/proc/self/exe", O_RDONLY | O_CLOEXEC));
  EXPECT_EQ(sizeOfSealedMemory(file.get()), -1);
}

// Empty memory of huge pages needs none of them.
TEST(SealedMemoryTest, MemoryOfHugePagesHasNone) {
  const UniqueFd huge(::memfd_create("test", MFD_CLOEXEC | MFD_ALLOW_SEALING | MFD_HUGETLB));
  if (!huge.isValid()) GTEST_SKIP() << "no huge pages here";
  ASSERT_TRUE(sealMemory(huge.get()));
  EXPECT_EQ(sizeOfSealedMemory(huge.get()), -1);
}

TEST(SealedMemoryTest, BytesAreSealedInAndMappedByWhoeverGetsThem) {
  const std::vector<std::byte> bytes(100'000, std::byte{7});
  const UniqueFd memory = makeSealedMemory("test", bytes);
  ASSERT_TRUE(memory.isValid());
  SealedMemory mapped;
  EXPECT_EQ(SealedMemory::map(memory.get(), bytes.size() - 1, &mapped), EBADMSG);
  EXPECT_EQ(SealedMemory::map(memory.get(), bytes.size() + 1, &mapped), EBADMSG);
  EXPECT_TRUE(mapped.bytes().empty());
  ASSERT_EQ(SealedMemory::map(memory.get(), bytes.size(), &mapped), 0);
  SealedMemory moved = std::move(mapped);
  EXPECT_TRUE(std::equal(bytes.begin(), bytes.end(), moved.bytes().begin(), moved.bytes().end()));
  EXPECT_TRUE(mapped.bytes().empty());
  EXPECT_EQ(SealedMemory::map(makeSealedMemory("test", {}).get(), 0, &mapped), 0) << "nothing to be mapped";
  SealedMemory assigned;
  assigned = std::move(moved);
  EXPECT_TRUE(std::equal(bytes.begin(), bytes.end(), assigned.bytes().begin(), assigned.bytes().end()));
  EXPECT_TRUE(moved.bytes().empty());
}

}  // namespace
}  // namespace brenvik

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/ipc/linux/SystemRegions.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include <cstring>
#include <filesystem>

#include "platform/base/fakes/FailingAllocations.h"

namespace brenvik {
namespace {

constexpr std::size_t kLarge = 1'000'000;

std::ptrdiff_t openDescriptors() {
  return std::distance(std::filesystem::directory_iterator("/proc/self/fd"),
                       std::filesystem::directory_iterator());
}

TEST(SystemRegionsTest, ALargeRegionThatIsGivenBackUnsentLeavesNothing) {
  SystemRegions regions;
  const auto before = openDescriptors();
  void* address = nullptr;
  ASSERT_EQ(regions.allocate(&address, kLarge), kern::success);
  std::memset(address, 'x', kLarge);
  EXPECT_EQ(openDescriptors(), before + 1);
  regions.deallocate(address, kLarge);
  EXPECT_EQ(openDescriptors(), before);
  EXPECT_FALSE(regions.sealIntoDescriptor(address, kLarge).isValid()) << "it is nobody's any more";
}

TEST(SystemRegionsTest, ALargeRegionTravelsSealedAndOnce) {
  SystemRegions regions;
  void* address = nullptr;
  ASSERT_EQ(regions.allocate(&address, kLarge), kern::success);
  std::memset(address, 'x', kLarge);
  const UniqueFd sealed = regions.sealIntoDescriptor(address, kLarge);
  ASSERT_TRUE(sealed.isValid());
  EXPECT_EQ(::fcntl(sealed.get(), F_GET_SEALS), F_SEAL_SHRINK | F_SEAL_GROW | F_SEAL_WRITE | F_SEAL_SEAL);
  EXPECT_EQ(::pwrite(sealed.get(), "y", 1, 0), -1);
  EXPECT_FALSE(regions.sealIntoDescriptor(address, kLarge).isValid());
}

TEST(SystemRegionsTest, WithoutMemoryToRememberItALargeRegionIsRefusedAndLeavesNothing) {
  if (!FailingAllocations::kWork) GTEST_SKIP() << "operator new belongs to the sanitizer";
  SystemRegions regions;
  const auto before = openDescriptors();
  void* address = &regions;
  KernelReturn code = kern::success;
  {
    const FailingAllocations noMemory(0);
    code = regions.allocate(&address, kLarge);
  }
  EXPECT_EQ(code, kern::noSpace);
  EXPECT_EQ(address, nullptr);
  EXPECT_EQ(openDescriptors(), before);
}

TEST(SystemRegionsTest, AnEmptyRegionStandsNowhereAndNeedsNotBeGivenBack) {
  SystemRegions regions;
  void* address = &regions;
  EXPECT_EQ(regions.allocate(&address, 0), kern::success);
  EXPECT_EQ(address, nullptr);
  regions.deallocate(address, 0);
}

}  // namespace
}  // namespace brenvik

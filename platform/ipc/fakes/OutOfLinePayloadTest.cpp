// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/ipc/OutOfLinePayload.h"

#include <gtest/gtest.h>

#include <string_view>

#include "platform/ipc/fakes/HeapRegions.h"

namespace brenvik {
namespace {

TEST(OutOfLinePayloadTest, APayloadStandsNowhereUntilItIsFilled) {
  const OutOfLinePayload payload;
  EXPECT_EQ(payload.address, nullptr);
  EXPECT_EQ(payload.length, 0U);
}

TEST(OutOfLinePayloadTest, TheBytesAreCopiedIntoARegionOfTheirOwn) {
  HeapRegions regions;
  OutOfLinePayload payload;
  const std::string_view bytes("a\0b", 3);
  EXPECT_EQ(fillPayload(regions, bytes, &payload), kern::success);
  EXPECT_EQ(regions.lastLength, 3U);
  ASSERT_EQ(payload.length, 3U);
  ASSERT_NE(payload.address, nullptr);
  EXPECT_NE(payload.address, bytes.data());
  EXPECT_EQ(std::string_view(static_cast<const char*>(payload.address), payload.length), bytes);
  regions.deallocate(payload.address, payload.length);
  EXPECT_EQ(regions.live(), 0U);
}

TEST(OutOfLinePayloadTest, WithoutARegionTheAllocatorsCodeComesBackAndOnlyTheLengthIsSet) {
  HeapRegions regions;
  for (const KernelReturn code : {kern::noSpace, kern::resourceShortage}) {
    regions.refuseWith = code;
    OutOfLinePayload payload;
    EXPECT_EQ(fillPayload(regions, "abc", &payload), code);
    EXPECT_EQ(payload.address, nullptr);
    EXPECT_EQ(payload.length, 3U);
  }
}

// As the real regions have it: nothing is allocated for nothing.
TEST(OutOfLinePayloadTest, NoBytesMayStandNowhere) {
  class NoRegions final : public RegionAllocator {
    KernelReturn allocate(void** address, std::size_t) noexcept override {
      *address = nullptr;
      return kern::success;
    }
    void deallocate(void*, std::size_t) noexcept override {}
  } regions;
  OutOfLinePayload payload{.address = nullptr, .length = 7};
  EXPECT_EQ(fillPayload(regions, "", &payload), kern::success);
  EXPECT_EQ(payload.address, nullptr);
  EXPECT_EQ(payload.length, 0U);
}

}  // namespace
}  // namespace brenvik

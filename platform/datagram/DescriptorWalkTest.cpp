// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/datagram/DescriptorWalk.h"

#include <gtest/gtest.h>

#include <cstring>
#include <vector>

namespace brenvik {
namespace {

// A complex message of these descriptors, then `regions` bytes; its size field says where the message ends.
class Datagram {
 public:
  explicit Datagram(std::uint32_t count) : bytes_(kDescriptorsOffset) {
    put(offsetof(MessageHeader, bits), kComplexBit);
    put(kDescriptorCountOffset, count);
  }
  Datagram& region(std::uint64_t address, std::uint32_t size) {
    return add(OutOfLineDescriptor{address, 0, 0, 0, kOutOfLineDescriptorType, size});
  }
  Datagram& port() { return add(PortDescriptor{0, 0, 0, kDispositionMoveSend, kPortDescriptorType}); }
  Datagram& unknown() { return add(PortDescriptor{0, 0, 0, kDispositionMoveSend, 7}); }
  Datagram& then(std::size_t regions) {
    put(offsetof(MessageHeader, size), static_cast<std::uint32_t>(bytes_.size()));
    bytes_.resize(regionOffsetAfter(bytes_.size()) + regions);
    return *this;
  }
  std::optional<DescriptorWalk> walk() const { return walkDescriptors(bytes_); }
  std::span<const std::byte> bytes() const { return bytes_; }

 private:
  template <class Descriptor>
  Datagram& add(const Descriptor& descriptor) {
    const auto raw = std::as_bytes(std::span(&descriptor, 1));
    bytes_.insert(bytes_.end(), raw.begin(), raw.end());
    return *this;
  }
  void put(std::size_t offset, std::uint32_t value) {
    std::memcpy(bytes_.data() + offset, &value, sizeof value);
  }

  std::vector<std::byte> bytes_;
};

// One region ends a message of 44 bytes, so the first region stands at 48.
TEST(DescriptorWalkTest, ARegionFollowsTheMessageAndEndsTheDatagram) {
  const auto walk = Datagram(1).region(48, 5).then(5).walk();
  ASSERT_TRUE(walk);
  EXPECT_EQ(walk->messageSize, 44U);
  EXPECT_EQ(walk->rights, 0U);
  EXPECT_FALSE(Datagram(1).region(56, 5).then(13).walk()) << "a gap before it";
  EXPECT_FALSE(Datagram(1).region(48, 5).then(6).walk()) << "a byte after it";
  EXPECT_FALSE(Datagram(1).region(48, 6).then(5).walk()) << "it ends outside";
  EXPECT_FALSE(Datagram(1).region(1 << 20, 5).then(5).walk()) << "it begins outside";
}

TEST(DescriptorWalkTest, RegionsStandInOrderAndAligned) {
  EXPECT_TRUE(Datagram(2).region(64, 5).region(72, 8).then(16).walk());
  EXPECT_FALSE(Datagram(2).region(64, 5).region(69, 8).then(13).walk()) << "unaligned";
  EXPECT_FALSE(Datagram(2).region(64, 16).region(72, 8).then(16).walk()) << "overlapping";
  EXPECT_FALSE(Datagram(2).region(72, 8).region(64, 8).then(16).walk()) << "out of order";
}

TEST(DescriptorWalkTest, PortsAndMemoryNeedADescriptorEach) {
  const auto walk = Datagram(4).port().region(0, 100'000).region(0, 0).port().then(0).walk();
  ASSERT_TRUE(walk);
  EXPECT_EQ(walk->rights, 3U);
}

TEST(DescriptorWalkTest, TheWalkEndsAtTheFirstDescriptorThatIsNone) {
  EXPECT_EQ(Datagram(3).port().unknown().port().then(0).walk()->rights, 1U);
  EXPECT_EQ(Datagram(3).port().then(0).walk()->rights, 1U) << "the others lie beyond the message";
  EXPECT_EQ(Datagram(0).port().then(0).walk()->rights, 0U) << "the count says none";
}

TEST(DescriptorWalkTest, TheSizeOfAMessageWithoutRegionsIsTheDatagrams) {
  const auto datagram = Datagram(1).port().then(0);
  EXPECT_EQ(datagram.walk()->messageSize, datagram.bytes().size());
}

}  // namespace
}  // namespace brenvik

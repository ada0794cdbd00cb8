// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "client/Outgoing.h"

#include <cstdint>
#include <cstring>

#include "platform/datagram/SealedMemory.h"

namespace brenvik::client {
namespace {

constexpr std::array<std::byte, kRegionAlignment - 1> kPadding{};

}  // namespace

bool Outgoing::lay(std::span<std::byte> message, Regions regions) noexcept {
  partCount_ = 0;
  descriptorCount_ = 0;
  parts_[partCount_++] = iovecOf(message);
  std::size_t end = message.size();
  for (std::size_t i = 0; i < regions.size(); ++i) {
    OutOfLineDescriptor descriptor{};
    descriptor.type = kOutOfLineDescriptorType;
    descriptor.copy = kVirtualCopy;
    descriptor.size = static_cast<std::uint32_t>(regions[i].size());
    const std::size_t offset = regionOffsetAfter(end);
    if (regions[i].size() > kLargestDatagram - offset) {
      memories_[i] = makeSealedMemory("brenvik-region", regions[i]);
      if (!memories_[i].isValid()) return false;
      descriptors_[descriptorCount_++] = memories_[i].get();
    } else if (!regions[i].empty()) {
      descriptor.address = offset;
      if (offset != end) parts_[partCount_++] = iovecOf(std::span(kPadding).first(offset - end));
      parts_[partCount_++] = iovecOf(regions[i]);
      end = offset + regions[i].size();
    }
    std::memcpy(message.data() + kDescriptorsOffset + i * sizeof descriptor, &descriptor, sizeof descriptor);
  }
  return true;
}

}  // namespace brenvik::client

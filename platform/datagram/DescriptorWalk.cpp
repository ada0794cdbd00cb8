// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/datagram/DescriptorWalk.h"

#include <cstring>

namespace brenvik {
namespace {

template <class Value>
Value read(std::span<const std::byte> datagram, std::size_t offset) noexcept {
  Value value;
  std::memcpy(&value, datagram.data() + offset, sizeof value);
  return value;
}

constexpr std::size_t kTypeOffset = offsetof(PortDescriptor, type);
static_assert(kTypeOffset == offsetof(OutOfLineDescriptor, type),
              "the walk tells descriptors apart by this byte");

bool hasInLineRegion(std::span<const std::byte> datagram, std::size_t end) noexcept {
  DescriptorCursor cursor(datagram, end);
  while (const auto descriptor = cursor.next()) {
    if (descriptor->kind == WalkedDescriptor::Kind::inLineRegion) return true;
  }
  return false;
}

}  // namespace

DescriptorCursor::DescriptorCursor(std::span<const std::byte> datagram, std::size_t end) noexcept
    : datagram_(datagram), end_(end) {
  const bool complex = (read<std::uint32_t>(datagram, offsetof(MessageHeader, bits)) & kComplexBit) != 0;
  if (complex && end >= kDescriptorsOffset) left_ = read<std::uint32_t>(datagram, kDescriptorCountOffset);
}

std::optional<WalkedDescriptor> DescriptorCursor::next() noexcept {
  if (left_ == 0 || end_ - at_ < sizeof(PortDescriptor)) return std::nullopt;
  const auto type = read<std::uint8_t>(datagram_, at_ + kTypeOffset);
  if (type == kPortDescriptorType) {
    const WalkedDescriptor found{WalkedDescriptor::Kind::port, at_, 0, 0};
    at_ += sizeof(PortDescriptor);
    --left_;
    return found;
  }
  if (type != kOutOfLineDescriptorType || end_ - at_ < sizeof(OutOfLineDescriptor)) return std::nullopt;
  const auto descriptor = read<OutOfLineDescriptor>(datagram_, at_);
  WalkedDescriptor found{WalkedDescriptor::Kind::emptyRegion, at_, 0, descriptor.size};
  if (descriptor.size != 0) {
    found.kind =
        descriptor.address != 0 ? WalkedDescriptor::Kind::inLineRegion : WalkedDescriptor::Kind::memfdRegion;
    found.regionOffset = descriptor.address;
  }
  at_ += sizeof(OutOfLineDescriptor);
  --left_;
  return found;
}

std::optional<DescriptorWalk> walkDescriptors(std::span<const std::byte> datagram) noexcept {
  DescriptorWalk walk;
  std::size_t end = datagram.size();
  const bool inLine = hasInLineRegion(datagram, end);
  if (inLine) {
    // The message ends where its sender says, or the regions behind it could be read as descriptors.
    end = read<std::uint32_t>(datagram, offsetof(MessageHeader, size));
    if (end > datagram.size() || !hasInLineRegion(datagram, end)) return std::nullopt;
  }
  walk.messageSize = static_cast<std::uint32_t>(end);

  std::size_t regionsEnd = 0;  // of the regions seen so far
  DescriptorCursor cursor(datagram, end);
  while (const auto descriptor = cursor.next()) {
    if (descriptor->kind == WalkedDescriptor::Kind::inLineRegion) {
      const std::size_t start = descriptor->regionOffset;
      if (regionsEnd == 0 ? start != regionOffsetAfter(end) : start < regionsEnd) return std::nullopt;
      if (start % kRegionAlignment != 0 || start > datagram.size()) return std::nullopt;
      if (datagram.size() - start < descriptor->regionLength) return std::nullopt;
      regionsEnd = start + descriptor->regionLength;
    } else if (descriptor->kind != WalkedDescriptor::Kind::emptyRegion) {
      ++walk.rights;
    }
  }
  if (inLine && regionsEnd != datagram.size()) return std::nullopt;
  return walk;
}

}  // namespace brenvik

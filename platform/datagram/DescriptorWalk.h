// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <cstddef>
#include <cstdint>
#include <optional>
#include <span>

#include "interface/Wire.h"

namespace brenvik {

// The rights and regions that a datagram claims to carry, read from its bytes alone; nothing is received,
// mapped or changed. Every length and offset in the datagram comes from the peer.
struct DescriptorWalk {
  // The message's size in bytes as its receiver sees it: the datagram's length, or, with in-line regions, the
  // size that the sender wrote.
  std::uint32_t messageSize = 0;
  // How many descriptors the control data must carry: ports, and regions that travel as a memfd.
  std::uint32_t rights = 0;
};

// One descriptor of the walk.
struct WalkedDescriptor {
  enum class Kind { port, inLineRegion, memfdRegion, emptyRegion };
  Kind kind;
  std::size_t offset;          // of the descriptor in the datagram
  std::size_t regionOffset;    // in-line region: of its bytes in the datagram
  std::uint32_t regionLength;  // bytes
};

// Steps through the descriptors of a complex message: up to the count, the first unknown type, or the first
// descriptor that does not lie wholly before `end`.
class DescriptorCursor {
 public:
  // Precondition: the datagram holds at least a header. `end` is at most its length.
  DescriptorCursor(std::span<const std::byte> datagram, std::size_t end) noexcept;
  std::optional<WalkedDescriptor> next() noexcept;

 private:
  const std::span<const std::byte> datagram_;
  const std::size_t end_;
  std::size_t at_ = kDescriptorsOffset;
  std::uint32_t left_ = 0;
};

// Checks the framing of a datagram of at least 24 bytes. Returns nothing if it is malformed:
// a region outside the datagram, unaligned, out of order or overlapping, a first region that does not follow
// the message, or bytes after the last region.
std::optional<DescriptorWalk> walkDescriptors(std::span<const std::byte> datagram) noexcept;

}  // namespace brenvik

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <cstddef>
#include <cstdint>
#include <optional>
#include <span>

#include "client/Channel.h"
#include "client/include/brenvik/mobile_helper.h"
#include "interface/Wire.h"

// Out-of-line regions, as they leave and as they come in.
namespace brenvik::client {

// Room for one message; a larger datagram arrives cut, which the kernel tells.
inline constexpr std::size_t kBufferSize = kLargestDatagram;

// Where a region of an incoming message stands: in the datagram, in a descriptor, or nowhere (size 0).
struct RegionPlace {
  std::uint32_t size = 0;
  std::size_t offset = 0;  // 0: in the message's first descriptor
};

// Checks the framing of a message whose fixed part has bodySize bytes and holds one out-of-line descriptor
// and no other: the region's place, that nothing follows it, and that as many descriptors came as it needs.
// Nothing when any of it is not as it should be.
std::optional<RegionPlace> placeOfRegion(std::span<const std::byte> datagram, std::size_t bodySize,
                                         const Incoming& incoming) noexcept;

// A receive buffer of kBufferSize bytes from malloc, or none; may change hands with a region in it.
class Buffer {
 public:
  Buffer() = default;
  Buffer(const Buffer&) = delete;
  Buffer& operator=(const Buffer&) = delete;
  ~Buffer();
  // Makes sure that there is one; false when out of memory.
  bool ensure() noexcept;
  std::span<std::byte> bytes() const noexcept { return {data_, data_ == nullptr ? 0 : kBufferSize}; }
  [[nodiscard]] void* release() noexcept;

 private:
  std::byte* data_ = nullptr;
};

// Hands a region that was placed over to the caller. `buffer` holds the datagram and may be given away with
// it. BVMH_ERROR_PROTOCOL for memory that is not sealed or shorter than it says.
std::int32_t takeRegion(const RegionPlace& place, Buffer& buffer, const Incoming& incoming,
                        bvmh_region* region) noexcept;

}  // namespace brenvik::client

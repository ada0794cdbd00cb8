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

// Out-of-line regions of received messages.
namespace brenvik::client {

// Room for one message, in bytes; a larger datagram arrives cut, and the kernel reports that.
inline constexpr std::size_t kBufferSize = kLargestDatagram;

// The place of a region of an incoming message: in the datagram, in a descriptor, or nowhere (size 0).
struct RegionPlace {
  std::uint32_t size = 0;
  std::size_t offset = 0;  // 0: in the message's first descriptor
};

// Checks the framing of a message whose fixed part has bodySize bytes and holds one out-of-line descriptor
// and no other: the region's place, that nothing follows it, and that the right number of descriptors came.
// Returns nothing if the message is malformed.
std::optional<RegionPlace> placeOfRegion(std::span<const std::byte> datagram, std::size_t bodySize,
                                         const Incoming& incoming) noexcept;

// A receive buffer of kBufferSize bytes from malloc, or none; may change hands with a region in it.
class Buffer {
 public:
  Buffer() = default;
  Buffer(const Buffer&) = delete;
  Buffer& operator=(const Buffer&) = delete;
  ~Buffer();
  // Allocates the buffer if there is none; false if memory runs out.
  bool ensure() noexcept;
  std::span<std::byte> bytes() const noexcept { return {data_, data_ == nullptr ? 0 : kBufferSize}; }
  [[nodiscard]] void* release() noexcept;

 private:
  std::byte* data_ = nullptr;
};

// Hands a region over to the caller. `buffer` holds the datagram, and its memory may go to the caller with
// the region. Returns BVMH_ERROR_PROTOCOL for memory that is not sealed or is shorter than its descriptor
// says.
std::int32_t takeRegion(const RegionPlace& place, Buffer& buffer, const Incoming& incoming,
                        bvmh_region* region) noexcept;

}  // namespace brenvik::client

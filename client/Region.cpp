// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "client/Region.h"

#include <sys/mman.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <utility>

#include "platform/datagram/DescriptorWalk.h"
#include "platform/datagram/SealedMemory.h"

namespace brenvik::client {
namespace {

// What a region's `owner` points at when its bytes are a mapping, not malloc's.
char mappingMark;

// From this size on, giving the whole receive buffer away is cheaper than copying the bytes out of it.
constexpr std::size_t kWorthTheBuffer = 16'384;

}  // namespace

std::optional<RegionPlace> placeOfRegion(std::span<const std::byte> datagram, std::size_t bodySize,
                                         const Incoming& incoming) noexcept {
  if (incoming.isCut) return std::nullopt;
  const auto walk = walkDescriptors(datagram);
  if (!walk || walk->messageSize != bodySize || walk->rights != incoming.descriptorCount) return std::nullopt;
  const auto descriptor = DescriptorCursor(datagram, bodySize).next();
  if (!descriptor || descriptor->kind == WalkedDescriptor::Kind::port) return std::nullopt;
  return RegionPlace{descriptor->regionLength, descriptor->regionOffset};
}

Buffer::~Buffer() { std::free(data_); }

bool Buffer::ensure() noexcept {
  if (data_ == nullptr) data_ = static_cast<std::byte*>(std::malloc(kBufferSize));
  return data_ != nullptr;
}

void* Buffer::release() noexcept { return std::exchange(data_, nullptr); }

std::int32_t takeRegion(const RegionPlace& place, Buffer& buffer, const Incoming& incoming,
                        bvmh_region* region) noexcept {
  *region = bvmh_region{};
  if (place.size == 0) return BVMH_OK;
  if (place.offset != 0) {
    const std::byte* bytes = buffer.bytes().data() + place.offset;
    if (place.size >= kWorthTheBuffer) {
      *region = {bytes, place.size, buffer.release(), nullptr};
      return BVMH_OK;
    }
    void* copy = std::malloc(place.size);
    if (copy == nullptr) return BVMH_ERROR_NO_MEMORY;
    std::memcpy(copy, bytes, place.size);
    *region = {copy, place.size, copy, nullptr};
    return BVMH_OK;
  }
  const int memory = incoming.descriptors[0].get();
  if (sizeOfSealedMemory(memory) < static_cast<std::int64_t>(place.size)) return BVMH_ERROR_PROTOCOL;
  void* const mapping = mapSealedMemory(memory, place.size);
  if (mapping == nullptr) return errno == ENOMEM ? BVMH_ERROR_NO_MEMORY : BVMH_ERROR_PROTOCOL;
  *region = {mapping, place.size, &mappingMark, nullptr};
  return BVMH_OK;
}

}  // namespace brenvik::client

extern "C" void bvmh_region_free(bvmh_region* region) {
  if (region == nullptr) return;
  if (region->owner == &brenvik::client::mappingMark) {
    ::munmap(const_cast<void*>(region->bytes), region->size);
  } else {
    std::free(region->owner);
  }
  *region = bvmh_region{};
}

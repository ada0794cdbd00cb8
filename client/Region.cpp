// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "client/Region.h"

#include <fcntl.h>
#include <sys/mman.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <utility>

namespace brenvik::client {
namespace {

// What a region's `owner` points at when its bytes are a mapping, not malloc's.
char mappingMark;

// From this size on, giving the whole receive buffer away is cheaper than copying the bytes out of it.
constexpr std::size_t kWorthTheBuffer = 16'384;

constexpr int kSeals = F_SEAL_SHRINK | F_SEAL_GROW | F_SEAL_WRITE;

}  // namespace

UniqueFd makeSealedMemory(std::span<const std::byte> bytes) noexcept {
  UniqueFd memory(::memfd_create("brenvik-region", MFD_CLOEXEC | MFD_ALLOW_SEALING));
  if (!memory.isValid()) return memory;
  for (std::size_t done = 0; done < bytes.size();) {
    const ssize_t written = ::write(memory.get(), bytes.data() + done, bytes.size() - done);
    if (written < 0 && errno == EINTR) continue;
    if (written <= 0) return UniqueFd();
    done += static_cast<std::size_t>(written);
  }
  if (::fcntl(memory.get(), F_ADD_SEALS, kSeals | F_SEAL_SEAL) != 0) return UniqueFd();
  return memory;
}

std::optional<RegionPlace> placeOfRegion(std::span<const std::byte> datagram, std::size_t bodySize,
                                         const OutOfLineDescriptor& descriptor,
                                         const Incoming& incoming) noexcept {
  if (incoming.isCut) return std::nullopt;
  const bool isInLine = descriptor.size != 0 && descriptor.address != 0;
  const std::size_t wantedDescriptors = descriptor.size != 0 && !isInLine ? 1 : 0;
  if (incoming.descriptorCount != wantedDescriptors) return std::nullopt;
  if (!isInLine) {
    if (datagram.size() != bodySize) return std::nullopt;
    return RegionPlace{descriptor.size, 0};
  }
  MessageHeader header;
  std::memcpy(&header, datagram.data(), sizeof header);
  const std::size_t offset = roundUpTo8(bodySize);
  if (header.size != bodySize || descriptor.address != offset || datagram.size() < offset ||
      datagram.size() - offset != descriptor.size) {
    return std::nullopt;
  }
  return RegionPlace{descriptor.size, offset};
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
  // Sealed first, measured second: what is sealed keeps its length, so that reading the mapping cannot fault.
  const int seals = ::fcntl(memory, F_GET_SEALS);
  if (seals < 0 || (seals & kSeals) != kSeals) return BVMH_ERROR_PROTOCOL;
  struct stat facts {};
  if (::fstat(memory, &facts) != 0 || facts.st_size < static_cast<off_t>(place.size))
    return BVMH_ERROR_PROTOCOL;
  void* mapping = ::mmap(nullptr, place.size, PROT_READ, MAP_PRIVATE, memory, 0);
  if (mapping == MAP_FAILED) return errno == ENOMEM ? BVMH_ERROR_NO_MEMORY : BVMH_ERROR_PROTOCOL;
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

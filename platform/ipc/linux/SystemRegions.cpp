// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/ipc/linux/SystemRegions.h"

#include <fcntl.h>
#include <sys/mman.h>
#include <unistd.h>

#include <algorithm>
#include <cstdlib>
#include <new>

#include "platform/datagram/SealedMemory.h"

namespace brenvik {

namespace {

constexpr std::size_t kPage = 4096;
static_assert(kLargestDatagram % kPage == 0);

}  // namespace

KernelReturn SystemRegions::allocate(void** address, std::size_t length) noexcept {
  *address = nullptr;
  if (length == 0) return kern::success;
  if (length <= kLongestInLine) {
    std::byte* datagram = spare_.release();
    // All small regions have one size, so that the spare fits whoever comes next. On whole pages the kernel
    // copies faster.
    if (datagram == nullptr) datagram = static_cast<std::byte*>(std::aligned_alloc(kPage, kLargestDatagram));
    if (datagram == nullptr) return kern::noSpace;
    ++liveSmall_;
    *address = datagram + kRoomForMessage;
    return kern::success;
  }
  UniqueFd memfd = makeSealableMemory("brenvik-reply");
  if (!memfd.isValid()) return kern::resourceShortage;
  // Allocated, not only sized: memory that is not there fails here and not as a SIGBUS while it is written.
  if (::posix_fallocate(memfd.get(), 0, static_cast<off_t>(length)) != 0) return kern::noSpace;
  void* const mapped = ::mmap(nullptr, length, PROT_READ | PROT_WRITE, MAP_SHARED, memfd.get(), 0);
  if (mapped == MAP_FAILED) return kern::noSpace;
  try {
    large_.push_back({mapped, length, std::move(memfd)});
  } catch (const std::bad_alloc&) {
    ::munmap(mapped, length);
    return kern::noSpace;
  }
  *address = mapped;
  return kern::success;
}

void SystemRegions::deallocate(void* address, std::size_t length) noexcept {
  if (address == nullptr) return;
  if (length > kLongestInLine) {
    (void)sealIntoDescriptor(address, length);
    return;
  }
  --liveSmall_;
  spare_.reset(static_cast<std::byte*>(address) - kRoomForMessage);
}

UniqueFd SystemRegions::sealIntoDescriptor(void* address, std::size_t length) noexcept {
  const auto region = std::find_if(large_.begin(), large_.end(), [address](const Large& candidate) {
    return candidate.address == address;
  });
  if (region == large_.end()) return {};
  UniqueFd memfd = std::move(region->memfd);
  large_.erase(region);
  // The seal against writing is refused while a writable mapping stands.
  ::munmap(address, length);
  if (!sealMemory(memfd.get())) return {};
  return memfd;
}

}  // namespace brenvik

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <cstddef>
#include <cstdlib>
#include <memory>
#include <vector>

#include "platform/base/UniqueFd.h"
#include "platform/ipc/RegionAllocator.h"

namespace brenvik {

// Allocates regions for replies. A region that fits a datagram beside its message is plain memory with room
// in front for the message, so that both are sent as one piece; the last one freed is kept for the next. A
// larger region is a mapped memfd (memfd_create(2)), which is sent as it is. Main loop only.
class SystemRegions final : public RegionAllocator {
 public:
  // Room for the reply's message in front of an in-line region, in bytes.
  static constexpr std::size_t kRoomForMessage = 56;
  static constexpr std::size_t kLongestInLine = kLargestDatagram - kRoomForMessage;

  KernelReturn allocate(void** address, std::size_t length) noexcept override;
  void deallocate(void* address, std::size_t length) noexcept override;

  // For a region longer than kLongestInLine: unmaps it and returns its memfd, sealed against shrinking,
  // growing and writing. Returns an invalid descriptor if the kernel refuses. Either way, the region is gone.
  UniqueFd sealIntoDescriptor(void* address, std::size_t length) noexcept;

  std::size_t live() const noexcept { return liveSmall_ + large_.size(); }

 private:
  struct Large {
    void* address;
    std::size_t length;
    UniqueFd memfd;
  };
  struct Freed {
    void operator()(std::byte* datagram) const noexcept { std::free(datagram); }
  };
  std::unique_ptr<std::byte, Freed> spare_;  // a whole datagram
  std::size_t liveSmall_ = 0;
  std::vector<Large> large_;
};

}  // namespace brenvik

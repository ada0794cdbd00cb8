// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <sys/uio.h>

#include <array>
#include <cstddef>
#include <span>

#include "client/Region.h"
#include "platform/datagram/Datagram.h"

namespace brenvik::client {

// No routine has more descriptors.
inline constexpr std::size_t kMaxRegions = 2;

using Regions = std::span<const std::span<const std::byte>>;

// A request in the form that is passed to the kernel: the message, then the regions that fit the datagram,
// each at a multiple of 8; the others in sealed memory of their own. It refers to the caller's bytes, which
// must outlive it.
class Outgoing {
 public:
  // Fills in the message's descriptors, one for each region, in their order. Returns false and sets errno if
  // sealed memory cannot be made.
  bool lay(std::span<std::byte> message, Regions regions) noexcept;
  std::span<const iovec> parts() const noexcept { return std::span(parts_).first(partCount_); }
  std::span<const int> descriptors() const noexcept {
    return std::span(descriptors_).first(descriptorCount_);
  }

 private:
  std::array<iovec, 1 + 2 * kMaxRegions> parts_;
  std::size_t partCount_ = 0;
  std::array<UniqueFd, kMaxRegions> memories_;
  std::array<int, kMaxRegions> descriptors_{};
  std::size_t descriptorCount_ = 0;
};

}  // namespace brenvik::client

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <cstddef>
#include <cstdint>
#include <optional>
#include <span>
#include <vector>

#include "platform/datagram/SealedMemory.h"
#include "platform/worker/WorkerChannel.h"

namespace brenvik {

// The longest payload of a message that need not fit a datagram: an answer's header fields have 256 KiB, and
// an address with every part as long as it may be stays below, too.
inline constexpr std::size_t kLongestLargePayload = std::size_t{1} << 20;

// A message whose payload travels in sealed memory where it is too long for a datagram. Throws
// std::bad_alloc, also where there are no descriptors.
WorkerMessage packLarge(std::uint32_t kind, std::vector<std::byte> payload,
                        std::vector<UniqueFd> descriptors = {});

// What packLarge() made, read again; the descriptors are the message's others.
class LargePayload {
 public:
  // Nothing when it has not that form.
  static std::optional<LargePayload> open(WorkerMessage message) noexcept;

  std::span<const std::byte> bytes() const noexcept;
  std::vector<UniqueFd>& descriptors() noexcept { return message_.descriptors; }

 private:
  LargePayload() = default;
  WorkerMessage message_;
  SealedMemory memory_;
  bool isInMemory_ = false;
};

}  // namespace brenvik

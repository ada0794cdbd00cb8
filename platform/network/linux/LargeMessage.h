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

// The longest payload, in bytes, of a message that need not fit a datagram. An answer's header fields have at
// most 256 KiB, and the longest address is shorter, too.
inline constexpr std::size_t kLongestLargePayload = std::size_t{1} << 20;

// Makes a message whose payload travels in sealed memory if it is too long for a datagram. Throws
// std::bad_alloc, also if there are no descriptors left.
WorkerMessage packLarge(std::uint32_t kind, std::vector<std::byte> payload,
                        std::vector<UniqueFd> descriptors = {});

// Reads a message that packLarge() made, and holds its other descriptors.
class LargePayload {
 public:
  // Returns nothing if the message is malformed.
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

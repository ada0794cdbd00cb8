// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <algorithm>
#include <cstring>

#include "client/Client.h"
#include "interface/Routines.h"

// What the C functions' handle of a client is.
struct bvmh_client {
  brenvik::client::Client client;
};

// How the parts of a request that no caller chooses are put in.
namespace brenvik::client {

inline constexpr std::size_t kLargestRequest =
    std::max_element(
        kRequestRoutines.begin(), kRequestRoutines.end(),
        [](const RoutineFacts& a, const RoutineFacts& b) { return a.requestSize < b.requestSize; })
        ->requestSize;

// The descriptor count and the NDR record.
inline void putFixedParts(const RoutineFacts& routine, std::span<std::byte> message) noexcept {
  std::size_t ndr = sizeof(MessageHeader);
  if (routine.descriptors != 0) {
    std::memcpy(message.data() + kDescriptorCountOffset, &routine.descriptors, sizeof routine.descriptors);
    ndr = kDescriptorsOffset + routine.descriptors * sizeof(OutOfLineDescriptor);
  }
  if (message.size() > ndr) std::memcpy(message.data() + ndr, &kNdrRecord, sizeof kNdrRecord);
}

// The length of the region of that index, in the body of a complex request.
inline void putRegionLength(const RoutineFacts& routine, std::span<std::byte> message, std::size_t index,
                            std::size_t length) noexcept {
  const auto value = static_cast<std::uint32_t>(length);
  std::memcpy(message.data() + routine.lengthsOffset + index * sizeof value, &value, sizeof value);
}

}  // namespace brenvik::client

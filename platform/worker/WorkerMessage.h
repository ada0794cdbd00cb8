// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <cstddef>
#include <cstdint>
#include <vector>

#include "platform/base/UniqueFd.h"

namespace brenvik {

// One message between the helper and a worker. What `kind` means, and how the payload is laid out
// (WorkerFields.h), is agreed between the two ends of a channel. What comes from a worker is a foreign byte.
struct WorkerMessage {
  static constexpr std::size_t kLongestPayload = 60'000;  // bytes; with its head it fits one datagram
  static constexpr std::size_t kMaxDescriptors = 4;

  std::uint32_t kind = 0;
  std::vector<std::byte> payload;
  std::vector<UniqueFd> descriptors;
};

enum class WorkerResult {
  done,
  closed,       // the other end has hung up
  timedOut,     // nothing came before the deadline
  full,         // the other end does not read
  malformed,    // what came, or what was to be sent, has not the form of a message
  outOfMemory,  // of memory or of descriptors, in this process
  unavailable,  // there is no worker, or none that can be listened to
};

}  // namespace brenvik

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <cstddef>
#include <cstdint>
#include <vector>

#include "platform/base/UniqueFd.h"

namespace brenvik {

// One message between the helper and a worker. The two ends of a channel agree on the meaning of `kind` and
// the layout of the payload (WorkerFields.h). The helper must not trust anything that a worker sends.
struct WorkerMessage {
  static constexpr std::size_t kLongestPayload = 60'000;  // bytes; with its head it fits one datagram
  static constexpr std::size_t kShortPayload = 8'192;     // bytes; what receiveShort() has room for
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
  malformed,    // the message received, or the one to be sent, is malformed
  outOfMemory,  // of memory or of descriptors, in this process
  unavailable,  // there is no worker, or it cannot be read from
};

}  // namespace brenvik

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <cstddef>
#include <span>

#include "platform/base/UniqueFd.h"
#include "platform/worker/WorkerMessage.h"

namespace brenvik {

// Memory without a name that can be sealed later (memfd_create(2)); it is empty, and written like a file.
// Invalid when memory or descriptors are lacking.
UniqueFd makeSealableMemory(const char* name) noexcept;

// From now on nobody changes it, whoever has a descriptor of it. Fails while it is mapped for writing.
bool sealMemory(int memory) noexcept;

// Sealed memory that another process has written, mapped for reading.
class SealedMemory {
 public:
  SealedMemory() = default;
  SealedMemory(SealedMemory&& other) noexcept;
  SealedMemory& operator=(SealedMemory&& other) noexcept;
  SealedMemory(const SealedMemory&) = delete;
  SealedMemory& operator=(const SealedMemory&) = delete;
  ~SealedMemory();

  // `malformed` when it is not memory that can never change again, or is not as long as this; then nothing is
  // mapped. The descriptor is not needed any more afterwards.
  static WorkerResult map(int memory, std::size_t length, SealedMemory* mapped) noexcept;

  std::span<const std::byte> bytes() const noexcept { return {address_, length_}; }

 private:
  const std::byte* address_ = nullptr;
  std::size_t length_ = 0;
};

}  // namespace brenvik

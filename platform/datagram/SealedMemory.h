// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <cstddef>
#include <cstdint>
#include <span>

#include "platform/base/UniqueFd.h"

// Memory without a name (memfd_create(2)) that carries to another process what is too long for a datagram.
// The sender seals it against change; the receiver looks for the seals before it believes the length. Nothing
// here throws or allocates. Any thread.
namespace brenvik {

// Empty memory, close-on-exec, which is written like a file and can be sealed later. Invalid with errno set
// when memory or descriptors are lacking. `name` is for people who look at /proc.
UniqueFd makeSealableMemory(const char* name) noexcept;

// Seals it against shrinking, growing, writing and further seals. Refused while it is mapped for writing.
bool sealMemory(int memory) noexcept;

// Both, with these bytes in it.
UniqueFd makeSealedMemory(const char* name, std::span<const std::byte> bytes) noexcept;

// The size of memory that is sealed against shrinking, growing and writing, in bytes; -1 when the descriptor
// is anything else, memory of huge pages included, which is mapped in other units.
std::int64_t sizeOfSealedMemory(int memory) noexcept;

// Maps memory that sizeOfSealedMemory() has looked at, for reading. Null with errno set when the kernel
// refuses. The caller unmaps it.
void* mapSealedMemory(int memory, std::size_t length) noexcept;

// Sealed memory that another process has written, mapped for reading. Unmapped by the destructor.
class SealedMemory {
 public:
  SealedMemory() = default;
  SealedMemory(SealedMemory&& other) noexcept;
  SealedMemory& operator=(SealedMemory&& other) noexcept;
  SealedMemory(const SealedMemory&) = delete;
  SealedMemory& operator=(const SealedMemory&) = delete;
  ~SealedMemory();

  // Returns 0, EBADMSG for what is not sealed or not exactly `length` bytes long, or the errno of mmap(2); on
  // failure nothing is mapped. The descriptor stays the caller's and is not needed any more afterwards.
  static int map(int memory, std::size_t length, SealedMemory* mapped) noexcept;

  std::span<const std::byte> bytes() const noexcept { return {address_, length_}; }

 private:
  const std::byte* address_ = nullptr;
  std::size_t length_ = 0;
};

}  // namespace brenvik

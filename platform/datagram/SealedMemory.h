// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <cstddef>
#include <cstdint>
#include <span>

#include "platform/base/UniqueFd.h"

// Anonymous memory (memfd_create(2)) for data that is too long for a datagram. The sender seals it against
// change; the receiver checks the seals before it trusts the length. Nothing here throws or allocates. Any
// thread.
namespace brenvik {

// Makes empty memory, close-on-exec, which is written like a file and can be sealed later. Returns an invalid
// descriptor and sets errno if memory or descriptors run out. `name` appears in /proc.
UniqueFd makeSealableMemory(const char* name) noexcept;

// Seals it against shrinking, growing, writing and further seals. Returns false on failure: it fails while
// the memory is mapped for writing.
bool sealMemory(int memory) noexcept;

// Makes memory with these bytes and seals it. Returns an invalid descriptor and sets errno on failure.
UniqueFd makeSealedMemory(const char* name, std::span<const std::byte> bytes) noexcept;

// Returns the size in bytes of memory that is sealed against shrinking, growing and writing; -1 for any other
// descriptor. Memory of huge pages counts as other, because it is mapped in larger units.
std::int64_t sizeOfSealedMemory(int memory) noexcept;

// Maps memory that sizeOfSealedMemory() has checked, for reading. Returns null and sets errno on failure. The
// caller must unmap it.
void* mapSealedMemory(int memory, std::size_t length) noexcept;

// Sealed memory that another process has written, mapped for reading. The destructor unmaps it.
class SealedMemory {
 public:
  SealedMemory() = default;
  SealedMemory(SealedMemory&& other) noexcept;
  SealedMemory& operator=(SealedMemory&& other) noexcept;
  SealedMemory(const SealedMemory&) = delete;
  SealedMemory& operator=(const SealedMemory&) = delete;
  ~SealedMemory();

  // Returns 0; EBADMSG if the memory is not sealed or not exactly `length` bytes long; or the errno of
  // mmap(2). On failure nothing is mapped. The caller still owns the descriptor and may close it afterwards.
  static int map(int memory, std::size_t length, SealedMemory* mapped) noexcept;

  std::span<const std::byte> bytes() const noexcept { return {address_, length_}; }

 private:
  const std::byte* address_ = nullptr;
  std::size_t length_ = 0;
};

}  // namespace brenvik

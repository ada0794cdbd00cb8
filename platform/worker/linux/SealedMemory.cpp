// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/worker/linux/SealedMemory.h"

#include <sys/mman.h>

#include <utility>

#include "platform/base/SealedMemory.h"

namespace brenvik {

UniqueFd makeSealableMemory(const char* name) noexcept {
  return UniqueFd(::memfd_create(name, MFD_CLOEXEC | MFD_ALLOW_SEALING));
}

bool sealMemory(int memory) noexcept { return sealAgainstChange(memory); }

SealedMemory::SealedMemory(SealedMemory&& other) noexcept
    : address_(std::exchange(other.address_, nullptr)), length_(std::exchange(other.length_, 0)) {}

SealedMemory& SealedMemory::operator=(SealedMemory&& other) noexcept {
  std::swap(address_, other.address_);
  std::swap(length_, other.length_);
  return *this;
}

SealedMemory::~SealedMemory() {
  if (address_ != nullptr) (void)::munmap(const_cast<std::byte*>(address_), length_);
}

WorkerResult SealedMemory::map(int memory, std::size_t length, SealedMemory* mapped) noexcept {
  *mapped = SealedMemory();
  const std::int64_t size = sizeOfSealedMemory(memory);
  if (size < 0 || static_cast<std::uint64_t>(size) != length) return WorkerResult::malformed;
  if (length == 0) return WorkerResult::done;
  void* const address = mapSealedMemory(memory, length);
  if (address == nullptr) return WorkerResult::outOfMemory;
  mapped->address_ = static_cast<const std::byte*>(address);
  mapped->length_ = length;
  return WorkerResult::done;
}

}  // namespace brenvik

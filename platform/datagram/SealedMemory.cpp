// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/datagram/SealedMemory.h"

#include <fcntl.h>
#include <sys/mman.h>
#include <sys/stat.h>
#include <sys/vfs.h>
#include <unistd.h>

#include <cerrno>
#include <utility>

namespace brenvik {
namespace {

constexpr int kNeededSeals = F_SEAL_SHRINK | F_SEAL_GROW | F_SEAL_WRITE;

// linux/magic.h. Memory of huge pages has seals, too, but is mapped and unmapped in other units.
constexpr auto kOrdinaryMemory = 0x01021994;

}  // namespace

UniqueFd makeSealableMemory(const char* name) noexcept {
  return UniqueFd(::memfd_create(name, MFD_CLOEXEC | MFD_ALLOW_SEALING));
}

bool sealMemory(int memory) noexcept { return ::fcntl(memory, F_ADD_SEALS, kNeededSeals | F_SEAL_SEAL) == 0; }

UniqueFd makeSealedMemory(const char* name, std::span<const std::byte> bytes) noexcept {
  UniqueFd memory = makeSealableMemory(name);
  while (memory.isValid() && !bytes.empty()) {
    const ssize_t written = ::write(memory.get(), bytes.data(), bytes.size());
    if (written < 0 && errno == EINTR) continue;
    if (written <= 0) return {};
    bytes = bytes.subspan(static_cast<std::size_t>(written));
  }
  return memory.isValid() && sealMemory(memory.get()) ? std::move(memory) : UniqueFd();
}

std::int64_t sizeOfSealedMemory(int memory) noexcept {
  // Sealed first, measured second: what is sealed keeps its length, so reading the mapping cannot fault.
  const int seals = ::fcntl(memory, F_GET_SEALS);
  if (seals < 0 || (seals & kNeededSeals) != kNeededSeals) return -1;
  struct stat status {};
  struct statfs system {};
  if (::fstat(memory, &status) != 0 || ::fstatfs(memory, &system) != 0) return -1;
  return system.f_type == kOrdinaryMemory ? status.st_size : -1;
}

void* mapSealedMemory(int memory, std::size_t length) noexcept {
  // Private: before Linux 6.7 a shared mapping of memory sealed against writing is refused, even for reading.
  void* const mapped = ::mmap(nullptr, length, PROT_READ, MAP_PRIVATE, memory, 0);
  return mapped == MAP_FAILED ? nullptr : mapped;
}

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

int SealedMemory::map(int memory, std::size_t length, SealedMemory* mapped) noexcept {
  *mapped = SealedMemory();
  const std::int64_t size = sizeOfSealedMemory(memory);
  if (size < 0 || static_cast<std::uint64_t>(size) != length) return EBADMSG;
  if (length == 0) return 0;
  void* const address = mapSealedMemory(memory, length);
  if (address == nullptr) return errno;
  mapped->address_ = static_cast<const std::byte*>(address);
  mapped->length_ = length;
  return 0;
}

}  // namespace brenvik

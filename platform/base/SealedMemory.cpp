// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/base/SealedMemory.h"

#include <fcntl.h>
#include <sys/mman.h>
#include <sys/stat.h>
#include <sys/vfs.h>

namespace brenvik {
namespace {

constexpr int kNeededSeals = F_SEAL_SHRINK | F_SEAL_GROW | F_SEAL_WRITE;

// linux/magic.h. Memory of huge pages has seals, too, but is mapped and unmapped in other units.
constexpr auto kOrdinaryMemory = 0x01021994;

}  // namespace

bool sealAgainstChange(int memory) noexcept {
  return ::fcntl(memory, F_ADD_SEALS, kNeededSeals | F_SEAL_SEAL) == 0;
}

std::int64_t sizeOfSealedMemory(int memory) noexcept {
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

}  // namespace brenvik

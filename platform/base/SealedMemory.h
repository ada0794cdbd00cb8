// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <cstddef>
#include <cstdint>

namespace brenvik {

// Seals a memfd (memfd_create(2)) against shrinking, growing, writing and further seals. Refused while it is
// mapped for writing.
bool sealAgainstChange(int memory) noexcept;

// The size of a memfd that is sealed against shrinking, growing and writing; -1 when the descriptor is
// anything else, memory of huge pages included, which is mapped in other units.
std::int64_t sizeOfSealedMemory(int memory) noexcept;

// Maps memory that sizeOfSealedMemory() has looked at, for reading. Null when the kernel refuses.
void* mapSealedMemory(int memory, std::size_t length) noexcept;

}  // namespace brenvik

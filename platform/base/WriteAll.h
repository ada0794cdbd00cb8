// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <sys/types.h>
#include <sys/uio.h>

#include <cstddef>
#include <span>
#include <string_view>

namespace brenvik {

// Write all the bytes, in as many calls as it takes. Each returns 0, or the errno of the call that failed;
// some of the bytes may have been written then. An interrupted call is repeated. Any thread; they allocate
// nothing. A descriptor that does not block answers EAGAIN when it is full.

// At the file's position.
int writeAll(int file, std::string_view bytes) noexcept;
int writeAll(int file, std::span<const std::byte> bytes) noexcept;
// One piece after the other; `pieces` is used up.
int writeAll(int file, std::span<iovec> pieces) noexcept;

// At `offset`, in bytes; the file's position stays.
int writeAllAt(int file, off_t offset, std::string_view bytes) noexcept;

}  // namespace brenvik

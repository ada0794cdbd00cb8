// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <sys/types.h>
#include <sys/uio.h>

#include <cstddef>
#include <span>
#include <string_view>

namespace brenvik {

// These functions write all the bytes, in as many system calls as that takes, and repeat interrupted calls.
// They return 0 or the errno of the call that failed; some of the bytes may have been written by then. On a
// non-blocking descriptor that is full, they return EAGAIN. Any thread; they allocate nothing.

// Writes at the file's position.
int writeAll(int file, std::string_view bytes) noexcept;
int writeAll(int file, std::span<const std::byte> bytes) noexcept;
// Writes the pieces in order, at the file's position; changes `pieces`.
int writeAll(int file, std::span<iovec> pieces) noexcept;

// Writes at `offset`, in bytes; the file's position stays.
int writeAllAt(int file, off_t offset, std::string_view bytes) noexcept;

}  // namespace brenvik

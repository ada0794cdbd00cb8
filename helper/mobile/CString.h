// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <cstddef>
#include <string_view>

namespace brenvik {

// Where C strings come from and go back to.
class CStringAllocator {
 public:
  virtual ~CStringAllocator() = default;
  virtual void* allocate(std::size_t size) noexcept = 0;  // null when there is no memory
  virtual void deallocate(void* block) noexcept = 0;
};

// malloc(3) and free(3). Any thread.
CStringAllocator& defaultCStringAllocator() noexcept;

enum class StringEncoding {
  utf8,   // the platform's own: bytes pass as they are, a path that is not UTF-8 included
  ascii,  // '?' for each character that ASCII lacks
};

// A NUL-terminated copy of a platform string (UTF-8). It goes into `buffer` when there is one, *size is not 0
// and the whole text fits there with its NUL; otherwise into a new block of the allocator, which the caller
// deallocates (it is the one that differs from `buffer`). *size, where given, is the buffer's size on entry
// and the text's length, without the NUL, on return. Without memory the result is `buffer` (null included),
// holding the empty string, and *size is 0: a buffer, whatever *size says, has room for one byte. Any thread.
char* GetOrCreateCString(CStringAllocator& allocator, std::string_view text, char* buffer, std::size_t* size,
                         StringEncoding encoding) noexcept;

}  // namespace brenvik

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <cstddef>
#include <string_view>

namespace brenvik {

// Allocates and frees C strings.
class CStringAllocator {
 public:
  virtual ~CStringAllocator() = default;
  virtual void* allocate(std::size_t size) noexcept = 0;  // null if memory runs out
  virtual void deallocate(void* block) noexcept = 0;
};

// malloc(3) and free(3). Any thread.
CStringAllocator& defaultCStringAllocator() noexcept;

enum class StringEncoding {
  utf8,   // the platform's own: bytes pass as they are, a path that is not UTF-8 included
  ascii,  // '?' for each character that ASCII lacks
};

// Returns a NUL-terminated copy of a platform string (UTF-8). The copy goes into `buffer` if that is not
// null, *size is not 0, and the whole text fits with its NUL. Otherwise it goes into a new block of the
// allocator, which the caller must deallocate if the result differs from `buffer`. If `size` is not null,
// *size is the buffer's size in bytes on entry and the text's length without the NUL on return. If memory
// runs out, the result is `buffer` (null included) holding the empty string, and *size is 0; so `buffer` must
// have room for one byte, whatever *size says. Any thread.
char* GetOrCreateCString(CStringAllocator& allocator, std::string_view text, char* buffer, std::size_t* size,
                         StringEncoding encoding) noexcept;

}  // namespace brenvik

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "helper/mobile/CString.h"

#include <cstdlib>
#include <cstring>

namespace brenvik {
namespace {

class Malloc final : public CStringAllocator {
 public:
  void* allocate(std::size_t size) noexcept override { return std::malloc(size); }
  void deallocate(void* block) noexcept override { std::free(block); }
};

constexpr bool isContinuation(char byte) noexcept {
  return (static_cast<unsigned char>(byte) & 0xC0) == 0x80;
}
constexpr bool isAscii(char byte) noexcept { return static_cast<unsigned char>(byte) < 0x80; }

std::size_t encodedLength(std::string_view text, StringEncoding encoding) noexcept {
  if (encoding == StringEncoding::utf8) return text.size();
  std::size_t length = 0;
  for (const char byte : text) {
    if (!isContinuation(byte)) ++length;
  }
  return length;
}

// `out` has room for encodedLength() and the NUL.
void encode(std::string_view text, StringEncoding encoding, char* out) noexcept {
  if (encoding == StringEncoding::utf8) {
    if (!text.empty()) std::memcpy(out, text.data(), text.size());
    out += text.size();
  } else {
    for (const char byte : text) {
      if (!isContinuation(byte)) *out++ = isAscii(byte) ? byte : '?';
    }
  }
  *out = '\0';
}

}  // namespace

CStringAllocator& defaultCStringAllocator() noexcept {
  static Malloc allocator;
  return allocator;
}

char* GetOrCreateCString(CStringAllocator& allocator, std::string_view text, char* buffer, std::size_t* size,
                         StringEncoding encoding) noexcept {
  const std::size_t length = encodedLength(text, encoding);
  char* out = nullptr;
  if (buffer != nullptr && size != nullptr && length < *size) {
    out = buffer;
  } else {
    out = static_cast<char*>(allocator.allocate(length + 1));
    if (out == nullptr) {
      if (buffer != nullptr) *buffer = '\0';
      if (size != nullptr) *size = 0;
      return buffer;
    }
  }
  encode(text, encoding, out);
  if (size != nullptr) *size = length;
  return out;
}

}  // namespace brenvik

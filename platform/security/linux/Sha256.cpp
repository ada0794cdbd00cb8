// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
// The plain functions, although libcrypto prefers others since 3.0: those read openssl.cnf and settle the
// whole library's configuration, in a process whose HTTP client may use the library later, its own way.
#define OPENSSL_SUPPRESS_DEPRECATED
#include "platform/security/linux/Sha256.h"

#include <dlfcn.h>
#include <openssl/sha.h>
#include <unistd.h>

#include <cerrno>
#include <mutex>

namespace brenvik {
namespace {

// The library of OpenSSL 3, whose functions the header above declares.
constexpr const char* kLibrary = "libcrypto.so.3";

struct Crypto {
  decltype(&SHA256_Init) init = nullptr;
  decltype(&SHA256_Update) update = nullptr;
  decltype(&SHA256_Final) final = nullptr;
};

template <typename Pointer>
bool find(void* library, const char* name, Pointer* function) noexcept {
  *function = reinterpret_cast<Pointer>(::dlsym(library, name));
  return *function != nullptr;
}

bool load(Crypto* functions) noexcept {
  void* const library = ::dlopen(kLibrary, RTLD_NOW | RTLD_LOCAL);
  return library != nullptr && find(library, "SHA256_Init", &functions->init) &&
         find(library, "SHA256_Update", &functions->update) &&
         find(library, "SHA256_Final", &functions->final);
}

// Null without the library, which is looked for again the next time: there may have been no descriptor left
// to load it with. It stays loaded: it registers exit handlers.
const Crypto* crypto() noexcept {
  static std::mutex mutex;
  static Crypto functions;
  static bool isLoaded = false;
  const std::lock_guard lock(mutex);
  if (!isLoaded) isLoaded = load(&functions);
  return isLoaded ? &functions : nullptr;
}

constexpr int digitOf(char c) noexcept {
  if (c >= '0' && c <= '9') return c - '0';
  if (c >= 'a' && c <= 'f') return c - 'a' + 10;
  if (c >= 'A' && c <= 'F') return c - 'A' + 10;
  return -1;
}

}  // namespace

std::optional<Sha256Digest> sha256OfFile(int fd) noexcept {
  const Crypto* const functions = crypto();
  SHA256_CTX context;
  if (functions == nullptr || functions->init(&context) != 1) return std::nullopt;
  std::array<std::uint8_t, std::size_t{64} << 10> part;
  for (;;) {
    const ssize_t size = ::read(fd, part.data(), part.size());
    if (size < 0 && errno == EINTR) continue;
    if (size < 0) return std::nullopt;
    if (size == 0) break;
    if (functions->update(&context, part.data(), static_cast<std::size_t>(size)) != 1) return std::nullopt;
  }
  Sha256Digest digest;
  if (functions->final(digest.data(), &context) != 1) return std::nullopt;
  return digest;
}

std::optional<Sha256Digest> parseSha256(std::string_view hex) noexcept {
  Sha256Digest digest;
  if (hex.size() != 2 * digest.size()) return std::nullopt;
  for (std::size_t i = 0; i < digest.size(); ++i) {
    const int high = digitOf(hex[2 * i]);
    const int low = digitOf(hex[2 * i + 1]);
    if (high < 0 || low < 0) return std::nullopt;
    digest[i] = static_cast<std::uint8_t>(high << 4 | low);
  }
  return digest;
}

}  // namespace brenvik

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/web/WebBody.h"

#include <sys/mman.h>

#include <algorithm>
#include <cstdlib>
#include <cstring>
#include <limits>
#include <new>

namespace brenvik {
namespace {

// The large page size of common machines. From here on a body is mapped, in such units: filling 100 MiB of
// small pages takes longer than receiving and decrypting what goes into them.
constexpr std::size_t kLargeUnit = std::size_t{2} << 20;

constexpr bool isMapped(std::size_t capacity) noexcept { return capacity >= kLargeUnit; }

std::byte* map(std::size_t capacity) {
  void* const made = ::mmap(nullptr, capacity, PROT_READ | PROT_WRITE, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0);
  if (made == MAP_FAILED) throw std::bad_alloc();
  return static_cast<std::byte*>(made);
}

}  // namespace

WebBody::~WebBody() {
  if (isMapped(capacity_)) {
    (void)::munmap(data_, capacity_);
  } else {
    std::free(data_);
  }
}

void WebBody::reserve(std::size_t capacity) {
  if (capacity <= capacity_) return;
  if (!isMapped(capacity)) {
    void* const larger = std::realloc(data_, capacity);
    if (larger == nullptr) throw std::bad_alloc();
    data_ = static_cast<std::byte*>(larger);
    capacity_ = capacity;
    return;
  }
  if (capacity > std::numeric_limits<std::size_t>::max() - kLargeUnit) throw std::bad_alloc();
  capacity = (capacity + kLargeUnit - 1) / kLargeUnit * kLargeUnit;
  if (isMapped(capacity_)) {
    void* const larger = ::mremap(data_, capacity_, capacity, MREMAP_MAYMOVE);
    if (larger == MAP_FAILED) throw std::bad_alloc();
    data_ = static_cast<std::byte*>(larger);
  } else {
    std::byte* const larger = map(capacity);
    if (size_ > 0) std::memcpy(larger, data_, size_);
    std::free(data_);
    data_ = larger;
  }
  capacity_ = capacity;
  (void)::madvise(data_, capacity_, MADV_HUGEPAGE);  // without them it is slower, and no less right
}

void WebBody::append(std::span<const std::byte> bytes) {
  if (bytes.empty()) return;
  if (bytes.size() > capacity_ - size_) {
    if (bytes.size() > std::numeric_limits<std::size_t>::max() / 2 - size_) throw std::bad_alloc();
    reserve(std::max(size_ + bytes.size(), capacity_ * 2));
  }
  std::memcpy(data_ + size_, bytes.data(), bytes.size());
  size_ += bytes.size();
}

}  // namespace brenvik

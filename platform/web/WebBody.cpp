// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/web/WebBody.h"

#include <sys/mman.h>
#include <sys/uio.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <limits>
#include <new>

#include "platform/datagram/SealedMemory.h"

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

// Of memory that is written like a file. A page that one write fills whole need not be cleared first, and
// pieces come in no multiple of it.
constexpr std::size_t kPage = 4096;

// Memory takes all of it or has run out.
bool writeBoth(int memory, std::span<const std::byte> first, std::span<const std::byte> second) noexcept {
  const iovec pieces[] = {{const_cast<std::byte*>(first.data()), first.size()},
                          {const_cast<std::byte*>(second.data()), second.size()}};
  ssize_t written = -1;
  do {
    written = ::writev(memory, pieces, 2);
  } while (written < 0 && errno == EINTR);
  return written >= 0 && static_cast<std::size_t>(written) == first.size() + second.size();
}

}  // namespace

WebBody WebBody::forAnotherProcess() {
  WebBody body;
  body.memory_ = makeSealableMemory("brenvik-body");
  if (!body.memory_.isValid()) throw std::bad_alloc();
  body.form_ = Form::forAnotherProcess;
  return body;
}

UniqueFd WebBody::takeSealed() noexcept {
  WebBody body = std::move(*this);
  if (body.form_ != Form::forAnotherProcess || !writeBoth(body.memory_.get(), body.tail_, {}) ||
      !sealMemory(body.memory_.get())) {
    return {};
  }
  return std::move(body.memory_);
}

std::optional<WebBody> WebBody::ofSealedMemory(UniqueFd memory, std::uint64_t size) {
  const auto length = sizeOfSealedMemory(memory.get());
  if (size == 0 || length < 0 || static_cast<std::uint64_t>(length) != size) return std::nullopt;
  WebBody body;
  void* const mapped = mapSealedMemory(memory.get(), static_cast<std::size_t>(size));
  if (mapped == nullptr) throw std::bad_alloc();
  body.data_ = static_cast<std::byte*>(mapped);
  body.size_ = static_cast<std::size_t>(size);
  body.memory_ = std::move(memory);
  body.form_ = Form::sealed;
  return body;
}

void WebBody::clear() noexcept {
  if (form_ == Form::sealed) *this = WebBody();
  // The next bytes go to the beginning. It was written there before, so cutting it off does not fail.
  if (form_ == Form::forAnotherProcess && size_ > 0)
    (void)!(::ftruncate(memory_.get(), 0) == 0 && ::lseek(memory_.get(), 0, SEEK_SET) == 0);
  tail_.clear();
  size_ = 0;
}

WebBody::~WebBody() {
  if (form_ == Form::sealed) {
    (void)::munmap(data_, size_);
  } else if (isMapped(capacity_)) {
    (void)::munmap(data_, capacity_);
  } else {
    std::free(data_);
  }
}

void WebBody::reserve(std::size_t capacity) {
  if (form_ == Form::forAnotherProcess) return;
  if (form_ == Form::sealed) {  // what others have filled becomes one of its own
    WebBody own;
    own.append(*this);
    *this = std::move(own);
  }
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
  if (form_ == Form::sealed) reserve(0);
  if (form_ == Form::forAnotherProcess) {
    const std::size_t whole = (tail_.size() + bytes.size()) / kPage * kPage;
    tail_.reserve(kPage);
    if (whole > 0) {
      const auto now = bytes.first(whole - tail_.size());
      if (!writeBoth(memory_.get(), tail_, now)) throw std::bad_alloc();
      size_ += now.size();
      tail_.clear();
      bytes = bytes.subspan(now.size());
    }
    tail_.insert(tail_.end(), bytes.begin(), bytes.end());
    size_ += bytes.size();
    return;
  }
  if (bytes.size() > capacity_ - size_) {
    if (bytes.size() > std::numeric_limits<std::size_t>::max() / 2 - size_) throw std::bad_alloc();
    reserve(std::max(size_ + bytes.size(), capacity_ * 2));
  }
  std::memcpy(data_ + size_, bytes.data(), bytes.size());
  size_ += bytes.size();
}

}  // namespace brenvik

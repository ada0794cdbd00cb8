// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <cstddef>
#include <span>
#include <utility>

namespace brenvik {

// The bytes of a response: a vector of bytes that does not clear what it is about to fill, grows without
// copying once it is large, and then lies in pages of the large size, where the system has them. Throws
// std::bad_alloc as a vector does.
class WebBody {
 public:
  WebBody() noexcept = default;
  WebBody(const WebBody& other) { append(other); }
  WebBody(WebBody&& other) noexcept
      : data_(std::exchange(other.data_, nullptr)),
        size_(std::exchange(other.size_, 0)),
        capacity_(std::exchange(other.capacity_, 0)) {}
  WebBody& operator=(WebBody other) noexcept {
    std::swap(data_, other.data_);
    std::swap(size_, other.size_);
    std::swap(capacity_, other.capacity_);
    return *this;
  }
  ~WebBody();

  const std::byte* data() const noexcept { return data_; }
  std::size_t size() const noexcept { return size_; }
  std::size_t capacity() const noexcept { return capacity_; }
  bool empty() const noexcept { return size_ == 0; }
  operator std::span<const std::byte>() const noexcept { return {data_, size_}; }  // NOLINT: it is one

  // Keeps the capacity.
  void clear() noexcept { size_ = 0; }
  void reserve(std::size_t capacity);
  // The bytes are not this body's own.
  void append(std::span<const std::byte> bytes);

 private:
  std::byte* data_ = nullptr;
  std::size_t size_ = 0;
  std::size_t capacity_ = 0;  // a whole number of kLargeUnit: mapped; else from the heap
};

}  // namespace brenvik

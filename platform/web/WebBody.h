// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <cstddef>
#include <cstdint>
#include <optional>
#include <span>
#include <utility>
#include <vector>

#include "platform/base/UniqueFd.h"

namespace brenvik {

// The bytes of a response. Unlike a vector, it does not clear memory that it is about to fill; a large body
// grows without copying, and uses huge pages if the system has them. Throws std::bad_alloc like a vector.
class WebBody {
 public:
  WebBody() noexcept = default;
  WebBody(const WebBody& other) { append(other); }
  WebBody(WebBody&& other) noexcept
      : data_(std::exchange(other.data_, nullptr)),
        size_(std::exchange(other.size_, 0)),
        capacity_(std::exchange(other.capacity_, 0)),
        memory_(std::move(other.memory_)),
        tail_(std::move(other.tail_)),
        form_(std::exchange(other.form_, Form::own)) {}
  WebBody& operator=(WebBody other) noexcept {
    std::swap(data_, other.data_);
    std::swap(size_, other.size_);
    std::swap(capacity_, other.capacity_);
    std::swap(memory_, other.memory_);
    std::swap(tail_, other.tail_);
    std::swap(form_, other.form_);
    return *this;
  }
  ~WebBody();

  // Makes a body that is filled for another process. Only takeSealed() makes its data readable. Its memory is
  // written, not mapped, so that new pages need not be cleared first. A copy of it is empty. Throws
  // std::bad_alloc.
  static WebBody forAnotherProcess();
  // Returns its memory, sealed, and leaves the body empty. Returns an invalid descriptor if the kernel
  // refuses.
  UniqueFd takeSealed() noexcept;
  // Makes a body from memory that another process has filled, mapped for reading. Returns nothing if the
  // memory can still change, or does not have exactly this size. Throws std::bad_alloc.
  static std::optional<WebBody> ofSealedMemory(UniqueFd memory, std::uint64_t size);
  // The memory of a body that ofSealedMemory() made, and which the body still owns; -1 for any other body.
  int sealedMemory() const noexcept { return form_ == Form::sealed ? memory_.get() : -1; }

  const std::byte* data() const noexcept { return data_; }
  std::size_t size() const noexcept { return size_; }
  std::size_t capacity() const noexcept { return capacity_; }  // of a body of its own
  bool empty() const noexcept { return size_ == 0; }
  operator std::span<const std::byte>() const noexcept {  // NOLINT: it is one
    return {data_, data_ != nullptr ? size_ : 0};
  }

  // Keeps the capacity if the body owns its memory.
  void clear() noexcept;
  void reserve(std::size_t capacity);
  // Appends the bytes, which must not be part of this body.
  void append(std::span<const std::byte> bytes);

 private:
  enum class Form { own, forAnotherProcess, sealed };

  std::byte* data_ = nullptr;
  std::size_t size_ = 0;
  std::size_t capacity_ = 0;  // a whole number of kLargeUnit: mapped; else from the heap. 0 when sealed
  UniqueFd memory_;
  std::vector<std::byte>
      tail_;  // of a body for another process: the last bytes, which do not fill a page yet
  Form form_ = Form::own;
};

}  // namespace brenvik

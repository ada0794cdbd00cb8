// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <unistd.h>

#include <utility>

namespace brenvik {

// Owns one file descriptor and closes it. Movable, not copyable. Not convertible to int or bool:
// descriptor 0 is a good one. Each object belongs to one thread at a time.
class [[nodiscard]] UniqueFd {
 public:
  UniqueFd() = default;
  explicit UniqueFd(int owned) noexcept : fd_(owned) {}
  UniqueFd(UniqueFd&& other) noexcept : fd_(other.release()) {}
  UniqueFd& operator=(UniqueFd&& other) noexcept {
    reset(other.release());
    return *this;
  }
  UniqueFd(const UniqueFd&) = delete;
  UniqueFd& operator=(const UniqueFd&) = delete;
  ~UniqueFd() { reset(); }

  // Returns the descriptor, which this object still owns; -1 if it has none.
  int get() const noexcept { return fd_; }
  bool isValid() const noexcept { return fd_ >= 0; }
  // Gives up the descriptor; the caller must close it.
  [[nodiscard]] int release() noexcept { return std::exchange(fd_, -1); }
  void reset(int next = -1) noexcept {
    if (const int old = std::exchange(fd_, next); old >= 0) ::close(old);
  }

 private:
  int fd_ = -1;
};

}  // namespace brenvik

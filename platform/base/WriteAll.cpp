// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/base/WriteAll.h"

#include <unistd.h>

#include <cerrno>
#include <cstddef>

namespace brenvik {
namespace {

// Take `count` written bytes from the front of what is left.
void drop(std::string_view& left, std::size_t count) noexcept { left.remove_prefix(count); }

void drop(std::span<iovec>& left, std::size_t count) noexcept {
  for (; !left.empty() && count >= left.front().iov_len; left = left.subspan(1))
    count -= left.front().iov_len;
  if (left.empty()) return;
  left.front().iov_base = static_cast<char*>(left.front().iov_base) + count;
  left.front().iov_len -= count;
}

// Calls `write`, which writes some of what is left, until nothing is left.
template <typename Left, typename Write>
int repeat(Left& left, Write write) noexcept {
  drop(left, 0);  // empty pieces at the front: a call that writes nothing would look like a failure
  while (!left.empty()) {
    const ssize_t written = write();
    if (written < 0 && errno == EINTR) continue;
    if (written < 0) return errno;
    if (written == 0) return EIO;
    drop(left, static_cast<std::size_t>(written));
  }
  return 0;
}

}  // namespace

int writeAll(int file, std::string_view bytes) noexcept {
  return repeat(bytes, [&] { return ::write(file, bytes.data(), bytes.size()); });
}

int writeAll(int file, std::span<const std::byte> bytes) noexcept {
  return writeAll(file, std::string_view(reinterpret_cast<const char*>(bytes.data()), bytes.size()));
}

int writeAll(int file, std::span<iovec> pieces) noexcept {
  return repeat(pieces, [&] { return ::writev(file, pieces.data(), static_cast<int>(pieces.size())); });
}

int writeAllAt(int file, off_t offset, std::string_view bytes) noexcept {
  return repeat(bytes, [&] {
    const ssize_t written = ::pwrite(file, bytes.data(), bytes.size(), offset);
    if (written > 0) offset += written;
    return written;
  });
}

}  // namespace brenvik

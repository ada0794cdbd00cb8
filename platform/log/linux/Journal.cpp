// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/log/linux/Journal.h"

#include <fcntl.h>
#include <sys/mman.h>
#include <sys/uio.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <bit>
#include <cerrno>
#include <cstdint>
#include <cstring>

#include "platform/base/UniqueFd.h"
#include "platform/base/WriteAll.h"

namespace brenvik {
namespace {

// How long a line may keep its writer, who may be the main loop.
constexpr timeval kPatience{0, 100'000};

iovec io(std::string_view bytes) noexcept { return {const_cast<char*>(bytes.data()), bytes.size()}; }

// An entry as it travels. Usually a field is "NAME=value\n"; a value with a newline in it goes as "NAME\n",
// its length as eight bytes, the value, and a newline.
class Entry {
 public:
  explicit Entry(std::span<const JournalField> fields) noexcept {
    for (const JournalField& field : fields.first(std::min(fields.size(), Journal::kMaxFields))) add(field);
  }
  std::span<iovec> bytes() noexcept { return {parts_.data(), count_}; }

 private:
  static_assert(std::endian::native == std::endian::little, "the length is little-endian");

  void add(const JournalField& field) noexcept {
    append(field.name);
    if (field.value.find('\n') == std::string_view::npos) {
      append("=");
    } else {
      std::uint64_t& length = lengths_[lengthCount_++];
      length = field.value.size();
      append("\n");
      append({reinterpret_cast<const char*>(&length), sizeof length});
    }
    append(field.value);
    append("\n");
  }
  void append(std::string_view bytes) noexcept { parts_[count_++] = io(bytes); }

  std::array<iovec, 5 * Journal::kMaxFields> parts_;
  std::size_t count_ = 0;
  std::array<std::uint64_t, Journal::kMaxFields> lengths_;
  std::size_t lengthCount_ = 0;
};

}  // namespace

Journal::Journal(const char* path) noexcept {
  address_.sun_family = AF_UNIX;
  std::strncpy(address_.sun_path, path, sizeof address_.sun_path - 1);
}

Journal::~Journal() { const UniqueFd socket(socket_.load()); }

// The socket, made when it is first needed; -1 when it cannot be made. Not connected, so that a journal that
// was started anew is found, and a large entry may be tried twice.
int Journal::socket() noexcept {
  if (const int present = socket_.load(std::memory_order_acquire); present >= 0) return present;
  UniqueFd made(::socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0));
  if (!made.isValid()) return -1;
  (void)::setsockopt(made.get(), SOL_SOCKET, SO_SNDTIMEO, &kPatience, sizeof kPatience);
  int present = -1;
  if (socket_.compare_exchange_strong(present, made.get(), std::memory_order_acq_rel)) return made.release();
  return present;  // another thread was first
}

bool Journal::send(std::span<const JournalField> fields) noexcept {
  Entry entry(fields);
  msghdr message{};
  message.msg_iov = entry.bytes().data();
  message.msg_iovlen = entry.bytes().size();
  if (send(message)) return true;
  return (errno == EMSGSIZE || errno == ENOBUFS) && sendInMemory(entry.bytes());
}

bool Journal::send(msghdr& message) noexcept {
  const int fd = socket();
  if (fd < 0) return false;
  message.msg_name = &address_;
  message.msg_namelen = sizeof address_;
  const int flags = MSG_NOSIGNAL | (isSlow_.load(std::memory_order_relaxed) ? MSG_DONTWAIT : 0);
  ssize_t sent = -1;
  do {
    sent = ::sendmsg(fd, &message, flags);
  } while (sent < 0 && errno == EINTR);
  if (sent >= 0) {
    isSlow_.store(false, std::memory_order_relaxed);
  } else if (errno == EAGAIN) {
    isSlow_.store(true, std::memory_order_relaxed);
  }
  return sent >= 0;
}

bool Journal::sendInMemory(std::span<iovec> bytes) noexcept {
  const UniqueFd memory(::memfd_create("journal-entry", MFD_CLOEXEC | MFD_ALLOW_SEALING));
  constexpr int kSeals = F_SEAL_SHRINK | F_SEAL_GROW | F_SEAL_WRITE | F_SEAL_SEAL;
  if (!memory.isValid() || writeAll(memory.get(), bytes) != 0 ||
      ::fcntl(memory.get(), F_ADD_SEALS, kSeals) != 0) {
    return false;
  }
  const int fd = memory.get();
  alignas(cmsghdr) std::array<char, CMSG_SPACE(sizeof fd)> control{};
  msghdr message{};
  message.msg_control = control.data();
  message.msg_controllen = control.size();
  cmsghdr* const item = CMSG_FIRSTHDR(&message);
  item->cmsg_level = SOL_SOCKET;
  item->cmsg_type = SCM_RIGHTS;
  item->cmsg_len = CMSG_LEN(sizeof fd);
  std::memcpy(CMSG_DATA(item), &fd, sizeof fd);
  return send(message);
}

}  // namespace brenvik

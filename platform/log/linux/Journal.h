// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <sys/socket.h>
#include <sys/un.h>

#include <atomic>
#include <span>
#include <string_view>

namespace brenvik {

// One field of a journal entry. A name consists of A to Z, 0 to 9 and underscores; a value may hold any
// bytes.
struct JournalField {
  std::string_view name;
  std::string_view value;
};

// The sending end of the journal's native protocol: one datagram for each entry. If the entry is too large,
// the datagram carries only a sealed memfd with the same bytes. Any thread; allocates nothing.
class Journal {
 public:
  static constexpr const char* kSocket = "/run/systemd/journal/socket";
  static constexpr std::size_t kMaxFields = 16;

  // `path` is copied; it must fit a socket address.
  explicit Journal(const char* path = kSocket) noexcept;
  ~Journal();
  Journal(const Journal&) = delete;
  Journal& operator=(const Journal&) = delete;

  // Returns false if there is no journal, or if it accepted nothing for a tenth of a second. After such a
  // wait, send() does not wait again until the journal has accepted an entry.
  bool send(std::span<const JournalField> fields) noexcept;

 private:
  int socket() noexcept;
  bool send(msghdr& message) noexcept;
  bool sendInMemory(std::span<iovec> bytes) noexcept;

  sockaddr_un address_{};
  std::atomic<int> socket_{-1};  // made with the first entry
  std::atomic<bool> isSlow_{false};
};

}  // namespace brenvik

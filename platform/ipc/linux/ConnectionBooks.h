// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <sys/types.h>

#include <cstddef>
#include <list>
#include <unordered_map>

namespace brenvik {

// Lists the connections of a service, oldest first: those that have not checked in (strangers), in total and
// by account, and those that have. Each call takes constant time. The lists do not own the connections.
class ConnectionBooks {
 public:
  // A client sends its check-in at once, so few connections are ever waiting. The limit of one account is
  // below the total, so that it cannot crowd out the others.
  static constexpr std::size_t kMaxStrangers = 128;
  static constexpr std::size_t kMaxStrangersPerAccount = 64;
  // A client that has checked in needs its connection only to check in again.
  static constexpr std::size_t kMaxAdmitted = 32;

  // The base class of a connection. The owner removes it from the lists before it destroys it.
  class Entry {
   public:
    explicit Entry(uid_t account) noexcept : account_(account) {}
    uid_t account() const noexcept { return account_; }

   private:
    friend class ConnectionBooks;
    enum class Book { none, strangers, admitted };
    const uid_t account_;
    Book book_ = Book::none;
    std::list<Entry*>::iterator inAll_;
    std::list<Entry*>::iterator inAccount_;
  };

  // Adds a stranger. Throws std::bad_alloc, and then nothing has changed.
  void add(Entry& entry);
  // Records that the stranger has checked in. A second call changes nothing.
  void admit(Entry& entry) noexcept;
  void remove(Entry& entry) noexcept;

  // Returns the connection that must be closed after `entry`, the newest one, was added: the oldest stranger
  // of its account if that has too many, else the oldest of all strangers if there are too many, else null.
  Entry* overdueAfter(const Entry& entry) const noexcept;
  // Returns the oldest connection of a checked-in client if there are too many of those, else null. It may be
  // closed: the client itself stays checked in.
  Entry* overdueAdmitted() const noexcept;
  Entry* oldestStranger() const noexcept { return strangers_.empty() ? nullptr : strangers_.front(); }

  std::size_t strangers() const noexcept { return strangers_.size(); }
  std::size_t admitted() const noexcept { return admitted_.size(); }
  std::size_t accounts() const noexcept { return accounts_.size(); }

 private:
  std::list<Entry*> strangers_;
  std::list<Entry*> admitted_;
  std::unordered_map<uid_t, std::list<Entry*>> accounts_;  // strangers; no empty lists
};

}  // namespace brenvik

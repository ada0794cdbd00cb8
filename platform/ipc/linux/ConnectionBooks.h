// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <sys/types.h>

#include <cstddef>
#include <list>
#include <unordered_map>

namespace brenvik {

// The connections of a service, oldest first: those that have not checked in (strangers), in all and by
// account, and those that have. Each step takes constant time. Owns nothing.
class ConnectionBooks {
 public:
  // A client sends its check-in at once, so few connections are ever waiting. What one account may hold is
  // below the total, so that it cannot crowd out the others.
  static constexpr std::size_t kMaxStrangers = 128;
  static constexpr std::size_t kMaxStrangersPerAccount = 64;
  // A client that has checked in needs its connection only to check in once more.
  static constexpr std::size_t kMaxAdmitted = 32;

  // What a connection is derived from. It is struck out before it is destroyed.
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

  // Enters a stranger; nothing is changed when it throws bad_alloc.
  void add(Entry& entry);
  // The stranger has checked in. Once more: nothing changes. Throws nothing.
  void admit(Entry& entry) noexcept;
  void remove(Entry& entry) noexcept;

  // The connection that must be closed, if one must: the oldest stranger of an account that has too many,
  // else the oldest stranger of all when there are too many. `entry` is the one that came last.
  Entry* overdueAfter(const Entry& entry) const noexcept;
  // The connection of a client that may be closed since there are too many of those. The client stays.
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

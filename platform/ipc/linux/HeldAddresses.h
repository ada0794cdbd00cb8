// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <memory>
#include <set>
#include <string>

namespace brenvik {

// The addresses of the sockets whose hang-up this process waits for, and of its listening sockets. A socket
// whose other end is one of them never hangs up while this process lives, because this process holds both
// ends. The kernel does not tell which socket is another one's end, but it tells the other end's address, and
// every socket can be given one. Main loop only.
class HeldAddresses : public std::enable_shared_from_this<HeldAddresses> {
  using Addresses = std::multiset<std::string>;

 public:
  // Keeps one address in the set.
  class Entry {
   public:
    Entry(std::shared_ptr<HeldAddresses> owner, Addresses::iterator at) noexcept
        : owner_(std::move(owner)), at_(at) {}
    Entry(const Entry&) = delete;
    Entry& operator=(const Entry&) = delete;
    ~Entry() { owner_->addresses_.erase(at_); }

   private:
    const std::shared_ptr<HeldAddresses> owner_;
    const Addresses::iterator at_;
  };

  // Adds the address of an AF_UNIX socket. A socket without an address gets an abstract one, which its other
  // end can see (getpeername(2)). Throws std::bad_alloc.
  std::unique_ptr<Entry> add(int socket);
  // Whether the other end of an AF_UNIX socket has an address of the set. Throws std::bad_alloc.
  bool hasOtherEndOf(int socket) const;

 private:
  Addresses addresses_;
};

}  // namespace brenvik

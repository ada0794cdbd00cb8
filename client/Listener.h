// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <sys/types.h>
#include <sys/un.h>

#include <array>
#include <cstdint>

#include "client/Region.h"
#include "client/TurnedAway.h"

namespace brenvik::client {

// The listening socket of a named service. The destructor removes a socket file that this object made, if it
// still is this socket's.
class ServiceSocket {
 public:
  ServiceSocket() = default;
  ServiceSocket(const ServiceSocket&) = delete;
  ServiceSocket& operator=(const ServiceSocket&) = delete;
  ~ServiceSocket();
  // Replaces a file that nobody serves. Codes of mobile_helper.h; errno stands after BVMH_ERROR_SYSTEM.
  std::int32_t listenAt(const char* directory, const char* name) noexcept;
  // Takes over a socket that somebody else made, whose file is theirs. Precondition:
  // isLocalSocket(descriptor, Listening::yes). False with errno set when it cannot be made non-blocking and
  // close-on-exec; then the descriptor stays the caller's.
  bool adopt(int descriptor) noexcept;
  // Gives up an adopted descriptor; its previous owner owns it again.
  void giveBack() noexcept { (void)socket_.release(); }
  // Removes the file as the destructor does, and hands over the socket; invalid if there is none.
  UniqueFd release() noexcept;
  int get() const noexcept { return socket_.get(); }
  // The file that it made; empty when it made none.
  const char* path() const noexcept { return address_.sun_path; }
  // Whether that file is still there.
  bool isNamed() const noexcept;

 private:
  UniqueFd socket_;
  sockaddr_un address_{};
  dev_t device_ = 0;
  ino_t inode_ = 0;
};

// The telephony daemon's two services, read from one place. One thread at a time.
class Listener {
 public:
  Listener() = default;
  Listener(const Listener&) = delete;
  Listener& operator=(const Listener&) = delete;
  // Does not wait for what strangers have sent over connections that were not accepted.
  ~Listener();
  std::int32_t open(const char* directory, unsigned services) noexcept;
  // Takes descriptors of listening sockets, -1 for none. The listener owns them only if this returns BVMH_OK.
  std::int32_t open(int pushes, int notifications) noexcept;
  int descriptor() const noexcept { return poll_.get(); }
  int systemError() const noexcept { return systemError_; }
  void allow(uid_t uid) noexcept { allowedUid_ = uid; }
  std::int32_t next(Deadline deadline, bvmh_event* event) noexcept;
  std::int32_t reply(const bvmh_event& event, std::int32_t domain, std::int32_t code) noexcept;

 private:
  enum class Service : std::uint8_t { pushes, notifications };
  // The helper opens a connection for each push or notification, so few are ever open at once.
  static constexpr std::size_t kMaxConnections = 32;

  struct Connection {
    UniqueFd socket;
    Service service = Service::pushes;
    std::uint64_t serial = 0;  // never used twice
    uid_t uid = 0;
    pid_t pid = 0;
  };

  std::int32_t systemFailure() noexcept;
  std::int32_t prepare() noexcept;
  std::int32_t watch(Service service) noexcept;
  // Whether new connections are looked at.
  void setAccepting(bool isAccepting) noexcept;
  void watchNames() noexcept;
  // Whether a service has lost its file since it was last asked.
  bool hasLostName() noexcept;
  std::int32_t accept(Service service) noexcept;
  // Serves what poll_ reported under this key; returns true if *event or *code has something for the caller.
  bool serve(std::uint64_t key, bvmh_event* event, std::int32_t* code) noexcept;
  // Reads one message; returns true if *event or *code has something for the caller.
  bool read(Connection& connection, bvmh_event* event, std::int32_t* code) noexcept;
  bool readPush(const Connection& connection, bvmh_event* event, std::int32_t* code) noexcept;
  bool readNotification(const Connection& connection, bvmh_event* event, std::int32_t* code) noexcept;
  void refuse(const Connection& connection, const MessageHeader& request, KernelReturn code) noexcept;

  UniqueFd poll_;
  UniqueFd names_;  // an inotify of the files that services_ made, if the system has one left
  std::array<ServiceSocket, 2> services_;
  std::array<bool, 2> hasLostName_{};
  std::array<Connection, kMaxConnections> connections_;
  TurnedAway turnedAway_;
  bool isAccepting_ = true;
  std::uint64_t lastSerial_ = 0;
  uid_t allowedUid_ = 0;  // beside the superuser and our own
  int systemError_ = 0;
  Buffer buffer_;
  Incoming incoming_;
};

}  // namespace brenvik::client

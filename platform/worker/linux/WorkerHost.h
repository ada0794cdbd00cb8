// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <cstddef>
#include <functional>
#include <string>

#include "platform/worker/WorkerChannel.h"
#include "platform/worker/linux/WorkerRights.h"

namespace brenvik {

// The worker's side: a worker's main() is little more than a call of run().
class WorkerHost {
 public:
  struct Description {
    std::string service;  // the name of the service whose socket the service manager may hand over
    WorkerRights rights;
    // A service waits for another helper when the last has hung up, instead of returning.
    bool staysForTheNext = false;
  };

  // How many connections a service serves at once; more wait in the socket. A helper has one, and a second
  // for a moment while it is restarted; several helpers, each with a socket of its own, can share a worker.
  static constexpr std::size_t kMaxConnections = 64;

  // Gets a channel that the helper has opened, and the kind of its work. Runs on the main thread, which waits
  // for it before it takes the next channel, so the work itself must be done on another thread. May throw
  // std::bad_alloc, which closes the channel.
  using Serve = std::function<void(std::uint32_t work, WorkerChannel channel)>;

  // Clears the environment, takes the connection of the helper that started this program (as standard input)
  // or the listening socket of the service manager, gives up the rights, and only then reads from the helper.
  // Serves only root's processes. Returns the exit status when the last of them has hung up. Exit with
  // _exit(2), because work may still be under way on other threads.
  static int run(const Description& description, const Serve& serve) noexcept;

  // For tests, the part after giving up the rights: serves one connection until it hangs up.
  static void serveConnection(WorkerChannel connection, const Serve& serve) noexcept;
};

}  // namespace brenvik

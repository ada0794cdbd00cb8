// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

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
  };

  // Gets a channel that the helper has opened, and the sort of work that it is for. On the main thread, which
  // goes on with the next one when it returns: the work itself belongs elsewhere. May throw std::bad_alloc,
  // which closes the channel.
  using Serve = std::function<void(std::uint32_t work, WorkerChannel channel)>;

  // Clears the environment, takes the connection of the helper that started this program (as standard input)
  // or the listening socket of the service manager, gives up the rights, and only then reads what the helper
  // sends. Talks to root's processes only. Returns when the last of them has hung up, with the status to
  // leave with: by _exit(2), as work may still be under way on other threads.
  static int run(const Description& description, const Serve& serve) noexcept;

  // The part after that, for tests: serves one connection until it hangs up.
  static void serveConnection(WorkerChannel connection, const Serve& serve) noexcept;
};

}  // namespace brenvik

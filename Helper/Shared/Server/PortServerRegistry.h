// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <map>
#include <mutex>

#include "interface/Wire.h"

namespace brenvik {

class ServerContext;

// Which server owns a port: its service port, every client's receive port and every client's death-watch
// port. Any thread. Its lock is taken inside a server's own, never the other way round.
class PortServerRegistry {
 public:
  // The process's own; made on first use, released at exit. Tests make private ones.
  static PortServerRegistry& shared();

  void add(PortName name, ServerContext* server);
  void remove(PortName name) noexcept;
  ServerContext* lookUp(PortName name) const noexcept;  // null when nobody owns it
  std::size_t size() const noexcept;

 private:
  mutable std::mutex mutex_;
  std::map<PortName, ServerContext*> servers_;
};

}  // namespace brenvik

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <functional>
#include <memory>

#include "interface/Wire.h"
#include "platform/ipc/RoutineTable.h"
#include "platform/runloop/RunLoop.h"

namespace brenvik {

// The names of this process's ports and the rights behind them. A name is never 0 or 0xFFFFFFFF and is not
// handed out again soon after it was freed. Main loop only.
class PortSpace {
 public:
  virtual ~PortSpace() = default;

  // Makes a port with one receive right. resourceShortage when the process or the system is out of
  // descriptors.
  virtual KernelReturn allocateReceiveRight(PortName* name) noexcept = 0;
  // Makes a send right to the port from its receive right (make-send).
  virtual KernelReturn insertSendRight(PortName name) noexcept = 0;
  // Drops one reference of the receive right: the port dies, every holder of a send right sees a hang-up.
  virtual KernelReturn dropReceiveRight(PortName name) noexcept = 0;
  // Drops one reference of a send right.
  virtual KernelReturn deallocateSendRight(PortName name) noexcept = 0;
};

// The platform's registry of named services.
class Bootstrap {
 public:
  virtual ~Bootstrap() = default;
  // Obtains the receive right of the named service. noAccess when another live process holds the name.
  virtual KernelReturn checkIn(const char* serviceName, PortName* receiveRight) noexcept = 0;
};

enum class WantTrailer : bool { no, yes };

// Serves a routine table on a port from a run loop. It answers unknown ids with mig::badId, malformed
// messages with mig::badArguments, and releases regions and the rights of refused requests after the reply.
// Main loop only; may be invalidated and destroyed from within one of its own handlers.
class RoutineSource {
 public:
  virtual ~RoutineSource() = default;
  virtual bool addTo(RunLoop& loop) noexcept = 0;
  virtual void invalidate() noexcept = 0;
};

// Watches the port behind a send right for its death. Main loop only; may be destroyed from its callback.
class DeathWatch {
 public:
  virtual ~DeathWatch() = default;
  virtual PortName port() const noexcept = 0;
  // False once the port has died or the watch was invalidated.
  virtual bool isValid() const noexcept = 0;
  // Runs once, from the run loop, after the port has died, also when it died before the callback was set.
  // Empty: none. Invalidating the watch runs nothing.
  virtual void setInvalidationCallback(std::function<void(DeathWatch&)> callback) noexcept = 0;
  virtual void invalidate() noexcept = 0;
  // What its maker gave as `info`.
  virtual void* info() const noexcept = 0;
};

// Makes the sources above for ports of one PortSpace. Null where the platform refused.
class PortSources {
 public:
  virtual ~PortSources() = default;
  virtual std::shared_ptr<RoutineSource> makeRoutineSource(PortName port, const RoutineTable& table,
                                                           WantTrailer trailer) noexcept = 0;
  virtual std::shared_ptr<DeathWatch> makeDeathWatch(PortName port, RunLoop& loop, void* info) noexcept = 0;
};

}  // namespace brenvik

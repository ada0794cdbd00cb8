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
// reused soon after it was freed. Main loop only.
//
// A right has references. The code that makes or adopts a reference must drop it once; the classes of
// platform/ipc/Rights.h do that. Unless a member says otherwise, it returns kern::success,
// kern::resourceShortage if the process or the system is out of descriptors or memory, or kern::invalidName
// if there is no such port.
class PortSpace {
 public:
  virtual ~PortSpace() = default;

  // Makes a port with one reference of its receive right, which the caller owns. On failure *name is not
  // written.
  virtual KernelReturn allocateReceiveRight(PortName* name) noexcept = 0;
  // Makes one reference of a send right to the port from its receive right (make-send). The caller owns it.
  // kern::invalidRight if this process does not hold the port's receive right.
  virtual KernelReturn insertSendRight(PortName name) noexcept = 0;
  // Drops one reference of the receive right. With the last one the port dies, and every holder of a send
  // right sees a hang-up. kern::invalidRight or invalidName if there is no reference; then nothing changes.
  virtual KernelReturn dropReceiveRight(PortName name) noexcept = 0;
  // Drops one reference of a send right. kern::invalidRight or invalidName if there is none; then nothing
  // changes.
  virtual KernelReturn deallocateSendRight(PortName name) noexcept = 0;
};

// The platform's registry of named services.
class Bootstrap {
 public:
  virtual ~Bootstrap() = default;
  // Obtains the receive right of the named service; the caller owns one reference. kern::noAccess if another
  // live process holds the name, kern::failure if the service cannot be set up, kern::resourceShortage if
  // memory runs out. Writes *receiveRight only on success.
  virtual KernelReturn checkIn(const char* serviceName, PortName* receiveRight) noexcept = 0;
};

enum class WantTrailer : bool { no, yes };

// Serves a routine table on a port from a run loop. It answers unknown ids with mig::badId, malformed
// messages with mig::badArguments, and releases regions and the rights of refused requests after the reply.
// Main loop only; may be invalidated and destroyed from within one of its own handlers.
class RoutineSource {
 public:
  virtual ~RoutineSource() = default;
  // Begins to serve on the loop, which must outlive the source. Returns false if the loop cannot watch the
  // port.
  virtual bool addTo(RunLoop& loop) noexcept = 0;
  // Stops serving for good. The port stays.
  virtual void invalidate() noexcept = 0;
};

// Watches the port behind a send right for its death. Main loop only; may be destroyed from its callback.
class DeathWatch {
 public:
  virtual ~DeathWatch() = default;  // invalidates
  // The send right's name. The watch owns no reference of the right.
  virtual PortName port() const noexcept = 0;
  // False once the port has died or the watch was invalidated.
  virtual bool isValid() const noexcept = 0;
  // Sets the callback, which runs once, from the run loop, after the port has died, even if it died before
  // the callback was set. Empty: no callback. Invalidating the watch does not run it.
  virtual void setInvalidationCallback(std::function<void(DeathWatch&)> callback) noexcept = 0;
  virtual void invalidate() noexcept = 0;
};

// Makes the objects above for ports of one PortSpace. Returns null if there is no such right, or the platform
// lacks memory or descriptors. The table and the loop must outlive the objects made with them.
class PortSources {
 public:
  virtual ~PortSources() = default;
  virtual std::shared_ptr<RoutineSource> makeRoutineSource(PortName port, const RoutineTable& table,
                                                           WantTrailer trailer) noexcept = 0;
  virtual std::shared_ptr<DeathWatch> makeDeathWatch(PortName port, RunLoop& loop) noexcept = 0;
};

}  // namespace brenvik

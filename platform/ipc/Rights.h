// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <utility>

#include "platform/ipc/Ports.h"

namespace brenvik {

// Owns one reference of a right to a port and drops it when destroyed. Empty unless it names a usable port.
// Main loop only; the port space must outlive it.
template <KernelReturn (PortSpace::*drop)(PortName) noexcept>
class PortRight {
 public:
  PortRight() noexcept = default;
  // Takes over a reference that the caller has.
  PortRight(PortSpace& ports, PortName adopted) noexcept : ports_(&ports), name_(adopted) {}
  PortRight(PortRight&& other) noexcept : ports_(other.ports_), name_(other.release()) {}
  PortRight& operator=(PortRight&& other) noexcept {
    reset();
    ports_ = other.ports_;
    name_ = other.release();
    return *this;
  }
  ~PortRight() { reset(); }

  // kNullPort if empty.
  PortName name() const noexcept { return name_; }
  explicit operator bool() const noexcept { return isUsablePort(name_); }

  // Gives up the reference without dropping it; the caller must drop it.
  PortName release() noexcept { return std::exchange(name_, kNullPort); }
  void reset() noexcept {
    // Fails only if the right has already gone.
    if (const PortName name = release(); isUsablePort(name)) (void)(ports_->*drop)(name);
  }

 private:
  PortSpace* ports_ = nullptr;
  PortName name_ = kNullPort;
};

// Dropping it kills the port: every holder of a send right sees a hang-up.
using ReceiveRight = PortRight<&PortSpace::dropReceiveRight>;
using SendRight = PortRight<&PortSpace::deallocateSendRight>;

}  // namespace brenvik

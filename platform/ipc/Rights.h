// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <utility>

#include "platform/ipc/Ports.h"

namespace brenvik {

// Owns one reference of a right to a port and drops it when destroyed. Empty unless it names a port that can
// be used. Main loop only; the port space outlives it.
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

  // kNullPort when empty.
  PortName name() const noexcept { return name_; }
  explicit operator bool() const noexcept { return isUsablePort(name_); }

  // Gives the reference up without dropping it.
  PortName release() noexcept { return std::exchange(name_, kNullPort); }
  void reset() noexcept {
    // It fails only for a right that has gone already.
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

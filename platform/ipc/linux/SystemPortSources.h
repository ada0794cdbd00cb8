// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <memory>

#include "platform/ipc/Ports.h"
#include "platform/ipc/linux/HeldAddresses.h"
#include "platform/ipc/linux/IncomingMessage.h"
#include "platform/ipc/linux/SystemPortSpace.h"
#include "platform/ipc/linux/SystemRegions.h"

namespace brenvik {

// Routine sources and death watches on the ports of a SystemPortSpace.
//
// A source reads several messages of a channel in one wake-up only if the sender does not wait for answers,
// and never more than a small budget. If a reply does not fit its channel, nothing more is read from that
// channel until the reply has gone out; other channels are not delayed. The number of connections that have
// not checked in is limited, per account and in total; the oldest is closed first. Their regions are never
// mapped, and their descriptors are closed on another thread.
class SystemPortSources final : public PortSources {
 public:
  // `limited`: an account that is refused again and again waits for its answers. `unlimited` is for fuzzing.
  enum class Refusals { limited, unlimited };

  // `ports` and `regions` must outlive this object and everything it makes.
  SystemPortSources(SystemPortSpace& ports, SystemRegions& regions, Refusals refusals = Refusals::limited);
  ~SystemPortSources() override;

  std::shared_ptr<RoutineSource> makeRoutineSource(PortName port, const RoutineTable& table,
                                                   WantTrailer trailer) noexcept override;
  // Also returns null if the port's other end is held by this process itself: the service's end of a
  // connection, or a socket of another watch. Such a port would not die before this process.
  std::shared_ptr<DeathWatch> makeDeathWatch(PortName port, RunLoop& loop) noexcept override;

 private:
  SystemPortSpace& ports_;
  SystemRegions& regions_;
  const Refusals refusals_;
  const std::shared_ptr<HeldAddresses> held_ = std::make_shared<HeldAddresses>();
  // The process serves one message at a time, so all channels share one buffer.
  IncomingMessage incoming_;
};

}  // namespace brenvik

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <memory>

#include "platform/ipc/Ports.h"
#include "platform/ipc/linux/IncomingMessage.h"
#include "platform/ipc/linux/SystemPortSpace.h"
#include "platform/ipc/linux/SystemRegions.h"

namespace brenvik {

// Routine sources and death watches on the ports of a SystemPortSpace.
//
// A source takes further messages of a channel without another wake-up only while the sender does not wait
// for answers, and never more than a small budget in a row. A reply that does not fit its channel waits for
// room, and nothing more is read from that channel until it has gone out; others do not notice. Of a
// service's connections that have not checked in, only so many are kept, of one account and in all, and the
// oldest goes first. What they send is never mapped, and descriptors of theirs are closed elsewhere.
class SystemPortSources final : public PortSources {
 public:
  // Whether an account that is refused again and again waits for its answers. Without it: for fuzzing.
  enum class Refusals { limited, unlimited };

  // Both outlive this object and everything it makes.
  SystemPortSources(SystemPortSpace& ports, SystemRegions& regions, Refusals refusals = Refusals::limited);
  ~SystemPortSources() override;

  std::shared_ptr<RoutineSource> makeRoutineSource(PortName port, const RoutineTable& table,
                                                   WantTrailer trailer) noexcept override;
  std::shared_ptr<DeathWatch> makeDeathWatch(PortName port, RunLoop& loop) noexcept override;

 private:
  SystemPortSpace& ports_;
  SystemRegions& regions_;
  const Refusals refusals_;
  // One message at a time is served in the whole process, so one buffer serves every channel.
  IncomingMessage incoming_;
};

}  // namespace brenvik

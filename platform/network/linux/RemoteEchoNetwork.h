// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <chrono>

#include "platform/net/EchoNetwork.h"
#include "platform/worker/Worker.h"

namespace brenvik {

// The network of a prober, in the network worker; the clocks are this process's. The caller's thread waits
// for each answer, but not for a worker that has died or hangs: what it asks then fails.
class RemoteEchoNetwork final : public EchoNetwork {
 public:
  // How long an answer that takes no time may take, the worker's start included; and beyond its own time-out
  // one that does.
  static constexpr std::chrono::milliseconds kPatience = std::chrono::seconds(3);
  // A name server that does not answer is given up by the C library after ten seconds.
  static constexpr std::chrono::milliseconds kLookUpPatience = std::chrono::seconds(12);

  // The worker outlives it.
  explicit RemoteEchoNetwork(Worker& worker, std::chrono::milliseconds patience = kPatience) noexcept
      : worker_(worker), patience_(patience) {}

  std::optional<in_addr> addressOfHost(const char* name) override;
  std::optional<int> protocolByName(const char* name) override;
  std::unique_ptr<EchoSocket> openEchoSocket(int protocol, std::uint16_t identifier) override;
  unsigned indexOfInterface(const char* name) override;
  int timeOfDay(timeval* now) noexcept override;
  std::chrono::microseconds steadyTime() noexcept override;

 private:
  class Socket;
  Worker& worker_;
  const std::chrono::milliseconds patience_;
};

}  // namespace brenvik

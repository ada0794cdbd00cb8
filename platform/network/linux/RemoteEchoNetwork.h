// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <chrono>

#include "platform/net/EchoNetwork.h"
#include "platform/worker/Worker.h"

namespace brenvik {

// The network of a prober, in the network worker; the clocks are this process's. The caller's thread waits
// for each answer. If the worker has died or hangs, the call fails.
class RemoteEchoNetwork final : public EchoNetwork {
 public:
  // The time limit of an answer that needs no waiting, the worker's start included; a receive may take this
  // long beyond its own time-out.
  static constexpr std::chrono::milliseconds kPatience = std::chrono::seconds(3);
  // A name server that does not answer is given up by the C library after ten seconds.
  static constexpr std::chrono::milliseconds kLookUpPatience = std::chrono::seconds(12);

  // The worker must outlive it.
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

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <netinet/in.h>
#include <sys/time.h>

#include <chrono>
#include <cstddef>
#include <cstdint>
#include <memory>
#include <optional>
#include <span>

namespace brenvik {

// What a send or a receive came to: bytes moved, or a negative count and the error's number.
struct EchoTransfer {
  std::ptrdiff_t count = -1;
  int error = 0;
};

// A socket for ICMP echo messages over IPv4 (RFC 792). One thread at a time. What is not noexcept throws
// std::bad_alloc.
class EchoSocket {
 public:
  virtual ~EchoSocket() = default;

  // Best effort: a failure is not reported.
  virtual void setReceiveBufferSize(int bytes) = 0;
  // Lets packets out and in by this interface only. Best effort: a failure is not reported.
  virtual void bindToInterface(unsigned index) = 0;
  // How long receive() waits. 0, or the error's number.
  virtual int setReceiveTimeOut(std::chrono::microseconds timeOut) = 0;

  // Sends the ICMP message with the identifier that stands in it.
  virtual EchoTransfer sendTo(in_addr destination, std::span<const std::byte> message) = 0;
  // Waits for the next datagram, which is cut to fit. EAGAIN when none came in time.
  virtual EchoTransfer receive(std::span<std::byte> buffer) = 0;
  // Whether what is received begins with the IP header or with the ICMP message.
  virtual bool deliversIpHeader() const noexcept = 0;
};

// The network as a prober sees it. Any thread. What is not noexcept throws std::bad_alloc.
class EchoNetwork {
 public:
  virtual ~EchoNetwork() = default;

  // The first IPv4 address of a host's name, as gethostbyname(3) finds it.
  virtual std::optional<in_addr> addressOfHost(const char* name) = 0;
  // The number of a protocol by name, as getprotobyname(3) knows it.
  virtual std::optional<int> protocolByName(const char* name) = 0;
  // A socket whose echo requests go out with `identifier` unchanged. Null when the system allows none.
  virtual std::unique_ptr<EchoSocket> openEchoSocket(int protocol, std::uint16_t identifier) = 0;
  // 0 when there is no such interface.
  virtual unsigned indexOfInterface(const char* name) = 0;
  // The wall clock. 0, or -1 with errno, which may be left 0.
  virtual int timeOfDay(timeval* now) noexcept = 0;
  // A clock that only moves forward.
  virtual std::chrono::microseconds steadyTime() noexcept = 0;
};

}  // namespace brenvik

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

// The result of a send or a receive: the bytes moved, or a negative count and an errno.
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
  // Limits sending and receiving to this interface. Best effort: a failure is not reported.
  virtual void bindToInterface(unsigned index) = 0;
  // Sets how long receive() waits. Returns 0 or an errno.
  virtual int setReceiveTimeOut(std::chrono::microseconds timeOut) = 0;

  // Sends the ICMP message with the identifier that it contains.
  virtual EchoTransfer sendTo(in_addr destination, std::span<const std::byte> message) = 0;
  // Waits for the next datagram, which is cut to fit. EAGAIN if none arrives in time.
  virtual EchoTransfer receive(std::span<std::byte> buffer) = 0;
  // Whether a received datagram begins with the IP header (true) or with the ICMP message.
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
  // Opens a socket that sends echo requests with this `identifier`. Returns null if the system allows none.
  virtual std::unique_ptr<EchoSocket> openEchoSocket(int protocol, std::uint16_t identifier) = 0;
  // 0 if there is no such interface.
  virtual unsigned indexOfInterface(const char* name) = 0;
  // Reads the wall clock. Returns 0, or -1 and sets errno, which may stay 0.
  virtual int timeOfDay(timeval* now) noexcept = 0;
  // A clock that only moves forward.
  virtual std::chrono::microseconds steadyTime() noexcept = 0;
};

}  // namespace brenvik

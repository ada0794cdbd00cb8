// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <atomic>
#include <cerrno>
#include <chrono>
#include <cstring>
#include <deque>
#include <memory>
#include <new>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "platform/net/EchoNetwork.h"

namespace brenvik {

// A network of one thread whose time passes only in receive(): each scripted arrival takes its time, and an
// empty script means silence, a whole receive time-out long.
class FakeEchoNetwork final : public EchoNetwork {
 public:
  struct Arrival {
    std::chrono::microseconds after;  // since the receive began
    std::vector<std::byte> datagram;  // ignored when `error` is set
    int error = 0;
  };

  // What the prober will find.
  std::optional<in_addr> hostAddress;
  std::optional<int> icmpNumber = 1;
  bool refuseSockets = false;
  bool isWithoutMemory = false;  // when it is asked for a socket
  bool raw = false;              // sockets deliver the IP header
  unsigned cellularIndex = 0;
  int timeOutError = 0;
  int sendError = 0;
  std::ptrdiff_t sendCount = 0;  // 0: all of it
  int clockFailures = 0;         // so many calls of timeOfDay() fail, with clockError
  int clockError = 0;
  timeval wallClock{1'700'000'000, 123'456};
  std::deque<Arrival> arrivals;

  // What the prober did.
  std::vector<std::string> namesAsked;
  std::vector<std::pair<int, std::uint16_t>> opened;  // protocol, identifier
  std::atomic<int> openSockets{0};  // a socket may go on another thread than the one that has the next
  std::vector<std::string> calls;   // on sockets, in order
  std::vector<std::vector<std::byte>> sent;
  in_addr destination{};
  std::chrono::microseconds elapsed{0};

  std::optional<in_addr> addressOfHost(const char* name) noexcept override {
    namesAsked.emplace_back(name);
    return hostAddress;
  }
  std::optional<int> protocolByName(const char* name) noexcept override {
    return std::strcmp(name, "icmp") == 0 ? icmpNumber : std::nullopt;
  }
  std::unique_ptr<EchoSocket> openEchoSocket(int protocol, std::uint16_t identifier) override {
    if (isWithoutMemory) throw std::bad_alloc();
    opened.emplace_back(protocol, identifier);
    if (refuseSockets) return nullptr;
    return std::make_unique<Socket>(*this);
  }
  unsigned indexOfInterface(const char* name) noexcept override {
    return std::strcmp(name, "pdp_ip0") == 0 ? cellularIndex : 0;
  }
  int timeOfDay(timeval* now) noexcept override {
    if (clockFailures > 0) {
      --clockFailures;
      errno = clockError;
      return -1;
    }
    *now = wallClock;
    return 0;
  }
  std::chrono::microseconds steadyTime() noexcept override { return elapsed; }

 private:
  class Socket final : public EchoSocket {
   public:
    explicit Socket(FakeEchoNetwork& network) : network_(network) { ++network_.openSockets; }
    ~Socket() override { --network_.openSockets; }
    void setReceiveBufferSize(int bytes) noexcept override {
      network_.calls.push_back("buffer " + std::to_string(bytes));
    }
    void bindToInterface(unsigned index) noexcept override {
      network_.calls.push_back("interface " + std::to_string(index));
    }
    int setReceiveTimeOut(std::chrono::microseconds value) noexcept override {
      network_.calls.push_back("time-out " + std::to_string(value.count()));
      timeOut_ = value;
      return network_.timeOutError;
    }
    EchoTransfer sendTo(in_addr to, std::span<const std::byte> message) noexcept override {
      network_.calls.emplace_back("send");
      network_.destination = to;
      if (network_.sendError != 0) return {-1, network_.sendError};
      network_.sent.emplace_back(message.begin(), message.end());
      return {network_.sendCount != 0 ? network_.sendCount : static_cast<std::ptrdiff_t>(message.size()), 0};
    }
    EchoTransfer receive(std::span<std::byte> buffer) noexcept override {
      if (network_.arrivals.empty() || network_.arrivals.front().after > timeOut_) {
        if (!network_.arrivals.empty()) network_.arrivals.front().after -= timeOut_;
        network_.elapsed += timeOut_;
        return {-1, EAGAIN};
      }
      const Arrival arrival = std::move(network_.arrivals.front());
      network_.arrivals.pop_front();
      network_.elapsed += arrival.after;
      if (arrival.error != 0) return {-1, arrival.error};
      const auto size = std::min(buffer.size(), arrival.datagram.size());
      if (size > 0) std::memcpy(buffer.data(), arrival.datagram.data(), size);
      return {static_cast<std::ptrdiff_t>(size), 0};
    }
    bool deliversIpHeader() const noexcept override { return network_.raw; }

   private:
    FakeEchoNetwork& network_;
    std::chrono::microseconds timeOut_ = std::chrono::hours(1);
  };
};

}  // namespace brenvik

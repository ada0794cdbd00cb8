// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <linux/if_ether.h>
#include <linux/if_packet.h>
#include <net/if.h>
#include <netinet/in.h>
#include <poll.h>
#include <sched.h>
#include <sys/socket.h>
#include <unistd.h>

#include <array>
#include <chrono>
#include <condition_variable>
#include <cstdint>
#include <cstdlib>
#include <functional>
#include <future>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include "platform/base/UniqueFd.h"

namespace brenvik {

// A network namespace of its own for tests, made of the kernel's own means and joined to nothing: what runs
// in it, run(), sees only interfaces made in it. Needs CAP_SYS_ADMIN and the program ip(8).
class PrivateNetwork {
 public:
  PrivateNetwork() {
    std::promise<bool> started;
    auto ready = started.get_future();
    thread_ = std::thread([this, &started] {
      const bool made = ::unshare(CLONE_NEWNET) == 0;
      threadId_ = ::gettid();
      started.set_value(made);
      for (;;) {
        std::packaged_task<void()> task;
        {
          std::unique_lock lock(mutex_);
          wakes_.wait(lock, [this] { return task_.valid() || ending_; });
          if (!task_.valid()) return;
          task = std::move(task_);
        }
        task();
      }
    });
    isMade_ = ready.get();
  }
  PrivateNetwork(const PrivateNetwork&) = delete;
  PrivateNetwork& operator=(const PrivateNetwork&) = delete;
  ~PrivateNetwork() {
    {
      const std::lock_guard lock(mutex_);
      ending_ = true;
    }
    wakes_.notify_one();
    thread_.join();
  }

  // False where the system does not let us make one; a test that needs it then skips itself.
  bool isMade() const noexcept { return isMade_; }
  // As ip(8) takes it after "netns".
  std::string name() const { return std::to_string(threadId_); }

  // Runs the work within the namespace, threads and programs it starts included, and waits for it.
  void run(std::function<void()> work) {
    std::packaged_task<void()> task(std::move(work));
    auto done = task.get_future();
    {
      const std::lock_guard lock(mutex_);
      task_ = std::move(task);
    }
    wakes_.notify_one();
    done.get();
  }

  // Runs one command of ip(8), without the leading "ip"; true when it succeeded.
  bool ip(const std::string& arguments) {
    bool ok = false;
    run([&] { ok = std::system(("ip " + arguments).c_str()) == 0; });
    return ok;
  }

  // Waits until the interface carries packets; false when it does not within a few seconds. The kernel
  // notices that the other end of a pair is up a little later, and drops what is sent before that.
  bool waitUntilUp(const std::string& interfaceName) {
    return ip("link show dev " + interfaceName + " > /dev/null && for i in $(seq 500); do " +
              "ip link show dev " + interfaceName +
              " | grep -q 'state UP' && exit 0; sleep 0.01; done; exit 1");
  }

  // Writes one of the namespace's settings, such as "net/ipv4/ping_group_range".
  bool set(const std::string& setting, const std::string& value) {
    bool ok = false;
    run([&] { ok = std::system(("echo '" + value + "' > /proc/sys/" + setting).c_str()) == 0; });
    return ok;
  }

 private:
  std::thread thread_;
  std::mutex mutex_;
  std::condition_variable wakes_;
  std::packaged_task<void()> task_;
  bool ending_ = false;
  bool isMade_ = false;
  pid_t threadId_ = 0;
};

// Everything that arrives on one interface, IPv6 and its kernel-made chatter aside; seen below routing and
// sockets, as a tap would. Made within a PrivateNetwork's run().
class PacketTap {
 public:
  explicit PacketTap(const char* interfaceName)
      : fd_(::socket(AF_PACKET, SOCK_DGRAM | SOCK_CLOEXEC | SOCK_NONBLOCK, htons(ETH_P_ALL))) {
    sockaddr_ll self{};
    self.sll_family = AF_PACKET;
    self.sll_protocol = htons(ETH_P_ALL);
    self.sll_ifindex = static_cast<int>(::if_nametoindex(interfaceName));
    if (::bind(fd_.get(), reinterpret_cast<const sockaddr*>(&self), sizeof self) != 0) fd_.reset();
  }
  bool isMade() const noexcept { return fd_.isValid(); }

  struct Packet {
    std::uint16_t protocol;  // ETH_P_IP, ETH_P_ARP ...
    std::vector<std::uint8_t> bytes;
    std::chrono::steady_clock::time_point at;
  };

  // What has arrived since the last call; waits for at least `atLeast` packets, no longer than `patience`.
  std::vector<Packet> packets(std::size_t atLeast = 0, std::chrono::milliseconds patience = {}) {
    std::vector<Packet> result;
    const auto deadline = std::chrono::steady_clock::now() + patience;
    for (;;) {
      std::array<std::uint8_t, 4096> buffer;
      sockaddr_ll from{};
      socklen_t size = sizeof from;
      const auto got =
          ::recvfrom(fd_.get(), buffer.data(), buffer.size(), 0, reinterpret_cast<sockaddr*>(&from), &size);
      if (got >= 0) {
        const std::uint16_t protocol = ntohs(from.sll_protocol);
        if (protocol == ETH_P_IPV6 || from.sll_pkttype == PACKET_OUTGOING) continue;
        result.push_back({protocol, {buffer.data(), buffer.data() + got}, std::chrono::steady_clock::now()});
        continue;
      }
      if (result.size() >= atLeast) return result;
      const auto left =
          std::chrono::ceil<std::chrono::milliseconds>(deadline - std::chrono::steady_clock::now());
      if (left.count() <= 0) return result;
      pollfd wait{fd_.get(), POLLIN, 0};
      (void)::poll(&wait, 1, static_cast<int>(left.count()));
    }
  }

 private:
  UniqueFd fd_;
};

}  // namespace brenvik

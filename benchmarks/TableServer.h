// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <fcntl.h>
#include <signal.h>
#include <sys/prctl.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <unistd.h>

#include <array>
#include <chrono>
#include <cstdlib>
#include <functional>
#include <limits>

#include "interface/Wire.h"
#include "platform/base/UniqueFd.h"
#include "platform/ipc/linux/SystemPortSources.h"
#include "platform/log/linux/SystemLog.h"
#include "platform/runloop/linux/SystemQueues.h"

namespace brenvik {

// A process that serves a routine table over the real transport until this one goes. It writes its log to
// /dev/null unless a journal listens.
class TableServer {
 public:
  // What a table is made of in the new process.
  struct Surroundings {
    SystemRunLoop& loop;
    SystemRegions& regions;
  };
  // Makes the table and what stands behind it, and gives it to `serve`, which does not return.
  using Make =
      std::function<void(const Surroundings& here, const std::function<void(const RoutineTable&)>& serve)>;

  explicit TableServer(const Make& make) {
    PortName port = kNullPort;
    if (ports_.allocateReceiveRight(&port) != kern::success ||
        ports_.insertSendRight(port) != kern::success) {
      std::abort();
    }
    client_ = UniqueFd(::fcntl(ports_.sendEnd(port)->get(), F_DUPFD_CLOEXEC, 0));
    child_ = ::fork();
    // This process keeps the receive right, too: giving it up would shut the socket that the other one reads.
    if (child_ == 0) run(port, make);
  }
  TableServer(const TableServer&) = delete;
  TableServer& operator=(const TableServer&) = delete;
  ~TableServer() {
    ::kill(child_, SIGKILL);
    ::waitpid(child_, nullptr, 0);
  }

  // Sends a request and waits for its answer: its length in bytes; reply() is good until the next exchange.
  std::size_t exchange(const void* request, std::size_t size) {
    if (::send(client_.get(), request, size, MSG_NOSIGNAL) < 0) std::abort();
    const ssize_t received = ::recv(client_.get(), reply_.data(), reply_.size(), 0);
    if (received < 0) std::abort();
    return static_cast<std::size_t>(received);
  }
  template <typename Message>
  const Message& reply() const {
    return *reinterpret_cast<const Message*>(reply_.data());
  }

 private:
  [[noreturn]] void run(PortName port, const Make& make) {
    ::prctl(PR_SET_PDEATHSIG, SIGKILL);
    client_.reset();
    ::dup2(::open("/dev/null", O_WRONLY | O_CLOEXEC), STDERR_FILENO);
    SystemLog log("benchmark");
    setLogSink(&log);
    const auto loop = SystemRunLoop::make();
    if (loop == nullptr) ::_exit(1);
    SystemRegions regions;
    SystemPortSources sources(ports_, regions);
    make({*loop, regions}, [&](const RoutineTable& table) {
      const auto source = sources.makeRoutineSource(port, table, WantTrailer::no);
      if (source == nullptr || !source->addTo(*loop)) ::_exit(1);
      (void)loop->run(std::chrono::duration<double>(std::numeric_limits<double>::max()),
                      ReturnAfterSource::no);
      ::_exit(0);
    });
    ::_exit(1);
  }

  SystemPortSpace ports_;
  UniqueFd client_;
  pid_t child_ = -1;
  alignas(4096) std::array<char, kLargestDatagram> reply_;
};

// An out-of-line reply that carries the region.
inline void answerWithRegion(Reply& reply, void* address, std::uint32_t length) noexcept {
  auto& message = reply.as<OutOfLineReply>();
  message.header.bits = kReplyDisposition | kComplexBit;
  message.header.size = sizeof message;
  message.descriptorCount = 1;
  message.payload = {
      reinterpret_cast<std::uint64_t>(address), 1, kVirtualCopy, 0, kOutOfLineDescriptorType, length};
  message.ndr = kNdrRecord;
  message.byteCount = length;
}

}  // namespace brenvik

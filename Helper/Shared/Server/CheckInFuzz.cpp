// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
//
// Any datagram with any descriptors at the service port, over a real socket: framing, admission, reply. The
// first byte of the input says which descriptors go along, two bits each: none, a sealed memfd, /dev/null, a
// socket. Bit 7 of the second byte admits the caller.

#include <fcntl.h>
#include <sys/mman.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <array>
#include <chrono>
#include <cstdlib>
#include <cstring>
#include <string>
#include <vector>

#include "Helper/Shared/Server/CheckInTable.h"
#include "platform/ipc/linux/SystemPortSources.h"
#include "platform/log/Log.h"
#include "platform/runloop/linux/SystemQueues.h"

namespace {

using namespace brenvik;

void require(bool condition) {
  if (!condition) std::abort();
}

class NoLog final : public LogSink {
 public:
  void unified(LogLevel, std::string_view, const LogPlace&, const MessageId&) noexcept override {}
  void bsd(SyslogPriority, std::string_view, const MessageId&) noexcept override {}
};

class NoRoutines final : public RoutineTable {
 public:
  Handler find(std::int32_t) const noexcept override { return nullptr; }
  void* context() const noexcept override { return nullptr; }
};

// A listening socket without a file.
class AbstractBootstrap final : public Bootstrap {
 public:
  explicit AbstractBootstrap(SystemPortSpace& ports) : ports_(ports) {
    address.sun_family = AF_UNIX;
    const std::string name = "brenvik-check-in-fuzz-" + std::to_string(::getpid());
    name.copy(address.sun_path + 1, sizeof address.sun_path - 2);
  }
  KernelReturn checkIn(const char*, PortName* receiveRight) noexcept override {
    UniqueFd socket(::socket(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC | SOCK_NONBLOCK, 0));
    const int on = 1;
    require(::bind(socket.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address) == 0 &&
            ::listen(socket.get(), 8) == 0 &&
            ::setsockopt(socket.get(), SOL_SOCKET, SO_PASSCRED, &on, sizeof on) == 0);
    *receiveRight = ports_.adoptService(std::move(socket), "");
    return kern::success;
  }
  sockaddr_un address{};

 private:
  SystemPortSpace& ports_;
};

struct Server {
  NoLog log;
  std::unique_ptr<SystemRunLoop> loop = SystemRunLoop::make();
  SystemPortSpace ports;
  SystemRegions regions;
  SystemPortSources sources{ports, regions, SystemPortSources::Refusals::unlimited};
  AbstractBootstrap bootstrap{ports};
  NoRoutines routines;
  bool admits = false;
  const ServerPlatform platform{.ports = ports,
                                .bootstrap = bootstrap,
                                .sources = sources,
                                .loop = *loop,
                                .hasEntitlement = [this](const char*, const AuditToken&) { return admits; }};
  std::unique_ptr<ServerContext> context;
  UniqueFd sealed{::memfd_create("fuzz", MFD_CLOEXEC | MFD_ALLOW_SEALING)};
  UniqueFd null{::open("/dev/null", O_RDONLY | O_CLOEXEC)};

  Server() {
    setLogSink(&log);
    require(::ftruncate(sealed.get(), 4096) == 0 &&
            ::fcntl(sealed.get(), F_ADD_SEALS, F_SEAL_SHRINK | F_SEAL_GROW | F_SEAL_WRITE) == 0);
    context = CreateServer(platform, "service", routines);
    require(context != nullptr);
  }
  void pump() {
    while (loop->run(std::chrono::seconds(0), ReturnAfterSource::yes) == RunResult::handledSource) {
    }
  }
};

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  static auto& server = *new Server;  // until the end: a closing thread may still use it
  if (size < 3 || size - 2 > kLargestDatagram) return 0;
  const std::uint8_t kinds = data[0];
  server.admits = (data[1] & 0x80) != 0;
  data += 2;
  size -= 2;
  const std::size_t portsBefore = server.ports.size();

  UniqueFd connection(::socket(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC, 0));
  std::array<int, 2> ends{};
  require(::connect(connection.get(), reinterpret_cast<const sockaddr*>(&server.bootstrap.address),
                    sizeof server.bootstrap.address) == 0 &&
          ::socketpair(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC, 0, ends.data()) == 0);
  UniqueFd life(ends[0]);
  UniqueFd given(ends[1]);
  std::vector<int> fds;
  for (int shift = 0; shift < 8; shift += 2) {
    const std::array kind{-1, server.sealed.get(), server.null.get(), given.get()};
    if (const int fd = kind[(kinds >> shift) & 3]; fd >= 0) fds.push_back(fd);
  }
  iovec io{const_cast<std::uint8_t*>(data), size};
  msghdr message{};
  message.msg_iov = &io;
  message.msg_iovlen = 1;
  alignas(cmsghdr) std::array<char, CMSG_SPACE(4 * sizeof(int))> control{};
  if (!fds.empty()) {
    message.msg_control = control.data();
    message.msg_controllen = CMSG_SPACE(fds.size() * sizeof(int));
    cmsghdr* const item = CMSG_FIRSTHDR(&message);
    item->cmsg_level = SOL_SOCKET;
    item->cmsg_type = SCM_RIGHTS;
    item->cmsg_len = CMSG_LEN(fds.size() * sizeof(int));
    std::memcpy(CMSG_DATA(item), fds.data(), fds.size() * sizeof(int));
  }
  require(::sendmsg(connection.get(), &message, 0) == static_cast<ssize_t>(size));
  given.reset();
  server.pump();

  // An answer exactly when one was asked for, in the form of the protocol; a port for nobody who is not
  // admitted.
  std::array<std::byte, 1024> answer;
  const ssize_t answered = ::recv(connection.get(), answer.data(), answer.size(), MSG_DONTWAIT);
  std::uint32_t replyPort = 0;
  if (size >= sizeof(MessageHeader)) std::memcpy(&replyPort, data + offsetof(MessageHeader, replyPort), 4);
  require((answered > 0) == (replyPort != 0));
  if (answered > 0) {
    const auto& header = *reinterpret_cast<const MessageHeader*>(answer.data());
    require(header.localPort == replyPort && header.replyPort == 0 &&
            header.size == static_cast<std::uint32_t>(answered));
    const bool isAdmitted = (header.bits & kComplexBit) != 0;
    require(answered == (isAdmitted ? ssize_t{sizeof(CheckInReply)} : ssize_t{sizeof(StatusReply)}));
    require(!isAdmitted || server.admits);
  }
  // The caller goes, and with it all that was made for it.
  life.reset();
  connection.reset();
  server.ports.closing().drain();
  server.pump();
  server.ports.closing().drain();
  server.pump();
  require(server.ports.size() == portsBefore && server.context->facts().clients == 0);
  return 0;
}

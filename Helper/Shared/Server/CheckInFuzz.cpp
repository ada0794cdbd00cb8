// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
//
// Any datagram with any descriptors at the service port, over a real socket: framing, admission, reply. The
// first byte of the input says which descriptors go along, two bits each: none, a sealed memfd, /dev/null, a
// socket. Bit 7 of the second byte admits the caller.

#include <fcntl.h>
#include <unistd.h>

#include <array>
#include <chrono>
#include <cstring>
#include <span>
#include <vector>

#include "Helper/Shared/Server/CheckInTable.h"
#include "platform/base/fakes/FuzzInput.h"
#include "platform/datagram/Datagram.h"
#include "platform/datagram/LocalSocket.h"
#include "platform/datagram/SealedMemory.h"
#include "platform/ipc/fakes/AbstractBootstrap.h"
#include "platform/ipc/fakes/FakePorts.h"
#include "platform/ipc/linux/SystemPortSources.h"
#include "platform/log/fakes/NoLog.h"
#include "platform/runloop/linux/SystemQueues.h"

namespace {

using namespace brenvik;

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
  UniqueFd sealed = makeSealableMemory("fuzz");
  UniqueFd null{::open("/dev/null", O_RDONLY | O_CLOEXEC)};

  Server() {
    setLogSink(&log);
    require(::ftruncate(sealed.get(), 4096) == 0 && sealMemory(sealed.get()));
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

  UniqueFd connection = makeSocket(Blocking::yes);
  UniqueFd life;
  UniqueFd given;
  require(connectSocket(connection.get(), server.bootstrap.address) == 0 &&
          makeSocketPair(&life, &given) == 0);
  std::vector<int> fds;
  for (int shift = 0; shift < 8; shift += 2) {
    const std::array kind{-1, server.sealed.get(), server.null.get(), given.get()};
    if (const int fd = kind[(kinds >> shift) & 3]; fd >= 0) fds.push_back(fd);
  }
  const std::array parts{iovecOf(std::as_bytes(std::span(data, size)))};
  require(sendDatagram(connection.get(), parts, fds) == 0);
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

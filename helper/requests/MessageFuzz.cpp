// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
//
// Any datagram with any descriptors, over a real socket, through framing, table and reply. The first byte of
// the input says which descriptors go along, two bits each: none, a sealed memfd, an unsealed one, a socket.

#include <fcntl.h>
#include <unistd.h>

#include <array>
#include <cstdlib>
#include <cstring>
#include <span>
#include <vector>

#include "helper/requests/RequestTable.h"
#include "helper/requests/fakes/RecordingAreas.h"
#include "platform/base/UniqueFd.h"
#include "platform/datagram/Datagram.h"
#include "platform/datagram/SealedMemory.h"
#include "platform/ipc/linux/SystemPortSources.h"
#include "platform/runloop/linux/SystemQueues.h"

namespace {

using namespace brenvik;

void require(bool condition) {
  if (!condition) std::abort();
}

UniqueFd memory() {
  UniqueFd fd = makeSealableMemory("fuzz");
  require(::write(fd.get(), "bplist00", 8) == 8);
  return fd;
}

// The helper's side of one client, made once.
struct Server {
  std::unique_ptr<SystemRunLoop> loop = SystemRunLoop::make();
  SystemPortSpace ports;
  SystemRegions regions;
  SystemPortSources sources{ports, regions};
  RecordingAreas areas;
  RequestTable<RecordingAreas> table{[this] { return &areas; }};
  PortName port = kNullPort;
  std::shared_ptr<RoutineSource> source;
  UniqueFd client;
  UniqueFd sealed = memory();
  UniqueFd unsealed = memory();

  Server() {
    require(sealMemory(sealed.get()));
    areas.payload = {};  // its bytes are no region of ours
    require(ports.allocateReceiveRight(&port) == kern::success &&
            ports.insertSendRight(port) == kern::success);
    source = sources.makeRoutineSource(port, table, WantTrailer::no);
    require(source->addTo(*loop));
    client = UniqueFd(::fcntl(ports.sendEnd(port)->get(), F_DUPFD_CLOEXEC, 0));
  }
};

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  static Server server;
  if (size < 2 || size - 1 > kLargestDatagram) return 0;
  const std::size_t portsBefore = server.ports.size();

  std::vector<int> fds;
  for (int shift = 0; shift < 8; shift += 2) {
    switch ((data[0] >> shift) & 3) {
      case 1:
        fds.push_back(server.sealed.get());
        break;
      case 2:
        fds.push_back(server.unsealed.get());
        break;
      case 3:
        fds.push_back(server.client.get());
        break;
      default:
        break;
    }
  }
  const std::array parts{iovecOf(std::as_bytes(std::span(data + 1, size - 1)))};
  require(sendDatagram(server.client.get(), parts, fds) == 0);
  while (server.loop->run(std::chrono::seconds(0), ReturnAfterSource::yes) == RunResult::handledSource) {
  }

  // An answer exactly when one was asked for, in the form of the protocol.
  std::array<std::byte, kLargestDatagram> answer;
  const ssize_t answered = ::recv(server.client.get(), answer.data(), answer.size(), MSG_DONTWAIT);
  std::uint32_t replyPort = 0;
  if (size - 1 >= sizeof(MessageHeader))
    std::memcpy(&replyPort, data + 1 + offsetof(MessageHeader, replyPort), 4);
  require((answered > 0) == (replyPort != 0));
  if (answered > 0) {
    const auto& header = *reinterpret_cast<const MessageHeader*>(answer.data());
    require(answered >= 36 && header.localPort == replyPort && header.replyPort == 0);
    require(header.size <= static_cast<std::uint32_t>(answered));
  }
  // The routines of this server keep no right.
  require(server.ports.size() == portsBefore && server.regions.live() == 0);
  return 0;
}

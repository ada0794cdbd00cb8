// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
//
// Any datagram with any descriptors, over a real socket, through framing, table and reply. The first byte of
// the input says which descriptors go along, two bits each: none, a sealed memfd, an unsealed one, a socket.

#include <fcntl.h>
#include <sys/mman.h>
#include <sys/socket.h>
#include <unistd.h>

#include <array>
#include <cstdlib>
#include <cstring>
#include <vector>

#include "helper/requests/RequestTable.h"
#include "helper/requests/fakes/RecordingAreas.h"
#include "platform/base/UniqueFd.h"
#include "platform/ipc/linux/SystemPortSources.h"
#include "platform/runloop/linux/SystemQueues.h"

namespace {

using namespace brenvik;

void require(bool condition) {
  if (!condition) std::abort();
}

UniqueFd memfd(int seals) {
  UniqueFd fd(::memfd_create("fuzz", MFD_CLOEXEC | MFD_ALLOW_SEALING));
  require(::write(fd.get(), "bplist00", 8) == 8);
  if (seals != 0) require(::fcntl(fd.get(), F_ADD_SEALS, seals) == 0);
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
  UniqueFd sealed = memfd(F_SEAL_SHRINK | F_SEAL_GROW | F_SEAL_WRITE);
  UniqueFd unsealed = memfd(0);

  Server() {
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
  iovec io{const_cast<std::uint8_t*>(data + 1), size - 1};
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
  require(::sendmsg(server.client.get(), &message, MSG_DONTWAIT) == static_cast<ssize_t>(size - 1));
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

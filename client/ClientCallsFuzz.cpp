// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include <fcntl.h>
#include <sys/socket.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <string>

#include "client/Region.h"
#include "interface/Messages.h"
#include "platform/datagram/Datagram.h"
#include "platform/datagram/LocalSocket.h"
#include "platform/datagram/SealedMemory.h"

// A helper that answers begun calls with any bytes. The input is a row of datagrams, each after its length
// (u16) and a byte: its lowest bit lets memory travel along, the next one gives the datagram the reply port
// number of a call that is under way, the upper six choose which.
namespace {

using namespace brenvik;
using namespace brenvik::client;

constexpr bvmh_call kCalls = 8;

void require(bool holds) {
  if (!holds) std::abort();
}

struct Door {
  Door() {
    path = "/tmp/client-calls-fuzz-" + std::to_string(::getpid());
    const auto address = socketAddress(path);
    ::unlink(path.c_str());
    listening = makeSocket(Blocking::no);
    require(address && bindSocket(listening.get(), *address) == 0 && ::listen(listening.get(), 4) == 0);
  }
  ~Door() { ::unlink(path.c_str()); }
  std::string path;
  UniqueFd listening;
};

void sendTo(int socket, std::span<const std::byte> bytes, int descriptor) {
  const std::array parts{iovecOf(bytes)};
  (void)sendDatagram(socket, parts, std::span(&descriptor, descriptor < 0 ? 0 : 1));
}

// Answers the check-in as a good helper does; the helper's end of the channel.
UniqueFd admit(const Door& door) {
  const UniqueFd connection(::accept4(door.listening.get(), nullptr, nullptr, SOCK_CLOEXEC));
  std::array<std::byte, 64> buffer{};
  Incoming incoming;
  require(receiveMessage(connection.get(), buffer, Deadline::never(), Waiting::never, &incoming) == Io::done);
  MessageHeader request;
  std::memcpy(&request, buffer.data(), sizeof request);
  UniqueFd ours;
  UniqueFd theirs;
  require(makeSocketPair(&ours, &theirs) == 0);
  CheckInReply reply{};
  reply.header = {kComplexBit | kReplyDisposition, sizeof reply, 0, request.replyPort, 0, request.id + 100};
  reply.descriptorCount = 1;
  reply.servicePort.disposition = kDispositionCopySend;
  reply.servicePort.type = kPortDescriptorType;
  sendTo(connection.get(), std::as_bytes(std::span(&reply, 1)), theirs.get());
  return ours;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  static const Door door;
  bvmh_client* const client = bvmh_client_create();
  require(client != nullptr && bvmh_client_set_socket(client, door.path.c_str()) == BVMH_OK);
  require(bvmh_client_fd(client) >= 0 && bvmh_begin_connect(client, nullptr, nullptr) == BVMH_OK);
  require(bvmh_process(client) == BVMH_OK);
  UniqueFd channel = admit(door);
  require(bvmh_process(client) == BVMH_OK);
  // Two of each form of reply.
  for (int i = 0; i < 2; ++i) {
    require(BVMobileHelperClearVoicemailTokenBegin(client, nullptr, nullptr) == BVMH_OK);
    require(BVMobileHelperIsVoicemailServiceSubscribedBegin(client, nullptr, nullptr) == BVMH_OK);
    require(BVMobileHelperCopyVoicemailTokenBegin(client, nullptr, nullptr) == BVMH_OK);
    require(BVMobileHelperLoadPlistFileBegin(client, "/x", nullptr, nullptr) == BVMH_OK);
  }
  static constexpr std::array<std::byte, 64> kContent{};
  while (size >= 3) {
    const std::size_t length = std::min(std::size_t{data[0]} | std::size_t{data[1]} << 8, size - 3);
    const unsigned extras = data[2];
    std::array<std::byte, 4096> datagram{};
    const std::size_t taken = std::min(length, datagram.size());
    std::memcpy(datagram.data(), data + 3, taken);
    data += 3 + length;
    size -= 3 + length;
    const std::uint32_t replyPort = (extras >> 2) % kCalls + 1;
    if ((extras & 2) != 0 && taken >= sizeof(MessageHeader))
      std::memcpy(datagram.data() + offsetof(MessageHeader, localPort), &replyPort, sizeof replyPort);
    const UniqueFd memory = (extras & 1) != 0 ? makeSealedMemory("fuzz", kContent) : UniqueFd();
    sendTo(channel.get(), std::span(datagram).first(taken), memory.get());
    require(bvmh_process(client) == BVMH_OK);
  }
  bvmh_disconnect(client);
  // Whatever came, each call has exactly one result, and its bytes can be read.
  bvmh_call results = 0;
  unsigned sum = 0;
  for (bvmh_result result; bvmh_take_result(client, 0, &result) == BVMH_OK; ++results) {
    for (std::size_t i = 0; i < result.region.size; ++i)
      sum += static_cast<const unsigned char*>(result.region.bytes)[i];
    require(std::memchr(result.text, '\0', sizeof result.text) != nullptr);
    bvmh_result_free(&result);
  }
  volatile unsigned sink = sum;
  (void)sink;
  require(results == kCalls + 1);
  bvmh_client_free(client);
  // A client whose channel was broken has knocked again.
  while (UniqueFd(::accept4(door.listening.get(), nullptr, nullptr, SOCK_CLOEXEC)).isValid()) {
  }
  return 0;
}

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include <sys/socket.h>

#include <algorithm>
#include <array>
#include <cstdint>
#include <cstdlib>

#include "client/Reply.h"
#include "platform/datagram/SealedMemory.h"

// Replies of any bytes. The first byte chooses the routine, the second what comes with the datagram: low bits
// the number of descriptors, then whether they are sealed memory or sockets, then whether the kernel cut
// something.
extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  using namespace brenvik;
  using namespace brenvik::client;
  if (size < 2) return 0;
  const std::size_t chosen = data[0] % (kRequestRoutines.size() + 1);
  const RoutineFacts& routine =
      chosen == kRequestRoutines.size() ? kCheckInRoutine : kRequestRoutines[chosen];
  const std::uint8_t extras = data[1];
  const auto bytes = std::as_bytes(std::span(data + 2, std::min(size - 2, kBufferSize)));

  static constexpr std::array<std::byte, 64> kContent{};
  Incoming incoming;
  incoming.isCut = (extras & 8) != 0;
  for (unsigned i = 0; i < (extras & 3U); ++i) {
    incoming.descriptors[i] = (extras & 4) != 0
                                  ? UniqueFd(::socket(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC, 0))
                                  : makeSealedMemory("fuzz", kContent);
    ++incoming.descriptorCount;
  }
  Buffer buffer;
  if (!buffer.ensure()) return 0;
  std::copy(bytes.begin(), bytes.end(), buffer.bytes().begin());
  const std::span<const std::byte> datagram = buffer.bytes().first(bytes.size());

  (void)answeredPort(datagram);
  Reply reply;
  if (!readReply(routine, datagram, &incoming, &reply)) return 0;
  if (reply.code != kern::success) return 0;
  if (routine.reply == ReplyForm::checkIn && !reply.port.isValid()) std::abort();
  if (routine.reply != ReplyForm::outOfLine) {
    if (datagram.size() != sizeOfReply(routine.reply)) std::abort();
    return 0;
  }
  bvmh_region region{};
  if (takeRegion(reply.region, buffer, incoming, &region) != BVMH_OK) return 0;
  unsigned sum = 0;  // every byte that the caller may read is there
  for (std::size_t i = 0; i < region.size; ++i) sum += static_cast<const unsigned char*>(region.bytes)[i];
  volatile unsigned sink = sum;
  (void)sink;
  bvmh_region_free(&region);
  return 0;
}

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include <cstdint>
#include <cstdlib>
#include <span>

#include "platform/network/EchoMessages.h"
#include "platform/network/GeoMessages.h"
#include "platform/network/GunzipMessages.h"
#include "platform/network/WebMessages.h"

using namespace brenvik;

namespace {

void require(bool holds) {
  if (!holds) std::abort();
}

}  // namespace

// What a helper may ask, read by the worker: by the first byte one of the questions. What is taken is written
// and read again without change.
extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  if (size == 0) return 0;
  const auto payload = std::as_bytes(std::span(data, size)).subspan(1);
  switch (data[0] % 6) {
    case 0:
      if (const auto question = decodeWebQuestion(payload)) {
        require(question->largestBody <= kLargestWebBody && question->timeLimit.count() >= 0);
        const auto again = decodeWebQuestion(encode(*question));
        require(again && again->url == question->url && again->headers == question->headers);
      }
      break;
    case 1:
      if (const auto question = decodeGunzipQuestion(payload))
        require(question->room <= question->largestOutput);
      break;
    case 2:
      if (const auto coordinate = decodeCoordinate(payload))
        require(decodeCoordinate(encode(*coordinate)).has_value());
      break;
    case 3:
      if (const auto name = decodeName(payload)) require(name->size() <= kLongestName);
      break;
    case 4:
      if (const auto socket = decodeSocket(payload)) require(socket->protocol >= 0 && socket->protocol < 256);
      break;
    default:
      if (const auto send = decodeSend(payload)) require(send->message.size() <= kLongestEcho);
      break;
  }
  return 0;
}

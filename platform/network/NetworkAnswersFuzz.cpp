// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include <cstdint>
#include <cstdlib>
#include <span>

#include "platform/base/Utf8.h"
#include "platform/network/EchoMessages.h"
#include "platform/network/GeoMessages.h"
#include "platform/network/GunzipMessages.h"
#include "platform/network/WebMessages.h"

using namespace brenvik;

namespace {

constexpr std::uint64_t kMaxSize = 10'000;

void require(bool holds) {
  if (!holds) std::abort();
}

void checkPlaces(const GeoOutcome<MapItems>& outcome) {
  require(outcome.answer.has_value() != outcome.error.has_value());
  if (!outcome.answer) return;
  for (const auto& item : *outcome.answer) {
    if (!item || !item->address || !item->address->structuredAddress) continue;
    const auto& address = *item->address->structuredAddress;
    if (address.countryCode) require(address.countryCode->size() == 2);
    for (const auto* part : {&address.administrativeArea, &address.locality, &address.postCode}) {
      if (*part)
        require(!(*part)->empty() && isValidUtf8(**part) && (*part)->find('\0') == std::string::npos);
    }
  }
}

}  // namespace

// What a worker may say, read by the helper: by the first byte one of the answers.
extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  if (size == 0) return 0;
  const auto payload = std::as_bytes(std::span(data, size)).subspan(1);
  switch (data[0] % 6) {
    case 0:
      if (const auto answer = decodeWebAnswer(payload, kMaxSize)) {
        require(answer->bodySize <= kMaxSize && answer->statusCode >= 0 && answer->statusCode < 1000);
        require(answer->errorKind == WebErrorKind::none || answer->bodySize == 0);
        const auto again = decodeWebAnswer(encode(*answer), kMaxSize);
        require(again && again->headers == answer->headers && again->bodySize == answer->bodySize);
      }
      break;
    case 1:
      if (const auto outcome = decodeGunzipOutcome(payload, {100, 1000, kMaxSize}))
        require(outcome->size <= kMaxSize &&
                (outcome->result == GunzipResult::refused) == (outcome->writeError != 0));
      break;
    case 2:
      if (const auto outcome = decodeMapItems(payload)) checkPlaces(*outcome);
      break;
    case 3:
      if (const auto outcome = decodeGeoIpResult(payload)) {
        require(outcome->answer.has_value() != outcome->error.has_value());
        if (outcome->answer) require(outcome->answer->ipAddress.size() < 64);
      }
      break;
    case 4:
      (void)decodeNumber(payload);  // any number is one
      (void)decodeForm(payload);
      break;
    default:
      if (const auto answer = decodeTransfer(payload, 100)) {
        require(answer->transfer.count >= -1 && answer->transfer.count <= 100 && answer->bytes.size() <= 100);
      }
      break;
  }
  return 0;
}

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include <cstdint>
#include <cstdlib>

#include "platform/base/Utf8.h"
#include "platform/geo/linux/GeocoderAnswer.h"

// Whatever a server sends is an error, no address, or an address whose parts keep what is promised of them.
extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  using namespace brenvik;
  const auto answer = readGeocoderAnswer({reinterpret_cast<const char*>(data), size});
  if (answer.error && (answer.address || answer.error->description.empty())) std::abort();
  if (!answer.address) return 0;
  const auto check = [](const std::optional<std::string>& part) {
    if (!part) return;
    const bool kept =
        !part->empty() && part->size() <= 1024 && part->find('\0') == std::string::npos && isValidUtf8(*part);
    if (!kept) std::abort();
  };
  check(answer.address->countryCode);
  check(answer.address->administrativeArea);
  check(answer.address->locality);
  check(answer.address->postCode);
  if (answer.address->countryCode && answer.address->countryCode->size() != 2) std::abort();
  return 0;
}

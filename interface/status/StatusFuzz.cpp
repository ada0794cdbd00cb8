// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
// What a socket sends in place of the helper. What was understood is written and read as the same once more.
#include <cstdint>
#include <cstdlib>

#include "interface/status/Status.h"

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  const auto report = brenvik::readStatus({reinterpret_cast<const char*>(data), size});
  if (!report) return 0;
  (void)brenvik::busyReasons(*report);  // only that it returns
  const auto again = brenvik::readStatus(brenvik::writeStatus(*report));
  if (!again) std::abort();
  if (brenvik::readStatus(brenvik::writeStatus(*again)) != again) std::abort();
  return 0;
}

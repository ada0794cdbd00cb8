// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include <cstdint>
#include <cstdlib>

#include "helper/heartbeat/EchoMessage.h"

using namespace brenvik;

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  const std::span bytes(reinterpret_cast<const std::byte*>(data), size);
  const std::uint16_t identifier = size >= 6 ? static_cast<std::uint16_t>(data[4] << 8 | data[5]) : 0;
  const bool bare = isEchoReply(bytes, false, identifier);
  // What matches is long enough, a reply, and stays one as it grows.
  if (bare && (size < kEchoMessageSize || data[0] != 0)) std::abort();
  (void)isEchoReply(bytes, true, identifier);  // must not read past the end; a sanitizer tells
  return 0;
}

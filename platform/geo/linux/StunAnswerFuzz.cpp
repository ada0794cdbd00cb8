// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include <arpa/inet.h>

#include <algorithm>
#include <cstdint>
#include <cstdlib>

#include "platform/geo/linux/StunMessage.h"

// Whatever arrives, it is ignored, a refusal, or an address that the system itself can read back.
extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  using namespace brenvik;
  const auto bytes = std::as_bytes(std::span(data, size));
  // The id the datagram carries, so that the attributes are reached; and one that it does not.
  StunTransactionId id{};
  if (size >= 20) std::copy_n(bytes.begin() + 8, id.size(), id.begin());
  const StunAnswer answer = readStunAnswer(bytes, id);
  if ((answer.verdict == StunVerdict::address) == answer.address.empty()) std::abort();
  if (!answer.address.empty()) {
    in6_addr parsed;
    const int family = answer.address.find(':') == std::string::npos ? AF_INET : AF_INET6;
    if (::inet_pton(family, answer.address.c_str(), &parsed) != 1) std::abort();
  }
  id[0] ^= std::byte{1};
  if (readStunAnswer(bytes, id).verdict != StunVerdict::ignored) std::abort();
  return 0;
}

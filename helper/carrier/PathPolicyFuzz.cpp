// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <string>

#include "helper/carrier/PathPolicy.h"

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  static brenvik::PathPolicy policy([] { return brenvik::MobileAccount{"/no/such/home", 0, 0}; });
  const std::string path(reinterpret_cast<const char*>(data), size);
  const char* const text = path.c_str();
  const bool listed = policy.isListedCarrierPath(text);
  const bool allowed = policy.isAllowedCarrierPath(text);
  // What is listed is allowed; what is allowed begins in one of four ways.
  if (listed && !allowed) std::abort();
  const std::string seen = text;
  if (allowed && !seen.starts_with("/no/such/home/Library/") &&
      !seen.starts_with("/private/var/mobile/Library/") && !seen.starts_with("/tmp")) {
    std::abort();
  }
  if (allowed && seen.starts_with("/tmp") && !seen.ends_with(".tcpk")) std::abort();
  return 0;
}

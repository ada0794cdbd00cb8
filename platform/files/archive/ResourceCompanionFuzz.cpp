// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <string_view>

#include "platform/files/archive/ResourceCompanion.h"

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  const auto found = brenvik::extendedAttributesOf({reinterpret_cast<const char*>(data), size});
  for (const auto& [name, value] : found) {
    if (name.empty() || name.size() > 200 || value.size() > size) std::abort();
  }
  return 0;
}

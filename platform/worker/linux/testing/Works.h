// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <cstdint>

namespace brenvik {

enum class WorkForTests : std::uint32_t { echo = 1, die, hang, report, sealedMemory, openMemory };

}  // namespace brenvik

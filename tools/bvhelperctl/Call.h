// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <cstdint>

#include "brenvik/mobile_helper.h"

// Checks in and calls the routine, whose name is said once for the call and for the outcome. What was given
// has been checked by then: wrong usage is told whether there is a helper or not.
#define BVHELPERCTL_CALL(routine, ...)                 \
  constexpr const char* name = #routine;               \
  const std::int32_t connected = bvmh_connect(client); \
  const std::int32_t code = connected != BVMH_OK ? connected : routine(__VA_ARGS__)

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <memory>

#include "Helper/Shared/Server/HelperServerUtils.h"

namespace brenvik {

// The table of the service port, which has only the check-in routine. The platform must outlive the table.
std::unique_ptr<RoutineTable> makeCheckInTable(const ServerPlatform& platform);

}  // namespace brenvik

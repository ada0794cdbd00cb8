// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include "tools/bvhelperctl/Outcome.h"
#include "tools/support/Parameters.h"

// The two switches. The helper answers that it switched whatever comes of it; these look for what would make
// the switch idle, as far as it can be seen from here, and add notes.
namespace brenvik::tools {

Outcome switchHeartbeat(bvmh_client* client, const Values& values);
Outcome switchRadioLogs(bvmh_client* client, const Values& values);

}  // namespace brenvik::tools

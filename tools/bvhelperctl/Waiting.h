// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include "tools/bvhelperctl/Outcome.h"
#include "tools/support/Parameters.h"

// Requests whose answer goes to the telephony daemon later. With --wait they take its place first, ask, and
// show the answer.
namespace brenvik::tools {

Outcome requestCivicInfo(bvmh_client* client, const Values& values);
Outcome requestWanAddress(bvmh_client* client, const Values& values);
Outcome checkDatabases(bvmh_client* client, const Values& values);

}  // namespace brenvik::tools

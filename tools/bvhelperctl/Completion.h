// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include "tools/support/ExitStatus.h"

// What a shell asks the program while a line is being typed: which domains exist, and which keys. Read from
// the helper's own preference files as far as this account may; the helper is not started for it.
//
//   bvhelperctl __complete domains
//   bvhelperctl __complete keys DOMAIN
namespace brenvik::tools {

bool isCompletionRequest(int argc, const char* const* argv);

// Prints the names, one a line. A name that a shell could not take as one plain word is left out.
ExitStatus printOffers(int argc, const char* const* argv);

}  // namespace brenvik::tools

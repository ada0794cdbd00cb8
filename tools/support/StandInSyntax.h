// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include "tools/support/CommandLineParser.h"

// brenvik-standin's options, from which its parser, its help, its manual page and its completions are made.
namespace brenvik::tools {

inline constexpr const char* kStandInName = "brenvik-standin";

ProgramSyntax standInSyntax();

// Options of everything that listens in the telephony daemon's place.
const Parameter& listeningDirectory();
const Parameter& listeningHelperUid();

}  // namespace brenvik::tools

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

namespace brenvik::tools {

// The whole program. Returns one of ExitStatus (tools/support/ExitStatus.h).
int runCommandLine(int argc, const char* const* argv);

}  // namespace brenvik::tools

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

namespace brenvik::tools {

// The whole program. Exit status: 0 done, 1 the helper refused or could not do it, 2 wrong usage or no
// helper.
int runCommandLine(int argc, const char* const* argv);

}  // namespace brenvik::tools

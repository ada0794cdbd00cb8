// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <string>
#include <vector>

#include "tools/bvhelperctl/CommandTable.h"

namespace brenvik::tools {

// "access": goes through the entitlement files with the helper's own code and prints each step. Needs no
// helper. Returns the exit status: 0 when the caller would be let in, 4 when it would be refused, 1 when that
// cannot be told. Throws UsageError.
int printAccess(bool asJson, const Values& values);

// The same with the files of other directories.
int printAccess(bool asJson, const Values& values, std::vector<std::string> directories);

}  // namespace brenvik::tools

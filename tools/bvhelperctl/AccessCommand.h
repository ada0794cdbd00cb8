// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <string>
#include <vector>

#include "tools/bvhelperctl/CommandTable.h"

namespace brenvik::tools {

// "access": goes through the entitlement files with the helper's own code and shows each step. Needs no
// helper. The outcome's status is `done` when the caller would be let in, `refused` when it would not, and
// `failed` when that cannot be told. Throws UsageError.
Outcome explainAccess(const Values& values);

// The same with the files of other directories.
Outcome explainAccess(const Values& values, std::vector<std::string> directories);

}  // namespace brenvik::tools

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <optional>
#include <string>

#include "tools/bvhelperctl/CommandTable.h"

namespace brenvik::tools {

// "status": what the helper tells at its status socket, or that it does not run. Never connects to the
// service socket, so that a helper that does not run is not started. The outcome's status is `done` in both
// cases. Throws UsageError.
Outcome showStatus(const Values& values);

// The version of the helper in this file; nothing when it cannot be read or is another program.
std::optional<std::string> versionIn(const std::string& path);

}  // namespace brenvik::tools

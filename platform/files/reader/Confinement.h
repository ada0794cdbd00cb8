// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

namespace brenvik {

// Takes from this process, for good, all it does not need to read an open archive and write to an open pipe:
// its user (where it may change it), memory, processor time, core dumps, new privileges, and every system
// call but a handful, which end it. Then tries one that must be refused. False: not confined, read nothing.
bool confineThisProcess();

}  // namespace brenvik

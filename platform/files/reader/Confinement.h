// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

namespace brenvik {

// Irrevocably limits this process to reading an open archive and writing to an open pipe: it drops its user
// (if it may change it), limits memory and processor time, forbids core dumps and new privileges, and kills
// the process at any system call but a handful. Then it tests that a forbidden call is refused. Returns false
// if the process is not confined; it must then read nothing.
bool confineThisProcess();

}  // namespace brenvik

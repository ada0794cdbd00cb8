// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <initializer_list>

namespace brenvik {

// Removes every variable from the process's environment except those named, so that no library or child finds
// a proxy, a certificate folder, a key log, a language or a time zone there. Variables that the dynamic
// loader read before the program began (LD_PRELOAD, LD_LIBRARY_PATH) have had their effect. Call it before
// other threads start; allocates nothing.
void clearEnvironmentExcept(std::initializer_list<const char*> names) noexcept;

}  // namespace brenvik

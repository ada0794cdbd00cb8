// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <initializer_list>

namespace brenvik {

// Removes every variable from the process's environment except those named, so that no library or child
// process reads a proxy, a certificate folder, a key log, a language or a time zone from it. It cannot undo
// variables that the dynamic loader has already read (LD_PRELOAD, LD_LIBRARY_PATH). Call it before other
// threads start; it allocates nothing.
void clearEnvironmentExcept(std::initializer_list<const char*> names) noexcept;

}  // namespace brenvik

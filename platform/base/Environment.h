// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <initializer_list>

namespace brenvik {

// Takes every variable out of the process's environment but those of these names, so that no library finds a
// proxy, a certificate folder, a key log, a language or a time zone there, and no child is given one. What
// the dynamic loader has read before the program began (LD_PRELOAD, LD_LIBRARY_PATH) has had its effect.
// Before other threads start; allocates nothing.
void clearEnvironmentExcept(std::initializer_list<const char*> names) noexcept;

}  // namespace brenvik

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

namespace brenvik {

// Removes the entry `name` of the directory and, when it is a directory itself, everything below it. Links
// are removed, not followed. Goes on past what cannot be removed. 0, or the first errno. A lack of memory
// makes it slow and no more than that. Any thread.
int removeTree(int directory, const char* name) noexcept;

}  // namespace brenvik

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

namespace brenvik {

// Renames a file within a folder without replacing another. Returns 0, or -1 and sets errno, to EEXIST if the
// name is taken. Some file systems cannot do this in one step; there, the check comes first, so the caller
// must keep other writers out.
int renameToFreeName(int folder, const char* from, const char* to) noexcept;

}  // namespace brenvik

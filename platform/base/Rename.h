// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

namespace brenvik {

// Renames within a folder and replaces nothing: -1 with errno EEXIST when the name is taken. On a file system
// that cannot do both at once, the name is looked for first, so other writers must be kept out.
int renameToFreeName(int folder, const char* from, const char* to) noexcept;

}  // namespace brenvik

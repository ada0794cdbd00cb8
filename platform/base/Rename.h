// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

namespace brenvik {

// Renames within a folder and replaces nothing: -1 with errno EEXIST when the name is taken. Not every file
// system can do that in one step; on the others the check comes first, so the caller keeps other writers out.
int renameToFreeName(int folder, const char* from, const char* to) noexcept;

}  // namespace brenvik

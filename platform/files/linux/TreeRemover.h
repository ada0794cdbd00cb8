// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

namespace brenvik {

// Removes the entry `name` of the directory, and everything below it if it is a directory. Removes links
// without following them. Continues past items that cannot be removed. Returns 0 or the first errno. A lack
// of memory only makes it slower. Any thread.
int removeTree(int directory, const char* name) noexcept;

}  // namespace brenvik

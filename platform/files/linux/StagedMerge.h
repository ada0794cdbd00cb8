// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

namespace brenvik {

// Whether everything in the directory `staged` can take its place in the directory `destination`: a directory
// where a directory (no link) or nothing is, anything else where no directory is. 0, or EEXIST. At most 100
// levels deep. May throw std::bad_alloc.
int checkMerge(int staged, int destination);

// Moves it there; each file that is replaced gives way in one step. 0 or errno; what could not be moved
// stays. Only after checkMerge, and on one file system.
int mergeStaged(int staged, int destination);

}  // namespace brenvik

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

namespace brenvik {

// Checks that everything in the directory `staged` can be moved into the directory `destination`: a directory
// onto a directory (not a link) or onto nothing, anything else onto anything but a directory. Returns 0 or an
// errno; EEXIST if it cannot. Goes at most 100 levels deep. May throw std::bad_alloc.
int checkMerge(int staged, int destination);

// Moves everything there and replaces each existing file in one step. Returns 0 or an errno; items that could
// not be moved stay in `staged`. Only after checkMerge(), and on one file system.
int mergeStaged(int staged, int destination);

}  // namespace brenvik

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

namespace brenvik {

// These functions wait until the data is on the disk. They return 0, or an errno if it cannot be written. A
// file system without a disk counts as written. Any thread.

// Waits for the file's content, owner, mode and times.
int syncFile(int file) noexcept;
// Waits for the names in the directory. The descriptor may be one of O_PATH.
int syncNames(int directory) noexcept;
// Waits for everything on the descriptor's file system, writes of other processes included. For trees: it is
// one wait instead of one for each file.
int syncFileSystem(int item) noexcept;

}  // namespace brenvik

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

namespace brenvik {

// Each waits until the disk has it: 0, or errno when it never will. A file system that has nothing to wait
// for counts as done. Any thread.

// The file: content, owner, mode, times.
int syncFile(int file) noexcept;
// The names in the directory. The descriptor may be one of O_PATH.
int syncNames(int directory) noexcept;
// Everything on the file system of the descriptor. For trees: one wait, where each file alone would cost one
// of its own. It also waits for what other processes have written there.
int syncFileSystem(int item) noexcept;

}  // namespace brenvik

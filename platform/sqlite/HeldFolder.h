// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <string>

namespace brenvik {

// Returns a path by which SQLite finds a file in the folder with this open descriptor. The path does not
// depend on the folder's place, so the folder may be where this account cannot look, or may have been moved.
// It works only for sqlite()'s functions, and as long as the descriptor is open. Throws std::bad_alloc.
std::string pathInHeldFolder(int folder, const char* name);

// Makes SQLite's file layer (the default VFS, see sqlite3_vfs_find(3)) understand such paths, and open files
// without waiting for the other end of a pipe. Takes the VFS's xSetSystemCall; returns false if that refuses.
using SqliteSetSystemCall = bool (*)(void* files, const char* name, void (*function)());
bool understandHeldFolders(void* files, SqliteSetSystemCall set) noexcept;

}  // namespace brenvik

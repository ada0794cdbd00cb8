// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <string>

namespace brenvik {

// The path by which SQLite finds a file in a folder that is open as this descriptor: not by the folder's
// place, so that it may stand where this account cannot look, or have been moved. Only for sqlite()'s
// functions, and as long as the descriptor is open.
std::string pathInHeldFolder(int folder, const char* name);

// Has SQLite's way to files (the default one of sqlite3_vfs_find(3)) understand such paths, and open files
// without waiting for whoever is at the other end of a pipe. Takes its xSetSystemCall; false when that
// refuses.
using SqliteSetSystemCall = bool (*)(void* files, const char* name, void (*function)());
bool understandHeldFolders(void* files, SqliteSetSystemCall set) noexcept;

}  // namespace brenvik

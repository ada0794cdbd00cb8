// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/sqlite/Sqlite.h"

#include <dlfcn.h>

#include <cerrno>
#include <mutex>

#include "platform/sqlite/HeldFolder.h"

namespace brenvik {
namespace {

constexpr char kLibrary[] = "libsqlite3.so.0";  // the name of its one binary interface since 2004

template <class Function>
bool look(void* library, const char* name, Function* function) noexcept {
  *function = reinterpret_cast<Function>(::dlsym(library, name));
  return *function != nullptr;
}

bool limit(const SqliteFunctions& functions, bool* lackedMemory) noexcept {
  // Pages one by one, as they are needed: each connection would begin with twenty, and each of them costs the
  // first read a page fault.
  (void)functions.config(SQLITE_CONFIG_PAGECACHE, nullptr, 0, 0);
  (void)functions.hard_heap_limit64(kMaxSqliteMemory);
  sqlite3_vfs* const files = functions.vfs_find(nullptr);
  // There is always one, unless the library could not start.
  *lackedMemory = files == nullptr;
  return files != nullptr && files->iVersion >= 3 &&
         understandHeldFolders(files, [](void* vfs, const char* name, void (*function)()) {
           auto* const of = static_cast<sqlite3_vfs*>(vfs);
           return of->xSetSystemCall(of, name, function) == SQLITE_OK;
         });
}

bool load(SqliteFunctions* functions, bool* lackedMemory) noexcept {
  errno = 0;
  void* const library = ::dlopen(kLibrary, RTLD_NOW | RTLD_LOCAL);
  if (library == nullptr) {
    // A missing library leaves ENOENT behind. The loader gives up at the first allocation that fails, and its
    // text does not always speak of memory.
    *lackedMemory = errno == ENOMEM;
    return false;
  }
#define BRENVIK_SQLITE_LOOK(name) &&look(library, "sqlite3_" #name, &functions->name)
  const bool isWhole = true BRENVIK_SQLITE_FUNCTIONS(BRENVIK_SQLITE_LOOK);
#undef BRENVIK_SQLITE_LOOK
  return isWhole && limit(*functions, lackedMemory);
}

}  // namespace

const SqliteFunctions* sqlite(bool* lackedMemory) noexcept {
  static std::mutex mutex;
  static SqliteFunctions functions;
  static bool loaded = false;
  const std::lock_guard lock(mutex);
  bool lacked = false;
  if (!loaded) loaded = load(&functions, &lacked);
  if (lackedMemory != nullptr) *lackedMemory = lacked;
  return loaded ? &functions : nullptr;
}

}  // namespace brenvik

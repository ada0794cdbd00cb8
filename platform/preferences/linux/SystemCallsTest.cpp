// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include <fcntl.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/uio.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdarg>

#include "platform/preferences/linux/TestHome.h"

namespace brenvik {
namespace {

SystemCalls* current = nullptr;  // the test's thread only

bool shallFail(int error) {
  if (error != 0) errno = error;
  return error != 0;
}

void note(const char* what) {
  if (current != nullptr) current->trace.emplace_back(what);
}

}  // namespace

SystemCalls::SystemCalls() { current = this; }
SystemCalls::~SystemCalls() { current = nullptr; }

}  // namespace brenvik

using brenvik::current;

extern "C" int fsync(int file) {
  struct stat facts;
  const bool isFolder = ::fstat(file, &facts) == 0 && S_ISDIR(facts.st_mode);
  brenvik::note(isFolder ? "fsync folder" : "fsync file");
  if (current != nullptr && brenvik::shallFail(isFolder ? current->failFolderSync : current->failFileSync))
    return -1;
  return static_cast<int>(::syscall(SYS_fsync, file));
}

extern "C" ssize_t writev(int file, const iovec* pieces, int count) {
  brenvik::note("write");
  if (current != nullptr && brenvik::shallFail(current->failWrite)) return -1;
  iovec cut{};
  if (current != nullptr && current->writeLimit != SIZE_MAX && count > 0) {
    cut = {pieces->iov_base, std::min(pieces->iov_len, current->writeLimit)};
    pieces = &cut;
    count = 1;
  }
  return ::syscall(SYS_writev, file, pieces, count);
}

extern "C" int renameat(int fromFolder, const char* from, int toFolder, const char* to) noexcept {
  brenvik::note("rename");
  if (current != nullptr && brenvik::shallFail(current->failRename)) return -1;
  return static_cast<int>(::syscall(SYS_renameat2, fromFolder, from, toFolder, to, 0));
}

extern "C" int renameat2(int fromFolder, const char* from, int toFolder, const char* to,
                         unsigned flags) noexcept {
  if (current != nullptr && brenvik::shallFail(current->failRenameFlags)) return -1;
  return static_cast<int>(::syscall(SYS_renameat2, fromFolder, from, toFolder, to, flags));
}

extern "C" int flock(int file, int operation) noexcept {
  if (current != nullptr && current->beforeLocking) current->beforeLocking();
  return static_cast<int>(::syscall(SYS_flock, file, operation));
}

extern "C" int open(const char* path, int flags, ...) {
  mode_t mode = 0;
  if ((flags & O_CREAT) != 0) {
    va_list arguments;
    va_start(arguments, flags);
    mode = va_arg(arguments, mode_t);
    va_end(arguments);
  } else if (current != nullptr && (flags & O_DIRECTORY) == 0 && brenvik::shallFail(current->failOpen)) {
    return -1;
  }
  return static_cast<int>(::syscall(SYS_openat, AT_FDCWD, path, flags, mode));
}
// What open() without a mode becomes where the C library's headers check calls (_FORTIFY_SOURCE).
extern "C" int checkedOpen(const char* path, int flags) __asm__("__open_2");
extern "C" int checkedOpen(const char* path, int flags) { return open(path, flags, 0); }

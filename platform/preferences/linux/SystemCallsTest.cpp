// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include <dlfcn.h>
#include <fcntl.h>
#include <pwd.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/uio.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <chrono>
#include <cstdarg>
#include <ctime>
#include <optional>
#include <string_view>

#include "platform/base/fakes/FailingCalls.h"
#include "platform/preferences/linux/TestHome.h"

namespace brenvik {
namespace {

SystemCalls* current = nullptr;  // the test's thread only

bool shallFail(int error) {
  if (error != 0) errno = error;
  return error != 0;
}

bool isInHook = false;

void runHook(const char* what) {
  if (current == nullptr || !current->hook || isInHook) return;
  isInHook = true;
  current->hook(what);
  isInHook = false;
}

void note(const char* what) {
  if (current != nullptr && !isInHook) current->trace.emplace_back(what);
  runHook(what);
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
  if (brenvik::FailingCall::failsNow("renameat2")) return -1;
  if (current != nullptr && brenvik::shallFail(current->failRenameFlags)) return -1;
  return static_cast<int>(::syscall(SYS_renameat2, fromFolder, from, toFolder, to, flags));
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
  if (current != nullptr && !current->machineIdFile.empty() && std::string_view(path) == "/etc/machine-id") {
    path = current->machineIdFile.c_str();
    errno = EIO;  // a call that succeeds may leave any number
  }
  return static_cast<int>(::syscall(SYS_openat, AT_FDCWD, path, flags, mode));
}
// What open() without a mode becomes where the C library's headers check calls (_FORTIFY_SOURCE).
extern "C" int checkedOpen(const char* path, int flags) __asm__("__open_2");
extern "C" int checkedOpen(const char* path, int flags) { return open(path, flags, 0); }

extern "C" ssize_t pread(int file, void* bytes, std::size_t count, off_t offset) {
  brenvik::runHook("read");
  if (brenvik::FailingCall::failsNow("pread")) return -1;
  const ssize_t got = ::syscall(SYS_pread64, file, bytes, count, offset);
  if (current != nullptr) ++current->reads;
  brenvik::runHook("have read");
  return got;
}

extern "C" int flock(int file, int operation) noexcept {
  brenvik::runHook("flock");
  if (brenvik::FailingCall::failsNow("flock")) return -1;
  return static_cast<int>(::syscall(SYS_flock, file, operation));
}

extern "C" int mkdirat(int folder, const char* name, mode_t mode) noexcept {
  brenvik::runHook("mkdir");
  if (brenvik::FailingCall::failsNow("mkdirat")) return -1;
  return static_cast<int>(::syscall(SYS_mkdirat, folder, name, mode));
}

extern "C" int fchmod(int file, mode_t mode) noexcept {
  if (brenvik::FailingCall::failsNow("fchmod")) return -1;
  return static_cast<int>(::syscall(SYS_fchmod, file, mode));
}

extern "C" int getpwuid_r(uid_t uid, passwd* row, char* text, std::size_t size, passwd** found) {
  using LookUp = decltype(&::getpwuid_r);
  static const auto real = reinterpret_cast<LookUp>(::dlsym(RTLD_NEXT, "getpwuid_r"));
  if (!brenvik::FailingCall::failsNow("getpwuid_r")) return real(uid, row, text, size, found);
  *found = nullptr;
  return errno;
}

extern "C" int clock_gettime(clockid_t clock, timespec* time) noexcept {
  const auto shown = current == nullptr         ? std::nullopt
                     : clock == CLOCK_MONOTONIC ? current->steadyTime
                     : clock == CLOCK_REALTIME  ? current->wallTime
                                                : std::nullopt;
  if (!shown) return static_cast<int>(::syscall(SYS_clock_gettime, clock, time));
  const auto seconds = std::chrono::floor<std::chrono::seconds>(*shown);
  *time = {seconds.count(), (*shown - seconds).count()};
  return 0;
}

extern "C" int nanosleep(const timespec* time, timespec* rest) {
  if (current == nullptr || !current->steadyTime) {
    return static_cast<int>(::syscall(SYS_nanosleep, time, rest));
  }
  const auto pause = std::chrono::seconds(time->tv_sec) + std::chrono::nanoseconds(time->tv_nsec);
  current->pauses.push_back(pause);
  *current->steadyTime += pause;
  return 0;
}

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/files/linux/ReaderProcess.h"

#include <fcntl.h>
#include <poll.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <csignal>
#include <cstdlib>
#include <memory>

#include "platform/base/Spawn.h"
#include "platform/files/archive/ArchiveFrames.h"

namespace brenvik {
namespace {

constexpr std::size_t kBuffer = 256 << 10;
constexpr std::size_t kPageSize = 4096;
constexpr int kPipe = archive_frame::kPipe;  // room for the reader to work ahead
constexpr std::size_t kWorthSplicing = 16 << 10;

}  // namespace

ReaderProcess::~ReaderProcess() {
  if (pid_ <= 0) return;
  ::kill(pid_, SIGKILL);
  while (::waitpid(pid_, nullptr, 0) < 0 && errno == EINTR) {
  }
}

int ReaderProcess::start(const std::string& program, int input) {
  int ends[2];
  if (::pipe2(ends, O_CLOEXEC) != 0) return errno;
  output_.reset(ends[0]);
  const UniqueFd theirs(ends[1]);
  (void)::fcntl(theirs.get(), F_SETPIPE_SZ, kPipe);  // smaller is only slower
  if (::fcntl(output_.get(), F_SETFL, O_NONBLOCK) != 0) return errno;

  Spawn spawn;
  spawn.give(input, STDIN_FILENO);
  spawn.give(theirs.get(), STDOUT_FILENO);
  spawn.giveNothing(STDERR_FILENO);
  char argument[] = "brenvik-archive-reader";
  char locale[] = "LC_ALL=C.UTF-8";
  char* const arguments[] = {argument, nullptr};
  char* const environment[] = {locale, nullptr};
  return spawn.start(program.c_str(), arguments, environment, &pid_);
}

// Waits until the reader has written something, or `patience` is over. 0 or errno.
int ReaderProcess::awaitOutput(std::chrono::milliseconds patience) const noexcept {
  constexpr std::int64_t kLongestWait = 60'000;  // ms: fits poll(2), and the caller looks at its clock again
  pollfd ready{output_.get(), POLLIN, 0};
  const int polled =
      ::poll(&ready, 1, static_cast<int>(std::min<std::int64_t>(patience.count(), kLongestWait)));
  return polled < 0 && errno != EINTR ? errno : 0;
}

int ReaderProcess::drain(std::chrono::steady_clock::time_point deadline, ReaderOutput& to) {
  // On a page's start, like the pieces asked for: from elsewhere the kernel's copying takes 1.7 times as
  // long.
  const std::unique_ptr<char, decltype(&std::free)> buffer(
      static_cast<char*>(std::aligned_alloc(kPageSize, kBuffer)), &std::free);
  if (!buffer) return ENOMEM;
  bool canSplice = true;
  for (;;) {
    const auto left =
        std::chrono::duration_cast<std::chrono::milliseconds>(deadline - std::chrono::steady_clock::now());
    if (left.count() <= 0) return ETIMEDOUT;
    const ReaderOutput::Direct direct = canSplice ? to.direct() : ReaderOutput::Direct{};
    const bool isDirect = direct.bytes >= kWorthSplicing;
    // From the reader's memory into the file's, without a stop in this process.
    const ssize_t got = isDirect ? ::splice(output_.get(), nullptr, direct.file, nullptr, direct.bytes,
                                            SPLICE_F_MOVE | SPLICE_F_NONBLOCK)
                                 : ::read(output_.get(), buffer.get(), std::min(kBuffer, to.bestPiece()));
    int error = got < 0 ? errno : 0;
    if (error == EAGAIN) {
      error = awaitOutput(left);
    } else if (isDirect && (error == EINVAL || error == ENOSYS || error == EPERM)) {
      canSplice = false;  // a file system, or a service manager's filter, without it
      error = 0;
    } else if (error == EINTR) {
      error = 0;
    } else if (got == 0) {
      return to.isComplete() ? 0 : EPIPE;
    } else if (got > 0 && isDirect) {
      to.wentDirectly(static_cast<std::size_t>(got));
    } else if (got > 0) {
      error = to.take({buffer.get(), static_cast<std::size_t>(got)});
    }
    if (error != 0) return error;
  }
}

}  // namespace brenvik

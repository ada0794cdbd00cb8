// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "tools/support/Output.h"

#include <fcntl.h>
#include <unistd.h>

#include <cerrno>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <cstring>

namespace brenvik::tools {
namespace {

// The errno of the first loss; later ones only follow from it.
int firstLoss = 0;

bool note(bool isWritten) noexcept {
  if (!isWritten && firstLoss == 0) firstLoss = errno == 0 ? EIO : errno;
  return firstLoss == 0;
}

int numberOf(Stream stream) noexcept { return stream == Stream::output ? STDOUT_FILENO : STDERR_FILENO; }

}  // namespace

void prepareStandardStreams() noexcept {
  for (const int number : {STDIN_FILENO, STDOUT_FILENO, STDERR_FILENO}) {
    if (::fcntl(number, F_GETFD) >= 0 || errno != EBADF) continue;
    // The wrong direction on purpose: reading or writing fails as it does with the stream closed.
    const int filled = ::open("/dev/null", number == STDIN_FILENO ? O_WRONLY : O_RDONLY);
    if (filled >= 0 && filled != number) (void)::close(filled);  // cannot be: the lowest free number is given
  }
  struct sigaction ignore {};
  ignore.sa_handler = SIG_IGN;
  (void)::sigaction(SIGPIPE, &ignore, nullptr);  // fails for wrong arguments only
}

bool printOut(std::string_view text) noexcept {
  if (firstLoss != 0) return false;
  return note(std::fwrite(text.data(), 1, text.size(), stdout) == text.size());
}

bool flushOutput() noexcept {
  if (firstLoss != 0) return false;
  return note(std::fflush(stdout) == 0);
}

int finishOutput(const char* program, ExitStatus status) noexcept {
  const bool isWhole = flushOutput();
  // Some file systems tell only at a close that there was no room; closing a copy is enough for them.
  const bool isClosed = isWhole && note(::close(::dup(STDOUT_FILENO)) == 0);
  if (isClosed) return static_cast<int>(status);
  std::fprintf(stderr, "%s: not everything could be written to standard output: %s\n", program,
               std::strerror(firstLoss));
  return static_cast<int>(status == ExitStatus::done ? ExitStatus::outputLost : status);
}

bool isTerminal(Stream stream) noexcept { return ::isatty(numberOf(stream)) == 1; }

bool wantsColour(Stream stream) noexcept {
  const char* refused = std::getenv("NO_COLOR");
  if (refused != nullptr && *refused != '\0') return false;
  const char* terminal = std::getenv("TERM");
  return terminal != nullptr && *terminal != '\0' && std::strcmp(terminal, "dumb") != 0 && isTerminal(stream);
}

std::string styled(Look look, const std::string& text, Stream stream) {
  if (!wantsColour(stream)) return text;
  const char* start = "\033[1m";
  if (look == Look::bad) start = "\033[1;31m";
  if (look == Look::quiet) start = "\033[2m";
  return start + text + "\033[0m";
}

}  // namespace brenvik::tools

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
//
// Linked into the reader of archives of a coverage build. The reader may open nothing once it is confined,
// and leaves by _exit(). So it starts with a witness, a copy of the process from before that: at its end the
// reader sends it all that it has counted, and the witness writes that down as its own.
#include <sys/types.h>
#include <unistd.h>

void __gcov_dump(void);
_Noreturn void __real__exit(int status);
_Noreturn void __wrap__exit(int status);

// The variables that begin as zero, the counts among them: at the same place in both processes.
extern char __bss_start[];
extern char _end[];

static int counts[2];
static int written[2];

__attribute__((constructor)) static void startWitness(void) {
  if (pipe(counts) != 0 || pipe(written) != 0) return;
  if (fork() != 0) {
    (void)close(counts[0]);
    (void)close(written[1]);
    return;
  }
  (void)close(STDIN_FILENO);
  (void)close(STDOUT_FILENO);
  (void)close(counts[1]);
  (void)close(written[0]);
  const int from = counts[0];
  const int to = written[1];
  for (char* at = __bss_start; at < _end;) {
    const ssize_t got = read(from, at, (size_t)(_end - at));
    if (got <= 0) __real__exit(0);  // the reader was killed
    at += got;
  }
  __gcov_dump();
  (void)!write(to, "x", 1);
  __real__exit(0);
}

_Noreturn void __wrap__exit(int status) {
  for (const char* at = __bss_start; at < _end;) {
    const ssize_t put = write(counts[1], at, (size_t)(_end - at));
    if (put <= 0) break;
    at += put;
  }
  char byte;
  (void)!read(written[0], &byte, 1);
  __real__exit(status);
}

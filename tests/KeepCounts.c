// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
//
// Linked into the programs of a coverage build, and into no other: gcov writes its counts when a program
// leaves by exit(), which forked children of tests and a daemon that is told to stop do not.
#define _GNU_SOURCE
#include <fcntl.h>
#include <signal.h>
#include <stddef.h>
#include <unistd.h>

void __gcov_dump(void);
_Noreturn void __real__exit(int status);
_Noreturn void __wrap__exit(int status);

// Of what is preloaded to withhold memory: writing needs some.
void brenvik_grant_memory(void) __attribute__((weak));

// A test may have left the program without a descriptor to write with, and what another account's program
// cannot write is said to nobody: tests look at what programs say. Before gcov's own function of the kind.
__attribute__((destructor)) static void makeWay(void) {
  if (brenvik_grant_memory != NULL) brenvik_grant_memory();
  closefrom(STDERR_FILENO + 1);
  const int nobody = open("/dev/null", O_WRONLY | O_CLOEXEC);
  if (nobody < 0) return;
  (void)dup2(nobody, STDERR_FILENO);
  (void)close(nobody);
}

_Noreturn void __wrap__exit(int status) {
  makeWay();
  __gcov_dump();
  __real__exit(status);
}

// Not safe in the middle of an allocation, but the daemon waits for events nearly always when it is told to
// stop, and what calls abort() does so in peace. One that was in the middle is ended by the alarm.
static void onEnd(int signal) {
  (void)alarm(5);
  makeWay();
  __gcov_dump();
  (void)raise(signal);  // ends the process as ever: the handler was for one time
}

__attribute__((constructor)) static void keepCounts(void) {
  static const int kSignals[] = {SIGTERM, SIGABRT};
  for (size_t i = 0; i < sizeof kSignals / sizeof *kSignals; ++i) {
    struct sigaction now;
    if (sigaction(kSignals[i], NULL, &now) != 0 || now.sa_handler != SIG_DFL) continue;
    struct sigaction action = {0};
    action.sa_handler = onEnd;
    action.sa_flags = (int)(SA_RESETHAND | SA_NODEFER);
    (void)sigaction(kSignals[i], &action, NULL);
  }
}

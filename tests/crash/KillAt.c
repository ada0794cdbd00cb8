// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
//
// Kills a process at the start of one of its system calls: that call does not take place, all calls before it
// did.
//
// usage: kill-at PID NUMBER      kills at the call of that number, counted over all threads from 1; 0: only
// counts
//        kill-at PID fork        kills when the process has made a child that shares its memory (vfork,
//        posix_spawn),
//                                and keeps that child from running until SIGTERM comes
//
// Prints "ready" when the calls count from now on, then one line: "killed NUMBER NAME", "killed fork CHILD",
// or "counted NUMBER" when SIGTERM came first or the process ended by itself. Needs the right to trace the
// process.
#define _GNU_SOURCE
#include <dirent.h>
#include <errno.h>
#include <seccomp.h>
#include <signal.h>
#include <stdbool.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/ptrace.h>
#include <sys/wait.h>
#include <unistd.h>

enum { kMaxThreads = 256 };
enum { kSystemCallStop = SIGTRAP | 0x80 };  // what PTRACE_O_TRACESYSGOOD makes of it
static const long kOptions = PTRACE_O_TRACESYSGOOD | PTRACE_O_TRACECLONE;

struct thread {
  pid_t id;
  bool hasEntered;  // a call since it was attached
};
static struct thread threads[kMaxThreads];
static int threadCount;
static volatile sig_atomic_t isOver;

static void end(int number) {
  (void)number;
  isOver = 1;
}

static void fail(const char* what) {
  fprintf(stderr, "kill-at: %s: %s\n", what, strerror(errno));
  exit(1);
}

static struct thread* threadOf(pid_t id) {
  for (int i = 0; i < threadCount; ++i) {
    if (threads[i].id == id) return &threads[i];
  }
  return NULL;
}

static struct thread* addThread(pid_t id, bool hasEntered) {
  if (threadCount == kMaxThreads) {
    errno = E2BIG;
    fail("threads");
  }
  threads[threadCount] = (struct thread){.id = id, .hasEntered = hasEntered};
  return &threads[threadCount++];
}

// Threads that are made meanwhile are seen by the second look, those after it by PTRACE_O_TRACECLONE.
static void attach(pid_t process, long options) {
  char path[64];
  snprintf(path, sizeof path, "/proc/%d/task", process);
  for (bool isNew = true; isNew;) {
    isNew = false;
    DIR* tasks = opendir(path);
    if (tasks == NULL) fail(path);
    for (const struct dirent* entry; (entry = readdir(tasks)) != NULL;) {
      const pid_t id = (pid_t)atoi(entry->d_name);
      if (id == 0 || threadOf(id) != NULL) continue;
      if (ptrace(PTRACE_SEIZE, id, NULL, options) != 0) {
        if (errno == ESRCH || errno == EPERM) continue;  // it has ended, or was attached with its maker
        fail("PTRACE_SEIZE");
      }
      if (ptrace(PTRACE_INTERRUPT, id, NULL, NULL) != 0) fail("PTRACE_INTERRUPT");
      addThread(id, false);
      isNew = true;
    }
    closedir(tasks);
  }
}

static void say(const char* line) {
  puts(line);
  fflush(stdout);
}

static void killAll(pid_t process) {
  if (kill(process, SIGKILL) != 0) fail("kill");
}

static const char* nameOf(pid_t id) {
  static char text[64];
  struct __ptrace_syscall_info info;
  if (ptrace(PTRACE_GET_SYSCALL_INFO, id, sizeof info, &info) <= 0) return "unknown";
  char* const name = seccomp_syscall_resolve_num_arch(SCMP_ARCH_NATIVE, (int)info.entry.nr);
  snprintf(text, sizeof text, "%s", name != NULL ? name : "unknown");
  free(name);
  return text;
}

static bool isEntry(pid_t id) {
  struct __ptrace_syscall_info info;
  return ptrace(PTRACE_GET_SYSCALL_INFO, id, sizeof info, &info) > 0 && info.op == PTRACE_SYSCALL_INFO_ENTRY;
}

// Goes on with a stopped thread; a signal that was for it is given to it.
static void goOn(pid_t id, int signal) {
  if (ptrace(PTRACE_SYSCALL, id, NULL, (void*)(long)signal) != 0 && errno != ESRCH) fail("PTRACE_SYSCALL");
}

static bool haveAllEntered(void) {
  for (int i = 0; i < threadCount; ++i) {
    if (!threads[i].hasEntered) return false;
  }
  return true;
}

static void forget(pid_t id) {
  struct thread* const thread = threadOf(id);
  if (thread != NULL) *thread = threads[--threadCount];
}

static void killAtCall(pid_t process, pid_t thread, long number) {
  const char* const name = nameOf(thread);
  killAll(process);
  char line[128];
  snprintf(line, sizeof line, "killed %ld %s", number, name);
  say(line);
  exit(0);
}

// A thread stopped that is still there. Returns true when it was at a call that counts.
static bool atCall(pid_t id, int status, bool isReady) {
  struct thread* thread = threadOf(id);
  if (thread == NULL) thread = addThread(id, true);
  const int signal = WSTOPSIG(status);
  const int event = status >> 16;
  if (signal != kSystemCallStop) {
    // A stop of a group goes on too: whoever stops the process for good does not use this program.
    goOn(id, event != 0 ? 0 : signal);
    return false;
  }
  if (!isEntry(id)) return false;
  const bool counts = isReady;
  thread->hasEntered = true;
  return counts;
}

static void holdUntilOver(pid_t process, pid_t child) {
  killAll(process);
  // Its maker learns of the death of a traced process when we have.
  int status = 0;
  do {
    const pid_t id = waitpid(-1, &status, __WALL);
    if (id < 0) fail("waitpid");
    if (id == process && !WIFSTOPPED(status)) break;
  } while (true);
  char line[64];
  snprintf(line, sizeof line, "killed fork %d", child);
  say(line);
  sigset_t none;
  sigemptyset(&none);
  while (!isOver) sigsuspend(&none);
  exit(0);  // the child, which is traced, goes on with our end
}

// Waits for a thread to stop; 0 when one has ended, or a signal came.
static pid_t nextStop(int* status) {
  const pid_t id = waitpid(-1, status, __WALL);
  if (id >= 0 && WIFSTOPPED(*status)) return id;
  if (id >= 0) forget(id);
  if (id < 0 && errno == ECHILD) threadCount = 0;
  if (id < 0 && errno != ECHILD && errno != EINTR) fail("waitpid");
  return 0;
}

// Goes on with the process until it has ended, SIGTERM has come or the wanted call is there; returns how many
// calls were counted.
static long trace(pid_t process, long wanted) {
  bool isReady = false;
  long calls = 0;
  while (!isOver && threadCount > 0) {
    if (!isReady && haveAllEntered()) {
      isReady = true;
      say("ready");
    }
    int status = 0;
    const pid_t id = nextStop(&status);
    if (id == 0) continue;
    if (status >> 16 == PTRACE_EVENT_VFORK) {
      unsigned long child = 0;
      if (ptrace(PTRACE_GETEVENTMSG, id, NULL, &child) != 0) fail("PTRACE_GETEVENTMSG");
      holdUntilOver(process, (pid_t)child);
    } else {
      if (atCall(id, status, isReady) && ++calls == wanted) killAtCall(process, id, calls);
      if (WSTOPSIG(status) == kSystemCallStop) goOn(id, 0);
    }
  }
  return calls;
}

int main(int count, char* arguments[]) {
  if (count != 3) {
    fprintf(stderr, "usage: kill-at PID NUMBER|fork\n");
    return 2;
  }
  const pid_t process = (pid_t)atoi(arguments[1]);
  const bool atFork = strcmp(arguments[2], "fork") == 0;
  struct sigaction action = {.sa_handler = end};
  sigaction(SIGTERM, &action, NULL);
  sigset_t term;
  sigemptyset(&term);
  sigaddset(&term, SIGTERM);
  if (atFork) sigprocmask(SIG_BLOCK, &term, NULL);  // taken while the child is held

  attach(process, kOptions | (atFork ? PTRACE_O_TRACEVFORK : 0));
  char line[64];
  snprintf(line, sizeof line, "counted %ld", trace(process, atFork ? -1 : atol(arguments[2])));
  say(line);
  return 0;  // what is still traced goes on
}

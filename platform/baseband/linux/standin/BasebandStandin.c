/* SPDX-License-Identifier: Apache-2.0 */
/* SPDX-FileCopyrightText: The BrenvikMobileHelper authors */
#define _GNU_SOURCE
#include <dlfcn.h>
#include <fcntl.h>
#include <limits.h>
#include <stddef.h>
#include <stdio.h>
#include <string.h>
#include <unistd.h>

#include "platform/baseband/linux/BasebandAbi.h"

/* What was called, one letter a call, for the test to read with dlsym. For a test that is another process,
 * files beside the library: the same letters are added to "calls", and what is found in the environment to
 * "environment", where these exist; "busy" makes the server busy by being there. */
char BasebandStandinCalls[64];
int BasebandStandinBusy;
static int server;

/* The path of a file beside the library. */
static const char* beside(const char* name, char* path) {
  Dl_info own;
  if (dladdr(&server, &own) == 0 || strlen(own.dli_fname) + strlen(name) + 2 > PATH_MAX) return "";
  strcpy(path, own.dli_fname);
  char* const slash = strrchr(path, '/');
  strcpy(slash == NULL ? path : slash + 1, name);
  return path;
}

static void add(const char* name, const char* text, size_t size) {
  char path[PATH_MAX];
  const int file = open(beside(name, path), O_WRONLY | O_APPEND | O_CLOEXEC);
  if (file < 0) return;
  if (write(file, text, size) < 0) perror(name);
  (void)close(file);
}

static void called(char what) {
  const size_t length = strlen(BasebandStandinCalls);
  if (length + 1 < sizeof BasebandStandinCalls) BasebandStandinCalls[length] = what;
  add("calls", &what, 1);
  for (char** each = environ; each != NULL && *each != NULL; ++each)
    add("environment", *each, strlen(*each) + 1);
}

#ifndef STANDIN_WITHOUT_CAN_HOST
int BrenvikBasebandCanHost(void) {
  called('?');
#ifdef STANDIN_CANNOT_HOST
  return 0;
#else
  return 2;
#endif
}
#endif

void* BrenvikBasebandServerCreate(void* logServer) {
  called(logServer == NULL ? 'c' : 'C');
#ifdef STANDIN_MAKES_NOTHING
  return NULL;
#else
  return &server;
#endif
}

void BrenvikBasebandServerStart(void* started) { called(started == &server ? 's' : '!'); }

int BrenvikBasebandServerIsBusy(void* asked) {
  called(asked == &server ? 'b' : '!');
  char path[PATH_MAX];
  return BasebandStandinBusy || access(beside("busy", path), F_OK) == 0;
}

#ifndef STANDIN_WITHOUT_STOP
void BrenvikBasebandServerStop(void* stopped) { called(stopped == &server ? 'x' : '!'); }
#endif

void BrenvikBasebandServerRelease(void* released) { called(released == &server ? 'r' : '!'); }

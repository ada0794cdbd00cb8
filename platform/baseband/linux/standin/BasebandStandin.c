/* SPDX-License-Identifier: Apache-2.0 */
/* SPDX-FileCopyrightText: The BrenvikMobileHelper authors */
#include <stddef.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <unistd.h>

#include "platform/baseband/linux/BasebandAbi.h"

/* What was called, one letter a call, for the test to read with dlsym. A test that is another process names a
 * file in the environment for the same letters, and another one whose presence makes the server busy. */
char BasebandStandinCalls[64];
int BasebandStandinBusy;
static int server;

static void called(char what) {
  const size_t length = strlen(BasebandStandinCalls);
  if (length + 1 < sizeof BasebandStandinCalls) BasebandStandinCalls[length] = what;
  const char* const path = getenv("BASEBAND_STANDIN_CALLS");
  FILE* const file = path == NULL ? NULL : fopen(path, "ae");
  if (file == NULL) return;
  (void)fputc(what, file);
  (void)fclose(file);
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
  const char* const busyFile = getenv("BASEBAND_STANDIN_BUSY");
  return busyFile == NULL ? BasebandStandinBusy : access(busyFile, F_OK) == 0;
}

#ifndef STANDIN_WITHOUT_STOP
void BrenvikBasebandServerStop(void* stopped) { called(stopped == &server ? 'x' : '!'); }
#endif

void BrenvikBasebandServerRelease(void* released) { called(released == &server ? 'r' : '!'); }

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
// Preloaded into a program, lets allocation number BRENVIK_FAIL_AT fail, and with BRENVIK_FAIL_ALL those
// after it as well. The number of allocations made stands in the file BRENVIK_COUNT, as a long.
#include <fcntl.h>
#include <stddef.h>
#include <stdlib.h>
#include <sys/mman.h>
#include <unistd.h>

void* __libc_malloc(size_t size);
void* __libc_calloc(size_t count, size_t size);
void* __libc_realloc(void* block, size_t size);

static long* counter;
static long failAt;
static int failAll;

__attribute__((constructor)) static void begin(void) {
  const char* const at = getenv("BRENVIK_FAIL_AT");
  const char* const path = getenv("BRENVIK_COUNT");
  if (at == NULL || path == NULL) return;
  const int file = open(path, O_RDWR | O_CREAT | O_CLOEXEC, 0600);
  if (file < 0 || ftruncate(file, sizeof(long)) != 0) _exit(99);
  void* const shared = mmap(NULL, sizeof(long), PROT_READ | PROT_WRITE, MAP_SHARED, file, 0);
  if (shared == MAP_FAILED) _exit(99);
  close(file);
  failAt = atol(at);
  failAll = getenv("BRENVIK_FAIL_ALL") != NULL;
  counter = shared;
  *counter = 0;
}

static int fails(void) {
  if (counter == NULL) return 0;
  const long number = (*counter)++;
  return number == failAt || (failAll && number > failAt);
}

void* malloc(size_t size) { return fails() ? NULL : __libc_malloc(size); }
void* calloc(size_t count, size_t size) { return fails() ? NULL : __libc_calloc(count, size); }
void* realloc(void* block, size_t size) { return fails() ? NULL : __libc_realloc(block, size); }

/* SPDX-License-Identifier: Apache-2.0 */
/* SPDX-FileCopyrightText: The BrenvikMobileHelper authors */
/*
 * Preloaded into the daemon by test_costs.py: counts what the process allocates from the heap, in the 8 bytes
 * of the file named in BRENVIK_ALLOCATION_COUNT.
 */
#include <fcntl.h>
#include <stdint.h>
#include <stdlib.h>
#include <sys/mman.h>
#include <unistd.h>

/* The C library's own, under the names it has for such as us. */
void* __libc_malloc(size_t size);
void* __libc_calloc(size_t count, size_t size);
void* __libc_realloc(void* block, size_t size);
void* __libc_memalign(size_t alignment, size_t size);

static uint64_t before_main;
static uint64_t* count = &before_main;

static void add(void) { __atomic_fetch_add(count, 1, __ATOMIC_RELAXED); }

__attribute__((constructor)) static void share(void) {
  const char* const path = getenv("BRENVIK_ALLOCATION_COUNT");
  const int fd = path != NULL ? open(path, O_RDWR | O_CLOEXEC) : -1;
  void* const shared =
      fd >= 0 ? mmap(NULL, sizeof(uint64_t), PROT_READ | PROT_WRITE, MAP_SHARED, fd, 0) : MAP_FAILED;
  if (fd >= 0) close(fd);
  if (shared != MAP_FAILED) count = shared;
}

void* malloc(size_t size) {
  add();
  return __libc_malloc(size);
}
void* calloc(size_t many, size_t size) {
  add();
  return __libc_calloc(many, size);
}
void* realloc(void* block, size_t size) {
  add();
  return __libc_realloc(block, size);
}
void* aligned_alloc(size_t alignment, size_t size) {
  add();
  return __libc_memalign(alignment, size);
}
int posix_memalign(void** block, size_t alignment, size_t size) {
  add();
  *block = __libc_memalign(alignment, size);
  return *block != NULL ? 0 : 12; /* ENOMEM */
}

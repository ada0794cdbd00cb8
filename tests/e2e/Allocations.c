/* SPDX-License-Identifier: Apache-2.0 */
/* SPDX-FileCopyrightText: The BrenvikMobileHelper authors */
/*
 * Preloaded into the daemon by allocations.py, which says what the file named in BRENVIK_ALLOCATIONS holds:
 * how often the process asked for memory or for a thread, how many blocks it has, and which requests fail.
 * Programs that the daemon starts are left alone.
 */
#define _GNU_SOURCE
#include <dlfcn.h>
#include <errno.h>
#include <execinfo.h>
#include <fcntl.h>
#include <pthread.h>
#include <stdarg.h>
#include <stdbool.h>
#include <stdint.h>
#include <stdlib.h>
#include <string.h>
#include <sys/mman.h>
#include <sys/syscall.h>
#include <unistd.h>

/* The C library's own, under the names it has for such as us. */
void* __libc_malloc(size_t size);
void* __libc_calloc(size_t count, size_t size);
void* __libc_realloc(void* block, size_t size);
void* __libc_memalign(size_t alignment, size_t size);
void __libc_free(void* block);

enum { kFrames = 48 };

struct shared {
  uint64_t made;  /* requests since this library was started */
  int64_t live;   /* blocks of the heap */
  uint64_t first; /* while armed, the requests of these numbers fail */
  uint64_t last;
  uint64_t failed; /* since it was armed: whoever arms sets it to 0 */
  uint64_t armed;
  uint64_t frames; /* of the first that failed: who asked, innermost first */
  uint64_t frame[kFrames];
};

static struct shared before_main;
static struct shared* shared = &before_main;
static int (*create_thread)(pthread_t*, const pthread_attr_t*, void* (*)(void*), void*);

__attribute__((constructor)) static void share(void) {
  create_thread = (int (*)(pthread_t*, const pthread_attr_t*, void* (*)(void*), void*))(uintptr_t)dlsym(
      RTLD_NEXT, "pthread_create");
  const char* const path = getenv("BRENVIK_ALLOCATIONS");
  if (path == NULL || strncmp(program_invocation_short_name, "BrenvikMobileHelper", 19) != 0) return;
  void* first_use;
  (void)backtrace(&first_use, 1); /* loads what it needs */
  const int fd = open(path, O_RDWR | O_CLOEXEC);
  void* const file =
      fd >= 0 ? mmap(NULL, sizeof *shared, PROT_READ | PROT_WRITE, MAP_SHARED, fd, 0) : MAP_FAILED;
  if (fd >= 0) close(fd);
  if (file == MAP_FAILED) return;
  /* It may be armed already. */
  ((struct shared*)file)->made = 0;
  ((struct shared*)file)->live = before_main.live;
  shared = file;
}

/* For a coverage build, which writes its counts at the very end. */
static bool granted;
void brenvik_grant_memory(void);
void brenvik_grant_memory(void) { granted = true; }

static bool fails(void) {
  if (granted) return false;
  const uint64_t number = __atomic_add_fetch(&shared->made, 1, __ATOMIC_RELAXED);
  if (__atomic_load_n(&shared->armed, __ATOMIC_ACQUIRE) == 0) return false;
  if (number < shared->first || number > shared->last) return false;
  if (__atomic_fetch_add(&shared->failed, 1, __ATOMIC_RELAXED) == 0) {
    shared->frames = (uint64_t)backtrace((void**)shared->frame, kFrames);
  }
  errno = ENOMEM;
  return true;
}

static void* counted(void* block) {
  if (block != NULL) __atomic_fetch_add(&shared->live, 1, __ATOMIC_RELAXED);
  return block;
}

void* malloc(size_t size) { return fails() ? NULL : counted(__libc_malloc(size)); }
void* calloc(size_t many, size_t size) { return fails() ? NULL : counted(__libc_calloc(many, size)); }
void* memalign(size_t alignment, size_t size) {
  return fails() ? NULL : counted(__libc_memalign(alignment, size));
}
void* aligned_alloc(size_t alignment, size_t size) { return memalign(alignment, size); }
int posix_memalign(void** block, size_t alignment, size_t size) {
  void* const made = memalign(alignment, size);
  if (made == NULL) return ENOMEM;
  *block = made;
  return 0;
}
void free(void* block) {
  if (block != NULL) __atomic_fetch_sub(&shared->live, 1, __ATOMIC_RELAXED);
  __libc_free(block);
}
void* realloc(void* block, size_t size) {
  if (block == NULL) return malloc(size);
  if (size == 0) {
    free(block);
    return NULL;
  }
  return fails() ? NULL : __libc_realloc(block, size);
}

/* What is asked of the kernel; the C library's own requests, for the heap and for stacks, do not come by
 * here. */
void* mmap(void* address, size_t length, int protection, int flags, int fd, off_t offset) {
  if (fails()) return MAP_FAILED;
  return (void*)syscall(SYS_mmap, address, length, protection, flags, fd,
                        offset);  // NOLINT: a kernel's address
}
void* mremap(void* address, size_t old_length, size_t length, int flags, ...) {
  va_list more;
  va_start(more, flags);
  void* const where = (flags & MREMAP_FIXED) != 0 ? va_arg(more, void*) : NULL;
  va_end(more);
  if (fails()) return MAP_FAILED;
  return (void*)syscall(SYS_mremap, address, old_length, length, flags, where);  // NOLINT: a kernel's address
}
int memfd_create(const char* name, unsigned flags) {
  return fails() ? -1 : (int)syscall(SYS_memfd_create, name, flags);
}
int pthread_create(pthread_t* thread, const pthread_attr_t* attributes, void* (*work)(void*),
                   void* argument) {
  return fails() ? EAGAIN : create_thread(thread, attributes, work, argument);
}

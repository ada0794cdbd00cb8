// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <spawn.h>
#include <sys/types.h>

namespace brenvik {

// How a child process is started, by posix_spawn(3): with the signals' default actions, none of them blocked,
// and none of this process's descriptors but 0 to 2. Settings that the system refuses show as the result of
// start(). One thread.
class Spawn {
 public:
  Spawn() noexcept;
  ~Spawn();
  Spawn(const Spawn&) = delete;
  Spawn& operator=(const Spawn&) = delete;

  // The child's descriptor `as` is this one, or /dev/null for writing.
  void give(int descriptor, int as) noexcept;
  void giveNothing(int as) noexcept;
  void enterFolder(const char* path) noexcept;
  // Without the controlling terminal of this process.
  void startSession() noexcept { flags_ |= POSIX_SPAWN_SETSID; }

  // Starts the program, whose arguments and environment each end with a null pointer. Returns 0 or an errno;
  // *pid is set on success only. The caller reaps the child. To be called once.
  int start(const char* program, char* const arguments[], char* const environment[], pid_t* pid) noexcept;

 private:
  posix_spawn_file_actions_t actions_;
  posix_spawnattr_t attributes_;
  int flags_ = POSIX_SPAWN_SETSIGDEF | POSIX_SPAWN_SETSIGMASK;
  int error_;  // the first one
  bool hasActions_;
  bool hasAttributes_ = false;
};

}  // namespace brenvik

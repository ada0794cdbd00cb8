// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <spawn.h>
#include <sys/types.h>

namespace brenvik {

// Starts a child process with posix_spawn(3). The child has the default action for every signal, no blocked
// signals, and no descriptors of this process but 0 to 2. If the system refuses a setting, start() returns
// the error. Each object belongs to one thread.
class Spawn {
 public:
  Spawn() noexcept;
  ~Spawn();
  Spawn(const Spawn&) = delete;
  Spawn& operator=(const Spawn&) = delete;

  // Makes the child's descriptor `as` a copy of this one, or /dev/null opened for writing.
  void give(int descriptor, int as) noexcept;
  void giveNothing(int as) noexcept;
  void enterFolder(const char* path) noexcept;
  // Starts the child in a session of its own, without this process's controlling terminal.
  void startSession() noexcept { flags_ |= POSIX_SPAWN_SETSID; }

  // Starts the program. `arguments` and `environment` each end with a null pointer. Returns 0 or an errno;
  // *pid is set only on success. The caller must reap the child. Call it once.
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

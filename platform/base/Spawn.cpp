// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/base/Spawn.h"

#include <fcntl.h>
#include <unistd.h>

#include <csignal>

namespace brenvik {

Spawn::Spawn() noexcept : error_(::posix_spawn_file_actions_init(&actions_)), hasActions_(error_ == 0) {
  if (error_ == 0) error_ = ::posix_spawnattr_init(&attributes_);
  hasAttributes_ = error_ == 0;
}

Spawn::~Spawn() {
  if (hasAttributes_) ::posix_spawnattr_destroy(&attributes_);
  if (hasActions_) ::posix_spawn_file_actions_destroy(&actions_);
}

void Spawn::give(int descriptor, int as) noexcept {
  if (error_ == 0) error_ = ::posix_spawn_file_actions_adddup2(&actions_, descriptor, as);
}

void Spawn::giveNothing(int as) noexcept {
  if (error_ == 0) error_ = ::posix_spawn_file_actions_addopen(&actions_, as, "/dev/null", O_WRONLY, 0);
}

void Spawn::enterFolder(const char* path) noexcept {
  if (error_ == 0) error_ = ::posix_spawn_file_actions_addchdir_np(&actions_, path);
}

int Spawn::start(const char* program, char* const arguments[], char* const environment[],
                 pid_t* pid) noexcept {
  sigset_t all;
  sigset_t none;
  ::sigfillset(&all);
  ::sigemptyset(&none);
  if (error_ == 0) error_ = ::posix_spawn_file_actions_addclosefrom_np(&actions_, STDERR_FILENO + 1);
  if (error_ == 0) error_ = ::posix_spawnattr_setsigdefault(&attributes_, &all);
  if (error_ == 0) error_ = ::posix_spawnattr_setsigmask(&attributes_, &none);
  if (error_ == 0) error_ = ::posix_spawnattr_setflags(&attributes_, static_cast<short>(flags_));
  pid_t child = -1;
  if (error_ == 0) error_ = ::posix_spawn(&child, program, &actions_, &attributes_, arguments, environment);
  if (error_ == 0) *pid = child;
  return error_;
}

}  // namespace brenvik

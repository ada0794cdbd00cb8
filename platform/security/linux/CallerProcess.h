// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <sys/types.h>

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

#include "platform/base/ProcessFacts.h"
#include "platform/base/UniqueFd.h"

namespace brenvik {

// The last component of the process's path in the unified hierarchy ("0::" line) of /proc/PID/cgroup
// (cgroups(7)), or, where there is no such line, in the hierarchy named systemd. Empty when there is none.
std::string_view unitOfCgroups(std::string_view text) noexcept;

// One process, held by its folder in /proc: a process that takes over the id later is another folder, so what
// is read here is never mixed up. Every question may find that the process is gone. One thread at a time;
// nothing throws but std::bad_alloc.
class CallerProcess {
 public:
  struct FileIdentity {
    dev_t device;
    ino_t inode;
    bool operator==(const FileIdentity&) const = default;
  };

  // Nothing when there is no such process, or it started at another time. `proc` is "/proc".
  static std::optional<CallerProcess> pin(const std::string& proc, pid_t pid, std::uint32_t startTime);

  // The file that the process executes now; nothing when it has exited, whether its parent knows or not.
  std::optional<FileIdentity> executable() const noexcept;
  // The same, open for reading; not valid when it cannot be opened.
  UniqueFd openExecutable() const noexcept;
  // The unit of the service manager it runs in; empty when in none or unknown.
  std::string unit() const;

 private:
  explicit CallerProcess(UniqueFd folder) noexcept : folder_(std::move(folder)) {}
  bool runsSince(std::uint32_t startTime) const noexcept;

  UniqueFd folder_;
};

}  // namespace brenvik

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

// The unit of the system's service manager that a control group is: the last component of its path, when
// nothing but slices of that manager stand above it. Empty for every other group, those below user.slice or
// below another unit included: whoever such a group was handed to names its children.
std::string_view unitOfCgroup(std::string_view path) noexcept;

// The same of the process's path in the unified hierarchy ("0::" line) of /proc/PID/cgroup (cgroups(7)), or,
// where there is no such line, in the hierarchy named systemd.
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
  // The path of that file as the kernel tells it; empty when unknown.
  std::string executablePath() const;
  // The unit of the service manager it runs in; empty when in none or unknown.
  std::string unit() const;
  // Its user namespace; nothing when it is gone or may not be looked at.
  std::optional<FileIdentity> userNamespace() const noexcept;
  static std::optional<FileIdentity> namespaceOfThisProcess(const std::string& proc);

 private:
  explicit CallerProcess(UniqueFd folder) noexcept : folder_(std::move(folder)) {}
  bool runsSince(std::uint32_t startTime) const noexcept;
  static std::optional<FileIdentity> identityAt(int folder, const char* path) noexcept;

  UniqueFd folder_;
};

}  // namespace brenvik

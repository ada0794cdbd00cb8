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
#include "platform/security/linux/CallerReader.h"

namespace brenvik {

// Returns the unit of the system's service manager that a control group belongs to: the last component of its
// path, if only slices of that manager are above it. Empty for every other group, including those below
// user.slice or another unit, because their owners choose the names.
std::string_view unitOfCgroup(std::string_view path) noexcept;

// The same for the text of /proc/PID/cgroup (cgroups(7)): uses the path in the unified hierarchy ("0::" line)
// or, without such a line, in the hierarchy named systemd.
std::string_view unitOfCgroups(std::string_view text) noexcept;

// One process, held by its open folder in /proc. A process that gets the same id later has another folder, so
// the two are never mixed up. Any call may find that the process has exited. What this process may not read
// by itself, it has the reader read. One thread at a time; throws only std::bad_alloc.
class CallerProcess {
 public:
  // Returns nothing if there is no such process, or it started at another time. `proc` is "/proc" (except in
  // tests). `reader` must outlive this object; null: there is none.
  static std::optional<CallerProcess> pin(const std::string& proc, pid_t pid, std::uint32_t startTime,
                                          CallerReader* reader = nullptr);

  // The file that the process executes now; nothing if it has exited, even if it is still a zombie.
  std::optional<FileIdentity> executable() const;
  // That file, its path and the user namespace, with one question to the reader at most. Nothing of what the
  // process may not be asked, or has no longer since it exited.
  CallerFacts facts() const;
  // The unit of the service manager that it runs in; empty if none or unknown.
  std::string unit() const;
  static std::optional<FileIdentity> namespaceOfThisProcess(const std::string& proc);

 private:
  CallerProcess(UniqueFd folder, CallerReader* reader) noexcept
      : folder_(std::move(folder)), reader_(reader) {}
  bool runsSince(std::uint32_t startTime) const noexcept;
  std::optional<CallerFacts> ask() const;

  UniqueFd folder_;
  CallerReader* reader_;
};

}  // namespace brenvik

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <sys/types.h>

#include <array>
#include <cstdint>

namespace brenvik {

// Who sent a message: the 32 bytes of the receive trailer, from facts the kernel attached to the message.
// Words: login uid, uid, gid, uid, gid, pid, session id, pid version (low 32 bits of the process's start time
// in clock ticks since boot, field 22 of /proc/PID/stat, proc(5)).
struct AuditToken {
  std::array<std::uint32_t, 8> words{};

  std::uint32_t uid() const noexcept { return words[1]; }
  std::uint32_t gid() const noexcept { return words[2]; }
  // -1 if the token names no process.
  pid_t pid() const noexcept { return words[5] == 0 ? -1 : static_cast<pid_t>(words[5]); }
  std::uint32_t pidVersion() const noexcept { return words[7]; }

  bool operator==(const AuditToken&) const = default;
};
static_assert(sizeof(AuditToken) == 32);

}  // namespace brenvik

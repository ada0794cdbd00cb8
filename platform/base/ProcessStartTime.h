// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <sys/types.h>

#include <cstdint>
#include <optional>

namespace brenvik {

// When a process started: the low 32 bits of field 22 of /proc/PID/stat (clock ticks since boot, proc(5)).
// With the process id it names one process for as long as the system is up. Nothing when there is no such
// process. Any thread; allocates nothing.
std::optional<std::uint32_t> processStartTime(pid_t pid) noexcept;

}  // namespace brenvik

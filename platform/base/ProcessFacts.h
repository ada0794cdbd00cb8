// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <sys/types.h>

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

namespace brenvik {

// A process's identity and state, from /proc/PID/stat (proc(5)). The process id and the start time together
// name one process for as long as the system is up.
struct ProcessFacts {
  char state = '?';             // field 3
  pid_t session = 0;            // field 6
  std::uint32_t startTime = 0;  // field 22, clock ticks since boot, low 32 bits
};

// Returns nothing if the text does not have that form.
std::optional<ProcessFacts> parseProcessStat(std::string_view text) noexcept;

// Returns nothing if there is no such process. Any thread; allocates nothing.
std::optional<ProcessFacts> processFacts(pid_t pid) noexcept;
std::optional<std::uint32_t> processStartTime(pid_t pid) noexcept;

// The program file that this process runs. Any thread.
struct ProgramFacts {
  std::string path;         // its path when the process started; empty: unknown
  bool isReplaced = false;  // the path now names another file, or no file
};
ProgramFacts programFacts();
// Reads them from a link like /proc/self/exe. Throws std::bad_alloc.
ProgramFacts programFactsOf(const char* link);

}  // namespace brenvik

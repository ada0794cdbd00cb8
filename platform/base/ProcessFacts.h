// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <sys/types.h>

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

namespace brenvik {

// What /proc/PID/stat (proc(5)) says of which process it is and whether it still runs. With the process id,
// the start time names one process for as long as the system is up.
struct ProcessFacts {
  char state = '?';             // field 3
  pid_t session = 0;            // field 6
  std::uint32_t startTime = 0;  // field 22, clock ticks since boot, low 32 bits
};

// Nothing when the text is not of that form.
std::optional<ProcessFacts> parseProcessStat(std::string_view text) noexcept;

// Nothing when there is no such process. Any thread; allocates nothing.
std::optional<ProcessFacts> processFacts(pid_t pid) noexcept;
std::optional<std::uint32_t> processStartTime(pid_t pid) noexcept;

// Of which file this process runs. Any thread.
struct ProgramFacts {
  std::string path;         // where it stood when it was started; empty: not known
  bool isReplaced = false;  // another file stands there now, or none
};
ProgramFacts programFacts();
// The same for a link like /proc/self/exe.
ProgramFacts programFactsOf(const char* link);

}  // namespace brenvik

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "tools/support/ExitStatus.h"

#include "brenvik/mobile_helper.h"

namespace brenvik::tools {

ExitStatus statusOfCode(std::int32_t code) noexcept {
  switch (code) {
    case BVMH_OK:
      return ExitStatus::done;
    case BVMH_INVALID_SECURITY:
    case BVMH_NO_ACCESS:
      return ExitStatus::refused;
    case BVMH_ERROR_UNREACHABLE:
    case BVMH_ERROR_NOT_CONNECTED:
    case BVMH_ERROR_HELPER_GONE:
      return ExitStatus::unreachable;
    case BVMH_ERROR_TIMED_OUT:
      return ExitStatus::timedOut;
    case BVMH_ERROR_PROTOCOL:
    case BVMH_ERROR_ANSWER_LOST:
    case BVMH_TYPE_ERROR:
    case BVMH_BAD_ID:
    case BVMH_BAD_ARGUMENTS:
    case BVMH_TRAILER_ERROR:
      return ExitStatus::protocol;
    case BVMH_ERROR_INVALID_ARGUMENT:
      return ExitStatus::usage;
    default:
      return ExitStatus::failed;
  }
}

std::string exitStatusLine(bool asksHelper) {
  std::string line = "Exit status:";
  for (const ExitStatusFacts& each : kExitStatuses) {
    if (each.isOfRequest && !asksHelper) continue;
    line += (each.status == ExitStatus::done ? " " : "; ") + std::to_string(static_cast<int>(each.status)) +
            " " + each.name;
  }
  return line + ".";
}

}  // namespace brenvik::tools

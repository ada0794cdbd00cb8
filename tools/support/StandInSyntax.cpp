// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "tools/support/StandInSyntax.h"

namespace brenvik::tools {

const Parameter& listeningDirectory() {
  static const Parameter parameter{"--directory", "folder of named services", ValueKind::path, 0, {}, false,
                                   "DIR"};
  return parameter;
}

const Parameter& listeningHelperUid() {
  static const Parameter parameter{
      "--helper-uid", "take messages from this user too", ValueKind::user, 0, {}, false, "UID"};
  return parameter;
}

ProgramSyntax standInSyntax() {
  static const std::vector<Group> noGroups;
  static const std::vector<Parameter> none;
  static const std::vector<Parameter> options{
      {"--json", "print one JSON object a line", ValueKind::text, 0, {}, false, nullptr},
      {"--count", "leave after so many pushes and notifications", ValueKind::count, 0, {}, false, "N"},
      {"--timeout", "leave after so many seconds", ValueKind::seconds, 0, {}, false, "SECONDS"},
      {"--refuse",
       "answer every push with this error code instead of success",
       ValueKind::count,
       0,
       {},
       false,
       "CODE"},
      {"--hang", "never answer a push", ValueKind::text, 0, {}, false, nullptr},
      listeningDirectory(),
      listeningHelperUid(),
      {"--version", "show the version", ValueKind::text, 0, {}, false, nullptr},
      {"--help", "show this help", ValueKind::text, 0, {}, false, nullptr},
  };
  constexpr const char* kSummary =
      "Stands in for the telephony daemon: prints the helper's pushes and notifications, and answers.";
  return {kStandInName, kSummary, &noGroups, {{"", "", kSummary, &none, &none}}, &options, false};
}

}  // namespace brenvik::tools

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include <cstdint>
#include <exception>
#include <nlohmann/json.hpp>

#include "tools/support/CommandLineParser.h"
#include "tools/support/EventStream.h"
#include "tools/support/Output.h"
#include "tools/support/StandInSyntax.h"

// A telephony daemon that only listens: takes the helper's pushes and notifications, answers as it is told,
// and prints them.
namespace {

using namespace brenvik::tools;

EventStreamOptions optionsIn(const Values& given) {
  EventStreamOptions options;
  options.program = kStandInName;
  options.asJson = given.has("--json");
  options.answers = !given.has("--hang");
  options.directory = given.get("--directory", "");
  if (given.has("--refuse")) {
    if (given.has("--hang")) throw UsageError{"--hang and --refuse exclude each other"};
    options.errorCode = *numberIn<std::int32_t>(given["--refuse"]);
  }
  if (given.has("--count")) options.most = numberIn<std::uint64_t>(given["--count"]);
  if (given.has("--timeout")) options.seconds = secondsIn(given["--timeout"]);
  if (given.has("--helper-uid")) options.helperUid = numberIn<std::uint32_t>(given["--helper-uid"]);
  return options;
}

ExitStatus run(int argc, char** argv) {
  const ProgramSyntax syntax = standInSyntax();
  const ParsedLine line = parseCommandLine(syntax, argc, argv);
  if (line.wish != ParsedLine::Wish::command) {
    const bool asJson = isFlagGiven("--json", argc, argv);
    (void)printOut(line.wish == ParsedLine::Wish::help ? helpOutput(syntax, line, asJson)
                                                       : versionOutput(syntax, BRENVIK_VERSION, asJson));
    return ExitStatus::done;
  }
  return printEvents(optionsIn(checkedValues({}, *syntax.globalOptions, line.globals)));
}

}  // namespace

int main(int argc, char** argv) {
  prepareStandardStreams();
  ExitStatus status = ExitStatus::usage;
  try {
    status = run(argc, argv);
  } catch (const UsageError& error) {
    printFailure(kStandInName, isFlagGiven("--json", argc, argv), error.message,
                 error.isAboutSyntax ? "Run with --help for more." : error.advice,
                 nlohmann::ordered_json::object());
  } catch (const std::exception& error) {
    status = ExitStatus::failed;
    printFailure(kStandInName, isFlagGiven("--json", argc, argv), error.what(), "",
                 nlohmann::ordered_json::object());
  }
  return finishOutput(kStandInName, status);
}

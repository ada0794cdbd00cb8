// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <cstdint>
#include <nlohmann/json.hpp>
#include <optional>
#include <span>
#include <string>
#include <vector>

#include "brenvik/mobile_helper.h"
#include "tools/support/CommandLineParser.h"
#include "tools/support/ExitStatus.h"
#include "tools/support/Parameters.h"

// Every subcommand once: its words, what it takes, the routines it calls, and the function that does it. The
// parser, the help, the completions and the manual page come from here.
namespace brenvik::tools {

// What a command has done.
struct Outcome {
  const char* routine = "";     // the one that was called
  std::int32_t code = BVMH_OK;  // its result
  bool isDone = true;           // false: it answered that the work failed
  std::string text;             // for people: lines, on success
  nlohmann::ordered_json fields = nlohmann::ordered_json::object();  // for programs, on success
  nlohmann::ordered_json fieldsOfFailure =
      nlohmann::ordered_json::object();  // the same, when something failed
  std::string failure;      // what went wrong, when the command knows better than the code's text
  std::string advice = "";  // what to do about that
  std::optional<ExitStatus> status = std::nullopt;  // when the code and isDone do not say it
  std::vector<std::string> notes = {};              // what else a person should know, on success
  std::optional<std::string> raw = std::nullopt;    // printed instead of the text, byte for byte
};

// The outcome of a routine: its code, and what is said when that is BVMH_OK.
Outcome did(const char* routine, std::int32_t code, std::string text);

struct Command {
  const char* group;  // "" for a command of one word
  const char* name;
  const char* summary;
  std::vector<const char*> routines;
  std::vector<Parameter> positionals;
  std::vector<Parameter> options;
  // Called with a client that has not checked in yet; the values of global options are among the values.
  // Throws UsageError, and std::bad_alloc. Null for "watch", which has no outcome.
  Outcome (*run)(bvmh_client* client, const Values& values);
  // True: needs no helper; run is called with null.
  bool isLocal = false;
};

// What may stand anywhere on the command line.
const std::vector<Parameter>& globalOptions();
const std::vector<Group>& commandGroups();
std::span<const Command> commandTable();

// "prefs set"
std::string wordsOf(const Command& command);

// All of it as the parser, the help, the completions and the manual page see it.
ProgramSyntax programSyntax();

}  // namespace brenvik::tools

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <span>
#include <string>
#include <vector>

#include "brenvik/mobile_helper.h"
#include "tools/bvhelperctl/Outcome.h"
#include "tools/support/CommandLineParser.h"
#include "tools/support/Parameters.h"

// Every subcommand once: its words, what it takes, the routines it calls, and the function that does it. The
// parser, the help, the completions and the manual page come from here.
namespace brenvik::tools {

struct Command {
  const char* group = "";  // "" for a command of one word
  const char* name;
  const char* summary;
  std::vector<const char*> routines = {};
  std::vector<Parameter> positionals = {};
  std::vector<Parameter> options = {};
  // Called with a client that has not checked in yet; the values of global options are among the values.
  // Throws UsageError, and std::bad_alloc. Null for "watch", which has no outcome.
  Outcome (*run)(bvmh_client* client, const Values& values) = nullptr;
  // True: needs no helper; run is called with null.
  bool isLocal = false;
};

// What may stand anywhere on the command line.
const std::vector<Parameter>& globalOptions();
const std::vector<Group>& commandGroups();
std::span<const Command> commandTable();

// "prefs set"
std::string wordsOf(const Command& command);

// The whole table in the form that the parser, the help, the completions and the manual page use.
ProgramSyntax programSyntax();

}  // namespace brenvik::tools

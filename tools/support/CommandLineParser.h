// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "tools/support/Parameters.h"

// Reads a command line against tables, and makes the help from the same tables. Nothing is built before it is
// needed: a program that is started for each request must not spend its time on a parser.
namespace brenvik::tools {

struct Group {
  const char* name;
  const char* summary;
};

// A command as the parser sees it; the parameters belong to somebody else.
struct CommandSyntax {
  const char* group;  // "" for a command of one word
  const char* name;   // "" for a program without commands
  const char* summary;
  const std::vector<Parameter>* positionals;
  const std::vector<Parameter>* options;
};

struct ProgramSyntax {
  const char* name;
  const char* summary;
  const std::vector<Group>* groups;
  std::vector<CommandSyntax> commands;
  const std::vector<Parameter>* globalOptions;  // may stand anywhere; "--help" and "--version" among them
  bool asksHelper = true;
};

struct ParsedLine {
  enum class Wish : unsigned char { command, help, version };
  Wish wish = Wish::command;
  std::optional<std::size_t> command;  // its place in ProgramSyntax::commands
  std::string group;                   // for help: the group that was named
  Values given;                        // of the command, unchecked, in the order of the command line
  Values globals;                      // unchecked
};

// Throws UsageError. An option that takes a value takes the next word, whatever it is. "--" makes everything
// after it a word; a word that begins with a dash needs it, unless it is "-" or a number.
ParsedLine parseCommandLine(const ProgramSyntax& program, int argc, const char* const* argv);

// Whether the flag is given before any "--", for a line that may not be well-formed.
bool isFlagGiven(std::string_view flag, int argc, const char* const* argv);

// The help of the program, of a group or of a command, as lines.
std::string helpText(const ProgramSyntax& program, const ParsedLine& line);

// What --help and --version print, with asJson as an object.
std::string helpOutput(const ProgramSyntax& program, const ParsedLine& line, bool asJson);
std::string versionOutput(const ProgramSyntax& program, const char* version, bool asJson);

// "prefs set"
std::string wordsOf(const CommandSyntax& command);

// The names nearest to a mistyped one: at most a third of its letters differ.
std::vector<std::string> similarNames(std::string_view given, const std::vector<std::string>& names);

}  // namespace brenvik::tools

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "tools/support/CommandLineParser.h"

#include <algorithm>
#include <cstring>
#include <nlohmann/json.hpp>
#include <numeric>

#include "tools/support/ExitStatus.h"
#include "tools/support/Output.h"
#include "tools/support/PropertyListText.h"

namespace brenvik::tools {
namespace {

// ---- names ----------------------------------------------------------------------------------------------

// Insertions, deletions, replacements and swaps of neighbours that turn one word into the other.
std::size_t distanceBetween(std::string_view a, std::string_view b) {
  std::vector<std::size_t> beforeLast;
  std::vector<std::size_t> last(b.size() + 1);
  std::iota(last.begin(), last.end(), std::size_t{0});
  for (std::size_t i = 1; i <= a.size(); ++i) {
    std::vector<std::size_t> row(b.size() + 1, i);
    for (std::size_t j = 1; j <= b.size(); ++j) {
      const std::size_t replaced = last[j - 1] + (a[i - 1] == b[j - 1] ? 0 : 1);
      row[j] = std::min({last[j] + 1, row[j - 1] + 1, replaced});
      if (i > 1 && j > 1 && a[i - 1] == b[j - 2] && a[i - 2] == b[j - 1])
        row[j] = std::min(row[j], beforeLast[j - 2] + 1);
    }
    beforeLast = std::exchange(last, std::move(row));
  }
  return last.back();
}

std::string inQuotes(const std::string& text) { return '"' + printable(text) + '"'; }

// "; did you mean "a" or "b"?", or nothing.
std::string suggestion(const std::vector<std::string>& names) {
  std::string text;
  for (const std::string& each : names) text += (text.empty() ? "; did you mean " : " or ") + inQuotes(each);
  return text.empty() ? "" : text + "?";
}

bool looksLikeNumber(std::string_view word) {
  return word.size() > 1 && word[0] == '-' && ((word[1] >= '0' && word[1] <= '9') || word[1] == '.');
}

// ---- the walk along the words ---------------------------------------------------------------------------

class Walk {
 public:
  explicit Walk(const ProgramSyntax& program) : program_(program) {
    if (program.commands.size() == 1 && *program.commands.front().name == '\0') line_.command = 0;
  }

  ParsedLine over(int argc, const char* const* argv) {
    bool areWordsOnly = false;
    for (int i = 1; i < argc; ++i) {
      const std::string word = argv[i];
      if (areWordsOnly || word == "-" || word.empty() || word[0] != '-' || looksLikeNumber(word)) {
        take(word);
      } else if (word == "--") {
        areWordsOnly = true;
      } else if (!takeOption(word, argc, argv, i)) {
        return line_;
      }
    }
    finish();
    return line_;
  }

 private:
  const CommandSyntax* command() const {
    return line_.command ? &program_.commands[*line_.command] : nullptr;
  }

  const Parameter* optionNamed(std::string_view name, bool* isGlobal) const {
    for (const bool global : {false, true}) {
      const std::vector<Parameter>* options =
          global ? program_.globalOptions : (command() == nullptr ? nullptr : command()->options);
      if (options == nullptr) continue;
      for (const Parameter& each : *options) {
        if (name == each.name) {
          *isGlobal = global;
          return &each;
        }
      }
    }
    return nullptr;
  }

  // False: help or the version is wanted, and nothing more counts.
  bool takeOption(const std::string& word, int argc, const char* const* argv, int& i) {
    const std::size_t equals = word.find('=');
    const std::string name = word == "-h" ? "--help" : word.substr(0, equals);
    bool isGlobal = false;
    const Parameter* option = optionNamed(name, &isGlobal);
    if (option == nullptr)
      throw UsageError{"not expected: " + printable(word) + suggestion(similarOptions(name))};
    if (name == "--help" || name == "--version") {
      line_.wish = name == "--help" ? ParsedLine::Wish::help : ParsedLine::Wish::version;
      return false;
    }
    std::string value;
    if (isFlag(*option)) {
      if (equals != std::string::npos) throw UsageError{name + " takes no value"};
    } else if (equals != std::string::npos) {
      value = word.substr(equals + 1);
    } else if (i + 1 < argc) {
      value = argv[++i];
    } else {
      throw UsageError{name + ": " + option->valueName + " is missing"};
    }
    Values& values = isGlobal ? line_.globals : line_.given;
    if (values.has(name)) {
      if (isFlag(*option)) return true;
      if (!option->isRepeatable) throw UsageError{name + " is given twice"};
    }
    values.add(name, std::move(value));
    return true;
  }

  std::vector<std::string> similarOptions(const std::string& name) const {
    std::vector<std::string> names;
    for (const Parameter& each : *program_.globalOptions) names.emplace_back(each.name);
    if (command() != nullptr) {
      for (const Parameter& each : *command()->options) names.emplace_back(each.name);
    }
    return similarNames(name, names);
  }

  void take(const std::string& word) {
    if (const CommandSyntax* found = command()) {
      if (positionals_ == found->positionals->size()) throw UsageError{"not expected: " + printable(word)};
      line_.given.add((*found->positionals)[positionals_++].name, word);
      return;
    }
    for (std::size_t i = 0; i < program_.commands.size(); ++i) {
      if (line_.group == program_.commands[i].group && word == program_.commands[i].name) {
        line_.command = i;
        return;
      }
    }
    if (line_.group.empty()) {
      for (const Group& each : *program_.groups) {
        if (word == each.name) {
          line_.group = word;
          return;
        }
      }
    }
    throw unknownCommand(word);
  }

  UsageError unknownCommand(const std::string& word) const {
    std::vector<std::string> names;
    if (line_.group.empty()) {
      for (const Group& each : *program_.groups) names.emplace_back(each.name);
    }
    for (const CommandSyntax& each : program_.commands) {
      if (line_.group == each.group) names.emplace_back(each.name);
    }
    std::vector<std::string> similar = similarNames(word, names);
    for (std::string& each : similar) each = line_.group.empty() ? each : line_.group + ' ' + each;
    // A command whose group was forgotten, or was another one.
    for (const CommandSyntax& each : program_.commands) {
      if (word == each.name) similar.push_back(wordsOf(each));
    }
    const std::string asked = line_.group.empty() ? word : line_.group + ' ' + word;
    return {"unknown command " + inQuotes(asked) + suggestion(similar)};
  }

  std::string missingPart() const {
    if (line_.group.empty()) return "a command is required";
    std::string names;
    for (const CommandSyntax& each : program_.commands) {
      if (line_.group == each.group) names += std::string(names.empty() ? "" : ", ") + each.name;
    }
    return inQuotes(line_.group) + " needs one of these behind it: " + names;
  }

  void finish() const {
    if (command() == nullptr) throw UsageError{missingPart()};
    const std::vector<Parameter>& wanted = *command()->positionals;
    if (positionals_ < wanted.size())
      throw UsageError{std::string(wanted[positionals_].name) + " is required"};
  }

  const ProgramSyntax& program_;
  ParsedLine line_;
  std::size_t positionals_ = 0;
};

// ---- help -----------------------------------------------------------------------------------------------

constexpr std::size_t kHelpWidth = 100;  // columns
constexpr std::size_t kHelpIndent = 30;  // where explanations start

// The left words, then the explanation in lines of its own column.
std::string helpLine(const std::string& left, const std::string& right) {
  std::string text = "  " + left;
  std::size_t column = text.size();
  if (column + 1 > kHelpIndent) {
    text += '\n';
    column = 0;
  }
  text.append(kHelpIndent - column, ' ');
  column = kHelpIndent;
  for (std::size_t start = 0; start < right.size();) {
    const std::size_t end = std::min(right.find(' ', start), right.size());
    if (column != kHelpIndent) {
      if (column + 1 + end - start > kHelpWidth) {
        text += '\n' + std::string(kHelpIndent, ' ');
        column = kHelpIndent;
      } else {
        text += ' ';
        ++column;
      }
    }
    text.append(right, start, end - start);
    column += end - start;
    start = end + 1;
  }
  return text + '\n';
}

std::string heading(const char* text) { return '\n' + styled(Look::strong, text, Stream::output) + '\n'; }

std::string optionLines(const std::vector<Parameter>& options) {
  std::string text;
  for (const Parameter& each : options) {
    text += helpLine(isFlag(each) ? each.name : std::string(each.name) + ' ' + each.valueName,
                     each.isRepeatable ? std::string(each.help) + " (may be repeated)" : each.help);
  }
  return text;
}

std::string helpOfCommand(const ProgramSyntax& program, const CommandSyntax& command) {
  const std::string words = wordsOf(command);
  std::string text = std::string(command.summary) + "\nUsage: " + program.name + (words.empty() ? "" : " ") +
                     words + " [OPTIONS]";
  for (const Parameter& each : *command.positionals) text += std::string(" ") + each.name;
  text += '\n';
  if (!command.positionals->empty()) {
    text += heading("Positionals:");
    for (const Parameter& each : *command.positionals) text += helpLine(each.name, each.help);
  }
  if (!command.options->empty()) text += heading("Options:") + optionLines(*command.options);
  return text;
}

std::string helpOfCommands(const ProgramSyntax& program, const std::string& group) {
  std::string text = heading("Subcommands:");
  if (group.empty()) {
    for (const Group& each : *program.groups) text += helpLine(each.name, each.summary);
  }
  for (const CommandSyntax& each : program.commands) {
    if (group == each.group) text += helpLine(each.name, each.summary);
  }
  return text;
}

// The global options but those that every program has.
std::string globalOptionsHint(const ProgramSyntax& program) {
  std::vector<std::string> names;
  for (const Parameter& each : *program.globalOptions) {
    const std::string name = each.name;
    if (name != "--help" && name != "--version") names.push_back(name);
  }
  std::string text;
  for (std::size_t i = 0; i < names.size(); ++i)
    text += (i == 0 ? "" : (i + 1 == names.size() ? " and " : ", ")) + names[i];
  return text + " may stand here, too: see " + program.name + " --help.\n";
}

nlohmann::ordered_json jsonOf(const std::vector<Parameter>& parameters) {
  nlohmann::ordered_json list = nlohmann::ordered_json::array();
  for (const Parameter& each : parameters) {
    nlohmann::ordered_json entry{{"name", each.name}, {"help", each.help}};
    if (each.name[0] == '-') {
      entry["value"] = isFlag(each) ? nlohmann::ordered_json() : nlohmann::ordered_json(each.valueName);
      entry["repeatable"] = each.isRepeatable;
    }
    if (each.kind == ValueKind::choice) entry["choices"] = each.choices;
    list.push_back(std::move(entry));
  }
  return list;
}

}  // namespace

std::string helpOutput(const ProgramSyntax& program, const ParsedLine& line, bool asJson) {
  if (!asJson) return helpText(program, line);
  nlohmann::ordered_json object{{"ok", true},
                                {"program", program.name},
                                {"summary", program.summary},
                                {"options", jsonOf(*program.globalOptions)}};
  nlohmann::ordered_json& commands = object["commands"] = nlohmann::ordered_json::array();
  for (std::size_t i = 0; i < program.commands.size(); ++i) {
    const CommandSyntax& each = program.commands[i];
    const bool isShown = line.command ? *line.command == i : line.group.empty() || line.group == each.group;
    if (!isShown || *each.name == '\0') continue;
    commands.push_back({{"command", wordsOf(each)},
                        {"summary", each.summary},
                        {"arguments", jsonOf(*each.positionals)},
                        {"options", jsonOf(*each.options)}});
  }
  return jsonLine(object) + '\n';
}

std::string versionOutput(const ProgramSyntax& program, const char* version, bool asJson) {
  if (!asJson) return std::string(program.name) + ' ' + version + '\n';
  return jsonLine({{"ok", true}, {"program", program.name}, {"version", version}}) + '\n';
}

std::string wordsOf(const CommandSyntax& command) {
  return *command.group == '\0' ? command.name : std::string(command.group) + ' ' + command.name;
}

std::vector<std::string> similarNames(std::string_view given, const std::vector<std::string>& names) {
  std::vector<std::string> similar;
  std::size_t least = std::max<std::size_t>(1, given.size() / 3);
  for (const std::string& each : names) {
    const std::size_t distance = distanceBetween(given, each);
    if (distance > least) continue;
    if (distance < least) similar.clear();
    least = distance;
    similar.push_back(each);
  }
  return similar;
}

ParsedLine parseCommandLine(const ProgramSyntax& program, int argc, const char* const* argv) {
  try {
    return Walk(program).over(argc, argv);
  } catch (UsageError& error) {
    error.isAboutSyntax = true;
    throw;
  }
}

bool isFlagGiven(std::string_view flag, int argc, const char* const* argv) {
  for (int i = 1; i < argc && std::strcmp(argv[i], "--") != 0; ++i) {
    if (flag == argv[i]) return true;
  }
  return false;
}

std::string helpText(const ProgramSyntax& program, const ParsedLine& line) {
  std::string text;
  const bool isWholeProgram = !line.command && line.group.empty();
  if (line.command) {
    text = helpOfCommand(program, program.commands[*line.command]);
  } else if (isWholeProgram) {
    text = std::string(program.summary) + "\nUsage: " + program.name + " [OPTIONS] COMMAND [ARGUMENTS]\n";
  } else {
    const auto group = std::find_if(program.groups->begin(), program.groups->end(),
                                    [&](const Group& each) { return line.group == each.name; });
    text = std::string(group->summary) + "\nUsage: " + program.name + ' ' + line.group +
           " [OPTIONS] COMMAND [ARGUMENTS]\n";
  }
  const bool isOnlyCommand = line.command && *program.commands[*line.command].name == '\0';
  if (isWholeProgram || isOnlyCommand) text += heading("Options:") + optionLines(*program.globalOptions);
  if (!line.command) text += helpOfCommands(program, line.group);
  text += '\n';
  if (!isWholeProgram && !isOnlyCommand) text += globalOptionsHint(program);
  return text + exitStatusLine(program.asksHelper) + '\n';
}

}  // namespace brenvik::tools

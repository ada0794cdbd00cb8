// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
//
// Prints what is made of the programs' tables: completions, and the parts of manual pages.
//
// usage: command-pages bash|zsh|fish|man bvhelperctl|brenvik-standin
#include <cstdio>
#include <cstring>
#include <functional>
#include <set>
#include <string>
#include <vector>

#include "tools/bvhelperctl/CommandTable.h"
#include "tools/support/StandInSyntax.h"

namespace brenvik::tools {
namespace {

void print(const std::string& text) { std::fputs(text.c_str(), stdout); }

// In single quotes of a shell; `escape` stands for a quote inside.
std::string quoted(const std::string& text, const char* escape) {
  std::string result = "'";
  for (const char c : text) result += c == '\'' ? escape : std::string(1, c);
  return result + "'";
}
std::string sh(const std::string& text) { return quoted(text, "'\\''"); }
std::string fish(const std::string& text) { return quoted(text, "\\'"); }

std::string joined(const std::vector<std::string>& words) {
  std::string result;
  for (const std::string& each : words) result += (result.empty() ? "" : " ") + each;
  return result;
}

struct Word {
  std::string name;
  std::string summary;
};

// What may follow the program's name, or the name of a group.
std::vector<Word> wordsAfter(const ProgramSyntax& program, const std::string& group) {
  std::vector<Word> words;
  if (group.empty()) {
    for (const Group& each : *program.groups) words.push_back({each.name, each.summary});
  }
  for (const CommandSyntax& each : program.commands) {
    if (each.group == group && *each.name != '\0') words.push_back({each.name, each.summary});
  }
  return words;
}

std::vector<std::string> groupNames(const ProgramSyntax& program) {
  std::vector<std::string> names;
  for (const Group& each : *program.groups) names.emplace_back(each.name);
  return names;
}

std::string valuedOptions(const ProgramSyntax& program) {
  std::set<std::string> names;
  const auto add = [&](const std::vector<Parameter>& options) {
    for (const Parameter& each : options) {
      if (!isFlag(each)) names.insert(each.name);
    }
  };
  add(*program.globalOptions);
  for (const CommandSyntax& each : program.commands) add(*each.options);
  return joined({names.begin(), names.end()});
}

std::string choicesOf(const Parameter& parameter) {
  return joined({parameter.choices.begin(), parameter.choices.end()});
}

// Every place where a value stands, as "<words>|<option or number of the positional>".
void eachValue(const ProgramSyntax& program,
               const std::function<void(const std::string& place, const Parameter&)>& visit) {
  for (const Parameter& each : *program.globalOptions) {
    if (!isFlag(each)) visit("*|" + std::string(each.name), each);
  }
  for (const CommandSyntax& command : program.commands) {
    for (const Parameter& each : *command.options) {
      if (!isFlag(each)) visit(wordsOf(command) + "|" + each.name, each);
    }
    for (std::size_t i = 0; i < command.positionals->size(); ++i) {
      visit(wordsOf(command) + "|" + std::to_string(i), (*command.positionals)[i]);
    }
  }
}

// The command that prints what else to offer, or nothing. `domain`: what the shell calls the word before.
std::string askingCommand(const Parameter& parameter, const char* domain) {
  if (parameter.offer == Offer::domains) return "bvhelperctl __complete domains 2> /dev/null";
  if (parameter.offer == Offer::keys)
    return std::string("bvhelperctl __complete keys ") + domain + " 2> /dev/null";
  return "";
}

// "_brenvik_standin": what the shells call the function.
std::string functionName(const ProgramSyntax& program) {
  std::string name = std::string("_") + program.name;
  for (char& c : name) c = c == '-' ? '_' : c;
  return name;
}

// ---- bash -----------------------------------------------------------------------------------------------

// Both shells walk the words before the cursor: `command` are the command's words so far, `place` is the
// option whose value is wanted, or the number of the positional.
constexpr const char* kWalk = R"(    if [[ " $valued " == *" $word "* ]]; then
      if (( i + 1 == last )); then place=$word; fi
      (( i += 1 ))
    elif [[ $word == -* ]]; then
      :
    elif [[ -n $groups ]] && { [[ -z $command ]] || [[ " $groups " == *" $command "* ]]; }; then
      command=${command:+$command }$word
    else
      (( count += 1 ))
      last_word=$word
    fi
)";

std::string header(const char* comment) {
  return std::string("# Made of the program's own table; not to be edited.\n") + comment;
}

void bash(const ProgramSyntax& program) {
  const std::string function = functionName(program);
  print(
      header("# SPDX-License-"
             "Identifier: Apache-2.0\n"));
  print(function + "() {\n  local word command='' place='' last_word='' count=0 i last=$COMP_CWORD\n");
  print("  local current=${COMP_WORDS[COMP_CWORD]}\n  local valued=" + sh(valuedOptions(program)) + "\n");
  print("  local groups=" + sh(joined(groupNames(program))) + "\n  COMPREPLY=()\n");
  print("  for (( i = 1; i < last; i += 1 )); do\n    word=${COMP_WORDS[i]}\n");
  print(kWalk);
  print("  done\n");
  print(R"(  if [[ -z $place && $current == -* ]]; then
    local options=)");
  std::vector<std::string> global;
  for (const Parameter& each : *program.globalOptions) global.emplace_back(each.name);
  print(sh(joined(global)) + "\n    case $command in\n");
  for (const CommandSyntax& command : program.commands) {
    std::vector<std::string> names;
    for (const Parameter& each : *command.options) names.emplace_back(each.name);
    if (!names.empty())
      print("      " + sh(wordsOf(command)) + ") options+=" + sh(" " + joined(names)) + " ;;\n");
  }
  print(
      "    esac\n    mapfile -t COMPREPLY < <(compgen -W \"$options\" -- \"$current\")\n    return\n  fi\n");
  print("  case \"$command|${place:-$count}\" in\n");
  const auto offer = [](const std::string& pattern, const std::string& offered) {
    print("    " + pattern + ") mapfile -t COMPREPLY < <(compgen " + offered + " -- \"$current\") ;;\n");
  };
  std::vector<std::string> places = groupNames(program);
  places.insert(places.begin(), "");
  for (const std::string& group : places) {
    std::vector<std::string> names;
    for (const Word& each : wordsAfter(program, group)) names.push_back(each.name);
    offer(sh(group + "|0"), "-W " + sh(joined(names)));
  }
  eachValue(program, [&](const std::string& place, const Parameter& parameter) {
    const bool isGlobal = place.starts_with('*');
    const std::string pattern = isGlobal ? "*" + sh(place.substr(1)) : sh(place);
    const std::string asked = askingCommand(parameter, "\"$last_word\"");
    if (!parameter.choices.empty()) offer(pattern, "-W " + sh(choicesOf(parameter)));
    if (!asked.empty()) offer(pattern, "-W \"$(" + asked + ")\"");
    if (parameter.kind == ValueKind::path) {
      print("    " + pattern + ") compopt -o filenames 2> /dev/null; ");
      print("mapfile -t COMPREPLY < <(compgen -f -- \"$current\") ;;\n");
    }
  });
  print("  esac\n}\ncomplete -F " + function + " " + program.name + "\n");
}

// ---- zsh ------------------------------------------------------------------------------------------------

std::string described(const std::string& name, const std::string& summary) {
  std::string escaped;
  for (const char c : name) escaped += c == ':' ? "\\:" : std::string(1, c);
  return sh(escaped + ":" + summary);
}

void zsh(const ProgramSyntax& program) {
  const std::string function = functionName(program);
  print(std::string("#compdef ") + program.name + "\n" +
        header("# SPDX-License-"
               "Identifier: Apache-2.0\n"));
  print(function + "() {\n  local word command='' place='' last_word='' count=0 i last=$CURRENT\n");
  print("  local current=$words[CURRENT]\n  local valued=" + sh(valuedOptions(program)) + "\n");
  print("  local groups=" + sh(joined(groupNames(program))) + "\n  local -a offered\n");
  print("  for (( i = 2; i < last; i += 1 )); do\n    word=$words[i]\n");
  print(kWalk);
  print("  done\n  if [[ -z $place && $current == -* ]]; then\n    offered=(\n");
  for (const Parameter& each : *program.globalOptions)
    print("      " + described(each.name, each.help) + "\n");
  print("    )\n    case $command in\n");
  for (const CommandSyntax& command : program.commands) {
    if (command.options->empty()) continue;
    print("      " + sh(wordsOf(command)) + ") offered+=(");
    for (const Parameter& each : *command.options) print(" " + described(each.name, each.help));
    print(" ) ;;\n");
  }
  print("    esac\n    _describe -o option offered\n    return\n  fi\n");
  print("  case \"$command|${place:-$count}\" in\n");
  std::vector<std::string> places = groupNames(program);
  places.insert(places.begin(), "");
  for (const std::string& group : places) {
    print("    " + sh(group + "|0") + ")\n      offered=(");
    for (const Word& each : wordsAfter(program, group)) print(" " + described(each.name, each.summary));
    print(" )\n      _describe command offered ;;\n");
  }
  eachValue(program, [&](const std::string& place, const Parameter& parameter) {
    const std::string pattern = place.starts_with('*') ? "*" + sh(place.substr(1)) : sh(place);
    const std::string asked = askingCommand(parameter, "$last_word");
    if (!parameter.choices.empty()) {
      print("    " + pattern + ") compadd -- " + choicesOf(parameter) + " ;;\n");
    } else if (!asked.empty()) {
      print("    " + pattern + ") compadd -- ${(f)\"$(" + asked + ")\"} ;;\n");
    } else if (parameter.kind == ValueKind::path) {
      print("    " + pattern + ") _files ;;\n");
    } else {
      print("    " + pattern + ") _message " + sh(parameter.help) + " ;;\n");
    }
  });
  print("  esac\n}\n" + function + " \"$@\"\n");
}

// ---- fish -----------------------------------------------------------------------------------------------

void fishShell(const ProgramSyntax& program) {
  const std::string at_function = "_" + functionName(program) + "_at";
  const std::string complete = std::string("complete -c ") + program.name;
  print(
      header("# SPDX-License-"
             "Identifier: Apache-2.0\n"));
  print("function " + at_function +
        " --description 'the words before the cursor are this command, and so many more'\n");
  print("    set -l valued " + valuedOptions(program) + "\n    set -l groups " + joined(groupNames(program)) +
        "\n");
  print(R"(    set -l command
    set -l count 0
    set -l skip no
    for word in (commandline -opc)[2..-1]
        if test $skip = yes
            set skip no
        else if contains -- $word $valued
            set skip yes
        else if string match -q -- '-*' $word
            continue
        else if test -n "$groups"; and begin
                test -z "$command"; or contains -- "$command" $groups
            end
            set command (string join ' ' $command $word)
        else
            set count (math $count + 1)
        end
    end
    test "$command" = "$argv[1]"; and begin
        test (count $argv) -lt 2; or test $count = $argv[2]
    end
end
)");
  print(complete + " -f\n");
  const auto line = [&](const std::string& condition, const std::string& rest) {
    print(complete + (condition.empty() ? "" : " -n " + fish(condition)) + " " + rest + "\n");
  };
  const auto at = [&](const std::string& words, const std::string& count) {
    return at_function + " \"" + words + "\"" + (count.empty() ? "" : " " + count);
  };
  const auto option = [&](const std::string& condition, const Parameter& each) {
    std::string rest = "-l " + std::string(each.name + 2) + " -d " + fish(each.help);
    if (!isFlag(each)) rest += each.kind == ValueKind::path ? " -r -F" : " -x";
    if (!each.choices.empty()) rest += " -a " + fish(choicesOf(each));
    line(condition, rest);
  };
  for (const Parameter& each : *program.globalOptions) option("", each);
  std::vector<std::string> places = groupNames(program);
  places.insert(places.begin(), "");
  for (const std::string& group : places) {
    for (const Word& each : wordsAfter(program, group)) {
      line(at(group, "0"), "-a " + fish(each.name) + " -d " + fish(each.summary));
    }
  }
  for (const CommandSyntax& command : program.commands) {
    for (const Parameter& each : *command.options) option(at(wordsOf(command), ""), each);
    for (std::size_t i = 0; i < command.positionals->size(); ++i) {
      const Parameter& each = (*command.positionals)[i];
      const std::string asked = askingCommand(each, "(commandline -opc)[-1]");
      if (!asked.empty()) {
        line(at(wordsOf(command), std::to_string(i)), "-a " + fish("(" + asked + ")"));
      } else if (!each.choices.empty()) {
        line(at(wordsOf(command), std::to_string(i)), "-a " + fish(choicesOf(each)));
      } else if (each.kind == ValueKind::path) {
        line(at(wordsOf(command), std::to_string(i)), "-F");
      }
    }
  }
}

// ---- the manual page ------------------------------------------------------------------------------------

// Underscores and stars mean something to scdoc, and a dot does at the beginning of a line.
std::string scd(const std::string& text) {
  std::string result;
  for (const char c : text) {
    if (std::strchr("_*\\~<", c) != nullptr) result += '\\';
    result += c;
  }
  return result;
}

void manualOption(const Parameter& each) {
  print("\t*" + scd(each.name) + "*" + (isFlag(each) ? "" : " _" + scd(each.valueName) + "_"));
  print(std::string(each.isRepeatable ? " (more than once, if need be)" : "") + "\n\t\t" + scd(each.help) +
        "\n\n");
}

void manualCommand(const Command& command) {
  print("*" + scd(wordsOf(command)) + "*");
  for (const Parameter& each : command.options) {
    print(" [" + scd(each.name) + (isFlag(each) ? "" : " _" + scd(each.valueName) + "_") + "]" +
          (each.isRepeatable ? "..." : ""));
  }
  for (const Parameter& each : command.positionals) print(" _" + scd(each.name) + "_");
  std::string summary = command.summary;
  summary.front() = static_cast<char>(std::toupper(static_cast<unsigned char>(summary.front())));
  print("\n\t" + scd(summary) + ".");
  if (!command.routines.empty()) {
    std::string routines;
    for (const char* each : command.routines)
      routines += (routines.empty() ? "" : " or ") + std::string(each);
    print(" Calls " + scd(routines) + ".");
  }
  print("\n\n");
  for (const Parameter& each : command.positionals) {
    print("\t_" + scd(each.name) + "_\n\t\t" + scd(each.help) + "\n\n");
  }
  for (const Parameter& each : command.options) manualOption(each);
}

void manual() {
  print("# COMMANDS\n\n");
  for (const Command& each : commandTable()) {
    if (*each.group == '\0') manualCommand(each);
  }
  for (const Group& group : commandGroups()) {
    print("## " + scd(group.name) + ": " + scd(group.summary) + "\n\n");
    for (const Command& each : commandTable()) {
      if (std::strcmp(each.group, group.name) == 0) manualCommand(each);
    }
  }
  print("# OPTIONS\n\nThese may stand anywhere.\n\n");
  for (const Parameter& each : globalOptions()) {
    print("*" + scd(each.name) + "*" + (isFlag(each) ? "" : " _" + scd(each.valueName) + "_") + "\n\t");
    print(scd(each.help) + "\n\n");
  }
}

// The program's options, for a page that has no commands.
void manualOfOptions(const ProgramSyntax& program) {
  for (const Parameter& each : *program.globalOptions) {
    print("*" + scd(each.name) + "*" + (isFlag(each) ? "" : " _" + scd(each.valueName) + "_") + "\n\t");
    std::string help = each.help;
    help.front() = static_cast<char>(std::toupper(static_cast<unsigned char>(help.front())));
    print(scd(help) + ".\n\n");
  }
}

void manualOfExitStatuses(bool asksHelper) {
  print("# EXIT STATUS\n\n");
  for (const ExitStatusFacts& each : kExitStatuses) {
    if (each.isOfRequest && !asksHelper) continue;
    print("*" + std::to_string(static_cast<int>(each.status)) + "*\n\t" + scd(each.meaning) + "\n\n");
  }
}

}  // namespace
}  // namespace brenvik::tools

int main(int argc, char** argv) {
  using namespace brenvik::tools;
  const std::string what = argc == 3 ? argv[1] : "";
  const std::string which = argc == 3 ? argv[2] : "";
  const bool isStandIn = which == kStandInName;
  const ProgramSyntax program = isStandIn ? standInSyntax() : programSyntax();
  if (which != program.name) {
    std::fprintf(stderr, "usage: command-pages bash|zsh|fish|man bvhelperctl|brenvik-standin\n");
    return 2;
  }
  if (what == "bash") {
    bash(program);
  } else if (what == "zsh") {
    zsh(program);
  } else if (what == "fish") {
    fishShell(program);
  } else if (what == "man") {
    if (isStandIn) {
      manualOfOptions(program);
    } else {
      manual();
    }
    manualOfExitStatuses(program.asksHelper);
  } else {
    return 2;
  }
  return std::fflush(stdout) == 0 ? 0 : 1;
}

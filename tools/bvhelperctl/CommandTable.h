// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <cstdint>
#include <map>
#include <nlohmann/json.hpp>
#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "brenvik/mobile_helper.h"

// Every subcommand once: its words, what it takes, the routines it calls, and the function that does it. The
// parser, the help and whatever else needs the list (completions) come from here.
namespace brenvik::tools {

// What a word on the command line may be; checked before anything is sent.
enum class ValueKind : std::uint8_t {
  text,       // UTF-8
  bytes,      // goes to the helper as it stands, or is checked by the command itself
  path,       // of a file that the helper opens: made absolute, since it works in another folder
  latitude,   // degrees
  longitude,  // degrees
  integer,    // 32 bits, signed
  count,      // from 1
  user,       // a user's number
  seconds,    // from a millisecond on
  choice,     // one of Parameter::choices
};

struct Parameter {
  const char* name;  // "DOMAIN", or "--type"
  const char* help;
  ValueKind kind = ValueKind::text;
  std::size_t limit = 0;                  // bytes that fit the message; 0: no limit
  std::vector<const char*> choices = {};  // kind choice
  bool isRepeatable = false;              // options only
  const char* valueName = "VALUE";        // options only: what help calls it; null: a flag
};

// What was given, by parameter name, in the order of the command line.
class Values {
 public:
  void add(std::string name, std::string value) { given_.emplace_back(std::move(name), std::move(value)); }
  bool has(std::string_view name) const { return find(name) != nullptr; }
  // Precondition: a positional, or has(name).
  const std::string& operator[](std::string_view name) const { return *find(name); }
  std::string get(std::string_view name, const char* otherwise) const {
    return has(name) ? (*this)[name] : otherwise;
  }
  std::span<const std::pair<std::string, std::string>> all() const { return given_; }

 private:
  const std::string* find(std::string_view name) const;
  std::vector<std::pair<std::string, std::string>> given_;
};

// A mistake in what was given that only the command itself can see.
struct UsageError {
  std::string message;
};

// What a command has done.
struct Outcome {
  const char* routine = "";     // the one that was called
  std::int32_t code = BVMH_OK;  // its result
  bool isDone = true;           // false: it answered that the work failed
  std::string text;             // for people: lines, on success
  nlohmann::ordered_json fields = nlohmann::ordered_json::object();  // for programs, on success
  std::string failure;  // what went wrong, when the command knows better than the code's text
};

struct Command {
  const char* group;  // "" for a command of one word
  const char* name;
  const char* summary;
  std::vector<const char*> routines;
  std::vector<Parameter> positionals;
  std::vector<Parameter> options;
  // Called with a client that has not checked in yet. Throws UsageError, and std::bad_alloc.
  Outcome (*run)(bvmh_client* client, const Values& values);
  // True: needs no helper; run is called with null before anything is connected.
  bool isLocal = false;
};

struct Group {
  const char* name;
  const char* summary;
};

// What may stand anywhere on the command line.
const std::vector<Parameter>& globalOptions();
const std::vector<Group>& commandGroups();
const std::vector<Command>& commandTable();

// "prefs set"
std::string wordsOf(const Command& command);

// The value of a parameter made ready for the helper; throws UsageError when it does not fit.
std::string checkedValue(const Parameter& parameter, const std::string& given);

// The number in a value that checkedValue has let through.
double secondsIn(const std::string& value);

}  // namespace brenvik::tools

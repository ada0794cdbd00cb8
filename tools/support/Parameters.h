// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <charconv>
#include <cstddef>
#include <cstdint>
#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <system_error>
#include <utility>
#include <vector>

// What may stand on a command line, and the values that did.
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

// Whether a value may be given as "-" (standard input) or "@FILE".
enum class ValueSource : std::uint8_t {
  argument,
  argumentOrFile,  // read before the command sees it
  byCommand,       // the same, but the command reads it itself
};

// What a shell may offer beside the choices; see Completion.h of bvhelperctl.
enum class Offer : std::uint8_t { nothing, choices, domains, keys };

struct Parameter {
  const char* name;  // "DOMAIN", or "--type"
  const char* help;
  ValueKind kind = ValueKind::text;
  std::size_t limit = 0;                  // bytes that fit the message; 0: no limit
  std::vector<const char*> choices = {};  // all there are for kind choice, else what a shell offers
  bool isRepeatable = false;              // options only
  const char* valueName = "VALUE";        // options only: what help calls it; null: a flag
  ValueSource source = ValueSource::argument;
  Offer offer = Offer::choices;
};

inline bool isFlag(const Parameter& parameter) noexcept { return parameter.valueName == nullptr; }

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
  std::span<std::pair<std::string, std::string>> all() { return given_; }

 private:
  const std::string* find(std::string_view name) const;
  std::vector<std::pair<std::string, std::string>> given_;
};

// A mistake in what was given.
struct UsageError {
  std::string message;
  std::string advice = "";
  bool isAboutSyntax = false;  // the words, not the values: the help is the advice
};

// The whole text as a number.
template <class Number>
std::optional<Number> numberIn(std::string_view text) {
  Number number{};
  const char* end = text.data() + text.size();
  const auto [stop, error] = std::from_chars(text.data(), end, number);
  if (error != std::errc() || stop != end || text.empty()) return std::nullopt;
  return number;
}

// The value of a parameter made ready for the helper; throws UsageError when it does not fit.
// What was read from elsewhere may be a secret: a message then does not repeat it.
std::string checkedValue(const Parameter& parameter, const std::string& given, bool isSecret = false);

// Precondition: one of the parameters has this name.
const Parameter& parameterNamed(const std::vector<Parameter>& parameters, std::string_view name);

// The number in a value that checkedValue has let through.
double secondsIn(const std::string& value);

enum class LastNewline : bool { keep, drop };

// What "-" and "@FILE" stand for. Anything else stands for itself. Standard input can be read once. Throws
// UsageError when it cannot be read or is larger than any value.
class ValueReader {
 public:
  static bool standsElsewhere(const std::string& given) { return given == "-" || given.starts_with('@'); }
  std::string read(const char* parameter, const std::string& given, LastNewline lastNewline);

 private:
  std::string readerOfInput_;  // the parameter that has read standard input
};

// Every value checked, and read where it stands somewhere else (unless "--literal" is among them); throws
// UsageError. Precondition: each has its parameter in one of the two tables.
Values checkedValues(const std::vector<Parameter>& positionals, const std::vector<Parameter>& options,
                     const Values& given);

// The content of a file that this program opens; throws UsageError.
std::string contentOf(const std::string& path);

}  // namespace brenvik::tools

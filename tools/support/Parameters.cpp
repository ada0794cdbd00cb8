// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "tools/support/Parameters.h"

#include <algorithm>
#include <array>
#include <cerrno>
#include <cstdio>
#include <cstring>
#include <filesystem>
#include <memory>

#include "platform/base/Utf8.h"
#include "platform/plist/PropertyListCodec.h"
#include "tools/support/PropertyListText.h"

namespace brenvik::tools {
namespace {

std::string contentOfStream(std::FILE* stream, const std::string& name) {
  std::string content;
  std::array<char, 65536> part;
  while (const std::size_t count = std::fread(part.data(), 1, part.size(), stream)) {
    content.append(part.data(), count);
    // Nothing larger can be stored: an endless device must not take all the memory there is.
    if (content.size() > kLargestXmlForm) throw UsageError{name + " is larger than any value can be"};
  }
  if (std::ferror(stream) != 0) throw UsageError{"cannot read " + name + ": " + std::strerror(errno)};
  return content;
}

// What a value is, when it is not what its parameter wants: for "NAME: ... is not WHAT". Empty when it is.
std::string missedBy(const Parameter& parameter, const std::string& given) {
  const auto isBetween = [&](double least, double most) {
    const auto number = numberIn<double>(given);
    return number && *number >= least && *number <= most;
  };
  const auto unless = [](bool isRight, const char* what) { return isRight ? "" : what; };
  switch (parameter.kind) {
    case ValueKind::text:
      return unless(isValidUtf8(given), "UTF-8");
    case ValueKind::bytes:
      return "";
    case ValueKind::path:
      return unless(!given.empty(), "a path");
    case ValueKind::latitude:
      return unless(isBetween(-90, 90), "a latitude, -90 to 90");
    case ValueKind::longitude:
      return unless(isBetween(-180, 180), "a longitude, -180 to 180");
    case ValueKind::integer:
      return unless(numberIn<std::int32_t>(given).has_value(), "an integer of 32 bits");
    case ValueKind::count:
      return unless(numberIn<std::int32_t>(given).value_or(0) >= 1, "a number of at least 1");
    case ValueKind::user:
      return unless(numberIn<std::uint32_t>(given).has_value(), "a user's number");
    case ValueKind::seconds:
      // As milliseconds they must fit 32 bits.
      return unless(isBetween(0.001, 4'000'000), "a number of seconds, 0.001 to 4000000");
    case ValueKind::choice:
      break;
  }
  std::string all;
  for (const char* each : parameter.choices) {
    if (given == each) return "";
    all += std::string(all.empty() ? "" : ", ") + each;
  }
  return "one of: " + all;
}

}  // namespace

const std::string* Values::find(std::string_view name) const {
  const auto found =
      std::find_if(given_.begin(), given_.end(), [&](const auto& each) { return each.first == name; });
  return found == given_.end() ? nullptr : &found->second;
}

std::string checkedValue(const Parameter& parameter, const std::string& given, bool isSecret) {
  const std::string name = std::string(parameter.name) + ": ";
  const auto wrong = [&](const std::string& what) {
    return UsageError{name + (isSecret ? "what was read" : '"' + printable(given) + '"') + " is not " + what};
  };
  if (const std::string what = missedBy(parameter, given); !what.empty()) throw wrong(what);
  // Every text but a value's own travels as a C string.
  if (parameter.kind == ValueKind::text && given.find('\0') != std::string::npos)
    throw UsageError{name + "a NUL cannot be part of it"};
  std::string value = given;
  if (parameter.kind == ValueKind::path) {
    std::error_code error;
    value = std::filesystem::absolute(given, error).string();
    if (error) throw wrong("a path from here: " + error.message());
  }
  if (parameter.limit != 0 && value.size() > parameter.limit) {
    throw UsageError{name + "at most " + std::to_string(parameter.limit) + " bytes"};
  }
  return value;
}

const Parameter& parameterNamed(const std::vector<Parameter>& parameters, std::string_view name) {
  return *std::find_if(parameters.begin(), parameters.end(),
                       [&](const Parameter& each) { return name == each.name; });
}

double secondsIn(const std::string& value) { return numberIn<double>(value).value_or(0); }

std::string contentOf(const std::string& path) {
  struct Close {
    void operator()(std::FILE* file) const { (void)std::fclose(file); }  // only read from
  };
  const std::unique_ptr<std::FILE, Close> file(std::fopen(path.c_str(), "rbe"));
  if (file == nullptr) throw UsageError{"cannot read " + printable(path) + ": " + std::strerror(errno)};
  return contentOfStream(file.get(), printable(path));
}

std::string ValueReader::read(const char* parameter, const std::string& given, LastNewline lastNewline) {
  if (!standsElsewhere(given)) return given;
  std::string content;
  if (given == "-") {
    if (!readerOfInput_.empty()) {
      throw UsageError{std::string(parameter) + ": standard input was already read for " + readerOfInput_};
    }
    readerOfInput_ = parameter;
    content = contentOfStream(stdin, "standard input");
  } else {
    content = contentOf(given.substr(1));
  }
  if (lastNewline == LastNewline::drop && content.ends_with('\n')) content.pop_back();
  return content;
}

Values checkedValues(const std::vector<Parameter>& positionals, const std::vector<Parameter>& options,
                     const Values& given) {
  Values values;
  ValueReader reader;
  const bool isLiteral = given.has("--literal");
  const char* readAsEmpty = nullptr;
  for (const auto& [name, value] : given.all()) {
    const auto named = [&wanted = name](const Parameter& each) { return wanted == each.name; };
    auto parameter = std::find_if(positionals.begin(), positionals.end(), named);
    if (parameter == positionals.end()) parameter = std::find_if(options.begin(), options.end(), named);
    const bool isElsewhere =
        parameter->source == ValueSource::argumentOrFile && !isLiteral && ValueReader::standsElsewhere(value);
    const std::string text = isElsewhere ? reader.read(parameter->name, value, LastNewline::drop) : value;
    if (isElsewhere && text.empty() && readAsEmpty == nullptr) readAsEmpty = parameter->name;
    values.add(name, checkedValue(*parameter, text, isElsewhere));
  }
  // More likely a program before the pipe that failed than an empty value that somebody wants.
  if (readAsEmpty != nullptr) {
    throw UsageError{std::string(readAsEmpty) + ": what was read is empty",
                     "An empty value is given as an argument: \"\"."};
  }
  return values;
}

}  // namespace brenvik::tools

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <cstdint>
#include <nlohmann/json.hpp>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "brenvik/mobile_helper.h"
#include "tools/support/ExitStatus.h"

namespace brenvik::tools {

// What a command has done.
struct Outcome {
  const char* routine = "";     // name of the routine that was called
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
inline Outcome did(const char* routine, std::int32_t code, std::string text) {
  Outcome outcome;
  outcome.routine = routine;
  outcome.code = code;
  outcome.text = std::move(text);
  return outcome;
}

}  // namespace brenvik::tools

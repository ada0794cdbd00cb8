// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <filesystem>
#include <string>
#include <vector>

// Helpers that run, as /proc shows them to everybody (proc(5)).
namespace brenvik::tools {

// Returns the content of a file in /proc or /sys; empty when it cannot be read. Not by streams: with them the
// program carries all of the library's locales, and each start of any command is slower by a fifth.
std::string factsIn(const std::filesystem::path& path);

// The words of the first line that begins with `name`; "" stands for the very first line.
std::vector<std::string> wordsAfter(const std::string& text, const std::string& name);

struct HelperProcess {
  int id = 0;
  std::string status;  // /proc/PID/status
  // In this program's process table and in no container's of its own.
  bool isOfThisSystem = true;
};

std::vector<HelperProcess> helperProcesses();

}  // namespace brenvik::tools

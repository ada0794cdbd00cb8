// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/base/ProcessFacts.h"

#include <fcntl.h>
#include <limits.h>
#include <sys/stat.h>
#include <unistd.h>

#include <array>
#include <charconv>

#include "platform/base/ProcPath.h"
#include "platform/base/UniqueFd.h"

namespace brenvik {
namespace {

// The number that a text begins with.
template <typename Number>
bool startsWith(std::string_view text, Number* number) noexcept {
  return std::from_chars(text.data(), text.data() + text.size(), *number).ec == std::errc();
}

}  // namespace

std::optional<ProcessFacts> parseProcessStat(std::string_view text) noexcept {
  // The program's name, field 2, is in brackets, is the process's own choice and may hold brackets and
  // blanks: count from its end.
  const std::size_t nameEnd = text.rfind(')');
  if (nameEnd == std::string_view::npos) return std::nullopt;
  std::string_view rest = text.substr(nameEnd + 1);
  ProcessFacts facts;
  std::uint64_t ticks = 0;
  for (int field = 3; field <= 22; ++field) {
    const std::size_t blank = rest.find(' ');
    if (blank == std::string_view::npos) return std::nullopt;
    rest.remove_prefix(blank + 1);
    if (field == 3 && !rest.empty()) facts.state = rest.front();
    if (field == 6 && !startsWith(rest, &facts.session)) return std::nullopt;
    if (field == 22 && !startsWith(rest, &ticks)) return std::nullopt;
  }
  facts.startTime = static_cast<std::uint32_t>(ticks);
  return facts;
}

std::optional<ProcessFacts> processFacts(pid_t pid) noexcept {
  const UniqueFd file(::open(ProcPath(pid, "stat").c_str(), O_RDONLY | O_CLOEXEC));
  std::array<char, 1024> text;
  const ssize_t size = ::read(file.get(), text.data(), text.size());  // fails when nothing is open
  if (size <= 0) return std::nullopt;
  return parseProcessStat({text.data(), static_cast<std::size_t>(size)});
}

std::optional<std::uint32_t> processStartTime(pid_t pid) noexcept {
  const auto facts = processFacts(pid);
  return facts ? std::optional(facts->startTime) : std::nullopt;
}

ProgramFacts programFacts() { return programFactsOf("/proc/self/exe"); }

ProgramFacts programFactsOf(const char* link) {
  std::array<char, PATH_MAX> text;
  const ssize_t size = ::readlink(link, text.data(), text.size());
  if (size <= 0) return {};
  ProgramFacts facts;
  facts.path.assign(text.data(), static_cast<std::size_t>(size));
  struct stat running {};
  struct stat standing {};
  // Through the link the kernel leads to the file itself, whatever has become of its name.
  if (::stat(link, &running) != 0) return facts;
  const auto differs = [&] {
    return ::stat(facts.path.c_str(), &standing) != 0 || standing.st_dev != running.st_dev ||
           standing.st_ino != running.st_ino;
  };
  if (!differs()) return facts;
  facts.isReplaced = true;
  // So proc(5) marks a name that is gone; a name may end like that, too, but then it is still there.
  constexpr std::string_view kMark = " (deleted)";
  if (facts.path.ends_with(kMark)) facts.path.resize(facts.path.size() - kMark.size());
  return facts;
}

}  // namespace brenvik

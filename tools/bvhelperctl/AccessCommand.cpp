// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "tools/bvhelperctl/AccessCommand.h"

#include <fcntl.h>
#include <pwd.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <charconv>
#include <cstring>
#include <optional>
#include <utility>

#include "platform/accounts/linux/PasswordDatabase.h"
#include "platform/base/ProcessFacts.h"
#include "platform/security/linux/EntitlementSearch.h"
#include "tools/support/PropertyListText.h"

namespace brenvik::tools {
namespace {

constexpr const char kEntitlement[] = "com.norvale.Teravox.BrenvikHelper.allow";

using Kind = EntitlementFinding::Kind;

const char* nameOf(Kind kind) {
  switch (kind) {
    case Kind::holds:
      return "holds";
    case Kind::differs:
      return "differs";
    case Kind::wrong:
      return "wrong";
    case Kind::unknown:
      return "unknown";
    case Kind::note:
      return "note";
  }
  return "";
}

// A program that is not running: what the helper would see if it were.
class ImaginedCaller final : public EntitlementCandidate {
 public:
  ImaginedCaller(const std::string& path, uid_t uid, std::string unit) : uid_(uid), unit_(std::move(unit)) {
    struct stat facts {};
    if (::stat(path.c_str(), &facts) == 0) executable_ = {facts.st_dev, facts.st_ino};
  }
  uid_t uid() const noexcept override { return uid_; }
  const std::optional<FileIdentity>& executable() override { return executable_; }
  const std::string& unit() override { return unit_; }

 private:
  const uid_t uid_;
  const std::string unit_;
  std::optional<FileIdentity> executable_;
};

// The interpreter that the kernel starts for a script; nothing when the file is no script.
std::optional<std::string> interpreterOf(const std::string& path) {
  const UniqueFd file(::open(path.c_str(), O_RDONLY | O_NONBLOCK | O_NOCTTY | O_CLOEXEC));
  std::array<char, 256> text;  // as much as the kernel reads
  const ssize_t size = ::read(file.get(), text.data(), text.size());
  if (size < 3) return std::nullopt;
  std::string_view line(text.data(), static_cast<std::size_t>(size));
  if (!line.starts_with("#!")) return std::nullopt;
  line = line.substr(0, line.find('\n'));
  line.remove_prefix(std::min(line.find_first_not_of(" \t", 2), line.size()));
  line = line.substr(0, line.find_first_of(" \t"));
  if (line.empty()) return std::nullopt;
  return std::string(line);
}

struct Asked {
  std::string executable;
  std::vector<std::string> scripts;  // what was given, and is run by the next
  uid_t uid = 0;
  std::string account;
  std::string unit;
};

void takeExecutable(const Values& values, Asked* asked) {
  if (values.has("--exe")) {
    asked->executable = values["--exe"];
  } else {
    std::array<char, 4096> path{};
    const ssize_t size = ::readlink("/proc/self/exe", path.data(), path.size());
    if (size > 0) asked->executable.assign(path.data(), static_cast<std::size_t>(size));
  }
  struct stat facts {};
  if (::stat(asked->executable.c_str(), &facts) != 0) {
    throw UsageError{"--exe: " + printable(asked->executable) + ": " + std::strerror(errno)};
  }
  if (!S_ISREG(facts.st_mode)) {
    throw UsageError{"--exe: " + printable(asked->executable) + " is not a regular file"};
  }
  constexpr std::size_t kMaxInterpreters = 4;  // the kernel follows no more
  while (asked->scripts.size() < kMaxInterpreters) {
    auto interpreter = interpreterOf(asked->executable);
    if (!interpreter) break;
    asked->scripts.push_back(std::exchange(asked->executable, std::move(*interpreter)));
  }
}

void takeAccount(const Values& values, PasswordDatabase& accounts, Asked* asked) {
  asked->uid = ::geteuid();
  if (values.has("--user")) {
    const std::string& given = values["--user"];
    const auto ids = accounts.idsOf(given.c_str());
    if (ids) {
      asked->uid = ids->uid;
    } else {
      const char* const end = given.data() + given.size();
      const auto [stop, error] = std::from_chars(given.data(), end, asked->uid);
      if (given.empty() || error != std::errc() || stop != end) {
        throw UsageError{"--user: there is no account named \"" + printable(given) + "\""};
      }
    }
  }
  const passwd* const account = ::getpwuid(asked->uid);
  if (account != nullptr) asked->account = account->pw_name;
}

void takeUnit(const Values& values, Asked* asked) {
  if (values.has("--unit")) {
    asked->unit = values["--unit"];
  } else if (!values.has("--exe")) {
    const auto startTime = processStartTime(::getpid());
    const auto self = CallerProcess::pin("/proc", ::getpid(), startTime.value_or(0));
    if (self) asked->unit = self->unit();
  }
}

std::string verdictOn(const EntitlementSearch::Result& result,
                      const std::vector<EntitlementFinding>& findings) {
  return result.value.asBoolean() == true ? result.file + " gives it" : whyNotEntitled(result, findings);
}

nlohmann::ordered_json fieldsOf(const Asked& asked, const EntitlementSearch::Result& result,
                                const std::vector<EntitlementFinding>& findings) {
  nlohmann::ordered_json steps = nlohmann::ordered_json::array();
  for (const EntitlementFinding& each : findings) {
    steps.push_back(
        {{"path", each.path}, {"key", each.key}, {"result", nameOf(each.kind)}, {"text", each.text}});
  }
  nlohmann::ordered_json fields{{"ok", !result.error}, {"granted", result.value.asBoolean() == true}};
  fields["caller"] = {
      {"executable", asked.executable}, {"uid", asked.uid}, {"account", asked.account}, {"unit", asked.unit}};
  fields["entitlement"] = kEntitlement;
  fields[result.error ? "error" : "reason"] = verdictOn(result, findings);
  fields["steps"] = std::move(steps);
  return fields;
}

// The word, filled up to a column of that width.
std::string column(std::string word, std::size_t width) {
  word.resize(std::max(word.size(), width), ' ');
  return word;
}

std::string textOf(const Asked& asked, const EntitlementSearch::Result& result,
                   const std::vector<EntitlementFinding>& findings) {
  std::string text;
  for (const std::string& script : asked.scripts) {
    text += printable(script) + " is a script: what runs is its interpreter\n";
  }
  const std::string account = asked.account.empty() ? std::to_string(asked.uid)
                                                    : asked.account + " (" + std::to_string(asked.uid) + ")";
  constexpr std::size_t kFacts = 12;  // columns
  text += column("executable", kFacts) + printable(asked.executable) + '\n';
  text += column("account", kFacts) + printable(account) + '\n';
  text += column("unit", kFacts) + (asked.unit.empty() ? "none" : printable(asked.unit)) + '\n';
  text += column("asks for", kFacts) + kEntitlement + '\n';
  std::string path;
  for (const EntitlementFinding& each : findings) {
    if (each.path != path) {
      path = each.path;
      text += '\n' + printable(path) + '\n';
    }
    const std::string subject = each.key.empty() ? "" : each.key + ' ';
    text += "  " + column(nameOf(each.kind), 9) + printable(subject + each.text) + '\n';
  }
  const char* const verdict = result.error                       ? "cannot be told"
                              : result.value.asBoolean() == true ? "let in"
                                                                 : "refused";
  return text + '\n' + verdict + ": " + printable(verdictOn(result, findings));
}

}  // namespace

Outcome explainAccess(const Values& values) { return explainAccess(values, entitlementDirectories()); }

Outcome explainAccess(const Values& values, std::vector<std::string> directories) {
  PasswordDatabase accounts;
  Asked asked;
  takeExecutable(values, &asked);
  takeAccount(values, accounts, &asked);
  takeUnit(values, &asked);

  EntitlementSearch search(accounts, std::move(directories));
  ImaginedCaller caller(asked.executable, asked.uid, asked.unit);
  std::vector<EntitlementFinding> findings;
  const EntitlementSearch::Result result = search.find(kEntitlement, caller, &findings);
  Outcome outcome;
  outcome.fields = fieldsOf(asked, result, findings);
  outcome.text = textOf(asked, result, findings);
  outcome.status = result.error                       ? ExitStatus::failed
                   : result.value.asBoolean() == true ? ExitStatus::done
                                                      : ExitStatus::refused;
  return outcome;
}

}  // namespace brenvik::tools

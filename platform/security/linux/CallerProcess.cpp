// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/security/linux/CallerProcess.h"

#include <fcntl.h>
#include <unistd.h>

#include <array>
#include <cerrno>

namespace brenvik {
namespace {

// Longer than any path the kernel gives for a cgroup, times the hierarchies of an old system.
constexpr std::size_t kLargestCgroupText = std::size_t{64} << 10;

std::string_view takeLine(std::string_view* text) noexcept {
  const std::size_t end = text->find('\n');
  const std::string_view line = text->substr(0, end);
  text->remove_prefix(end == std::string_view::npos ? text->size() : end + 1);
  return line;
}

}  // namespace

// The manager of a user and the owner of a delegated unit name the groups below theirs as they like, a unit's
// name of the system among others. Slices of the system's manager are handed to nobody, but for what stands
// in user.slice.
std::string_view unitOfCgroup(std::string_view path) noexcept {
  if (!path.starts_with('/')) return {};
  for (;;) {
    path.remove_prefix(1);
    const std::size_t slash = path.find('/');
    if (slash == std::string_view::npos) return path;
    const std::string_view above = path.substr(0, slash);
    constexpr std::string_view kSlice = ".slice";
    if (!above.ends_with(kSlice) || above.size() == kSlice.size() || above == "user.slice") return {};
    path.remove_prefix(slash);
  }
}

std::string_view unitOfCgroups(std::string_view text) noexcept {
  std::string_view path;
  while (!text.empty()) {
    std::string_view line = takeLine(&text);
    const std::size_t first = line.find(':');
    const std::size_t second = first == std::string_view::npos ? first : line.find(':', first + 1);
    if (second == std::string_view::npos) continue;
    const std::string_view controllers = line.substr(first + 1, second - first - 1);
    const bool unified = controllers.empty() && line.substr(0, first) == "0";
    if (!unified && controllers != "name=systemd") continue;
    path = line.substr(second + 1);
    if (unified) break;
  }
  return unitOfCgroup(path);
}

std::optional<CallerProcess> CallerProcess::pin(const std::string& proc, pid_t pid, std::uint32_t startTime,
                                                CallerReader* reader) {
  if (pid <= 0) return std::nullopt;
  const std::string path = proc + '/' + std::to_string(pid);
  CallerProcess process(UniqueFd(::open(path.c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC)), reader);
  if (!process.folder_.isValid() || !process.runsSince(startTime)) return std::nullopt;
  return process;
}

bool CallerProcess::runsSince(std::uint32_t startTime) const noexcept {
  const UniqueFd file(::openat(folder_.get(), "stat", O_RDONLY | O_CLOEXEC));
  std::array<char, 1024> text;
  const ssize_t size = ::read(file.get(), text.data(), text.size());  // fails when nothing is open
  if (size <= 0) return false;
  const auto facts = parseProcessStat({text.data(), static_cast<std::size_t>(size)});
  return facts && facts->startTime == startTime && facts->state != 'Z' && facts->state != 'X';
}

// Nothing when this process needs no help, or there is none.
std::optional<CallerFacts> CallerProcess::ask() const {
  return errno == EACCES && reader_ != nullptr ? reader_->read(folder_.get()) : std::nullopt;
}

std::optional<FileIdentity> CallerProcess::executable() const {
  if (const auto found = identityAt(folder_.get(), "exe")) return found;
  const auto told = ask();
  return told ? told->executable : std::nullopt;
}

CallerFacts CallerProcess::facts() const {
  CallerFacts found = callerFactsOf(folder_.get());
  if (found.executable && found.userNamespace) return found;
  auto told = ask();  // errno is still that of whichever was read last in vain
  return told ? std::move(*told) : found;
}

std::optional<FileIdentity> CallerProcess::namespaceOfThisProcess(const std::string& proc) {
  return identityAt(AT_FDCWD, (proc + "/self/ns/user").c_str());
}

std::string CallerProcess::unit() const {
  const UniqueFd file(::openat(folder_.get(), "cgroup", O_RDONLY | O_CLOEXEC));
  std::string text;
  std::array<char, 1024> part;
  for (;;) {
    const ssize_t size = ::read(file.get(), part.data(), part.size());  // fails when nothing is open
    if (size < 0 || text.size() > kLargestCgroupText) return {};
    if (size == 0) return std::string(unitOfCgroups(text));
    text.append(part.data(), static_cast<std::size_t>(size));
  }
}

}  // namespace brenvik

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/security/linux/EntitlementFiles.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <optional>
#include <utility>

#include "platform/base/UniqueFd.h"
#include "platform/log/Log.h"
#include "platform/plist/PropertyListCodec.h"
#include "platform/security/linux/CallerProcess.h"
#include "platform/security/linux/Sha256.h"

namespace brenvik {
namespace {

// A file names one program and a few entitlements; this is a thousand times that.
constexpr std::size_t kLargestFile = std::size_t{1} << 20;
constexpr std::string_view kSuffix = ".plist";
constexpr std::string_view kDefaultUser = "root";

// The names in a directory that may be entitlement files, in order; nothing when it cannot be read. Without
// readdir(3), which asks three more questions of the system at every first check-in.
std::optional<std::vector<std::string>> entitlementFilesIn(int directory) {
  std::vector<std::string> names;
  alignas(dirent64) std::array<char, 4096> entries;
  for (;;) {
    const ssize_t size = ::getdents64(directory, entries.data(), entries.size());
    if (size < 0) return std::nullopt;
    if (size == 0) break;
    for (ssize_t at = 0; at < size;) {
      const auto* const entry = reinterpret_cast<const dirent64*>(entries.data() + at);
      const std::string_view name = entry->d_name;
      if (name.ends_with(kSuffix) && !name.starts_with('.')) names.emplace_back(name);
      at += entry->d_reclen;
    }
  }
  std::sort(names.begin(), names.end());
  return names;
}

// Only the superuser can have put it there or changed it.
bool isTrusted(const struct stat& facts) noexcept {
  return facts.st_uid == 0 && (facts.st_mode & (S_IWGRP | S_IWOTH)) == 0;
}

std::vector<std::string> splitPath(std::string_view path) {
  std::vector<std::string> parts;
  while (!path.empty()) {
    const std::size_t colon = path.find(':');
    parts.emplace_back(path.substr(0, colon));
    path.remove_prefix(colon == std::string_view::npos ? path.size() : colon + 1);
  }
  return parts;
}

// A text that can be handed to the system: a property list may hold NULs.
bool isCString(std::string_view text) noexcept { return text.find('\0') == std::string_view::npos; }

// What a file says of itself, all keys of the right type.
struct Entry {
  std::string executable;
  std::string user;
  std::optional<std::string> unit;
  std::optional<std::string> sha256;
  PropertyList entitlements;
};

// False when the key is there with another type.
bool takeOptional(const PropertyList& file, std::string_view key, std::optional<std::string>* text) {
  const PropertyList value = file.find(key);
  if (!value) return true;
  const auto string = value.asString();
  if (string) text->emplace(*string);
  return string.has_value();
}

std::optional<Entry> readEntry(const PropertyList& file) {
  Entry entry;
  const PropertyList executable = file.find("Executable");
  const auto path = executable.asString();
  if (!path || !path->starts_with('/') || !isCString(*path)) return std::nullopt;
  entry.executable = *path;
  std::optional<std::string> user;
  if (!takeOptional(file, "User", &user) || !takeOptional(file, "Unit", &entry.unit) ||
      !takeOptional(file, "SHA256", &entry.sha256)) {
    return std::nullopt;
  }
  entry.user = user.value_or(std::string(kDefaultUser));
  if (!isCString(entry.user)) return std::nullopt;
  entry.entitlements = file.find("Entitlements");
  if (!entry.entitlements.is(PropertyList::Type::dictionary)) return std::nullopt;
  return entry;
}

enum class Verdict {
  passedOver,   // does not match, or must not be believed
  matches,      // speaks for the caller
  undecidable,  // might speak for the caller, and cannot be asked now
};

}  // namespace

class EntitlementFiles::Task final : public SecurityTask {
 public:
  Task(const EntitlementFiles& files, CallerProcess process, uid_t uid) noexcept
      : files_(files), process_(std::move(process)), uid_(uid) {}

  Answer copyEntitlement(std::string_view name) noexcept override try {
    Answer answer;
    for (const std::string& directory : files_.directories_) {
      if (lookInDirectory(directory, name, &answer)) break;
    }
    // Last, so that whatever was read was read while the caller was there: a process that has gone holds
    // nothing, and one that has become another program holds what that one does.
    if (answer.value && process_.executable() != executable_) return {};
    return answer;
  } catch (...) {
    return {{}, true};  // out of memory
  }

 private:
  // Both return true when the question is settled, one way or the other.
  bool lookInDirectory(const std::string& directory, std::string_view name, Answer* answer) {
    const UniqueFd folder(::open(directory.c_str(), O_RDONLY | O_DIRECTORY | O_NONBLOCK | O_CLOEXEC));
    if (!folder.isValid() && errno == ENOENT) return false;
    if (!folder.isValid() && errno == ENOTDIR) {
      logUnified(LogLevel::error, "entitlement directory %s passed over: not a directory", directory.c_str());
      return false;
    }
    struct stat facts {};
    if (::fstat(folder.get(), &facts) != 0) return giveUpOn(directory, answer);  // also when none is open
    if (!isTrusted(facts)) {
      logUnified(LogLevel::error,
                 "entitlement directory %s passed over: not owned by root, or others may write to it",
                 directory.c_str());
      return false;
    }
    const auto names = entitlementFilesIn(folder.get());
    if (!names) return giveUpOn(directory, answer);
    return std::any_of(names->begin(), names->end(), [&](const std::string& file) {
      return lookInFile(folder.get(), file, directory + '/' + file, name, answer);
    });
  }

  bool lookInFile(int directory, const std::string& file, const std::string& path, std::string_view name,
                  Answer* answer) {
    PropertyList content;
    const Verdict isReadable = read(directory, file, path, &content);
    if (isReadable == Verdict::undecidable) return giveUpOn(path, answer);
    if (isReadable == Verdict::passedOver) return false;
    const auto entry = readEntry(content);
    if (!entry) return false;
    PropertyList value = entry->entitlements.find(name);
    const Verdict isTheCallers = judge(*entry, value.hasValue(), path);
    if (isTheCallers == Verdict::undecidable) return giveUpOn(path, answer);
    if (isTheCallers == Verdict::passedOver) return false;
    answer->value = std::move(value);
    return true;
  }

  // A file that might have said no is not skipped in favour of a later one that says yes.
  static bool giveUpOn(const std::string& path, Answer* answer) noexcept {
    logUnified(LogLevel::error, "entitlements cannot be told: %s cannot be examined", path.c_str());
    answer->error = true;
    return true;
  }

  static Verdict passOver(const std::string& path, const char* why) noexcept {
    logUnified(LogLevel::error, "entitlement file %s passed over: %s", path.c_str(), why);
    return Verdict::passedOver;
  }

  static Verdict read(int directory, const std::string& file, const std::string& path,
                      PropertyList* content) {
    // Neither a link out of the directory nor a pipe or a device that would hold us up.
    const UniqueFd fd(
        ::openat(directory, file.c_str(), O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_NOCTTY | O_CLOEXEC));
    const int error = errno;
    struct stat facts {};
    if (::fstat(fd.get(), &facts) != 0) {  // as of a file that could not be opened
      switch (error) {
        case ENOENT:
          return Verdict::passedOver;  // removed since it was listed
        case ELOOP:
        case ENXIO:
        case ENODEV:
          return passOver(path, "not a regular file");
        default:
          return Verdict::undecidable;
      }
    }
    if (!S_ISREG(facts.st_mode)) return passOver(path, "not a regular file");
    if (!isTrusted(facts)) return passOver(path, "not owned by root, or others may write to it");
    if (static_cast<std::uint64_t>(facts.st_size) > kLargestFile) return passOver(path, "too large");
    std::vector<std::byte> bytes(static_cast<std::size_t>(facts.st_size));
    // A regular file gives all it has at once, unless it fails or is being changed.
    if (::read(fd.get(), bytes.data(), bytes.size()) != facts.st_size) return Verdict::undecidable;
    CodecFailure failure{};
    *content = parsePropertyList(bytes, &failure);
    if (failure == CodecFailure::noMemory) return Verdict::undecidable;
    if (!content->is(PropertyList::Type::dictionary))
      return passOver(path, "not a property list of the right form");
    return Verdict::matches;
  }

  // In order of what can be relied on: the account, which the kernel attached to the message, comes first, so
  // that nothing of a caller of another account is even looked at. `hasKey` spares the rest to a file that
  // has nothing to say.
  Verdict judge(const Entry& entry, bool hasKey, const std::string& path) {
    if (!isOfAccount(entry.user)) return Verdict::passedOver;

    struct stat facts {};
    if (::stat(entry.executable.c_str(), &facts) != 0) {
      return errno == ENOMEM || errno == EIO ? Verdict::undecidable : Verdict::passedOver;
    }
    const auto running = executable();
    if (!running || *running != CallerProcess::FileIdentity{facts.st_dev, facts.st_ino})
      return Verdict::passedOver;
    if (!isTrusted(facts)) {
      return passOver(path, "its executable is not owned by root, or others may write to it");
    }
    if (!hasKey) return Verdict::passedOver;

    if (entry.unit && !runsIn(*entry.unit)) return Verdict::passedOver;
    return entry.sha256 ? judgeDigest(*entry.sha256) : Verdict::matches;
  }

  // No unit has an empty name, which is what a caller in none would show.
  bool runsIn(const std::string& unit) const {
    if (unit.empty()) return false;
    return process_.unit() == unit;
  }

  Verdict judgeDigest(const std::string& hex) const noexcept {
    const auto wanted = parseSha256(hex);
    if (!wanted) return Verdict::passedOver;
    const UniqueFd fd = process_.openExecutable();
    if (!fd.isValid() && (errno == ENOENT || errno == ESRCH)) return Verdict::passedOver;  // it has gone
    struct stat facts {};
    if (::fstat(fd.get(), &facts) != 0) return Verdict::undecidable;  // also when it cannot be opened
    // It may have become another program since it was compared.
    if (executable_ != CallerProcess::FileIdentity{facts.st_dev, facts.st_ino}) return Verdict::passedOver;
    const auto digest = sha256OfFile(fd.get());
    if (!digest) return Verdict::undecidable;
    return *digest == *wanted ? Verdict::matches : Verdict::passedOver;
  }

  // An account that cannot be looked up is not the caller's.
  bool isOfAccount(const std::string& name) {
    // The superuser has this id by definition: the usual case spares reading the account database.
    if (name == kDefaultUser) return uid_ == 0;
    const auto ids = files_.accounts_.idsOf(name.c_str());
    return ids && ids->uid == uid_;
  }

  const std::optional<CallerProcess::FileIdentity>& executable() noexcept {
    if (!executable_) executable_ = process_.executable();
    return executable_;
  }

  const EntitlementFiles& files_;
  const CallerProcess process_;
  const uid_t uid_;
  std::optional<CallerProcess::FileIdentity> executable_;  // asked for once
};

EntitlementFiles::EntitlementFiles(AccountDirectory& accounts)
    : EntitlementFiles(accounts, splitPath(BRENVIK_ENTITLEMENT_DIRECTORIES)) {}

EntitlementFiles::EntitlementFiles(AccountDirectory& accounts, std::vector<std::string> directories,
                                   std::string proc)
    : accounts_(accounts), directories_(std::move(directories)), proc_(std::move(proc)) {}

std::unique_ptr<SecurityTask> EntitlementFiles::makeTask(const AuditToken& caller) noexcept try {
  auto process = CallerProcess::pin(proc_, caller.pid(), caller.pidVersion());
  if (!process) return nullptr;
  return std::make_unique<Task>(*this, std::move(*process), caller.uid());
} catch (...) {
  return nullptr;  // out of memory
}

}  // namespace brenvik

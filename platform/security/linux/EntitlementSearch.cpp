// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/security/linux/EntitlementSearch.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <concepts>
#include <cstring>
#include <span>
#include <utility>

#include "platform/log/Log.h"
#include "platform/plist/PropertyListCodec.h"
#include "platform/security/linux/Sha256.h"
#include "platform/security/linux/TrustedPath.h"

namespace brenvik {
namespace {

using Kind = EntitlementFinding::Kind;
using Type = PropertyList::Type;

// A file names one program and a few entitlements; this is a thousand times that.
constexpr std::size_t kLargestFile = std::size_t{1} << 20;
constexpr std::string_view kSuffix = ".plist";
constexpr std::string_view kDefaultUser = "root";
// An administrator has a handful of files; where so many are wrong, some are told again.
constexpr std::size_t kMaxToldCallers = 1024;

constexpr const char kChangeable[] = "not owned by root, or others may write to it";

// The names in a directory that may be entitlement files, in order; nothing when it cannot be read. Without
// readdir(3), which asks three more questions of the system at every first check-in.
std::optional<std::vector<std::string>> entitlementFilesIn(int directory) {
  std::vector<std::string> names;
  alignas(dirent64) std::array<char, 1024> entries;  // some thirty files at a time
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

// A text that can be handed to the system: a property list may hold NULs.
bool isCString(std::string_view text) noexcept { return text.find('\0') == std::string_view::npos; }

const char* nameOf(Type type) noexcept {
  switch (type) {
    case Type::boolean:
      return "a boolean";
    case Type::integer:
      return "an integer";
    case Type::real:
      return "a real";
    case Type::string:
      return "a string";
    case Type::data:
      return "data";
    case Type::date:
      return "a date";
    case Type::array:
      return "an array";
    case Type::dictionary:
      return "a dictionary";
  }
  return "";
}

// The value of an entitlement that is not true.
std::string valueInWords(const PropertyList& value) {
  return value.is(Type::boolean) ? "false" : std::string(nameOf(value.type())) + ", not a boolean";
}

// What a file says of itself, all keys of the right type and form.
struct Entry {
  std::string executable;
  std::string user = std::string(kDefaultUser);
  std::optional<std::string> unit;
  std::optional<Sha256Digest> sha256;
  PropertyList entitlements;
};

struct WrongKey {
  const char* key;
  std::string text;
};

// Reads each key of a file, and collects what is wrong with which.
class EntryReader {
 public:
  explicit EntryReader(const PropertyList& file) : file_(file) {}

  Entry read() {
    Entry entry;
    const auto executable = text("Executable", IsNeeded::yes);
    if (executable && (!executable->starts_with('/') || !isCString(*executable))) {
      blame("Executable", "is not an absolute path");
    }
    if (executable) entry.executable = *executable;
    const auto user = text("User", IsNeeded::no);
    if (user) entry.user = *user;
    const auto unit = text("Unit", IsNeeded::no);
    if (unit && (unit->empty() || unit->find('/') != std::string_view::npos)) {
      blame("Unit", "is not the name of a unit");
    }
    if (unit) entry.unit = *unit;
    if (const auto digest = text("SHA256", IsNeeded::no)) {
      entry.sha256 = parseSha256(*digest);
      if (!entry.sha256) blame("SHA256", "is not 64 hexadecimal digits");
    }
    entry.entitlements = file_.find("Entitlements");
    check("Entitlements", entry.entitlements, Type::dictionary, IsNeeded::yes);
    return entry;
  }
  const std::vector<WrongKey>& wrong() const noexcept { return wrong_; }

 private:
  enum class IsNeeded { no, yes };

  void blame(const char* key, std::string text) { wrong_.push_back({key, std::move(text)}); }

  bool check(const char* key, const PropertyList& value, Type type, IsNeeded isNeeded) {
    if (value.is(type)) return true;
    if (value) {
      blame(key, std::string("is ") + nameOf(value.type()) + ", not " + nameOf(type));
    } else if (isNeeded == IsNeeded::yes) {
      blame(key, "is missing");
    }
    return false;
  }

  std::optional<std::string> text(const char* key, IsNeeded isNeeded) {
    const PropertyList value = file_.find(key);
    if (!check(key, value, Type::string, isNeeded)) return std::nullopt;
    return std::string(*value.asString());
  }

  const PropertyList& file_;
  std::vector<WrongKey> wrong_;
};

}  // namespace

// One search. The steps return true when the question is settled, one way or the other.
class EntitlementSearch::Run {
 public:
  Run(EntitlementSearch& search, std::string_view name, EntitlementCandidate& candidate,
      std::vector<EntitlementFinding>* findings)
      : search_(search), name_(name), candidate_(candidate), findings_(findings) {}

  Result run() {
    for (const std::string& directory : search_.directories_) {
      path_ = directory;
      if (lookInDirectory(directory)) break;
    }
    return std::move(result_);
  }

 private:
  enum class Verdict {
    passedOver,   // does not match, or must not be believed
    matches,      // speaks for the candidate
    undecidable,  // might speak for the candidate, and cannot be asked now
  };

  bool lookInDirectory(const std::string& directory) {
    const TrustedPath walked = walkTrustedPath(directory);
    // Whoever may write there could else have the line written again and again.
    state_ = {walked.facts.st_dev, walked.facts.st_ino, 0, {}, {}, {}};
    switch (walked.outcome) {
      case TrustedPath::Outcome::untrusted:
        return passOverDirectory(walked.place + " is " + kChangeable);
      case TrustedPath::Outcome::unknown:
        return giveUp();
      case TrustedPath::Outcome::missing:
        if (walked.error == ENOTDIR) return passOverDirectory("not a directory");
        if (walked.error != ENOENT) return giveUp();
        tell({}, Kind::note, "does not exist");
        return false;
      case TrustedPath::Outcome::trusted:
        break;
    }
    if (!S_ISDIR(walked.facts.st_mode)) return passOverDirectory("not a directory");
    if (!isRootsAlone(walked.facts)) return passOverDirectory(kChangeable);
    const UniqueFd folder(::open(walked.place.c_str(), O_RDONLY | O_DIRECTORY | O_NONBLOCK | O_CLOEXEC));
    if (!folder.isValid()) return giveUp();
    const auto names = entitlementFilesIn(folder.get());
    if (!names) return giveUp();
    search_.forget(directory);
    tell({}, Kind::note, names->empty() ? "has no files" : "is read");
    return std::any_of(names->begin(), names->end(), [&](const std::string& file) {
      path_ = directory + '/' + file;
      return lookInFile(folder.get(), file);
    });
  }

  bool lookInFile(int directory, const std::string& file) {
    PropertyList content;
    const Verdict isReadable = read(directory, file, &content);
    if (isReadable == Verdict::undecidable) return giveUp();
    if (isReadable == Verdict::passedOver) return false;
    EntryReader reader(content);
    const Entry entry = reader.read();
    if (!reader.wrong().empty()) {
      passOver(reader.wrong());
      return false;
    }
    if (findings_ != nullptr) noteUnknownKeys(content);
    PropertyList value = entry.entitlements.find(name_);
    const Verdict isTheCandidates = judge(entry, value.hasValue());
    if (isTheCandidates == Verdict::undecidable) return giveUp();
    if (isTheCandidates == Verdict::passedOver) return false;
    result_.value = std::move(value);
    result_.file = path_;
    return true;
  }

  // A file that might have said no is not skipped in favour of a later one that says yes.
  bool giveUp() {
    if (findings_ == nullptr) {
      logUnified(LogLevel::error, "entitlements cannot be told: %s cannot be examined", path_.c_str());
    }
    tell({}, Kind::unknown, "cannot be examined");
    result_.error = true;
    return true;
  }

  static FileState stateOf(const struct stat& facts) {
    return {facts.st_dev, facts.st_ino, facts.st_size, facts.st_mtim, facts.st_ctim, {}};
  }

  bool passOverDirectory(const std::string& why) {
    tell({}, Kind::wrong, why.c_str());
    if (isNews(why)) {
      logUnified(LogLevel::error, "entitlement directory %s passed over: %s", path_.c_str(), why.c_str());
    }
    return false;
  }
  Verdict passOver(const std::string& why) {
    if (isNews(why)) {
      logUnified(LogLevel::error, "entitlement file %s passed over: %s", path_.c_str(), why.c_str());
    }
    return Verdict::passedOver;
  }
  Verdict passOverWhole(const std::string& why) {
    tell({}, Kind::wrong, why.c_str());
    return passOver(why);
  }
  void passOver(std::span<const WrongKey> keys) {
    std::string all;
    for (const WrongKey& each : keys) {
      tell(each.key, Kind::wrong, each.text.c_str());
      all += (all.empty() ? "" : "; ") + std::string(each.key) + ' ' + each.text;
    }
    (void)passOver(all);
  }
  bool isNews(const std::string& why) {
    if (findings_ != nullptr) return false;
    FileState state = state_;
    state.reason = why;
    return search_.isNews(path_, std::move(state));
  }

  void tell(std::string_view key, Kind kind, const char* text) {
    if (findings_ != nullptr) findings_->push_back({path_, std::string(key), kind, text});
  }
  // A text that is made only if somebody wants it.
  template <std::invocable MakeText>
  void tell(std::string_view key, Kind kind, MakeText makeText) {
    if (findings_ != nullptr) findings_->push_back({path_, std::string(key), kind, makeText()});
  }

  Verdict read(int directory, const std::string& file, PropertyList* content) {
    // Neither a link out of the directory nor a pipe or a device that would hold us up.
    const UniqueFd fd(
        ::openat(directory, file.c_str(), O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_NOCTTY | O_CLOEXEC));
    const int error = errno;
    struct stat facts {};
    if (::fstat(fd.get(), &facts) != 0) {               // as of a file that could not be opened
      if (error == ENOENT) return Verdict::passedOver;  // removed since it was listed
      if (error != ELOOP && error != ENXIO && error != ENODEV) return Verdict::undecidable;
      (void)::fstatat(directory, file.c_str(), &facts, AT_SYMLINK_NOFOLLOW);  // for the state alone
      facts.st_mode = 0;
    }
    state_ = stateOf(facts);
    if (!S_ISREG(facts.st_mode)) return passOverWhole("not a regular file");
    if (!isRootsAlone(facts)) return passOverWhole(kChangeable);
    if (static_cast<std::uint64_t>(facts.st_size) > kLargestFile) return passOverWhole("too large");
    std::vector<std::byte> bytes(static_cast<std::size_t>(facts.st_size));
    // A regular file gives all it has at once, unless it fails or is being changed.
    if (::read(fd.get(), bytes.data(), bytes.size()) != facts.st_size) return Verdict::undecidable;
    *content = parsePropertyList(bytes);
    if (!content->is(Type::dictionary)) return passOverWhole("not a property list of the right form");
    return Verdict::matches;
  }

  // A misspelt key narrows nothing, which its author should learn.
  void noteUnknownKeys(const PropertyList& file) {
    for (std::size_t i = 0; i < file.size(); ++i) {
      const std::string_view key = file.keyAt(i);
      constexpr std::array<std::string_view, 5> kKnown{"Executable", "User", "Unit", "SHA256",
                                                       "Entitlements"};
      if (std::find(kKnown.begin(), kKnown.end(), key) == kKnown.end()) {
        tell(key, Kind::note, "is not a key of these files, and is not looked at");
      }
    }
  }

  // In order of what can be relied on: the account, which the kernel attached to the message, comes first, so
  // that nothing of a caller of another account is even looked at. `hasKey` spares the rest to a file that
  // has nothing to say. Somebody who wants the findings gets those of the other keys, too; the verdict is the
  // same.
  Verdict judge(const Entry& entry, bool hasKey) {
    Verdict verdict = judgeUser(entry.user);
    if (verdict != Verdict::matches && findings_ == nullptr) return verdict;
    verdict = worse(verdict, judgeExecutable(entry.executable));
    if (verdict != Verdict::matches && findings_ == nullptr) return verdict;
    if (hasKey) {
      tell("Entitlements", Kind::holds, [&] {
        const PropertyList value = entry.entitlements.find(name_);
        const std::string has = "has " + std::string(name_);
        return value.asBoolean() == true ? has : has + " as " + valueInWords(value);
      });
    } else {
      tell("Entitlements", Kind::differs, [&] { return "does not have " + std::string(name_); });
      verdict = worse(verdict, Verdict::passedOver);
    }
    if (verdict != Verdict::matches && findings_ == nullptr) return verdict;
    if (entry.unit) verdict = worse(verdict, judgeUnit(*entry.unit));
    if (!entry.sha256) return verdict;
    if (verdict == Verdict::matches) return judgeDigest(*entry.sha256);
    tell("SHA256", Kind::note, "was not compared");
    return verdict;
  }

  // What stops first decides: a file that does not match is not made undecidable by a later key.
  static Verdict worse(Verdict first, Verdict second) noexcept {
    return first == Verdict::matches ? second : first;
  }

  // An account that cannot be looked up is not the candidate's.
  Verdict judgeUser(const std::string& name) {
    // The superuser has this id by definition: the usual case spares reading the account database.
    std::optional<uid_t> uid;
    if (name == kDefaultUser) {
      uid = 0;
    } else if (isCString(name)) {
      if (const auto ids = search_.accounts_.idsOf(name.c_str())) uid = ids->uid;
    }
    if (!uid) {
      const WrongKey wrong{"User", "is \"" + name + "\", and there is no such account"};
      passOver({&wrong, 1});
      return Verdict::passedOver;
    }
    if (*uid == candidate_.uid()) {
      tell("User", Kind::holds, [&] { return "is " + name; });
      return Verdict::matches;
    }
    tell("User", Kind::differs, [&] {
      return "is " + name + " (" + std::to_string(*uid) + "), and the caller is " +
             std::to_string(candidate_.uid());
    });
    return Verdict::passedOver;
  }

  Verdict judgeExecutable(const std::string& path) {
    const TrustedPath walked = walkTrustedPath(path);
    switch (walked.outcome) {
      case TrustedPath::Outcome::untrusted:
        return distrustExecutable(walked.place);
      case TrustedPath::Outcome::missing:
        tell("Executable", Kind::differs, [&] { return "is " + path + ": " + std::strerror(walked.error); });
        return Verdict::passedOver;
      case TrustedPath::Outcome::unknown:
        tell("Executable", Kind::unknown, [&] { return "is " + path + ": " + std::strerror(walked.error); });
        return Verdict::undecidable;
      case TrustedPath::Outcome::trusted:
        break;
    }
    if (!isRootsAlone(walked.facts)) return distrustExecutable(walked.place);
    search_.forget(path_);  // nothing is wrong with it any more
    const auto& running = candidate_.executable();
    if (!running || *running != FileIdentity{walked.facts.st_dev, walked.facts.st_ino}) {
      tell("Executable", Kind::differs, [&] { return "is " + path + ", and the caller runs another file"; });
      return Verdict::passedOver;
    }
    tell("Executable", Kind::holds, [&] { return "is " + path; });
    executable_ = walked.place;
    return Verdict::matches;
  }

  Verdict distrustExecutable(const std::string& place) {
    const WrongKey wrong{"Executable", "cannot be relied on: " + place + " is " + kChangeable};
    passOver({&wrong, 1});
    return Verdict::passedOver;
  }

  Verdict judgeUnit(const std::string& unit) {
    const std::string& its = candidate_.unit();
    if (its == unit) {
      tell("Unit", Kind::holds, [&] { return "is " + unit; });
      return Verdict::matches;
    }
    tell("Unit", Kind::differs, [&] {
      return "is " + unit + ", and the caller runs in " +
             (its.empty() ? std::string("no unit of the system's service manager") : its);
    });
    return Verdict::passedOver;
  }

  Verdict judgeDigest(const Sha256Digest& wanted) {
    const auto cannotTell = [&](const char* why) {
      tell("SHA256", Kind::unknown, why);
      return Verdict::undecidable;
    };
    // By its own path, which only root can lead elsewhere: through the caller's link in /proc the file would
    // come open with the rights of the caller's mounts.
    const UniqueFd fd(::openat(AT_FDCWD, executable_.c_str(), O_RDONLY | O_NONBLOCK | O_NOCTTY | O_CLOEXEC));
    if (!fd.isValid() && errno == ENOENT) return hasChanged();
    struct stat facts {};
    if (::fstat(fd.get(), &facts) != 0) return cannotTell("cannot be compared: the file cannot be read");
    // The path may lead to another file since it was compared.
    if (candidate_.executable() != FileIdentity{facts.st_dev, facts.st_ino}) return hasChanged();
    const auto digest = sha256OfFile(fd.get());
    if (!digest) return cannotTell("cannot be compared: the file or libcrypto cannot be read");
    if (*digest == wanted) {
      tell("SHA256", Kind::holds, "is the digest of the executable");
      return Verdict::matches;
    }
    tell("SHA256", Kind::differs, "is not the digest of the executable");
    return Verdict::passedOver;
  }
  Verdict hasChanged() {
    tell("SHA256", Kind::differs, "cannot be compared: the caller has become another program, or has ended");
    return Verdict::passedOver;
  }

  EntitlementSearch& search_;
  const std::string_view name_;
  EntitlementCandidate& candidate_;
  std::vector<EntitlementFinding>* const findings_;
  std::string path_;        // of what is looked at now
  FileState state_;         // of the same
  std::string executable_;  // without links: what the file names, after it was found to be the candidate's
  Result result_;
};

EntitlementSearch::EntitlementSearch(AccountDirectory& accounts, std::vector<std::string> directories)
    : accounts_(accounts), directories_(std::move(directories)) {}

EntitlementSearch::Result EntitlementSearch::find(std::string_view name, EntitlementCandidate& candidate,
                                                  std::vector<EntitlementFinding>* findings) {
  return Run(*this, name, candidate, findings).run();
}

bool EntitlementSearch::isNews(const std::string& path, FileState state) {
  const std::lock_guard lock(mutex_);
  const auto isSame = [](const timespec& a, const timespec& b) {
    return a.tv_sec == b.tv_sec && a.tv_nsec == b.tv_nsec;
  };
  const auto known = told_.find(path);
  if (known != told_.end()) {
    const FileState& before = known->second;
    if (before.device == state.device && before.inode == state.inode && before.size == state.size &&
        isSame(before.modified, state.modified) && isSame(before.changed, state.changed) &&
        before.reason == state.reason) {
      return false;
    }
  }
  if (known == told_.end() && told_.size() >= kMaxToldCallers) told_.clear();
  told_.insert_or_assign(path, std::move(state));
  return true;
}

void EntitlementSearch::forget(const std::string& path) noexcept {
  const std::lock_guard lock(mutex_);
  told_.erase(path);
}

std::vector<std::string> entitlementDirectories() {
  std::vector<std::string> parts;
  std::string_view path = BRENVIK_ENTITLEMENT_DIRECTORIES;
  while (!path.empty()) {
    const std::size_t colon = path.find(':');
    parts.emplace_back(path.substr(0, colon));
    path.remove_prefix(colon == std::string_view::npos ? path.size() : colon + 1);
  }
  return parts;
}

namespace {

// What the findings say of one file.
struct Nearness {
  const EntitlementFinding* blame = nullptr;  // the first key that differs or is wrong
  int faults = 0;                             // how many there are of these
  int passed = 0;                             // keys before the first of them
  bool namesCaller = false;                   // its executable is the caller's
  bool hasName = true;                        // it has the entitlement

  void add(const EntitlementFinding& each) {
    if (each.kind == Kind::holds && blame == nullptr) ++passed;
    if (each.kind == Kind::holds && each.key == "Executable") namesCaller = true;
    if (each.kind != Kind::differs && each.kind != Kind::wrong) return;
    if (each.key == "Entitlements" && each.kind == Kind::differs) hasName = false;
    if (blame == nullptr) blame = &each;
    ++faults;
  }
  // The fewest keys that differ; among those, one that names the caller's executable; among those, the key
  // that is compared last.
  bool isNearerThan(const Nearness& other) const noexcept {
    if (other.blame == nullptr) return true;
    if (faults != other.faults) return faults < other.faults;
    if (namesCaller != other.namesCaller) return namesCaller;
    return passed > other.passed;
  }
};

// The file that came nearest to giving the entitlement; one without blame when none came near.
Nearness nearestFile(const std::vector<EntitlementFinding>& findings) {
  Nearness best;
  for (std::size_t i = 0; i < findings.size();) {
    Nearness file;
    const std::string& path = findings[i].path;
    for (; i < findings.size() && findings[i].path == path; ++i) file.add(findings[i]);
    if (file.blame != nullptr && file.hasName && file.isNearerThan(best)) best = file;
  }
  return best;
}

}  // namespace

std::string whyNotEntitled(const EntitlementSearch::Result& result,
                           const std::vector<EntitlementFinding>& findings) {
  if (result.error) {
    const auto cause = std::find_if(findings.rbegin(), findings.rend(),
                                    [](const auto& each) { return each.kind == Kind::unknown; });
    return (cause == findings.rend() ? std::string("a file") : cause->path) + " cannot be examined now";
  }
  if (result.value.asBoolean() == true) return result.file + " gives it by now";
  if (result.value) return result.file + " gives it as " + valueInWords(result.value);
  const EntitlementFinding* const blame = nearestFile(findings).blame;
  if (blame == nullptr) return "no file names it";
  if (blame->key.empty()) return blame->path + " is passed over: " + blame->text;
  return blame->path + " came nearest, but its " + blame->key + ' ' + blame->text;
}

}  // namespace brenvik

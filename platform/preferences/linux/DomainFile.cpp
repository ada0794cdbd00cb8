// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/preferences/linux/DomainFile.h"

#include <fcntl.h>
#include <sys/file.h>
#include <sys/uio.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <climits>
#include <cstdio>
#include <cstdlib>
#include <ctime>
#include <thread>
#include <utility>

#include "platform/base/ErrorText.h"
#include "platform/base/Rename.h"
#include "platform/base/WriteAll.h"
#include "platform/log/Log.h"
#include "platform/plist/PropertyListCodec.h"

namespace brenvik {
namespace {

// Whoever deletes the lock file while writers are at work takes their lock away.
constexpr const char kLockName[] = ".brenvik-preferences.lock";
// One name for all: only the lock's holder writes, so what is found under it was left by a dead writer.
constexpr const char kTemporaryName[] = ".brenvik-preferences.tmp";

// Longer than a kernel's clock tick, which is what file times are taken from.
constexpr std::int64_t kSettlingTime = 50'000'000;  // ns
// How often a file is read again that changed while it was read.
constexpr int kReadAttempts = 3;
constexpr int kMaxMovedAside = 1000;

std::int64_t nanoseconds(const timespec& time) noexcept {
  return std::int64_t{time.tv_sec} * 1'000'000'000 + time.tv_nsec;
}

FileStamp stampOf(const struct stat& facts) noexcept {
  return {facts.st_dev, facts.st_ino, facts.st_size, nanoseconds(facts.st_mtim)};
}

// Failures that say something about this process or this moment, and nothing about the file.
bool isPassing(int error) noexcept {
  return error == EMFILE || error == ENFILE || error == ENOMEM || error == EINTR || error == EAGAIN;
}

// Fills `bytes`; shortens them when the file is shorter by now. 0, or an errno.
int readWhole(int file, std::string& bytes) noexcept {
  std::size_t filled = 0;
  while (filled < bytes.size()) {
    const ssize_t got =
        ::pread(file, bytes.data() + filled, bytes.size() - filled, static_cast<off_t>(filled));
    if (got < 0 && errno == EINTR) continue;
    if (got < 0) return errno;
    if (got == 0) break;
    filled += static_cast<std::size_t>(got);
  }
  bytes.resize(filled);
  return 0;
}

// What is wrong with a domain's file, or null and its content.
const char* parse(std::string_view bytes, EditableDictionary& values) {
  const PropertyList document = parsePropertyList(std::as_bytes(std::span(bytes)));
  if (!document) return "not a property list";
  if (!document.is(PropertyList::Type::dictionary)) return "not a dictionary";
  auto found = EditableDictionary::of(document);
  if (!found) return "too large when taken apart";
  values = std::move(*found);
  return nullptr;
}

UniqueFd openFolderAt(int parent, const char* name) noexcept {
  return UniqueFd(::openat(parent, name, O_RDONLY | O_DIRECTORY | O_CLOEXEC));
}

int writeAll(int file, std::span<const std::string_view> content) noexcept {
  std::array<iovec, 4> pieces{};
  std::size_t count = 0;
  for (const auto piece : content) {
    if (!piece.empty() && count < pieces.size()) {
      pieces[count++] = {const_cast<char*>(piece.data()), piece.size()};
    }
  }
  return brenvik::writeAll(file, std::span(pieces.data(), count));
}

}  // namespace

int FolderLock::take(int folder, std::chrono::milliseconds patience) noexcept {
  const auto deadline = std::chrono::steady_clock::now() + patience;
  // A writer holds the lock for about a millisecond; a flock cannot be waited for with a time-out, so look
  // again soon, and less often later.
  auto pause = std::chrono::microseconds(50);
  constexpr auto kLongestPause = std::chrono::microseconds(2000);
  for (;;) {
    UniqueFd file(::openat(folder, kLockName, O_RDWR | O_CREAT | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC, 0600));
    if (!file.isValid()) return errno;
    for (;;) {
      if (::flock(file.get(), LOCK_EX | LOCK_NB) == 0) break;
      if (errno != EWOULDBLOCK && errno != EINTR) return errno;
      if (std::chrono::steady_clock::now() >= deadline) return EWOULDBLOCK;
      std::this_thread::sleep_for(pause);
      pause = std::min(pause * 2, kLongestPause);
    }
    // Somebody may have removed the file in between; then others lock another one.
    struct stat facts;
    if (::fstat(file.get(), &facts) != 0) return errno;
    if (facts.st_nlink > 0) {
      file_ = std::move(file);
      return 0;
    }
    if (std::chrono::steady_clock::now() >= deadline) return EWOULDBLOCK;
  }
}

// Reads the open file whole, and again when it changes meanwhile: programs that know nothing of the lock may
// be writing it in place. Notes what is wrong, if anything.
void DomainFile::readContent(Attempt& attempt, std::string& bytes) {
  const int file = attempt.loaded.pin.get();
  struct stat facts;
  if (::fstat(file, &facts) != 0) return attempt.fail(errno);
  for (int round = 1;; ++round) {
    if (!S_ISREG(facts.st_mode)) return attempt.damaged("not a regular file");
    if (static_cast<std::uint64_t>(facts.st_size) > EditableDictionary::kMaxFileSize) {
      return attempt.damaged("too large");
    }
    attempt.loaded.stamp = stampOf(facts);
    bytes.resize(static_cast<std::size_t>(facts.st_size));
    if (const int error = readWhole(file, bytes); error != 0) {
      return isPassing(error) ? attempt.fail(error) : attempt.damaged("unreadable", error);
    }
    if (::fstat(file, &facts) != 0) return attempt.fail(errno);
    if (stampOf(facts) == attempt.loaded.stamp || round == kReadAttempts) return;
  }
}

DomainFile::Attempt DomainFile::tryLoad() const {
  Attempt attempt;
  Loaded& loaded = attempt.loaded;
  // O_NONBLOCK: a pipe in the file's place would keep us waiting for a writer. A link is followed: it may
  // stand for the domain's file, and whoever can plant one here can write the file itself.
  loaded.pin.reset(::open(path_.c_str(), O_RDONLY | O_CLOEXEC | O_NONBLOCK | O_NOCTTY));
  if (!loaded.pin.isValid()) {
    const int error = errno;
    if (error == ENOENT || error == ENOTDIR || error == ENAMETOOLONG) return attempt;
    if (isPassing(error)) {
      attempt.fail(error);
    } else {
      attempt.damaged("unreadable", error);
    }
    return attempt;
  }
  loaded.state = State::read;
  std::string bytes;
  readContent(attempt, bytes);
  if (loaded.state != State::read) return attempt;
  // A lack of memory leaves by an exception: a good file is not to be moved aside for it.
  if (const char* const damage = parse(bytes, loaded.values); damage != nullptr) {
    attempt.damaged(damage);
    return attempt;
  }
  timespec now{};
  ::clock_gettime(CLOCK_REALTIME, &now);
  loaded.isSettled = nanoseconds(now) - loaded.stamp.modified > kSettlingTime;
  return attempt;
}

DomainFile::Loaded DomainFile::load(std::chrono::milliseconds patience, const FolderLock* held) {
  const auto withoutDamage = [this](Attempt& attempt) {
    if (attempt.error != 0) (void)fail("read", attempt.error);
    return std::move(attempt.loaded);
  };
  Attempt attempt = tryLoad();
  if (attempt.damage == nullptr) return withoutDamage(attempt);
  const UniqueFd folder(
      ::open((place_.root + "/" + place_.folder).c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  FolderLock own;
  if (held == nullptr || !held->isHeld()) {
    if (!lock(folder.get(), patience, own)) return std::move(attempt.loaded);
    // Another writer may have done all this meanwhile, and put a good file there.
    attempt = tryLoad();
    if (attempt.damage == nullptr) return withoutDamage(attempt);
  }
  if (moveAside(folder.get(), attempt)) return {};
  return std::move(attempt.loaded);
}

FileStamp DomainFile::stamp() const noexcept {
  struct stat facts;
  return ::stat(path_.c_str(), &facts) == 0 ? stampOf(facts) : FileStamp{};
}

UniqueFd DomainFile::openFolder() const noexcept {
  UniqueFd folder(::open(place_.root.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  if (!folder.isValid()) {
    (void)fail("open home", errno);
    return {};
  }
  if (UniqueFd there = openFolderAt(folder.get(), place_.folder.c_str()); there.isValid()) return there;
  std::array<char, NAME_MAX + 1> name{};
  for (std::string_view rest = place_.folder; !rest.empty();) {
    const std::string_view component = rest.substr(0, rest.find('/'));
    rest.remove_prefix(std::min(component.size() + 1, rest.size()));
    if (component.empty()) continue;
    if (component.size() >= name.size()) {
      (void)fail("mkdir", ENAMETOOLONG);
      return {};
    }
    name[component.copy(name.data(), component.size())] = '\0';
    UniqueFd next = openFolderAt(folder.get(), name.data());
    if (!next.isValid() && errno == ENOENT) {
      const bool isOurs = ::mkdirat(folder.get(), name.data(), place_.folderMode) == 0;
      if (!isOurs && errno != EEXIST) {
        (void)fail("mkdir", errno);
        return {};
      }
      next = openFolderAt(folder.get(), name.data());
      // The umask must not decide who can read it; and a value is only as durable as the way to it.
      if (next.isValid() && isOurs &&
          (::fchmod(next.get(), place_.folderMode) != 0 || ::fsync(folder.get()) != 0)) {
        (void)fail("mkdir", errno);
        return {};
      }
    }
    if (!next.isValid()) {
      (void)fail("open folder", errno);
      return {};
    }
    folder = std::move(next);
  }
  return folder;
}

bool DomainFile::lock(int folder, std::chrono::milliseconds patience, FolderLock& lock) const noexcept {
  const int error = lock.take(folder, patience);
  return error == 0 || fail("lock", error);
}

bool DomainFile::replace(int folder, std::span<const std::string_view> content, FileStamp& stamp,
                         UniqueFd& pin) const noexcept {
  constexpr int kFlags = O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC;
  UniqueFd file(::openat(folder, kTemporaryName, kFlags, 0600));
  if (!file.isValid() && errno == EEXIST) {
    if (::unlinkat(folder, kTemporaryName, 0) != 0) return fail("remove an old temporary file", errno);
    file.reset(::openat(folder, kTemporaryName, kFlags, 0600));
  }
  if (!file.isValid()) return fail("create", errno);
  const auto giveUp = [this, folder](const char* call, int error) {
    ::unlinkat(folder, kTemporaryName, 0);
    return fail(call, error);
  };
  if (const int error = writeAll(file.get(), content); error != 0) return giveUp("write", error);
  // 0600 from the start; only a file for everybody is opened up, whatever the umask.
  if (place_.fileMode != 0600 && ::fchmod(file.get(), place_.fileMode) != 0) return giveUp("chmod", errno);
  if (::fsync(file.get()) != 0) return giveUp("fsync", errno);
  struct stat facts;
  if (::fstat(file.get(), &facts) != 0) return giveUp("fstat", errno);
  // Closing the old file first lets it go within the rename instead of becoming an orphan of its own.
  pin.reset();
  stamp = {};
  // Rename last: a power cut leaves the old file or the new one, never half of one.
  if (::renameat(folder, kTemporaryName, folder, place_.name.c_str()) != 0) return giveUp("rename", errno);
  if (::fsync(folder) != 0) return fail("fsync of the folder", errno);
  stamp = stampOf(facts);
  pin = std::move(file);
  return true;
}

bool DomainFile::moveAside(int folder, const Attempt& attempt) const {
  const char* const reason = attempt.error != 0 ? describeError(attempt.error) : attempt.damage;
  int error = 0;
  for (int number = 1; number <= kMaxMovedAside; ++number) {
    const std::string suffix = ".damaged-" + std::to_string(number);
    // A long name is cut, so that it fits with the suffix.
    const std::string name = place_.name.substr(0, NAME_MAX - suffix.size()) + suffix;
    if (renameToFreeName(folder, place_.name.c_str(), name.c_str()) == 0) {
      logUnified(LogLevel::error, "Preferences %s: damaged (%s), moved aside to %s", path_.c_str(), reason,
                 name.c_str());
      return true;
    }
    error = errno;
    if (error != EEXIST) break;
  }
  logUnified(LogLevel::error,
             "Preferences %s: damaged (%s) and cannot be moved aside (%s); nothing is stored there",
             path_.c_str(), reason, describeError(error));
  return false;
}

// Says what went wrong; always false.
bool DomainFile::fail(const char* call, int error) const noexcept {
  logUnified(LogLevel::error, "Preferences %s: %s: %s", path_.c_str(), call,
             error == EWOULDBLOCK ? "another writer does not let go of the lock" : describeError(error));
  return false;
}

}  // namespace brenvik

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/files/linux/Way.h"

#include <fcntl.h>
#include <limits.h>
#include <linux/openat2.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <string_view>

namespace brenvik {
namespace {

constexpr int kMaxLinks = 40;  // the kernel's limit for one path

bool isOwn(const struct stat& info) { return info.st_uid == 0 || info.st_uid == ::geteuid(); }

bool openWithoutLinks(const std::string& path, int flags, UniqueFd* item) {
  open_how how{};
  how.flags = static_cast<unsigned>(flags | O_CLOEXEC);
  how.resolve = RESOLVE_NO_SYMLINKS;
  item->reset(static_cast<int>(::syscall(SYS_openat2, AT_FDCWD, path.c_str(), &how, sizeof how)));
  return item->isValid();
}

// ELOOP: there is a link on the way. ENOSYS: a service manager's filter, which cannot look into the
// arguments. EPERM: a filter that is older than the call.
bool mayHaveLinks(int error) { return error == ELOOP || error == ENOSYS || error == EPERM; }

bool leadsUp(std::string_view target) {
  return ("/" + std::string(target) + "/").find("/../") != std::string::npos;
}

bool isFollowed(int directory, const struct stat& link, std::string_view target, Links links) {
  struct stat info {};
  if (!isOwn(link) || ::fstat(directory, &info) != 0) return false;
  if (isOwn(info) && (info.st_mode & 0022) == 0) return true;
  return links == Links::own && (target.front() == '/' || !leadsUp(target));
}

// Takes the first name off the path; empty when only slashes are left.
std::string takeName(std::string* path) {
  path->erase(0, path->find_first_not_of('/'));
  std::string name = path->substr(0, path->find('/'));
  path->erase(0, name.size());
  return name;
}

}  // namespace

int openDirectory(const std::string& path, UniqueFd* directory, Links links) {
  if (path.empty()) return ENOENT;
  if (openWithoutLinks(path, O_PATH | O_DIRECTORY, directory)) return 0;
  if (!mayHaveLinks(errno)) return errno;

  std::string rest = path;
  int followed = 0;
  UniqueFd at(::open(rest.front() == '/' ? "/" : ".", O_PATH | O_DIRECTORY | O_CLOEXEC));
  while (at.isValid()) {
    const std::string name = takeName(&rest);
    if (name.empty()) {
      *directory = std::move(at);
      return 0;
    }
    UniqueFd next(::openat(at.get(), name.c_str(), O_PATH | O_NOFOLLOW | O_CLOEXEC));
    struct stat info {};
    if (!next.isValid() || ::fstat(next.get(), &info) != 0) return errno;
    if (S_ISDIR(info.st_mode)) {
      at = std::move(next);
      continue;
    }
    if (!S_ISLNK(info.st_mode)) return ENOTDIR;
    if (++followed > kMaxLinks) return ELOOP;
    std::array<char, PATH_MAX> text;
    const ssize_t length = ::readlinkat(next.get(), "", text.data(), text.size());
    if (length <= 0) return length < 0 ? errno : ENOENT;
    const std::string_view target(text.data(), static_cast<std::size_t>(length));
    if (!isFollowed(at.get(), info, target, links)) return ENOENT;
    rest.insert(0, std::string(target) + "/");
    if (target.front() == '/') at.reset(::open("/", O_PATH | O_DIRECTORY | O_CLOEXEC));
  }
  return errno;
}

int openToRead(const std::string& path, int flags, UniqueFd* item) {
  if (openWithoutLinks(path, flags, item)) return 0;
  if (!mayHaveLinks(errno)) return errno;
  Place place;
  if (const int error = Place::openExisting(path, &place, Links::own); error != 0) return error;
  item->reset(::openat(place.directory.get(), place.name.c_str(), flags | O_CLOEXEC));
  return item->isValid() ? 0 : errno;
}

int Place::open(const std::string& path, Place* place, Links links) {
  std::size_t end = path.size();
  while (end > 0 && path[end - 1] == '/') --end;
  if (end == 0) return path.empty() ? ENOENT : EEXIST;
  const std::size_t slash = path.rfind('/', end - 1);
  place->name = slash == std::string::npos ? path.substr(0, end) : path.substr(slash + 1, end - slash - 1);
  if (place->name == "." || place->name == "..") return EEXIST;
  const std::string parent = slash == std::string::npos ? "." : path.substr(0, slash + 1);
  return openDirectory(parent, &place->directory, links);
}

int Place::openExisting(const std::string& path, Place* place, Links links) {
  const int error = path.ends_with('/') ? EEXIST : open(path, place, links);
  if (error != EEXIST) return error;
  place->name = ".";
  return openDirectory(path, &place->directory, links);
}

}  // namespace brenvik

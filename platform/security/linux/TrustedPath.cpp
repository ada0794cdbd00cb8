// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/security/linux/TrustedPath.h"

#include <limits.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <string_view>
#include <utility>

namespace brenvik {
namespace {

constexpr int kMaxLinks = 40;  // as many as the kernel follows

bool isFolderToTrust(const struct stat& facts) noexcept {
  const bool nobodyRenamesRootsEntries = (facts.st_mode & S_ISVTX) != 0;
  return isRootsAlone(facts) || (facts.st_uid == 0 && nobodyRenamesRootsEntries);
}

TrustedPath withError(int error) {
  TrustedPath result;
  // Nobody can execute what even root cannot reach; a lack of memory or descriptors says nothing of what is
  // there.
  const bool isShortage = error == ENOMEM || error == EIO || error == EMFILE || error == ENFILE;
  result.outcome = isShortage ? TrustedPath::Outcome::unknown : TrustedPath::Outcome::missing;
  result.error = error;
  return result;
}

// The first component of a path, taken from it; empty at its end.
std::string takeComponent(std::string* path) {
  const std::size_t begin = path->find_first_not_of('/');
  if (begin == std::string::npos) {
    path->clear();
    return {};
  }
  const std::size_t end = path->find('/', begin);
  std::string component = path->substr(begin, end == std::string::npos ? end : end - begin);
  path->erase(0, end);
  return component;
}

// Puts a link's target in front of the rest of the path, which begins with a slash or is empty. As
// readlink(2). A function of its own: its buffer would be a page of the stack for each check-in, and hardly
// any has a link.
[[gnu::noinline]] ssize_t followLink(const std::string& link, std::string* rest) {
  std::array<char, PATH_MAX> target;
  const ssize_t size = ::readlink(link.c_str(), target.data(), target.size());
  if (size > 0) rest->insert(0, target.data(), static_cast<std::size_t>(size));
  return size;
}

void goUp(std::string* place) {
  place->erase(place->rfind('/') == std::string::npos ? 0 : place->rfind('/'));
}

}  // namespace

bool isRootsAlone(const struct stat& facts) noexcept {
  return facts.st_uid == 0 && (facts.st_mode & (S_IWGRP | S_IWOTH)) == 0;
}

// By path and not by descriptors, which would cost three times as many system calls at each check-in: what
// was found to be root's alone, nobody else can exchange before the next look.
TrustedPath walkTrustedPath(const std::string& path) {
  TrustedPath at;
  const auto lookAt = [&at](const std::string& place) {
    return ::lstat(place.empty() ? "/" : place.c_str(), &at.facts) == 0;
  };
  if (!lookAt(at.place)) return withError(errno);
  std::string rest = path;
  int links = 0;
  for (;;) {
    const std::string name = takeComponent(&rest);
    if (name.empty()) break;
    if (!S_ISDIR(at.facts.st_mode)) return withError(ENOTDIR);
    // Judged before anything in it is looked up, and only as a folder above.
    if (!isFolderToTrust(at.facts)) {
      at.outcome = TrustedPath::Outcome::untrusted;
      if (at.place.empty()) at.place = "/";
      return at;
    }
    if (name == ".") continue;
    std::string next = at.place;
    name == ".." ? goUp(&next) : void(next += '/' + name);
    if (!lookAt(next)) return withError(errno);
    if (!S_ISLNK(at.facts.st_mode)) {
      at.place = std::move(next);
      continue;
    }
    if (at.facts.st_uid != 0) {
      at.outcome = TrustedPath::Outcome::untrusted;
      at.place = std::move(next);
      return at;
    }
    if (++links > kMaxLinks) return withError(ELOOP);
    const ssize_t size = followLink(next, &rest);
    if (size <= 0) return withError(size == 0 ? ENOENT : errno);
    if (rest.front() == '/') at.place.clear();
    if (!lookAt(at.place)) return withError(errno);
  }
  if (path.ends_with('/') && !S_ISDIR(at.facts.st_mode)) return withError(ENOTDIR);
  at.outcome = TrustedPath::Outcome::trusted;
  if (at.place.empty()) at.place = "/";
  return at;
}

}  // namespace brenvik

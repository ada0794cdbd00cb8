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

// One walk along a path. A step returns false when it has ended the walk, whose result is then in at_.
class Walk {
 public:
  explicit Walk(const std::string& path) : path_(path), rest_(path) {}

  TrustedPath run() {
    if (!lookAt(at_.place)) return std::move(at_);
    for (std::string name = takeComponent(&rest_); !name.empty(); name = takeComponent(&rest_)) {
      if (!stepTo(name)) return std::move(at_);
    }
    if (path_.ends_with('/') && !S_ISDIR(at_.facts.st_mode)) {
      (void)fail(ENOTDIR);
    } else {
      (void)end(TrustedPath::Outcome::trusted, at_.place);
    }
    return std::move(at_);
  }

 private:
  // Goes one component further.
  bool stepTo(const std::string& name) {
    if (!S_ISDIR(at_.facts.st_mode)) return fail(ENOTDIR);
    // Judged before anything in it is looked up, and only as a folder above.
    if (!isFolderToTrust(at_.facts)) return end(TrustedPath::Outcome::untrusted, at_.place);
    if (name == ".") return true;
    std::string next = at_.place;
    name == ".." ? goUp(&next) : void(next += '/' + name);
    if (!lookAt(next)) return false;
    if (S_ISLNK(at_.facts.st_mode)) return stepThroughLink(next);
    at_.place = std::move(next);
    return true;
  }

  bool stepThroughLink(const std::string& link) {
    if (at_.facts.st_uid != 0) return end(TrustedPath::Outcome::untrusted, link);
    if (++links_ > kMaxLinks) return fail(ELOOP);
    const ssize_t size = followLink(link, &rest_);
    if (size <= 0) return fail(size == 0 ? ENOENT : errno);
    if (rest_.front() == '/') at_.place.clear();
    return lookAt(at_.place);
  }

  bool lookAt(const std::string& place) {
    return ::lstat(place.empty() ? "/" : place.c_str(), &at_.facts) == 0 || fail(errno);
  }
  bool fail(int error) {
    at_ = withError(error);
    return false;
  }
  bool end(TrustedPath::Outcome outcome, const std::string& place) {
    at_.outcome = outcome;
    at_.place = place.empty() ? "/" : place;
    return false;
  }

  const std::string& path_;
  std::string rest_;  // of the path, links on the way replaced by what they lead to
  int links_ = 0;
  TrustedPath at_;
};

}  // namespace

bool isRootsAlone(const struct stat& facts) noexcept {
  return facts.st_uid == 0 && (facts.st_mode & (S_IWGRP | S_IWOTH)) == 0;
}

// By path and not by descriptors, which would cost three times as many system calls at each check-in: what
// was found to be root's alone, nobody else can exchange before the next look.
TrustedPath walkTrustedPath(const std::string& path) { return Walk(path).run(); }

}  // namespace brenvik

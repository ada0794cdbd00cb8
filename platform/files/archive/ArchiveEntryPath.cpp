// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/files/archive/ArchiveEntryPath.h"

#include <cstddef>

#include "platform/base/Utf8.h"

namespace brenvik {
namespace {

constexpr std::size_t kLongestName = 255;
constexpr std::size_t kLongestPath = 1024;
// A walk of the tree holds two descriptors a level.
constexpr std::size_t kMaxDepth = 100;

bool hasOnlyPlainBytes(std::string_view text) {
  for (const char c : text) {
    const auto byte = static_cast<unsigned char>(c);
    if (byte < 0x20 || byte == 0x7F || c == '\\') return false;
  }
  return true;
}

// Cuts the first name off; an empty one where two slashes meet.
std::string_view takeName(std::string_view* path) {
  const std::size_t slash = path->find('/');
  const std::string_view name = path->substr(0, slash);
  path->remove_prefix(slash == std::string_view::npos ? path->size() : slash + 1);
  return name;
}

bool isPlainName(std::string_view name) {
  return !name.empty() && name != "." && name != ".." && name.size() <= kLongestName;
}

}  // namespace

bool isCleanEntryPath(std::string_view path) noexcept {
  if (path.empty() || path.size() > kLongestPath || path.back() == '/') return false;
  if (!hasOnlyPlainBytes(path) || !isValidUtf8(path)) return false;
  std::size_t depth = 0;
  while (!path.empty()) {
    if (!isPlainName(takeName(&path)) || ++depth > kMaxDepth) return false;
  }
  return true;
}

bool staysInside(std::string_view linkPath, std::string_view target) noexcept {
  if (target.empty() || target.size() > kLongestPath || target.front() == '/') return false;
  if (!hasOnlyPlainBytes(target) || !isValidUtf8(target)) return false;
  std::size_t above = 0;  // directories between the link and the top of the tree
  for (const char c : linkPath) above += c == '/';
  bool wentDown = false;
  while (!target.empty()) {
    const std::string_view name = takeName(&target);
    if (name.empty() || name == ".") continue;
    if (name == "..") {
      if (wentDown || above == 0) return false;
      --above;
    } else {
      wentDown = true;
    }
  }
  return true;
}

}  // namespace brenvik

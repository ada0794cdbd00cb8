// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <string>
#include <string_view>

#include "platform/base/fakes/FuzzInput.h"
#include "platform/files/archive/ArchiveEntryPath.h"
#include "platform/files/archive/ArchiveFrames.h"

namespace brenvik {

// Walks names as the kernel would: never above the top, never an empty step.
inline int depthAfter(std::string_view path, int depth) {
  while (!path.empty()) {
    const std::size_t slash = path.find('/');
    const std::string_view name = path.substr(0, slash);
    path.remove_prefix(slash == std::string_view::npos ? path.size() : slash + 1);
    if (name == "..") --depth;
    if (!name.empty() && name != "." && name != "..") ++depth;
    require(depth >= 0);
  }
  return depth;
}

// Ends the process at an entry, or an order of calls, that the parser must never let through.
class CheckingFrameSink final : public ArchiveFrameSink {
 public:
  int beginEntry(const ArchiveEntry& entry) override {
    require(!open_);
    open_ = true;
    require(entry.path.size() <= archive_frame::kLongestPath && entry.mode <= 0777);
    if (!isCleanEntryPath(entry.path)) return 0;
    require(entry.path.front() != '/' && entry.path.find("//") == std::string::npos);
    require(("/" + entry.path + "/").find("/../") == std::string::npos);
    require(entry.path.find('\0') == std::string::npos);
    const int depth = depthAfter(entry.path, 0);
    if (entry.kind == archive_frame::Kind::link && staysInside(entry.path, entry.target)) {
      require(!entry.target.empty() && entry.target.front() != '/');
      (void)depthAfter(entry.target, depth - 1);
    }
    return 0;
  }
  int entryData(std::string_view) override {
    require(open_);
    return 0;
  }
  int entryCompanion(std::string_view bytes) override {
    require(open_ && bytes.size() <= archive_frame::kLargestCompanion);
    return 0;
  }
  int endEntry() override {
    require(open_);
    open_ = false;
    return 0;
  }
  int refuseEntry(const std::string& path, int code) override {
    require(!open_ && path.size() <= archive_frame::kLongestPath && code > 0);
    return 0;
  }

 private:
  bool open_ = false;
};

}  // namespace brenvik

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
//
// What a reader under foreign control may say: the frames, and the paths and link targets in them.
#include <algorithm>
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <string>
#include <string_view>

#include "platform/files/archive/ArchiveEntryPath.h"
#include "platform/files/archive/ArchiveFrames.h"

namespace brenvik {
namespace {

void require(bool good) {
  if (!good) std::abort();
}

// Walks names as the kernel would: never above the top, never an empty step.
int depthAfter(std::string_view path, int depth) {
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

class CheckingSink final : public ArchiveFrameSink {
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

enum class Data { taken, passed };  // passed: a file's data goes another way

int parse(std::string_view bytes, std::size_t piece, Data data = Data::taken) {
  CheckingSink sink;
  ArchiveFrameParser parser(sink);
  int result = 0;
  while (!bytes.empty() && result == 0) {
    require(parser.bestPiece() > 0);
    const std::size_t ahead = data == Data::passed ? parser.dataAhead() : 0;
    const std::string_view part = bytes.substr(0, ahead > 0 ? ahead : piece);
    bytes.remove_prefix(part.size());
    if (ahead > 0) {
      parser.pass(part.size());
    } else {
      result = parser.take(part);
    }
  }
  return result != 0 ? result : parser.hasFinished() ? -1 : 0;
}

}  // namespace
}  // namespace brenvik

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  const std::string_view bytes(reinterpret_cast<const char*>(data), size);
  // However the pipe cuts them, the frames say the same.
  const int whole = brenvik::parse(bytes, size + 1);
  brenvik::require(brenvik::parse(bytes, 1) == whole);
  brenvik::require(brenvik::parse(bytes, 7) == whole);
  brenvik::require(brenvik::parse(bytes, 1, brenvik::Data::passed) == whole);
  (void)brenvik::isCleanEntryPath(bytes);
  const std::string_view link = bytes.substr(0, size / 2);
  (void)brenvik::staysInside(link, bytes.substr(link.size()));
  return 0;
}

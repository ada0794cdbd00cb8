// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
//
// What a reader under foreign control may say: the frames, and the paths and link targets in them.
#include <algorithm>
#include <cstddef>
#include <cstdint>
#include <string_view>

#include "platform/base/fakes/FuzzInput.h"
#include "platform/files/archive/ArchiveEntryPath.h"
#include "platform/files/archive/ArchiveFrames.h"
#include "platform/files/fakes/CheckingFrameSink.h"

namespace brenvik {
namespace {

enum class Data { taken, passed };  // passed: a file's data goes another way

int parse(std::string_view bytes, std::size_t piece, Data data = Data::taken) {
  CheckingFrameSink sink;
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

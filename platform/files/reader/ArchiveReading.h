// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <cstddef>

#include "platform/files/archive/ArchiveFrames.h"

namespace brenvik {

// Takes the frames (ArchiveFrames.h) that the reader makes.
class FrameOutput {
 public:
  virtual ~FrameOutput() = default;
  virtual void frame(archive_frame::Type type, const void* bytes, std::size_t length) = 0;
  // Sends what frame() has gathered.
  virtual void flush() = 0;
  // The bytes as frames of at most kLargestChunk.
  void chunks(archive_frame::Type type, const char* bytes, std::size_t length);
};

// Reads the zip archive in a regular file, from its beginning, and hands over what is in it, flushed. Whether
// an entry may be unpacked is not decided here. Returns false if the archive could not be read to its end; a
// `failed` frame then says why, unless the file itself cannot be read. Needs a UTF-8 locale. Throws
// std::bad_alloc.
bool readArchive(int file, FrameOutput& out);

}  // namespace brenvik

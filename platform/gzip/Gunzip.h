// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <cstddef>
#include <cstdint>
#include <span>

namespace brenvik {

enum class GunzipResult {
  whole,      // every member was read to its end and its checksum was right
  damaged,    // not gzip, a checksum or length is wrong, or bytes follow the last member
  truncated,  // the input ends within a member
  tooLarge,   // more output than allowed
  refused,    // the output could not be written, or its receiver said no
  outOfMemory,
  unavailable,  // the decompressor cannot be reached, or did not end in time
};

// A gzip file in memory.
struct GunzipInput {
  std::span<const std::byte> bytes;
  // The sealed memory that holds these very bytes from its beginning, where there is one; -1: none. It can be
  // handed to another process as it is.
  int sealedMemory = -1;
};

struct GunzipOutcome {
  GunzipResult result = GunzipResult::unavailable;
  std::uint64_t size = 0;  // of the output so far, what was only counted included
  int writeError = 0;      // with `refused`, the number of the error of the write
};

// Decompresses gzip files (RFC 1952), of one or several members. Any thread.
class Gunzip {
 public:
  virtual ~Gunzip() = default;

  // Writes the output to a file, from where that stands, as long as there are at most `room` bytes of it.
  // What goes beyond is only counted, up to `largestOutput`. The file is worth nothing unless the result is
  // `whole` and the size within the room. An empty input is truncated.
  virtual GunzipOutcome gunzipInto(const GunzipInput& input, int file, std::uint64_t room,
                                   std::uint64_t largestOutput) noexcept = 0;
};

}  // namespace brenvik

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
  // Sealed memory that holds exactly these bytes from its beginning, and can be sent to another process; -1:
  // none. The caller owns it.
  int sealedMemory = -1;
};

struct GunzipOutcome {
  GunzipResult result = GunzipResult::unavailable;
  std::uint64_t size = 0;  // bytes of output so far, including those only counted
  int writeError = 0;      // with `refused`, the errno of the write
};

// Decompresses gzip files (RFC 1952), of one or several members. Any thread.
class Gunzip {
 public:
  virtual ~Gunzip() = default;

  // Writes at most `room` bytes of the output to a file, from its current position. Bytes beyond that are
  // only counted, up to `largestOutput`. Use the file only if the result is `whole` and the size at most
  // `room`. An empty input is `truncated`.
  virtual GunzipOutcome gunzipInto(const GunzipInput& input, int file, std::uint64_t room,
                                   std::uint64_t largestOutput) noexcept = 0;
};

}  // namespace brenvik

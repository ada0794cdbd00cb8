// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <cstddef>
#include <cstdint>
#include <functional>
#include <span>

namespace brenvik {

enum class GunzipResult {
  whole,      // every member was read to its end and its checksum was right
  damaged,    // not gzip, a checksum or length is wrong, or bytes follow the last member
  truncated,  // the input ends within a member
  tooLarge,   // more output than allowed
  refused,    // the receiver of the output said no
  outOfMemory,
  unavailable,  // the decompressor could not be loaded
};

// Decompresses gzip files (RFC 1952), of one or several members. Any thread.
class Gunzip {
 public:
  // Takes the next bytes of the output; false ends the work.
  using Receiver = std::function<bool(std::span<const std::byte> output)>;

  virtual ~Gunzip() = default;

  // Hands the output over piece by piece, never more than `largestOutput` bytes in all; what it handed over
  // is worth nothing unless the result is `whole`. An empty input is truncated.
  virtual GunzipResult gunzip(std::span<const std::byte> input, std::uint64_t largestOutput,
                              const Receiver& receiver) noexcept = 0;
};

}  // namespace brenvik

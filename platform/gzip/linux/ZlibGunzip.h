// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <functional>

#include "platform/gzip/Gunzip.h"

namespace brenvik {

// zlib's inflate with the gzip wrapper.
class ZlibGunzip final : public Gunzip {
 public:
  // Takes the next bytes of the output; false ends the work.
  using Receiver = std::function<bool(std::span<const std::byte> output)>;

  // Passes the output to the receiver piece by piece, at most `largestOutput` bytes in all. Use it only if
  // the result is `whole`. An empty input is `truncated`. Throws what the receiver throws, and
  // std::bad_alloc.
  GunzipResult gunzip(std::span<const std::byte> input, std::uint64_t largestOutput,
                      const Receiver& receiver);
  GunzipOutcome gunzipInto(const GunzipInput& input, int file, std::uint64_t room,
                           std::uint64_t largestOutput) noexcept override;
  // The same, to a file. `mayGoOn` is called after each piece; false ends the work.
  GunzipOutcome gunzipInto(const GunzipInput& input, int file, std::uint64_t room,
                           std::uint64_t largestOutput, const std::function<bool()>& mayGoOn) noexcept;
};

}  // namespace brenvik

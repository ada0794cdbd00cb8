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

  // Hands the output over piece by piece, never more than `largestOutput` bytes in all; what it handed over
  // is worth nothing unless the result is `whole`. An empty input is truncated. Throws what the receiver
  // throws, and std::bad_alloc.
  GunzipResult gunzip(std::span<const std::byte> input, std::uint64_t largestOutput,
                      const Receiver& receiver);
  GunzipOutcome gunzipInto(const GunzipInput& input, int file, std::uint64_t room,
                           std::uint64_t largestOutput) noexcept override;
  // The same; `mayGoOn` is asked after each piece.
  GunzipOutcome gunzipInto(const GunzipInput& input, int file, std::uint64_t room,
                           std::uint64_t largestOutput, const std::function<bool()>& mayGoOn) noexcept;
};

}  // namespace brenvik

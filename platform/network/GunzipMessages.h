// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <cstddef>
#include <cstdint>
#include <optional>
#include <span>
#include <vector>

#include "platform/gzip/Gunzip.h"

namespace brenvik {

// One gzip file to be unpacked, as it goes to the worker: beside it travel the sealed memory that it lies in
// and the file to write to.
struct GunzipQuestion {
  std::uint64_t inputSize = 0;
  std::uint64_t room = 0;
  std::uint64_t largestOutput = 0;
};

// Nothing when it is not such a question or outcome, or one that no correct program sends. All throw
// std::bad_alloc.
std::vector<std::byte> encode(const GunzipQuestion& question);
std::optional<GunzipQuestion> decodeGunzipQuestion(std::span<const std::byte> payload);
std::vector<std::byte> encode(const GunzipOutcome& outcome);
std::optional<GunzipOutcome> decodeGunzipOutcome(std::span<const std::byte> payload,
                                                 const GunzipQuestion& question);

}  // namespace brenvik

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

// A request to the worker to unpack one gzip file. Its descriptors are the sealed memory that holds the file
// and the file to write to.
struct GunzipQuestion {
  std::uint64_t inputSize = 0;
  std::uint64_t room = 0;
  std::uint64_t largestOutput = 0;
};

// The decoders return nothing for a malformed message, and for one that no correct program sends. All throw
// std::bad_alloc.
std::vector<std::byte> encode(const GunzipQuestion& question);
std::optional<GunzipQuestion> decodeGunzipQuestion(std::span<const std::byte> payload);
std::vector<std::byte> encode(const GunzipOutcome& outcome);
std::optional<GunzipOutcome> decodeGunzipOutcome(std::span<const std::byte> payload,
                                                 const GunzipQuestion& question);

}  // namespace brenvik

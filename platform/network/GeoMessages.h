// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <cstddef>
#include <optional>
#include <span>
#include <string>
#include <vector>

#include "platform/geo/GeoService.h"

namespace brenvik {

// The outcome of a question: exactly one of the two members has a value.
template <typename Answer>
struct GeoOutcome {
  std::optional<Answer> answer;
  std::optional<GeoError> error;
};

// The longest description, in bytes. The sender cuts it, the receiver refuses a longer one: it is one line
// for people.
inline constexpr std::size_t kLongestGeoError = 1000;
// The longest address, all parts together, in bytes.
inline constexpr std::size_t kLongestAddress = 200'000;

// The decoders return nothing for a malformed message, and for one that no correct program sends: a part of
// an address that is empty, not UTF-8 or contains a NUL; a country code that is not two capital letters; a
// malformed public address. All throw std::bad_alloc.
std::vector<std::byte> encode(const Coordinate& coordinate);
std::optional<Coordinate> decodeCoordinate(std::span<const std::byte> payload);
std::vector<std::byte> encode(const GeoOutcome<MapItems>& outcome);
std::optional<GeoOutcome<MapItems>> decodeMapItems(std::span<const std::byte> payload);
std::vector<std::byte> encode(const GeoOutcome<GeoIpResult>& outcome);
std::optional<GeoOutcome<GeoIpResult>> decodeGeoIpResult(std::span<const std::byte> payload);

}  // namespace brenvik

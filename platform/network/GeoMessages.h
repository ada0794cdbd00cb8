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

// What became of a question: exactly one of the two is given.
template <typename Answer>
struct GeoOutcome {
  std::optional<Answer> answer;
  std::optional<GeoError> error;
};

// A description is cut to this length, and refused beyond it: it is a line for people.
inline constexpr std::size_t kLongestGeoError = 1000;
// Of an address together, in bytes.
inline constexpr std::size_t kLongestAddress = 200'000;

// Nothing when it is not such a question or outcome, or one that no correct program sends: a part of an
// address that is empty, no UTF-8 or holds a NUL, a country code of anything but two capital letters, a
// malformed public address. All throw std::bad_alloc.
std::vector<std::byte> encode(const Coordinate& coordinate);
std::optional<Coordinate> decodeCoordinate(std::span<const std::byte> payload);
std::vector<std::byte> encode(const GeoOutcome<MapItems>& outcome);
std::optional<GeoOutcome<MapItems>> decodeMapItems(std::span<const std::byte> payload);
std::vector<std::byte> encode(const GeoOutcome<GeoIpResult>& outcome);
std::optional<GeoOutcome<GeoIpResult>> decodeGeoIpResult(std::span<const std::byte> payload);

}  // namespace brenvik

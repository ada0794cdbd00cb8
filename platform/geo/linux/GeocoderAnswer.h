// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <optional>
#include <string>
#include <string_view>

#include "platform/geo/GeoService.h"

namespace brenvik {

// The largest answer of a reverse geocoder, in bytes; a usual one has a kilobyte.
inline constexpr std::size_t kLargestGeocoderAnswer = std::size_t{256} << 10;

// The parsed body of a Nominatim-compatible server's answer (format jsonv2).
struct GeocoderAnswer {
  std::optional<StructuredAddress> address;  // absent, without error: the server does not know the place
  std::optional<GeoError> error;             // the body is malformed
};

// A part of the address counts as absent if it is not a text, is empty or contains a NUL; so does a country
// code that is not two letters. Throws only std::bad_alloc.
GeocoderAnswer readGeocoderAnswer(std::string_view body);

}  // namespace brenvik

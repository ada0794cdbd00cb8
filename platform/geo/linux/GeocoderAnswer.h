// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <optional>
#include <string>
#include <string_view>

#include "platform/geo/GeoService.h"

namespace brenvik {

// The largest answer a reverse geocoder may give; a usual one has a kilobyte.
inline constexpr std::size_t kLargestGeocoderAnswer = std::size_t{256} << 10;

// What the body of a Nominatim-compatible server's answer (format jsonv2) says.
struct GeocoderAnswer {
  std::optional<StructuredAddress> address;  // absent, without error: the server knows nothing of the place
  std::optional<GeoError> error;             // the body is no such answer
};

// A part of the address that is not a text, is empty or holds a NUL counts as absent, as does a country code
// of anything but two letters. Throws nothing but std::bad_alloc.
GeocoderAnswer readGeocoderAnswer(std::string_view body);

}  // namespace brenvik

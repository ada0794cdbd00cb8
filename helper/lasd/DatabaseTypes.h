// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <array>
#include <cstdint>

namespace brenvik {

// The radio technologies that have a location-aware service database; each is one bit of a mask.
enum DatabaseType : std::int32_t { umts = 1, cdma = 2, lte = 4, gsm = 8, scdma = 16 };

// The order in which the types are handled, downloads and notifications included.
inline constexpr std::array<std::int32_t, 5> kDatabaseTypesInOrder{gsm, umts, cdma, lte, scdma};

// The preferences domain of the version records.
inline constexpr const char kVersionsDomain[] = "com.norvale.lasd";
// Keys of a version record, in the manifest and in the preferences.
inline constexpr const char kVersionKey[] = "Version";
inline constexpr const char kContentUrlKey[] = "ContentURL";

// The type's key in the manifest and the preferences; null for any other value, combinations included.
constexpr const char* keyOfDatabaseType(std::int32_t type) noexcept {
  switch (type) {
    case umts:
      return "umts";
    case cdma:
      return "cdma";
    case lte:
      return "lte";
    case gsm:
      return "gsm";
    case scdma:
      return "scdma";
    default:
      return nullptr;
  }
}

// The same for a log line; never null.
constexpr const char* nameOfDatabaseType(std::int32_t type) noexcept {
  const char* const key = keyOfDatabaseType(type);
  return key != nullptr ? key : "unknown";
}

}  // namespace brenvik

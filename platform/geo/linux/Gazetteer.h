// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <optional>
#include <string>

#include "platform/geo/GeoService.h"
#include "platform/geo/linux/Query.h"
#include "platform/sqlite/Sqlite.h"

namespace brenvik {

// The offline gazetteer: a read-only SQLite database of country borders and places. The country is the one
// whose border the coordinate lies in; city and administrative area are those of the nearest place of that
// country. One thread at a time.
class Gazetteer {
 public:
  // Opens nothing; the database is opened by the first look-up, and again by each that finds it closed.
  explicit Gazetteer(std::string path) : path_(std::move(path)) {}

  struct Answer {
    std::optional<StructuredAddress> address;  // absent, without error: nothing is known of the coordinate
    std::optional<GeoError> error;
  };
  // The coordinate has to be one: latitude within 90 degrees, longitude within 180. Postal codes are not
  // known.
  Answer lookUp(Coordinate coordinate);

 private:
  struct Position {
    std::int64_t lng;  // 1e-5 degrees
    std::int64_t lat;
  };
  struct Place {
    double kilometres;
    std::string name;
    std::string country;
    std::optional<std::int64_t> area;
  };

  bool open(std::string& error);
  // Ends a run of a statement, whose last step gave `code`.
  void finish(Query& statement, int code);
  std::optional<std::string> countryAt(Position position);
  std::optional<std::string> countryAround(Position position);
  // The nearest place within `kilometres`, of the country if one is named.
  std::optional<Place> nearestPlace(Position position, const std::string* country, double kilometres);
  void searchBox(Position position, const std::string* country, std::int64_t west, std::int64_t east,
                 std::int64_t south, std::int64_t north, std::optional<Place>& nearest);
  std::optional<std::string> areaName(std::int64_t area);

  const std::string path_;
  // The statements go before their database does.
  struct Opened {
    SqliteDatabase database;
    Query rings;
    Query places;
    Query placesOfCountry;
    Query area;
  };
  std::optional<Opened> opened_;
  std::optional<std::string> failure_;  // the first error that a statement of this look-up met
};

}  // namespace brenvik

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <array>
#include <cstdint>
#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <vector>

#include "platform/geo/GeoService.h"
#include "platform/geo/linux/Query.h"
#include "platform/sqlite/Sqlite.h"

namespace brenvik {

// The offline gazetteer: a read-only SQLite database of borders and places. The country code comes from the
// border that the coordinate lies in, or from the table of disputed land; city and administrative area are
// those of the town that a resident would name. One thread at a time.
class Gazetteer {
 public:
  // Opens nothing. The first look-up opens the database, and so does each look-up that finds it closed.
  explicit Gazetteer(std::string path) : path_(std::move(path)) {}

  struct Answer {
    std::optional<StructuredAddress> address;  // absent, without error: nothing is known about the coordinate
    std::optional<GeoError> error;
  };
  // Precondition: latitude within 90 degrees, longitude within 180. The gazetteer has no postal codes.
  Answer lookUp(Coordinate coordinate);

  // Corrects the `country` that another source gives for a place by this gazetteer's rules: returns a
  // territory's own code instead of its sovereign's, and the table's answer on disputed land. Otherwise, or
  // if the database cannot be read, returns `country`. Precondition as for lookUp().
  std::string ownCode(Coordinate coordinate, const std::string& country);

 private:
  struct Position {
    std::int64_t lng;  // 1e-5 degrees
    std::int64_t lat;
  };
  struct Land {
    std::uint8_t country = 0;  // 0: nobody's
    bool disputed = false;
  };
  struct Town {
    double score;       // kilometres beyond the town's edge; below 0 inside
    double kilometres;  // to its middle
    std::uint8_t country;
    std::uint16_t area;  // 0: none
    std::uint32_t place;
  };
  // What a search has found so far.
  struct Found {
    std::optional<Town> nearest;  // of any size; the position is in its area
    std::vector<Town> best;       // the town with the lowest score in each area
    Town* bestOf(std::uint16_t area);
    // The town that names the position. Precondition: one was found.
    const Town& town();
  };
  struct Country {
    std::string code;
    std::string sovereign;  // of a territory, else empty
  };
  struct Rule {
    std::uint8_t country;
    std::vector<std::uint16_t> needs;  // layers, in ascending order
  };

  static Position positionOf(Coordinate coordinate);
  bool open(std::string& error);
  bool readTables();
  // Ends a run of a statement whose last step returned `code`.
  void finish(Query& statement, int code);
  Land landAround(Position position);
  Land landAt(Position position);
  Land decide(std::span<const std::uint16_t> around) const;
  // Returns the town that names the position: among the towns in the area of the nearest place, the one with
  // the lowest score. Only towns of `country`, unless that is 0.
  std::optional<Town> townNear(Position position, std::uint8_t country);
  void searchRow(Position position, std::uint8_t country, std::int64_t row, std::int64_t west,
                 std::int64_t east, double kilometres, Found& found);
  void searchSquare(Position position, std::uint8_t country, std::int64_t cell,
                    std::span<const std::byte> data, double kilometres, Found& found);
  // Writes the town's name and area into the address.
  void nameTown(const Town& town, StructuredAddress& address);

  const std::string path_;
  // The statements are destroyed before their database.
  struct Opened {
    SqliteDatabase database;
    Query land;
    Query near;
    Query place;
    std::vector<Country> countries;    // by number; 0 is nobody
    std::vector<std::uint8_t> layers;  // country of each; 0: an outline
    std::vector<Rule> rules;
  };
  std::optional<Opened> opened_;
  std::optional<std::string> failure_;  // the first error of a statement in this look-up
};

}  // namespace brenvik

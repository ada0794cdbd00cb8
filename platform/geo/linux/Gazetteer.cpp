// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/geo/linux/Gazetteer.h"

#include <algorithm>
#include <array>
#include <cmath>
#include <cstring>
#include <map>
#include <numbers>

namespace brenvik {
namespace {

// As the maker of the database writes them.
constexpr std::int64_t kApplicationId = 0x42764761;
constexpr std::int64_t kFormat = 1;

constexpr double kUnitsPerDegree = 100'000;
constexpr std::int64_t kHalfTurn = 18'000'000;
constexpr std::int64_t kQuarterTurn = 9'000'000;
constexpr double kKilometresPerDegree = 111.195;  // of latitude, on the mean sphere
constexpr double kEarthRadius = 6371.0;           // kilometres

// A place names the city of what lies around it, and, farther out, still its administrative area. Beyond that
// its neighbours are as likely to be something else.
constexpr double kCityReach = 50;
constexpr double kAreaReach = 150;
// Most places have a neighbour within the first ring: a small box holds few rows to read.
constexpr std::array kSearchRadii{3.0, 10.0, 25.0, kCityReach, kAreaReach};

double radians(std::int64_t units) {
  return static_cast<double>(units) / kUnitsPerDegree * std::numbers::pi / 180;
}

// Along the great circle (haversine formula).
double kilometresBetween(double lng1, double lat1, double lng2, double lat2) {
  const double sinLat = std::sin((lat2 - lat1) / 2);
  const double sinLng = std::sin((lng2 - lng1) / 2);
  const double h = sinLat * sinLat + std::cos(lat1) * std::cos(lat2) * sinLng * sinLng;
  return 2 * kEarthRadius * std::asin(std::min(1.0, std::sqrt(h)));
}

std::string percentEncoded(const std::string& path) {
  std::string uri;
  for (const char c : path) {
    const bool plain = (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') || (c >= '0' && c <= '9') ||
                       c == '/' || c == '.' || c == '-' || c == '_';
    if (plain) {
      uri += c;
    } else {
      constexpr char kHex[] = "0123456789ABCDEF";
      const auto byte = static_cast<unsigned char>(c);
      uri += '%';
      uri += kHex[byte >> 4];
      uri += kHex[byte & 15];
    }
  }
  return uri;
}

// True when the ring, a closed line of (longitude, latitude) pairs of 32-bit numbers, goes around the
// position. A position on the line belongs to exactly one of the two sides.
bool goesAround(std::span<const std::byte> ring, std::int64_t lng, std::int64_t lat) {
  const std::size_t count = ring.size() / 8;
  const auto point = [&](std::size_t i) {
    std::array<std::int32_t, 2> pair;
    std::memcpy(pair.data(), ring.data() + i * 8, 8);
    return pair;
  };
  bool inside = false;
  if (count == 0) return false;
  auto from = point(count - 1);
  for (std::size_t i = 0; i < count; ++i) {
    const auto to = point(i);
    if ((from[1] > lat) != (to[1] > lat)) {
      // Where the edge meets the position's parallel, east of the position or not; multiplied out, so exact.
      const std::int64_t rise = std::int64_t{to[1]} - from[1];
      const std::int64_t offset = (lng - from[0]) * rise - (std::int64_t{to[0]} - from[0]) * (lat - from[1]);
      if (rise > 0 ? offset < 0 : offset > 0) inside = !inside;
    }
    from = to;
  }
  return inside;
}

}  // namespace

bool Gazetteer::open(std::string& error) {
  if (opened_) return true;
  const SqliteFunctions* const functions = sqlite();
  if (functions == nullptr) {
    error = "SQLite cannot be loaded";
    return false;
  }
  // Immutable: nobody writes it, so there is nothing to lock and no journal to look for.
  sqlite3* handle = nullptr;
  const int code = functions->open_v2(("file:" + percentEncoded(path_) + "?immutable=1").c_str(), &handle,
                                      SQLITE_OPEN_READONLY | SQLITE_OPEN_URI | SQLITE_OPEN_NOMUTEX, nullptr);
  SqliteDatabase database(handle);
  if (code != SQLITE_OK) {
    error = functions->errstr(code);
    return false;
  }
  // Whoever could write the file could otherwise have its views and functions run here, with our rights.
  (void)functions->db_config(handle, SQLITE_DBCONFIG_DEFENSIVE, 1, nullptr);
  (void)functions->db_config(handle, SQLITE_DBCONFIG_TRUSTED_SCHEMA, 0, nullptr);

  const auto number = [&](const char* sql) {
    Query query(*functions, handle, sql);
    return query.isValid() && query.step() == SQLITE_ROW ? query.integer(0) : -1;
  };
  if (number("pragma application_id") != kApplicationId || number("pragma user_version") != kFormat) {
    error = "not a gazetteer of this version";
    return false;
  }
  constexpr std::string_view kRings =
      "select g.id, g.country, r.points from ring_at a join ring r on r.id = a.id join region g on g.id = "
      "r.region "
      "where a.min_lng <= ?1 and a.max_lng >= ?1 and a.min_lat <= ?2 and a.max_lat >= ?2";
  constexpr std::string_view kPlaces =
      "select a.min_lng, a.min_lat, p.name, p.country, p.area from place_at a join place p on p.id = a.id "
      "where a.min_lng >= ?1 and a.max_lng <= ?2 and a.min_lat >= ?3 and a.max_lat <= ?4";
  const std::string placesOfCountry = std::string(kPlaces) + " and (p.country = ?5 or p.border = ?5)";
  Opened opened{std::move(database), Query(*functions, handle, kRings), Query(*functions, handle, kPlaces),
                Query(*functions, handle, placesOfCountry),
                Query(*functions, handle, "select name from area where id = ?1")};
  if (!opened.rings.isValid() || !opened.places.isValid() || !opened.placesOfCountry.isValid() ||
      !opened.area.isValid()) {
    error = functions->errmsg(handle);
    return false;
  }
  opened_ = std::move(opened);
  return true;
}

Gazetteer::Answer Gazetteer::lookUp(Coordinate coordinate) {
  std::string error;
  if (!open(error)) return {{}, GeoError{"the offline gazetteer cannot be read: " + error}};
  failure_.reset();
  const Position position{std::llround(coordinate.longitude * kUnitsPerDegree),
                          std::llround(coordinate.latitude * kUnitsPerDegree)};

  Answer answer;
  auto country = countryAround(position);
  auto place = nearestPlace(position, country ? &*country : nullptr, country ? kAreaReach : kCityReach);
  // Off every border, the nearest town's country is the best there is; so it is where a border has no
  // country.
  if (!country && place) country = place->country;
  if (country) {
    StructuredAddress address;
    address.countryCode = std::move(country);
    if (place && place->area) address.administrativeArea = areaName(*place->area);
    if (place && place->kilometres <= kCityReach) address.locality = std::move(place->name);
    answer.address = std::move(address);
  }
  if (failure_) return {{}, GeoError{"the offline gazetteer is damaged: " + *failure_}};
  return answer;
}

void Gazetteer::finish(Query& statement, int code) {
  if (code == SQLITE_ROW || code == SQLITE_DONE) code = statement.failure();
  if (code == SQLITE_OK || failure_) return;
  // The text is that of the latest call, whatever it came to.
  failure_ = isLackOfMemory(code) ? sqlite()->errstr(code) : sqlite()->errmsg(opened_->database.get());
}

// Borders meet the antimeridian from one side or the other, and the pole from one: a position on the edge of
// the map is asked for on either side, a hair's breadth inside.
std::optional<std::string> Gazetteer::countryAround(Position position) {
  position.lat = std::clamp(position.lat, -kQuarterTurn + 1, kQuarterTurn - 1);
  if (std::abs(position.lng) < kHalfTurn) return countryAt(position);
  if (auto east = countryAt({kHalfTurn - 1, position.lat})) return east;
  return countryAt({-kHalfTurn + 1, position.lat});
}

std::optional<std::string> Gazetteer::countryAt(Position position) {
  // A region is an area with holes: inside an odd number of its rings is inside. Regions do not overlap.
  std::map<std::int64_t, std::pair<bool, std::string>> regions;
  const Query::Run run(opened_->rings);
  opened_->rings.bind(1, position.lng);
  opened_->rings.bind(2, position.lat);
  int code = opened_->rings.step();
  for (; code == SQLITE_ROW; code = opened_->rings.step()) {
    if (!goesAround(opened_->rings.blob(2), position.lng, position.lat)) continue;
    auto& [inside, country] = regions[opened_->rings.integer(0)];
    inside = !inside;
    country = opened_->rings.text(1);
  }
  finish(opened_->rings, code);
  for (auto& [id, region] : regions) {
    if (region.first) return std::move(region.second);
  }
  return std::nullopt;
}

std::optional<Gazetteer::Place> Gazetteer::nearestPlace(Position position, const std::string* country,
                                                        double kilometres) {
  std::optional<Place> nearest;
  for (const double radius : kSearchRadii) {
    if (radius > kilometres) break;
    const double height = radius / kKilometresPerDegree * kUnitsPerDegree;
    const auto south = static_cast<std::int64_t>(std::floor(static_cast<double>(position.lat) - height));
    const auto north = static_cast<std::int64_t>(std::ceil(static_cast<double>(position.lat) + height));
    // Meridians draw together towards the poles: the box is as wide as its narrowest parallel asks for.
    const double narrowest =
        std::cos(radians(std::min(std::max(std::abs(south), std::abs(north)), kQuarterTurn)));
    const double width = narrowest > 0 ? height / narrowest : 2.0 * kHalfTurn;
    nearest.reset();
    if (width >= kHalfTurn) {
      searchBox(position, country, -kHalfTurn, kHalfTurn, south, north, nearest);
    } else {
      const auto west = static_cast<std::int64_t>(std::floor(static_cast<double>(position.lng) - width));
      const auto east = static_cast<std::int64_t>(std::ceil(static_cast<double>(position.lng) + width));
      searchBox(position, country, std::max(west, -kHalfTurn), std::min(east, kHalfTurn), south, north,
                nearest);
      // What sticks out beyond the antimeridian comes in again on the other side.
      if (west < -kHalfTurn) {
        searchBox(position, country, west + 2 * kHalfTurn, kHalfTurn, south, north, nearest);
      }
      if (east > kHalfTurn)
        searchBox(position, country, -kHalfTurn, east - 2 * kHalfTurn, south, north, nearest);
    }
    // In a corner of the box, the place found may be farther than one that is just outside.
    if (nearest && nearest->kilometres <= radius) return nearest;
  }
  if (nearest && nearest->kilometres > kilometres) nearest.reset();
  return nearest;
}

void Gazetteer::searchBox(Position position, const std::string* country, std::int64_t west, std::int64_t east,
                          std::int64_t south, std::int64_t north, std::optional<Place>& nearest) {
  Query& statement = country != nullptr ? opened_->placesOfCountry : opened_->places;
  const Query::Run run(statement);
  statement.bind(1, west);
  statement.bind(2, east);
  statement.bind(3, south);
  statement.bind(4, north);
  if (country != nullptr) statement.bind(5, *country);
  const double lng = radians(position.lng);
  const double lat = radians(position.lat);
  int code = statement.step();
  for (; code == SQLITE_ROW; code = statement.step()) {
    const double kilometres =
        kilometresBetween(lng, lat, radians(statement.integer(0)), radians(statement.integer(1)));
    if (nearest && nearest->kilometres <= kilometres) continue;
    nearest = Place{kilometres, std::string(statement.text(2)), std::string(statement.text(3)), {}};
    if (!statement.isNull(4)) nearest->area = statement.integer(4);
  }
  finish(statement, code);
}

std::optional<std::string> Gazetteer::areaName(std::int64_t area) {
  const Query::Run run(opened_->area);
  opened_->area.bind(1, area);
  std::optional<std::string> name;
  const int code = opened_->area.step();
  if (code == SQLITE_ROW) name = opened_->area.text(0);
  finish(opened_->area, code);
  return name;
}

}  // namespace brenvik

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/geo/linux/Gazetteer.h"

#include <algorithm>
#include <array>
#include <cmath>
#include <cstring>
#include <numbers>

namespace brenvik {
namespace {

// As the maker of the database writes them.
constexpr std::int64_t kApplicationId = 0x42764761;
constexpr std::int64_t kFormat = 2;
constexpr std::int64_t kSquare = 25'000;
constexpr std::int64_t kColumns = 1440;
constexpr std::int64_t kRows = 720;
constexpr int kLargestLeaf = 26;  // log2
constexpr std::size_t kPlaceSize = 12;
constexpr double kHeaviest = 8;  // kilometres

constexpr double kUnitsPerDegree = 100'000;
constexpr std::int64_t kHalfTurn = 18'000'000;
constexpr std::int64_t kQuarterTurn = 9'000'000;
constexpr double kKilometresPerDegree = 111.195;  // of latitude, on the mean sphere
constexpr double kEarthRadius = 6371.0;           // kilometres

// A place names the city of what lies around it, and, farther out, still its administrative area. Beyond that
// its neighbours are as likely to be something else.
constexpr double kCityReach = 50;
constexpr double kAreaReach = 150;
// Almost every position has a town within the first circle: few rows to read.
constexpr std::array kSearchRadii{12.0, 25.0, kCityReach + kHeaviest, kAreaReach + kHeaviest};

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

// Outside a town, how far it is to its edge. Inside, how near its middle is as a share of the way: small
// towns that touch a large one keep their own ground.
constexpr double kInside = 3;
double scoreOf(double kilometres, double weight) {
  return kilometres >= weight ? kilometres - weight : kInside * (kilometres / weight - 1);
}
// The distance at which a town of this weight has the score.
double distanceOfScore(double score, double weight) {
  return score >= 0 ? score + weight : weight * (1 + score / kInside);
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

// Reads LEB128 numbers. Past the end, and of one that is too long, it reads zeros and is broken.
class Numbers {
 public:
  explicit Numbers(std::span<const std::byte> bytes) : bytes_(bytes) {}
  bool atEnd() const { return at_ == bytes_.size(); }
  bool isBroken() const { return broken_; }
  std::uint32_t next() {
    std::uint32_t number = 0;
    for (unsigned shift = 0; shift < 32 && at_ < bytes_.size(); shift += 7) {
      const auto byte = std::to_integer<std::uint32_t>(bytes_[at_++]);
      number |= (byte & 127U) << shift;
      if (byte < 128) return number;
    }
    broken_ = true;
    at_ = bytes_.size();
    return 0;
  }
  std::int64_t nextSigned() {
    const std::uint32_t number = next();
    return static_cast<std::int64_t>(number >> 1) ^ -static_cast<std::int64_t>(number & 1);
  }

 private:
  std::span<const std::byte> bytes_;
  std::size_t at_ = 0;
  bool broken_ = false;
};

// Reads a ring of `count` corners, the first one counted from `from`. True when it goes around the position;
// one on the line belongs to exactly one of the two sides.
bool goesAround(Numbers& ring, std::uint32_t count, std::array<std::int64_t, 2> from, std::int64_t x,
                std::int64_t y) {
  std::array<std::int64_t, 2> first{};
  bool inside = false;
  const auto edge = [&](const auto& a, const auto& b) {
    if ((a[1] > y) == (b[1] > y)) return;
    // Where the edge meets the position's parallel, east of the position or not; multiplied out, so exact.
    const std::int64_t rise = b[1] - a[1];
    const std::int64_t offset = (x - a[0]) * rise - (b[0] - a[0]) * (y - a[1]);
    if (rise > 0 ? offset < 0 : offset > 0) inside = !inside;
  };
  for (std::uint32_t i = 0; i < count && !ring.isBroken(); ++i) {
    std::array<std::int64_t, 2> to = from;
    to[0] += ring.nextSigned();
    to[1] += ring.nextSigned();
    // Nothing true lies outside the quadtree's square, and the products above must not overflow.
    constexpr std::int64_t kWorld = std::int64_t{1} << kLargestLeaf;
    if (to[0] < 0 || to[1] < 0 || to[0] > kWorld || to[1] > kWorld) to = {};
    if (i == 0) {
      first = to;
    } else {
      edge(from, to);
    }
    from = to;
  }
  edge(from, first);
  return inside;
}

// The Z-order number of the smallest square of the quadtree that a position lies in.
std::int64_t zOrder(std::int64_t x, std::int64_t y) {
  std::int64_t number = 0;
  for (unsigned bit = 0; bit < 14; ++bit) {
    number |= (x >> 12 >> bit & 1) << 2 * bit | (y >> 12 >> bit & 1) << (2 * bit + 1);
  }
  return number;
}

template <typename Number>
Number littleEndian(std::span<const std::byte> bytes) {
  Number number = 0;
  for (std::size_t i = 0; i < sizeof(Number); ++i) {
    number = static_cast<Number>(number | std::to_integer<Number>(bytes[i]) << 8 * i);
  }
  return number;
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
  // Otherwise an account that can write the file could run its views and functions here, with our rights.
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
  Opened opened{
      std::move(database),
      Query(*functions, handle, "select data from land where cell <= ?1 order by cell desc limit 1"),
      Query(*functions, handle, "select cell, data from near where cell between ?1 and ?2"),
      Query(*functions, handle,
            "select t.name, a.name from place p join place t on t.id = ifnull(p.town, p.id) left join area a "
            "on a.id = p.area "
            "where p.id = ?1"),
      {},
      {},
      {}};
  if (!opened.land.isValid() || !opened.near.isValid() || !opened.place.isValid()) {
    error = functions->errmsg(handle);
    return false;
  }
  opened_ = std::move(opened);
  failure_.reset();
  try {
    if (readTables()) return true;
  } catch (...) {
    opened_.reset();
    throw;
  }
  error = failure_.value_or("its tables are incomplete");
  opened_.reset();
  return false;
}

// Countries, layers and rules are few, and every look-up needs them.
bool Gazetteer::readTables() {
  constexpr std::size_t kMaxRows = 4096;  // of each: what has more is no gazetteer
  const auto readAll = [this](const char* sql, const auto& take) {
    Query rows(*sqlite(), opened_->database.get(), sql);
    if (!rows.isValid()) {
      failure_ = sqlite()->errmsg(opened_->database.get());
      return false;
    }
    int code = rows.step();
    std::size_t count = 1;
    for (; code == SQLITE_ROW; code = rows.step(), ++count) {
      if (count > kMaxRows || rows.integer(0) != static_cast<std::int64_t>(count) || !take(rows))
        return false;
    }
    finish(rows, code);
    return !failure_ && count > 1;
  };
  auto& countries = opened_->countries;
  auto& layers = opened_->layers;
  auto& rules = opened_->rules;
  countries.emplace_back();
  layers.emplace_back();
  const auto isCountry = [&countries](std::int64_t number) {
    return number > 0 && number < static_cast<std::int64_t>(countries.size());
  };
  if (!readAll("select id, code, sovereign from country order by id", [&countries](Query& row) {
        countries.push_back({std::string(row.text(1)), std::string(row.text(2))});
        return countries.size() <= 256;
      })) {
    return false;
  }
  if (!readAll("select id, country from layer order by id", [&layers, &isCountry](Query& row) {
        layers.push_back(static_cast<std::uint8_t>(row.integer(1)));
        return row.integer(1) == 0 || isCountry(row.integer(1));
      })) {
    return false;
  }
  // A table of disputed land may be empty.
  (void)readAll("select id, country, needs from rule order by id", [&rules, &isCountry](Query& row) {
    if (!isCountry(row.integer(1))) return false;
    Rule rule{static_cast<std::uint8_t>(row.integer(1)), {}};
    const auto needs = row.blob(2);
    for (std::size_t at = 0; at + 2 <= needs.size(); at += 2) {
      rule.needs.push_back(littleEndian<std::uint16_t>(needs.subspan(at)));
    }
    std::sort(rule.needs.begin(), rule.needs.end());
    rules.push_back(std::move(rule));
    return true;
  });
  return !failure_;
}

Gazetteer::Position Gazetteer::positionOf(Coordinate coordinate) {
  return {std::llround(coordinate.longitude * kUnitsPerDegree),
          std::llround(coordinate.latitude * kUnitsPerDegree)};
}

Gazetteer::Answer Gazetteer::lookUp(Coordinate coordinate) {
  std::string error;
  if (!open(error)) return {{}, GeoError{"the offline gazetteer cannot be read: " + error}};
  failure_.reset();
  const Position position = positionOf(coordinate);
  Answer answer;
  std::uint8_t country = landAround(position).country;
  const auto town = townNear(position, country);
  // Off every border, the nearest town's country is the best there is; so it is where a border has no
  // country.
  if (country == 0 && town && town->kilometres <= kCityReach) country = town->country;
  if (country != 0) {
    StructuredAddress address;
    address.countryCode = opened_->countries[country].code;
    if (town) nameTown(*town, address);
    answer.address = std::move(address);
  }
  if (failure_) {
    answer = {{}, GeoError{"the offline gazetteer is damaged: " + *failure_}};
    // The file may be another one by the time of the next look-up.
    opened_.reset();
  }
  return answer;
}

std::string Gazetteer::ownCode(Coordinate coordinate, const std::string& country) {
  std::string error;
  if (!open(error)) return country;
  failure_.reset();
  const Land land = landAround(positionOf(coordinate));
  if (failure_) {
    opened_.reset();
    return country;
  }
  const Country& ours = opened_->countries[land.country];
  return land.country != 0 && (land.disputed || ours.sovereign == country) ? ours.code : country;
}

void Gazetteer::finish(Query& statement, int code) {
  if (code == SQLITE_ROW || code == SQLITE_DONE) code = statement.failure();
  if (code == SQLITE_OK || failure_) return;
  // The text is that of the latest call, whatever it came to.
  failure_ = isLackOfMemory(code) ? sqlite()->errstr(code) : sqlite()->errmsg(opened_->database.get());
}

// Borders meet the antimeridian from one side or the other, and the pole from one: a position on the edge of
// the map is asked for on either side, a hair's breadth inside.
Gazetteer::Land Gazetteer::landAround(Position position) {
  position.lat = std::clamp(position.lat, -kQuarterTurn + 1, kQuarterTurn - 1);
  if (std::abs(position.lng) < kHalfTurn) return landAt(position);
  if (const Land east = landAt({kHalfTurn - 1, position.lat}); east.country != 0) return east;
  return landAt({-kHalfTurn + 1, position.lat});
}

Gazetteer::Land Gazetteer::landAt(Position position) {
  const std::int64_t x = position.lng + kHalfTurn;
  const std::int64_t y = position.lat + kQuarterTurn;
  const Query::Run run(opened_->land);
  opened_->land.bind(1, zOrder(x, y));
  const int code = opened_->land.step();
  Land land;
  if (code == SQLITE_ROW) {
    Numbers leaf(opened_->land.blob(0));
    const std::uint32_t size = leaf.next();
    const std::int64_t corner = size <= kLargestLeaf ? -(std::int64_t{1} << size) : 0;
    std::array<std::uint16_t, 64> around{};  // the layers that the position lies in, in ascending order
    std::size_t count = 0;
    while (!leaf.atEnd() && !leaf.isBroken()) {
      const std::uint32_t rings = leaf.next();
      const std::uint32_t layer = leaf.next();
      bool inside = rings == 0;
      for (std::uint32_t i = 0; i < rings && !leaf.isBroken(); ++i) {
        const std::uint32_t corners = leaf.next();
        inside ^= goesAround(leaf, corners, {x & corner, y & corner}, x, y);
      }
      if (layer == 0 || layer >= opened_->layers.size() || (inside && count == around.size())) {
        failure_ = "its borders cannot be read";
        break;
      }
      if (inside) around[count++] = static_cast<std::uint16_t>(layer);
    }
    if (leaf.isBroken() && !failure_) failure_ = "its borders cannot be read";
    land = decide(std::span(around).first(count));
  }
  finish(opened_->land, code);
  return land;
}

// The first rule of disputed land that fits, else the layer of the highest rank.
Gazetteer::Land Gazetteer::decide(std::span<const std::uint16_t> around) const {
  for (const Rule& rule : opened_->rules) {
    if (std::includes(around.begin(), around.end(), rule.needs.begin(), rule.needs.end())) {
      return {rule.country, true};
    }
  }
  for (const std::uint16_t layer : around) {
    if (opened_->layers[layer] != 0) return {opened_->layers[layer], false};
  }
  return {};
}

Gazetteer::Town* Gazetteer::Found::bestOf(std::uint16_t area) {
  const auto found =
      std::find_if(best.begin(), best.end(), [area](const Town& town) { return town.area == area; });
  return found == best.end() ? nullptr : &*found;
}

const Gazetteer::Town& Gazetteer::Found::town() {
  const Town& ofArea = *bestOf(nearest->area);
  const Town& ofAll = *std::min_element(best.begin(), best.end(),
                                        [](const Town& a, const Town& b) { return a.score < b.score; });
  return ofArea.score > 0 && ofAll.score < 0 ? ofAll : ofArea;
}

std::optional<Gazetteer::Town> Gazetteer::townNear(Position position, std::uint8_t country) {
  Found found;
  for (const double radius : kSearchRadii) {
    const double height = radius / kKilometresPerDegree * kUnitsPerDegree;
    const auto south = static_cast<std::int64_t>(std::floor(static_cast<double>(position.lat) - height));
    const auto north = static_cast<std::int64_t>(std::ceil(static_cast<double>(position.lat) + height));
    // Meridians draw together towards the poles: the box is as wide as its narrowest parallel asks for.
    const double narrowest =
        std::cos(radians(std::min(std::max(std::abs(south), std::abs(north)), kQuarterTurn)));
    const double width = narrowest > 0 ? height / narrowest : 2.0 * kHalfTurn;
    const auto from = static_cast<double>(position.lng) - width + kHalfTurn;
    const auto to = static_cast<double>(position.lng) + width + kHalfTurn;
    const bool whole = width >= kHalfTurn;
    const std::int64_t west = whole ? 0 : static_cast<std::int64_t>(std::floor(from / kSquare));
    const std::int64_t east = whole ? kColumns - 1 : static_cast<std::int64_t>(std::floor(to / kSquare));
    const std::int64_t first = std::max<std::int64_t>((south + kQuarterTurn) / kSquare, 0);
    const std::int64_t last = std::min((north + kQuarterTurn) / kSquare, kRows - 1);
    found.nearest.reset();
    found.best.clear();
    for (std::int64_t row = first; row <= last; ++row) {
      searchRow(position, country, row, std::max<std::int64_t>(west, 0), std::min(east, kColumns - 1), radius,
                found);
      // What sticks out beyond the antimeridian comes in again on the other side.
      if (west < 0) searchRow(position, country, row, west + kColumns, kColumns - 1, radius, found);
      if (east >= kColumns) searchRow(position, country, row, 0, east - kColumns, radius, found);
    }
    // A heavier town than the one found may still be just outside.
    if (found.nearest && found.bestOf(found.nearest->area)->score <= radius - kHeaviest) break;
  }
  if (!found.nearest || found.nearest->kilometres > kAreaReach) return std::nullopt;
  return found.town();
}

void Gazetteer::searchRow(Position position, std::uint8_t country, std::int64_t row, std::int64_t west,
                          std::int64_t east, double kilometres, Found& found) {
  const Query::Run run(opened_->near);
  opened_->near.bind(1, row * kColumns + west);
  opened_->near.bind(2, row * kColumns + east);
  int code = opened_->near.step();
  for (; code == SQLITE_ROW; code = opened_->near.step()) {
    searchSquare(position, country, opened_->near.integer(0), opened_->near.blob(1), kilometres, found);
  }
  finish(opened_->near, code);
}

void Gazetteer::searchSquare(Position position, std::uint8_t country, std::int64_t cell,
                             std::span<const std::byte> data, double kilometres, Found& found) {
  const std::int64_t west = cell % kColumns * kSquare - kHalfTurn;
  const std::int64_t south = cell / kColumns * kSquare - kQuarterTurn;
  const double lng = radians(position.lng);
  const double lat = radians(position.lat);
  const double cosine = std::cos(lat);
  // Of the square's parallels the shortest.
  const double shortest =
      std::max(0.0, std::cos(radians(std::max(std::abs(south), std::abs(south + kSquare)))));
  for (; data.size() >= kPlaceSize; data = data.subspan(kPlaceSize)) {
    const auto itsCountry = std::to_integer<std::uint8_t>(data[5]);
    if (itsCountry >= opened_->countries.size() || itsCountry == 0) {
      if (!failure_) failure_ = "its places cannot be read";
      return;
    }
    if (country != 0 && itsCountry != country) continue;
    const double itsLng = radians(west + littleEndian<std::uint16_t>(data));
    const double itsLat = radians(south + littleEndian<std::uint16_t>(data.subspan(2)));
    const double weight = std::to_integer<int>(data[4]) / 10.0;
    const auto area = littleEndian<std::uint16_t>(data.subspan(6));
    Town* const best = found.bestOf(area);
    // Farther away than this it can be neither the nearest nor the best of its area.
    const double worst = best == nullptr
                             ? kilometres
                             : std::max(found.nearest->kilometres, distanceOfScore(best->score, weight));
    // Never more than the distance, and much quicker: most places are out by it. Sine of x is above 0.99 x up
    // to 0.24.
    const double up = (itsLat - lat) / 2;
    const double across = (itsLng - lng) / 2;
    if (std::abs(across) < 0.24 &&
        2 * kEarthRadius * 0.99 * std::sqrt(up * up + cosine * shortest * across * across) > worst) {
      continue;
    }
    const double away = kilometresBetween(lng, lat, itsLng, itsLat);
    if (away > kilometres) continue;
    const Town town{scoreOf(away, weight), away, itsCountry, area,
                    littleEndian<std::uint32_t>(data.subspan(8))};
    if (!found.nearest || away < found.nearest->kilometres) found.nearest = town;
    if (best == nullptr) {
      found.best.push_back(town);
    } else if (town.score < best->score) {
      *best = town;
    }
  }
  if (!data.empty() && !failure_) failure_ = "its places cannot be read";
}

void Gazetteer::nameTown(const Town& town, StructuredAddress& address) {
  const Query::Run run(opened_->place);
  opened_->place.bind(1, std::int64_t{town.place});
  const int code = opened_->place.step();
  if (code == SQLITE_ROW) {
    if (town.kilometres <= kCityReach) address.locality = opened_->place.text(0);
    if (!opened_->place.isNull(1)) address.administrativeArea = opened_->place.text(1);
  }
  finish(opened_->place, code);
}

}  // namespace brenvik

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include <gtest/gtest.h>

#include <algorithm>
#include <array>
#include <cmath>
#include <cstdint>
#include <cstring>
#include <map>
#include <numbers>
#include <random>
#include <span>
#include <string>
#include <utility>
#include <vector>

#include "platform/geo/linux/Gazetteer.h"
#include "platform/geo/linux/Query.h"

namespace brenvik {
namespace {

constexpr double kUnitsPerDegree = 100'000;

// The whole database in memory, searched from one end to the other: no index, no circles, no seam in the map.
class EveryPlace {
 public:
  explicit EveryPlace(const char* path) {
    sqlite3* handle = nullptr;
    EXPECT_EQ(sqlite()->open_v2(path, &handle, SQLITE_OPEN_READONLY, nullptr), SQLITE_OK);
    const SqliteDatabase database(handle);
    for (Query rows(*sqlite(), handle, "select id, code from country"); rows.step() == SQLITE_ROW;)
      countries_[rows.integer(0)] = rows.text(1);
    for (Query rows(*sqlite(), handle, "select id, country from layer"); rows.step() == SQLITE_ROW;)
      layers_[rows.integer(0)] = rows.integer(1);
    for (Query rows(*sqlite(), handle, "select country, needs from rule order by id");
         rows.step() == SQLITE_ROW;) {
      rules_.push_back({rows.integer(0), {}});
      const auto needs = rows.blob(1);
      for (std::size_t at = 0; at < needs.size(); at += 2)
        rules_.back().second.push_back(number(needs, at, 2));
    }
    for (Query rows(*sqlite(), handle,
                    "select id, ifnull(area, 0), name, country, ifnull(town, id) from place");
         rows.step() == SQLITE_ROW;) {
      names_[rows.integer(0)] = {rows.integer(1), std::string(rows.text(2))};
      sources_[rows.integer(0)] = rows.integer(3);
      towns_[rows.integer(0)] = rows.integer(4);
    }
    for (Query rows(*sqlite(), handle, "select id, name from area"); rows.step() == SQLITE_ROW;)
      areas_[rows.integer(0)] = rows.text(1);
    for (Query rows(*sqlite(), handle, "select cell, data from near order by cell");
         rows.step() == SQLITE_ROW;) {
      const auto data = rows.blob(1);
      for (std::size_t at = 0; at < data.size(); at += 12) {
        const double lng = degrees(rows.integer(0) % 1440 * 25000 + number(data, at, 2)) - 180;
        const double lat = degrees(rows.integer(0) / 1440 * 25000 + number(data, at + 2, 2)) - 90;
        places_.push_back({vectorOf(lat, lng), lat, lng, static_cast<double>(number(data, at + 4, 1)) / 10,
                           number(data, at + 5, 1), number(data, at + 6, 2), number(data, at + 8, 4)});
      }
    }
    for (Query rows(*sqlite(), handle, "select cell, data from land"); rows.step() == SQLITE_ROW;)
      readLeaf(rows.integer(0), rows.blob(1));
  }

  std::size_t size() const { return places_.size(); }
  Coordinate coordinateOf(std::size_t place) const { return {places_[place].lat, places_[place].lng}; }
  // As the source of the places says.
  const std::string& countryOf(std::size_t place) const {
    return countries_.at(sources_.at(places_[place].number));
  }

  // "COUNTRY|area|city", or "nowhere".
  std::string at(Coordinate coordinate) const {
    std::int64_t country = countryAt(coordinate);
    const auto here = vectorOf(coordinate.latitude, coordinate.longitude);
    const Place* nearest = nullptr;
    double away = 1e9;
    std::map<std::int64_t, std::pair<double, const Place*>> best;
    for (const Place& place : places_) {
      if (country != 0 && place.country != country) continue;
      const double kilometres = 6371.0 * chordAngle(here, place.at);
      if (kilometres < away) {
        away = kilometres;
        nearest = &place;
      }
      const double score =
          kilometres >= place.weight ? kilometres - place.weight : 3 * (kilometres / place.weight - 1);
      const auto [found, isNew] = best.try_emplace(place.area, score, &place);
      if (!isNew && score < found->second.first) found->second = {score, &place};
    }
    const Place* town = nullptr;
    if (nearest != nullptr && away <= 150) {
      auto [score, ofArea] = best[nearest->area];
      town = ofArea;
      for (const auto& [area, other] : best) {
        if (best[nearest->area].first > 0 && other.first < 0 && other.first < score) {
          score = other.first;
          town = other.second;
        }
      }
    }
    const double toTown = town == nullptr ? 1e9 : 6371.0 * chordAngle(here, town->at);
    if (country == 0 && toTown <= 50) country = town->country;
    if (country == 0) return "nowhere";
    std::string text = countries_.at(country) + '|';
    if (town == nullptr) return text + '|';
    const std::int64_t area = names_.at(town->number).first;
    const std::string& name = names_.at(towns_.at(town->number)).second;
    return text + (area != 0 ? areas_.at(area) : "") + '|' + (toTown <= 50 ? name : "");
  }

 private:
  using Vector = std::array<double, 3>;
  using Ring = std::vector<std::array<double, 2>>;
  struct Place {
    Vector at;
    double lat;
    double lng;
    double weight;
    std::int64_t country;
    std::int64_t area;
    std::int64_t number;
  };
  struct Leaf {
    std::array<double, 2> corner;
    double size;
    std::vector<std::pair<std::int64_t, std::vector<Ring>>> layers;
  };

  static std::int64_t number(std::span<const std::byte> bytes, std::size_t at, std::size_t size) {
    std::int64_t value = 0;
    for (std::size_t i = size; i-- > 0;) value = value * 256 + std::to_integer<int>(bytes[at + i]);
    return value;
  }
  static double degrees(std::int64_t units) { return static_cast<double>(units) / kUnitsPerDegree; }
  static Vector vectorOf(double lat, double lng) {
    const double phi = lat * std::numbers::pi / 180;
    const double lambda = lng * std::numbers::pi / 180;
    return {std::cos(phi) * std::cos(lambda), std::cos(phi) * std::sin(lambda), std::sin(phi)};
  }
  static double chordAngle(const Vector& a, const Vector& b) {
    return 2 * std::asin(std::min(1.0, std::hypot(a[0] - b[0], a[1] - b[1], a[2] - b[2]) / 2));
  }
  void readLeaf(std::int64_t cell, std::span<const std::byte> data) {
    std::size_t at = 0;
    const auto next = [&] {
      std::int64_t value = 0;
      for (int shift = 0;; shift += 7) {
        const int byte = std::to_integer<int>(data[at++]);
        value += std::int64_t{byte & 127} << shift;
        if (byte < 128) return value;
      }
    };
    const auto nextSigned = [&] {
      const std::int64_t value = next();
      return value % 2 == 0 ? value / 2 : -(value + 1) / 2;
    };
    std::array<std::int64_t, 2> corner{};
    for (std::size_t bit = 0; bit < 28; ++bit) corner[bit % 2] |= (cell >> bit & 1) << (bit / 2 + 12);
    Leaf leaf{{static_cast<double>(corner[0]), static_cast<double>(corner[1])}, std::exp2(next()), {}};
    while (at < data.size()) {
      const std::int64_t rings = next();
      leaf.layers.push_back({next(), {}});
      for (std::int64_t i = 0; i < rings; ++i) {
        Ring ring(static_cast<std::size_t>(next()));
        auto [x, y] = corner;
        for (auto& point : ring) {
          x += nextSigned();
          y += nextSigned();
          point = {static_cast<double>(x), static_cast<double>(y)};
        }
        leaf.layers.back().second.push_back(std::move(ring));
      }
    }
    leaves_.push_back(std::move(leaf));
  }
  std::int64_t countryAt(Coordinate coordinate) const {
    const double x = std::round((coordinate.longitude + 180) * kUnitsPerDegree);
    const double y = std::round((coordinate.latitude + 90) * kUnitsPerDegree);
    std::vector<std::int64_t> around;
    for (const Leaf& leaf : leaves_) {
      if (x < leaf.corner[0] || y < leaf.corner[1] || x >= leaf.corner[0] + leaf.size ||
          y >= leaf.corner[1] + leaf.size) {
        continue;
      }
      for (const auto& [layer, rings] : leaf.layers) {
        bool inside = rings.empty();
        for (const Ring& ring : rings) {
          for (std::size_t i = 0, before = ring.size() - 1; i < ring.size(); before = i++) {
            const auto& a = ring[before];
            const auto& b = ring[i];
            if ((a[1] > y) != (b[1] > y) && x < a[0] + (b[0] - a[0]) * (y - a[1]) / (b[1] - a[1]))
              inside = !inside;
          }
        }
        if (inside) around.push_back(layer);
      }
    }
    const auto isAround = [&](std::int64_t layer) {
      return std::find(around.begin(), around.end(), layer) != around.end();
    };
    for (const auto& [country, needs] : rules_) {
      if (std::all_of(needs.begin(), needs.end(), isAround)) return country;
    }
    std::sort(around.begin(), around.end());
    for (const std::int64_t layer : around) {
      if (layers_.at(layer) != 0) return layers_.at(layer);
    }
    return 0;
  }

  std::vector<Place> places_;
  std::vector<Leaf> leaves_;
  std::map<std::int64_t, std::string> countries_;
  std::map<std::int64_t, std::int64_t> layers_;
  std::vector<std::pair<std::int64_t, std::vector<std::int64_t>>> rules_;
  std::map<std::int64_t, std::pair<std::int64_t, std::string>> names_;
  std::map<std::int64_t, std::int64_t> towns_;
  std::map<std::int64_t, std::int64_t> sources_;
  std::map<std::int64_t, std::string> areas_;
};

TEST(GazetteerOracleTest, RandomPositionsAreAnsweredAsASearchOfEverythingDoes) {
  const EveryPlace everything(GAZETTEER_DATABASE);
  ASSERT_GT(everything.size(), 100'000U);
  std::mt19937 random(20240229);
  const auto uniform = [&](double from, double to) {
    return std::uniform_real_distribution<double>(from, to)(random);
  };
  std::vector<Coordinate> positions;
  for (int i = 0; i < 120; ++i) {  // around places
    const Coordinate place = everything.coordinateOf(random() % everything.size());
    positions.push_back({place.latitude + uniform(-0.5, 0.5), place.longitude + uniform(-0.5, 0.5)});
  }
  for (int i = 0; i < 60; ++i) positions.push_back({uniform(-90, 90), uniform(-180, 180)});
  std::vector<Coordinate> atTheSeam;
  for (std::size_t i = 0; i < everything.size(); ++i) {
    if (std::abs(everything.coordinateOf(i).longitude) > 177) atTheSeam.push_back(everything.coordinateOf(i));
  }
  for (int i = 0; i < 60; ++i) {  // on both sides of the antimeridian, where something is near
    const Coordinate place = atTheSeam.at(random() % atTheSeam.size());
    const double beside = 180 - uniform(0.001, 1);
    positions.push_back({place.latitude + uniform(-0.5, 0.5), random() % 2 == 0 ? beside : -beside});
  }
  for (int i = 0; i < 40; ++i) {  // around the poles
    positions.push_back({random() % 2 == 0 ? uniform(80, 90) : uniform(-90, -80), uniform(-180, 180)});
  }

  Gazetteer gazetteer(GAZETTEER_DATABASE);
  int known = 0;
  for (Coordinate position : positions) {
    // As exact as the database is, so that both look at the very same point.
    position.latitude =
        std::round(std::clamp(position.latitude, -89.9, 89.9) * kUnitsPerDegree) / kUnitsPerDegree;
    position.longitude =
        std::round(std::clamp(position.longitude, -179.999, 179.999) * kUnitsPerDegree) / kUnitsPerDegree;
    const auto answer = gazetteer.lookUp(position);
    ASSERT_FALSE(answer.error);
    std::string text = "nowhere";
    if (answer.address) {
      ++known;
      text = answer.address->countryCode.value_or("") + '|' +
             answer.address->administrativeArea.value_or("") + '|' + answer.address->locality.value_or("");
    }
    EXPECT_EQ(text, everything.at(position)) << position.latitude << ", " << position.longitude;
  }
  EXPECT_GT(known, 100);
}

// What the places' own source says of a country that is not answered there: disputed land, and four slips of
// the source.
const std::map<std::string, std::size_t> kOtherwise{{"IL for PS", 17}, {"IL for SY", 6}, {"MA for EH", 5},
                                                    {"IN for PK", 2},  {"VN for CN", 2}, {"SS for SD", 1},
                                                    {"AE for IR", 1},  {"TR for IQ", 1}, {"IN for MM", 1}};

TEST(GazetteerOracleTest, EveryPlaceLiesInTheCountryThatItsSourceSays) {
  const EveryPlace everything(GAZETTEER_DATABASE);
  Gazetteer gazetteer(GAZETTEER_DATABASE);
  std::map<std::string, std::size_t> otherwise;
  for (std::size_t i = 0; i < everything.size(); ++i) {
    const auto answer = gazetteer.lookUp(everything.coordinateOf(i));
    ASSERT_FALSE(answer.error);
    const auto country = answer.address ? answer.address->countryCode.value_or("") : "";
    if (country != everything.countryOf(i)) ++otherwise[everything.countryOf(i) + " for " + country];
  }
  EXPECT_EQ(otherwise, kOtherwise);
}

}  // namespace
}  // namespace brenvik

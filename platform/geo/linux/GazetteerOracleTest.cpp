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
#include <string>
#include <vector>

#include "platform/geo/linux/Gazetteer.h"
#include "platform/geo/linux/Query.h"

namespace brenvik {
namespace {

constexpr double kUnitsPerDegree = 100'000;

// The whole database in memory, searched from one end to the other: no index, no boxes, no seam in the map.
class EveryPlace {
 public:
  explicit EveryPlace(const char* path) {
    sqlite3* handle = nullptr;
    EXPECT_EQ(sqlite()->open_v2(path, &handle, SQLITE_OPEN_READONLY, nullptr), SQLITE_OK);
    const SqliteDatabase database(handle);
    Query places(*sqlite(), handle,
                 "select min_lng, min_lat, name, country, ifnull(border, ''), ifnull(area, 0) from place_at "
                 "join place using(id)");
    while (places.step() == SQLITE_ROW) {
      places_.push_back({vectorOf(degrees(places.integer(1)), degrees(places.integer(0))),
                         degrees(places.integer(1)), degrees(places.integer(0)), std::string(places.text(2)),
                         std::string(places.text(3)), std::string(places.text(4)), places.integer(5)});
    }
    Query areas(*sqlite(), handle, "select id, name from area");
    while (areas.step() == SQLITE_ROW) areas_[areas.integer(0)] = areas.text(1);
    Query rings(*sqlite(), handle,
                "select region, country, points from ring join region on region.id = region");
    while (rings.step() == SQLITE_ROW) {
      Region& region = regions_[rings.integer(0)];
      region.country = rings.text(1);
      std::vector<std::int32_t> numbers(rings.blob(2).size() / sizeof(std::int32_t));
      std::memcpy(numbers.data(), rings.blob(2).data(), rings.blob(2).size());
      Ring ring;
      for (std::size_t i = 0; i + 1 < numbers.size(); i += 2)
        ring.push_back({degrees(numbers[i]), degrees(numbers[i + 1])});
      region.rings.push_back(std::move(ring));
    }
  }

  std::size_t size() const { return places_.size(); }
  Coordinate coordinateOf(std::size_t place) const { return {places_[place].lat, places_[place].lng}; }

  // "COUNTRY|area|city", or "nowhere".
  std::string at(Coordinate coordinate) const {
    std::string country = countryAt(coordinate);
    const auto here = vectorOf(coordinate.latitude, coordinate.longitude);
    const Place* nearest = nullptr;
    double most = -2;
    for (const Place& place : places_) {
      if (!country.empty() && place.country != country && place.border != country) continue;
      const double cosine = here[0] * place.at[0] + here[1] * place.at[1] + here[2] * place.at[2];
      if (cosine <= most) continue;
      most = cosine;
      nearest = &place;
    }
    const double kilometres = nearest == nullptr ? 1e9 : 6371.0 * chordAngle(here, nearest->at);
    if (kilometres > (country.empty() ? 50 : 150)) nearest = nullptr;
    if (country.empty() && nearest != nullptr) country = nearest->country;
    if (country.empty()) return "nowhere";
    std::string text = country + '|';
    if (nearest != nullptr && nearest->area != 0) text += areas_.at(nearest->area);
    return text + '|' + (nearest != nullptr && kilometres <= 50 ? nearest->name : "");
  }

 private:
  using Vector = std::array<double, 3>;
  using Ring = std::vector<std::array<double, 2>>;
  struct Place {
    Vector at;
    double lat;
    double lng;
    std::string name;
    std::string country;
    std::string border;
    std::int64_t area;
  };
  struct Region {
    std::string country;
    std::vector<Ring> rings;
  };

  static double degrees(std::int64_t units) { return static_cast<double>(units) / kUnitsPerDegree; }
  static Vector vectorOf(double lat, double lng) {
    const double phi = lat * std::numbers::pi / 180;
    const double lambda = lng * std::numbers::pi / 180;
    return {std::cos(phi) * std::cos(lambda), std::cos(phi) * std::sin(lambda), std::sin(phi)};
  }
  static double chordAngle(const Vector& a, const Vector& b) {
    return 2 * std::asin(std::min(1.0, std::hypot(a[0] - b[0], a[1] - b[1], a[2] - b[2]) / 2));
  }
  std::string countryAt(Coordinate coordinate) const {
    for (const auto& [id, region] : regions_) {
      bool inside = false;
      for (const Ring& ring : region.rings) {
        for (std::size_t i = 0, before = ring.size() - 1; i < ring.size(); before = i++) {
          const auto& a = ring[before];
          const auto& b = ring[i];
          if ((a[1] > coordinate.latitude) == (b[1] > coordinate.latitude)) continue;
          const double meets = a[0] + (b[0] - a[0]) * (coordinate.latitude - a[1]) / (b[1] - a[1]);
          if (coordinate.longitude < meets) inside = !inside;
        }
      }
      if (inside) return region.country;
    }
    return {};
  }

  std::vector<Place> places_;
  std::map<std::int64_t, std::string> areas_;
  std::map<std::int64_t, Region> regions_;
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

}  // namespace
}  // namespace brenvik

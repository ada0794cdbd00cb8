// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include <gtest/gtest.h>

#include <algorithm>
#include <fstream>
#include <map>
#include <set>
#include <sstream>
#include <string>
#include <vector>

#include "platform/geo/linux/Gazetteer.h"

namespace brenvik {
namespace {

std::vector<std::string> split(const std::string& text, char by) {
  std::vector<std::string> parts;
  std::istringstream stream(text);
  for (std::string part; std::getline(stream, part, by);) parts.push_back(part);
  return parts;
}

// The list is general knowledge. What the gazetteer's data answers otherwise is named here, each with its
// reason.
const std::set<std::string> kKnownToBeOtherwise{
    "Jersey City",  // its position in the data is three kilometres inland; New York's quarters are nearer
    "Hull sector of Gatineau",  // no population in the data, and within the circle of Ottawa
    "Castries",                 // its position in the data is two kilometres south of the town
    "Port of Spain",            // the same, to the north: Laventille is nearer
    "Willemstad",               // the same, five kilometres to the east: its quarter Otrabanda answers
    "Paramaribo",               // the same, four kilometres to the north: its quarter Rainville answers
    "Phuket",                   // the data counts its quarter Talat Yai as a town
};

TEST(GazetteerPlacesTest, TheListOfPlacesIsAnsweredAsAPersonWouldAnswerIt) {
  std::ifstream list(PLACES_LIST);
  ASSERT_TRUE(list.is_open());
  Gazetteer gazetteer(GAZETTEER_DATABASE);
  int places = 0;
  std::set<std::string> otherwise;
  for (std::string line; std::getline(list, line);) {
    if (line.empty() || line.starts_with('#')) continue;
    const auto fields = split(line, '\t');
    ASSERT_EQ(fields.size(), 5U) << line;
    ++places;
    const auto answer = gazetteer.lookUp({std::stod(fields[0]), std::stod(fields[1])});
    ASSERT_FALSE(answer.error) << answer.error->description;
    const auto address = answer.address.value_or(StructuredAddress{});
    const auto towns = split(fields[3], '|');
    const bool right = address.countryCode == fields[2] &&
                       (fields[3] == "-" ||
                        std::find(towns.begin(), towns.end(), address.locality.value_or("")) != towns.end());
    if (right) continue;
    otherwise.insert(fields[4]);
    EXPECT_TRUE(kKnownToBeOtherwise.contains(fields[4]))
        << line << "\n  is answered: " << address.countryCode.value_or("") << ", "
        << address.administrativeArea.value_or("") << ", " << address.locality.value_or("");
  }
  EXPECT_GE(places, 400);
  EXPECT_EQ(otherwise, kKnownToBeOtherwise) << "an exception that is none any more";
}

// "+DDMM-DDDMM" or "+DDMMSS-DDDMMSS", as the table of time zones writes positions.
Coordinate positionIn(const std::string& text) {
  const auto second = text.find_first_of("+-", 1);
  const auto degrees = [](const std::string& part, std::size_t digits) {
    double value = std::stod(part.substr(1, digits)) + std::stod(part.substr(1 + digits, 2)) / 60;
    if (part.size() > digits + 3) value += std::stod(part.substr(3 + digits, 2)) / 3600;
    return part[0] == '-' ? -value : value;
  };
  return {degrees(text.substr(0, second), 2), degrees(text.substr(second), 3)};
}

// The positions are those of the zones' main towns, to a minute of arc: a few lie in a neighbour's country or
// in the sea by that. All territories of ISO 3166-1 have a zone, but for two without inhabitants.
const std::set<std::string> kZonesOtherwise{
    "MC Europe/Monaco is answered FR",  // two minutes of arc south-west of Monaco's border
};

TEST(GazetteerPlacesTest, TheTimeZoneAndTheLookUpNameTheSameCountry) {
  std::ifstream table("/usr/share/zoneinfo/zone.tab");
  ASSERT_TRUE(table.is_open());
  Gazetteer gazetteer(GAZETTEER_DATABASE);
  std::set<std::string> countries;
  std::set<std::string> otherwise;
  for (std::string line; std::getline(table, line);) {
    if (line.empty() || line.starts_with('#')) continue;
    const auto fields = split(line, '\t');
    ASSERT_GE(fields.size(), 3U) << line;
    const auto answer = gazetteer.lookUp(positionIn(fields[1]));
    ASSERT_FALSE(answer.error);
    const auto country = answer.address ? answer.address->countryCode.value_or("") : "";
    if (country == fields[0]) {
      countries.insert(country);
    } else {
      otherwise.insert(fields[0] + " " + fields[2] + " is answered " + country);
    }
  }
  EXPECT_GE(countries.size(), 245U);
  EXPECT_EQ(otherwise, kZonesOtherwise);
}

TEST(GazetteerPlacesTest, TerritoriesWithoutATimeZoneHaveTheirCodeToo) {
  Gazetteer gazetteer(GAZETTEER_DATABASE);
  const auto countryAt = [&](double latitude, double longitude) {
    return gazetteer.lookUp({latitude, longitude})
        .address.value_or(StructuredAddress{})
        .countryCode.value_or("");
  };
  EXPECT_EQ(countryAt(-54.42, 3.36), "BV");
  EXPECT_EQ(countryAt(-53.10, 73.51), "HM");
  EXPECT_EQ(countryAt(-20.80, 55.45), "RE") << "its sea, too";
}

TEST(GazetteerPlacesTest, TheSeaIsNobodys) {
  Gazetteer gazetteer(GAZETTEER_DATABASE);
  for (const Coordinate sea :
       {Coordinate{30, -40}, Coordinate{-45, -120}, Coordinate{-35, 80}, Coordinate{85, 150},
        Coordinate{12, 160}, Coordinate{45, -150}, Coordinate{-50, 0}}) {
    EXPECT_FALSE(gazetteer.lookUp(sea).address) << sea.latitude << ", " << sea.longitude;
  }
}

}  // namespace
}  // namespace brenvik

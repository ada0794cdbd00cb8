// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
//
// Asks the gazetteer about a grid of positions and writes the country codes, two bytes each ("  " for none),
// row by row from the north-western corner. scripts/draw-places makes pictures of them.
#include <cstdio>
#include <cstdlib>

#include "platform/geo/linux/Gazetteer.h"

int main(int argc, char** argv) {
  if (argc != 8) {
    std::fprintf(stderr, "usage: gazetteer-map GAZETTEER.db SOUTH WEST NORTH EAST WIDTH HEIGHT\n");
    return 2;
  }
  const double south = std::atof(argv[2]);
  const double west = std::atof(argv[3]);
  const double north = std::atof(argv[4]);
  const double east = std::atof(argv[5]);
  const int width = std::atoi(argv[6]);
  const int height = std::atoi(argv[7]);
  brenvik::Gazetteer gazetteer(argv[1]);
  for (int y = 0; y < height; ++y) {
    for (int x = 0; x < width; ++x) {
      const auto answer = gazetteer.lookUp(
          {north - (y + 0.5) * (north - south) / height, west + (x + 0.5) * (east - west) / width});
      if (answer.error) {
        std::fprintf(stderr, "gazetteer-map: %s\n", answer.error->description.c_str());
        return 1;
      }
      const auto country = answer.address ? answer.address->countryCode.value_or("  ") : "  ";
      if (std::fwrite(country.data(), 1, 2, stdout) != 2) return 1;
    }
  }
  return std::fflush(stdout) == 0 ? 0 : 1;
}

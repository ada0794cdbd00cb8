// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <algorithm>
#include <cstddef>
#include <cstdio>
#include <functional>
#include <string>
#include <vector>

// For what a person or another process waits for: single waits, measured in turns.
namespace brenvik {

using Times = std::vector<double>;  // microseconds

// The value below which `share` of the times lie. Reorders them.
inline double quantile(Times& times, double share) {
  const auto at =
      std::min(times.size() - 1, static_cast<std::size_t>(static_cast<double>(times.size()) * share));
  std::nth_element(times.begin(), times.begin() + static_cast<std::ptrdiff_t>(at), times.end());
  return times[at];
}

// One of those that are compared. `wait` does the thing once and says how long it took, in microseconds.
struct Contestant {
  std::string name;
  std::function<double()> wait;
};

// How often: in each round every contestant has its turn, of `unmeasured` waits and then `measured` ones.
struct Turns {
  int rounds;
  int unmeasured;
  int measured;
};

// What the first may take of the second's time; both by their place among the contestants. With `without`,
// only what it takes more than that one counts.
struct PairLimit {
  static constexpr std::size_t kNone = static_cast<std::size_t>(-1);

  std::size_t ours;
  std::size_t peer;
  double most;
  std::size_t without = kNone;
};

// Measures the contestants in turns and compares their medians round by round, so that a slow moment of the
// machine meets both sides; the ratio is the median of the rounds'. False when one is above its limit.
inline bool comparePaired(const Turns& turns, const std::vector<Contestant>& contestants,
                          const std::vector<PairLimit>& limits) {
  std::vector<Times> medians(contestants.size());
  for (int round = 0; round < turns.rounds; ++round) {
    for (std::size_t i = 0; i < contestants.size(); ++i) {
      for (int n = 0; n < turns.unmeasured; ++n) (void)contestants[i].wait();
      Times times;
      for (int n = 0; n < turns.measured; ++n) times.push_back(contestants[i].wait());
      medians[i].push_back(quantile(times, 0.5));
    }
  }
  for (std::size_t i = 0; i < contestants.size(); ++i) {
    Times copy = medians[i];
    std::printf("%-44s %9.2f us\n", contestants[i].name.c_str(), quantile(copy, 0.5));
  }
  bool good = true;
  for (const PairLimit& limit : limits) {
    Times ratios;
    for (std::size_t round = 0; round < medians[limit.ours].size(); ++round) {
      const double base = limit.without == PairLimit::kNone ? 0 : medians[limit.without][round];
      ratios.push_back((medians[limit.ours][round] - base) / medians[limit.peer][round]);
    }
    const double ratio = quantile(ratios, 0.5);
    const bool within = ratio <= limit.most;
    const std::string ours = limit.without == PairLimit::kNone ? contestants[limit.ours].name
                                                               : "(" + contestants[limit.ours].name + " - " +
                                                                     contestants[limit.without].name + ")";
    std::printf("%s / %s: ratio %.3f, at most %.2f  %s\n", ours.c_str(), contestants[limit.peer].name.c_str(),
                ratio, limit.most, within ? "ok" : "ABOVE");
    good = good && within;
  }
  return good;
}

}  // namespace brenvik

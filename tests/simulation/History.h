// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <cstdint>
#include <functional>
#include <optional>
#include <string>
#include <vector>

#include "World.h"

namespace brenvik::simulation {

// One thing that happens, some time after the one before. What it is follows from its seed.
struct Step {
  Time gap{0};
  std::uint64_t seed = 0;
};

// The steps that a seed stands for.
std::vector<Step> stepsOf(std::uint64_t seed);

// What came of a history.
struct Result {
  std::optional<std::string> finding;
  std::uint64_t digest = 0;  // of everything that happened, in order
  Time simulated{0};
  std::uint64_t lives = 0;
  std::uint64_t calls = 0;
  std::uint64_t checkIns = 0;
  std::uint64_t deaths = 0;
};

// Plays the steps. `trace`, if not empty, gets a line for each thing that happens.
Result play(std::uint64_t seed, const std::vector<Step>& steps,
            const std::function<void(const std::string&)>& trace = {});

// The fewest of the steps that still end in such a finding.
std::vector<Step> shrink(std::uint64_t seed, std::vector<Step> steps, const std::string& finding);

}  // namespace brenvik::simulation

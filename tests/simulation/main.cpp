// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include <unistd.h>

#include <chrono>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <stdexcept>
#include <string>

#include "Disk.h"
#include "History.h"

namespace {

using brenvik::simulation::play;
using brenvik::simulation::Result;

// The seed that is being played, for a death of the program.
volatile std::uint64_t seedNow = 0;

// In seconds; most take some hundredths of one. A helper that waits for what never comes ends here.
constexpr unsigned kLongestHistory = 120;

void tellSeed(int signal) {
  char text[64];
  const int length = std::snprintf(text, sizeof text, "died of signal %d at seed %llu\n", signal,
                                   static_cast<unsigned long long>(seedNow));
  (void)!::write(STDERR_FILENO, text, static_cast<std::size_t>(length));
  (void)std::signal(signal, SIG_DFL);
  (void)std::raise(signal);
}

struct Options {
  std::uint64_t first = 1;
  std::uint64_t seeds = 300;
  double minutes = 0;
  bool isVerbose = false;
  bool isTwice = false;
};

bool read(int count, char** words, Options& options) {
  for (int i = 1; i < count; ++i) {
    const std::string word = words[i];
    const auto next = [&] { return i + 1 < count ? words[++i] : ""; };
    if (word == "--seed") {
      options.first = std::strtoull(next(), nullptr, 0);
    } else if (word == "--seeds") {
      options.seeds = std::strtoull(next(), nullptr, 0);
    } else if (word == "--minutes") {
      options.minutes = std::strtod(next(), nullptr);
    } else if (word == "--verbose") {
      options.isVerbose = true;
    } else if (word == "--twice") {
      options.isTwice = true;
    } else {
      return false;
    }
  }
  return true;
}

void tell(std::uint64_t seed, const Result& result) {
  (void)::alarm(0);
  std::printf("seed %llu: %s\n", static_cast<unsigned long long>(seed), result.finding->c_str());
  const auto steps = brenvik::simulation::stepsOf(seed);
  const auto fewer = brenvik::simulation::shrink(seed, steps, *result.finding);
  std::printf("with %zu of %zu steps:\n", fewer.size(), steps.size());
  const Result last = play(seed, fewer, [](const std::string& line) { std::printf("  %s\n", line.c_str()); });
  std::printf("seed %llu, shrunk: %s\n", static_cast<unsigned long long>(seed),
              last.finding ? last.finding->c_str() : "(nothing)");
  (void)std::fflush(stdout);
}

}  // namespace

// Plays histories, each of which follows from its seed. Status 1 if one has found something; 77 if this
// account may not mount.
int main(int count, char** words) {
  Options options;
  if (!read(count, words, options)) {
    std::fprintf(stderr, "usage: %s [--seed FIRST] [--seeds COUNT | --minutes N] [--twice] [--verbose]\n",
                 words[0]);
    return 2;
  }
  try {
    brenvik::simulation::Disk::enter();
  } catch (const std::runtime_error& error) {
    std::fprintf(stderr, "cannot make a file system of its own (%s)\n", error.what());
    return 77;
  }
  for (const int signal : {SIGSEGV, SIGABRT, SIGBUS, SIGFPE, SIGALRM}) (void)std::signal(signal, tellSeed);

  using Clock = std::chrono::steady_clock;
  const auto begin = Clock::now();
  const auto elapsed = [&] { return std::chrono::duration<double>(Clock::now() - begin).count(); };
  std::uint64_t histories = 0;
  std::uint64_t findings = 0;
  Result sum;
  for (std::uint64_t seed = options.first;
       options.minutes > 0 ? elapsed() < options.minutes * 60 : histories < options.seeds;
       ++seed, ++histories) {
    seedNow = seed;
    (void)::alarm(kLongestHistory);
    const auto steps = brenvik::simulation::stepsOf(seed);
    Result result =
        play(seed, steps,
             options.isVerbose ? [](const std::string& line) { std::printf("%s\n", line.c_str()); }
                               : std::function<void(const std::string&)>());
    if (options.isTwice && play(seed, steps).digest != result.digest)
      result.finding = "it does not repeat itself";
    sum.simulated += result.simulated;
    sum.lives += result.lives;
    sum.calls += result.calls;
    sum.checkIns += result.checkIns;
    sum.deaths += result.deaths;
    if (!result.finding) continue;
    tell(seed, result);
    if (++findings == 5) break;
  }
  std::printf(
      "%llu histories in %.1f s: %.0f simulated hours, %llu lives, %llu deaths, %llu check-ins, %llu calls; "
      "%llu findings\n",
      static_cast<unsigned long long>(histories), elapsed(),
      std::chrono::duration<double>(sum.simulated).count() / 3600, static_cast<unsigned long long>(sum.lives),
      static_cast<unsigned long long>(sum.deaths), static_cast<unsigned long long>(sum.checkIns),
      static_cast<unsigned long long>(sum.calls), static_cast<unsigned long long>(findings));
  return findings == 0 ? 0 : 1;
}

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
//
// So many clients at once, each a process that checks in, calls now and then and dies at a random moment, in
// the middle of whatever it does; another one takes its place.
//
// usage: brenvik-crowd CLIENTS SECONDS MEAN_LIFE MEAN_PAUSE SEED    (means in seconds)
//
// Prints one line when all of them have checked in for the first time, one at the end: how many processes
// there were, how many calls were answered, and how many failed. Status 0 when none did.
#include <sys/mman.h>
#include <sys/time.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <chrono>
#include <cmath>
#include <csignal>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <new>
#include <random>
#include <string>
#include <unordered_set>

#include "brenvik/mobile_helper.h"

namespace {

using Clock = std::chrono::steady_clock;

constexpr int kMaxBurst = 20;
constexpr std::uint32_t kPatience = 30'000;  // milliseconds; a helper that needs longer has failed

// What all processes count together.
struct Counts {
  std::atomic<std::uint64_t> checkIns{0};
  std::atomic<std::uint64_t> answers{0};
  std::atomic<std::uint64_t> failures{0};
  std::atomic<std::int32_t> lastFailure{0};
};

struct Means {
  double life;
  double pause;
};

class Member {
 public:
  Member(Counts& counts, const Means& means, std::uint64_t seed)
      : counts_(counts), means_(means), generator_(seed), key_("key " + std::to_string(seed % 50)) {}

  // Ends with a signal, or with a failure.
  [[noreturn]] void live() {
    dieAfter(random(means_.life));
    bvmh_client* const client = bvmh_client_create();
    if (client == nullptr) ::_exit(2);
    bvmh_client_set_timeout(client, kPatience);
    judge(bvmh_connect(client), counts_.checkIns);
    while (true) {
      sleepFor(random(means_.pause));
      const int burst = oneIn(10) ? 1 + static_cast<int>(generator_() % kMaxBurst) : 1;
      for (int i = 0; i < burst; ++i) judge(call(client), counts_.answers);
    }
  }

 private:
  double random(double mean) { return std::exponential_distribution<>(1 / mean)(generator_); }
  bool oneIn(unsigned count) { return generator_() % count == 0; }

  // The signal's default is to end the process, wherever it is.
  static void dieAfter(double seconds) {
    itimerval timer{};
    timer.it_value.tv_sec = static_cast<time_t>(seconds);
    timer.it_value.tv_usec = 1 + static_cast<suseconds_t>(999'998 * (seconds - std::floor(seconds)));
    ::setitimer(ITIMER_REAL, &timer, nullptr);
  }

  static void sleepFor(double seconds) { ::usleep(static_cast<useconds_t>(seconds * 1e6)); }

  std::int32_t call(bvmh_client* client) {
    bvmh_region region{};
    std::int32_t code = 0;
    if (oneIn(50)) {
      const std::string value =
          "<plist version=\"1.0\"><integer>" + std::to_string(generator_() % 1000) + "</integer></plist>";
      return BVMobileHelperSetPreferenceValue(client, "com.example.crowd", key_.c_str(), value.data(),
                                              value.size());
    }
    switch (generator_() % 4) {
      case 0:
        code = BVMobileHelperCopyPreferenceValue(client, "com.example.crowd", key_.c_str(), &region);
        break;
      case 1:
        code = BVMobileHelperCopyAppPreferenceValue(client, "com.example.none", "key", &region);
        break;
      case 2:
        code = BVMobileHelperCopyPreferenceValue(client, "com.example.large", "key", &region);
        break;
      default: {
        char country[BVMH_COUNTRY_CODE_SIZE];
        code = BVMobileHelperCopyCountryCode(client, country, sizeof country);
      }
    }
    bvmh_region_free(&region);
    return code;
  }

  void judge(std::int32_t code, std::atomic<std::uint64_t>& counter) {
    if (code == BVMH_OK) {
      ++counter;
      return;
    }
    counts_.lastFailure = code;
    ++counts_.failures;
    ::_exit(1);
  }

  Counts& counts_;
  const Means means_;
  std::mt19937_64 generator_;
  const std::string key_;
};

// Starts one; returns its process id.
pid_t start(Counts& counts, const Means& means, std::uint64_t seed) {
  const pid_t pid = ::fork();
  if (pid == 0) Member(counts, means, seed).live();
  return pid;
}

}  // namespace

int main(int count, char* arguments[]) {
  if (count != 6) {
    std::fputs("usage: brenvik-crowd CLIENTS SECONDS MEAN_LIFE MEAN_PAUSE SEED\n", stderr);
    return 2;
  }
  const auto clients = std::strtoul(arguments[1], nullptr, 10);
  const auto end = Clock::now() + std::chrono::milliseconds(std::atol(arguments[2]) * 1000);
  const Means means{std::atof(arguments[3]), std::atof(arguments[4])};
  std::uint64_t seed = std::strtoull(arguments[5], nullptr, 10) << 32;

  void* const shared =
      ::mmap(nullptr, sizeof(Counts), PROT_READ | PROT_WRITE, MAP_SHARED | MAP_ANONYMOUS, -1, 0);
  if (shared == MAP_FAILED) {
    std::perror("mmap");
    return 2;
  }
  auto& counts = *new (shared) Counts;
  std::unordered_set<pid_t> alive;
  std::uint64_t processes = 0;
  bool isFull = false;
  while (Clock::now() < end) {
    while (alive.size() < clients && Clock::now() < end) {
      const pid_t pid = start(counts, means, ++seed);
      if (pid < 0) {
        std::perror("fork");
        break;
      }
      alive.insert(pid);
      ++processes;
    }
    if (!isFull && counts.checkIns >= clients) {
      isFull = true;
      std::puts("full");
      std::fflush(stdout);
    }
    pid_t gone = 0;
    while ((gone = ::waitpid(-1, nullptr, WNOHANG)) > 0) alive.erase(gone);
    ::usleep(5000);
  }
  for (const pid_t pid : alive) ::kill(pid, SIGKILL);
  while (::waitpid(-1, nullptr, 0) > 0) {
  }
  std::printf(
      "{\"processes\": %llu, \"check-ins\": %llu, \"answers\": %llu, \"failures\": %llu, \"last failure\": "
      "%d}\n",
      static_cast<unsigned long long>(processes), static_cast<unsigned long long>(counts.checkIns.load()),
      static_cast<unsigned long long>(counts.answers.load()),
      static_cast<unsigned long long>(counts.failures.load()), counts.lastFailure.load());
  return counts.failures == 0 ? 0 : 1;
}

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
//
// What a script waits for that runs bvhelperctl: `bvhelperctl ping` beside a program that does nothing and
// the bare call, which no program can do without. The daemon runs all the time. It admits both callers by
// entitlement files that are written for the time being, so it wants the sandbox of the end-to-end tests:
//
//   sudo tests/e2e/sandbox build/release $PWD/build/release/bench/CommandBenchmark
#include <fcntl.h>
#include <sched.h>
#include <signal.h>
#include <spawn.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <array>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <memory>
#include <string>
#include <thread>

#include "Paired.h"
#include "brenvik/mobile_helper.h"

namespace brenvik {
namespace {

using Clock = std::chrono::steady_clock;

constexpr double kMaxRatioToFloor = 1.3;
constexpr const char* kProgram = BRENVIK_BUILD_DIRECTORY "/bvhelperctl";
constexpr const char* kDaemon = BRENVIK_BUILD_DIRECTORY "/BrenvikMobileHelper";

void require(bool holds, const char* what) {
  if (holds) return;
  std::fprintf(stderr, "CommandBenchmark: %s\n", what);
  std::exit(2);
}

pid_t start(const char* path, const char* argument) {
  posix_spawn_file_actions_t actions;
  require(::posix_spawn_file_actions_init(&actions) == 0, "posix_spawn_file_actions_init");
  for (const int stream : {STDOUT_FILENO, STDERR_FILENO})
    (void)::posix_spawn_file_actions_addopen(&actions, stream, "/dev/null", O_WRONLY,
                                             0);  // only for want of memory
  std::array<char*, 3> words{const_cast<char*>(path), const_cast<char*>(argument), nullptr};
  pid_t process = 0;
  require(::posix_spawn(&process, path, &actions, nullptr, words.data(), environ) == 0, path);
  (void)::posix_spawn_file_actions_destroy(&actions);  // cannot fail
  return process;
}

void run(const char* path, const char* argument) {
  int status = -1;
  require(::waitpid(start(path, argument), &status, 0) > 0 && status == 0, path);
}

// Checks in and leaves again, as the command does.
bool call() {
  struct Free {
    void operator()(bvmh_client* client) const { bvmh_client_free(client); }
  };
  const std::unique_ptr<bvmh_client, Free> client(bvmh_client_create());
  return bvmh_connect(client.get()) == BVMH_OK;
}

double timeOf(const auto& work) {
  const auto begin = Clock::now();
  work();
  return std::chrono::duration<double, std::micro>(Clock::now() - begin).count();
}

void entitle(const std::string& name, const std::string& executable) {
  const std::string path = "/etc/brenvik/entitlements.d/" + name + ".plist";
  std::ofstream(path)
      << "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<plist version=\"1.0\"><dict><key>Executable</key>"
      << "<string>" << executable << "</string><key>Entitlements</key><dict>"
      << "<key>com.norvale.Teravox.BrenvikHelper.allow</key><true/></dict></dict></plist>\n";
  require(::chmod(path.c_str(), 0644) == 0, "an entitlement file cannot be written: run it in the sandbox");
}

int benchmark() {
  // One processor: where the next process lands would be measured otherwise.
  cpu_set_t one;
  CPU_ZERO(&one);
  CPU_SET(static_cast<std::size_t>(::sched_getcpu()), &one);
  require(::sched_setaffinity(0, sizeof one, &one) == 0, "sched_setaffinity");
  entitle("50-bvhelperctl", kProgram);
  entitle("51-command-benchmark", std::filesystem::read_symlink("/proc/self/exe"));
  const pid_t daemon = start(kDaemon, nullptr);
  bool isThere = false;
  for (int i = 0; i < 500 && !isThere; ++i) {
    isThere = call();
    if (!isThere) std::this_thread::sleep_for(std::chrono::milliseconds(10));
  }
  require(isThere, "the daemon does not answer");
  const bool good = comparePaired(
      {.rounds = 15, .unmeasured = 3, .measured = 40},
      {{"bvhelperctl ping", [] { return timeOf([] { run(kProgram, "ping"); }); }},
       {"/bin/true and a bare call",
        [] {
          return timeOf([] {
            run("/bin/true", nullptr);
            require(call(), "the daemon does not answer");
          });
        }},
       {"/bin/true", [] { return timeOf([] { run("/bin/true", nullptr); }); }},
       {"a bare call", [] { return timeOf([] { require(call(), "the daemon does not answer"); }); }}},
      {{.ours = 0, .peer = 1, .most = kMaxRatioToFloor}});
  ::kill(daemon, SIGTERM);
  (void)::waitpid(daemon, nullptr, 0);  // how it ends is for other tests
  return good ? 0 : 1;
}

}  // namespace
}  // namespace brenvik

int main() { return brenvik::benchmark(); }

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include <benchmark/benchmark.h>
#include <fcntl.h>
#include <pwd.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <functional>
#include <iterator>
#include <map>
#include <string>
#include <vector>

#include "Paired.h"
#include "platform/base/UniqueFd.h"
#include "platform/preferences/linux/FilePreferences.h"
#include "platform/stores/RemoteVoicemailStore.h"
#include "platform/stores/linux/PreparedFolder.h"
#include "platform/worker/linux/WorkerProgram.h"

// One durable set (setValue and synchronize) beside the least that durability costs: writing, syncing and
// renaming the same bytes, and syncing the folder. Disks have moods, so each set is followed by the bare
// write at once, and the medians of both are compared. Takes place in a folder made below the current one, or
// below the folder named in BRENVIK_BENCHMARK_FOLDER; on a file system in memory the figures would say
// nothing.
//
// Then a voicemail token read from the store worker, beside a bare ping-pong with another process: 288 bytes
// there, 36 back, no more. And two first reads beside the start of a worker that is asked for nothing: from a
// worker that was started ahead, as the helper does it for a phone that is subscribed to visual voicemail,
// and one that starts the worker itself. Run by root, this needs an account "mobile": the tests' sandbox has
// one.
namespace brenvik {
namespace {

using Clock = std::chrono::steady_clock;

constexpr double kMaxRatioToBare = 1.25;           // times the bare write
constexpr double kMaxRatioOfFirstRead = 0.5;       // times the start of the worker
constexpr double kMaxRatioOfColdFirstRead = 1.25;  // the same
constexpr const char kDomain[] = "com.example.benchmark";

struct SetTimes {
  std::vector<double> ours;  // seconds
  std::vector<double> bare;
  std::size_t bytes = 0;
};
std::map<std::int64_t, SetTimes> timesByKeys;

double median(std::vector<double> all) {
  if (all.empty()) return 0;
  std::nth_element(all.begin(), all.begin() + static_cast<std::ptrdiff_t>(all.size() / 2), all.end());
  return all[all.size() / 2];
}

void require(bool holds, const char* what) {
  if (holds) return;
  std::perror(what);
  std::exit(2);
}

class Folder {
 public:
  Folder() {
    const char* const below = std::getenv("BRENVIK_BENCHMARK_FOLDER");
    std::string name = std::string(below != nullptr ? below : ".") + "/preferences-benchmark.XXXXXX";
    require(::mkdtemp(name.data()) != nullptr, "mkdtemp");
    path = std::filesystem::absolute(name);
  }
  Folder(const Folder&) = delete;
  Folder& operator=(const Folder&) = delete;
  ~Folder() { std::filesystem::remove_all(path); }
  std::filesystem::path path;
};

void bareWrite(int folder, const std::string& bytes) {
  UniqueFd file(::openat(folder, "bare.tmp", O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0600));
  require(file.isValid(), "open");
  require(::write(file.get(), bytes.data(), bytes.size()) == static_cast<ssize_t>(bytes.size()), "write");
  require(::fsync(file.get()) == 0, "fsync");
  file.reset();
  require(::renameat(folder, "bare.tmp", folder, "bare") == 0, "rename");
  require(::fsync(folder) == 0, "fsync");
}

void durableSet(benchmark::State& state) {
  const auto keys = static_cast<std::uint64_t>(state.range(0));
  const Folder home;
  FilePreferences store([&home] { return FilePreferences::Places{home.path, home.path / "any", ""}; });
  const auto keyOf = [](std::uint64_t i) { return "com.example.setting." + std::to_string(i); };
  std::uint64_t number = 1'000'000;
  const auto nextValue = [&number] { return PropertyList::string("value " + std::to_string(++number)); };
  const auto sync = [&store] {
    require(store.synchronize(kDomain, UserScope::currentUser, HostScope::anyHost), "synchronize");
  };
  for (std::uint64_t i = 0; i < keys; ++i) {
    store.setValue(keyOf(i), nextValue(), kDomain, UserScope::currentUser, HostScope::anyHost);
  }
  sync();
  const auto path = home.path / "Library/Preferences" / (std::string(kDomain) + ".plist");
  std::ifstream in(path, std::ios::binary);
  const std::string bytes{std::istreambuf_iterator<char>(in), {}};
  const UniqueFd folder(::open(path.parent_path().c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  require(folder.isValid() && !bytes.empty(), "the domain's file");

  SetTimes& times = timesByKeys[state.range(0)];
  times.bytes = bytes.size();
  for (auto _ : state) {
    const std::string key = keyOf(number * 7919 % keys);
    const PropertyList value = nextValue();
    const auto start = Clock::now();
    store.setValue(key, value, kDomain, UserScope::currentUser, HostScope::anyHost);
    sync();
    const auto middle = Clock::now();
    bareWrite(folder.get(), bytes);
    const auto end = Clock::now();
    times.ours.push_back(std::chrono::duration<double>(middle - start).count());
    times.bare.push_back(std::chrono::duration<double>(end - middle).count());
    state.SetIterationTime(times.ours.back());
  }
}

double microsecondsOf(const std::function<void()>& work) {
  const auto start = Clock::now();
  work();
  return std::chrono::duration<double, std::micro>(Clock::now() - start).count();
}

// A process that answers 288 bytes with 36.
class BarePeer {
 public:
  BarePeer() {
    int ends[2];
    require(::socketpair(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC, 0, ends) == 0, "socketpair");
    pid_ = ::fork();
    require(pid_ >= 0, "fork");
    if (pid_ == 0) {
      ::close(ends[0]);
      while (::recv(ends[1], bytes_, sizeof bytes_, 0) > 0)
        require(::send(ends[1], bytes_, 36, 0) == 36, "send");
      ::_exit(0);
    }
    ::close(ends[1]);
    socket_.reset(ends[0]);
  }
  BarePeer(const BarePeer&) = delete;
  BarePeer& operator=(const BarePeer&) = delete;
  ~BarePeer() {
    socket_.reset();
    (void)::waitpid(pid_, nullptr, 0);
  }
  double pingPong() {
    return microsecondsOf([this] {
      require(::send(socket_.get(), bytes_, 288, 0) == 288, "send");
      require(::recv(socket_.get(), bytes_, sizeof bytes_, 0) == 36, "recv");
    });
  }

 private:
  char bytes_[512] = {};
  pid_t pid_ = -1;
  UniqueFd socket_;
};

// "mobile" where there is such an account and it has another number than this one.
PreparedFolder::Account accountFor(const std::string& home) {
  const passwd* const mobile = ::geteuid() == 0 ? ::getpwnam("mobile") : nullptr;
  return {home, mobile != nullptr ? mobile->pw_uid : ::geteuid(),
          mobile != nullptr ? mobile->pw_gid : ::getegid()};
}

void waitUntilItRuns(WorkerProgram& worker) {
  // It knows no such work, so it hangs up as soon as it runs.
  WorkerChannel channel;
  WorkerMessage message;
  require(worker.open(0, &channel) == WorkerResult::done, "open");
  require(channel.receive(&message, Clock::now() + std::chrono::seconds(10)) == WorkerResult::closed,
          "start");
}

bool compareTokenReads() {
  const Folder home;
  // Looked up once, as the helper does it.
  const PreparedFolder::Account account = accountFor(home.path);
  PreparedFolder folder([&account] { return account; }, "Voicemail", stores::kVoicemailFile);
  const WorkerProgram::Description description{.service = stores::kService,
                                               .program = stores::kProgram,
                                               .bootstrap = home.path,
                                               .folders = {BRENVIK_BUILD_DIRECTORY}};
  const std::string token(60, 't');
  const auto read = [&token](RemoteVoicemailStore& store) {
    require(store.copyToken() == token, "the token");
  };
  WorkerProgram worker(description);
  RemoteVoicemailStore store(worker, folder);
  (void)store.setToken(&token);
  read(store);
  BarePeer bare;
  const bool isFast = comparePaired({.rounds = 15, .unmeasured = 50, .measured = 400},
                                    {{"token read", [&] { return microsecondsOf([&] { read(store); }); }},
                                     {"bare ping-pong", [&] { return bare.pingPong(); }}},
                                    {{.ours = 0, .peer = 1, .most = 10.0}});
  const auto firstRead = [&](WorkerProgram& fresh) {
    RemoteVoicemailStore first(fresh, folder);
    return microsecondsOf([&] { read(first); });
  };
  const bool startsAtOnce = comparePaired({.rounds = 15, .unmeasured = 0, .measured = 4},
                                          {{"first token read, worker started ahead",
                                            [&] {
                                              WorkerProgram fresh(description);
                                              fresh.start();
                                              waitUntilItRuns(fresh);
                                              return firstRead(fresh);
                                            }},
                                           {"first token read, which starts the worker",
                                            [&] {
                                              WorkerProgram fresh(description);
                                              return firstRead(fresh);
                                            }},
                                           {"start of the worker",
                                            [&] {
                                              WorkerProgram fresh(description);
                                              return microsecondsOf([&] { waitUntilItRuns(fresh); });
                                            }}},
                                          {{.ours = 0, .peer = 2, .most = kMaxRatioOfFirstRead},
                                           {.ours = 1, .peer = 2, .most = kMaxRatioOfColdFirstRead}});
  return isFast && startsAtOnce;
}

BENCHMARK(durableSet)
    ->Arg(10)
    ->Arg(1'000)
    ->Arg(10'000)
    ->UseManualTime()
    ->Iterations(300)
    ->Unit(benchmark::kMicrosecond);

}  // namespace
}  // namespace brenvik

int main(int argc, char** argv) {
  benchmark::Initialize(&argc, argv);
  if (benchmark::ReportUnrecognizedArguments(argc, argv)) return 2;
  benchmark::RunSpecifiedBenchmarks();
  bool isGood = !brenvik::timesByKeys.empty();
  std::printf("\n%10s %10s %12s %12s %8s %8s\n", "keys", "bytes", "set, us", "bare, us", "ratio", "at most");
  for (const auto& [keys, times] : brenvik::timesByKeys) {
    const double ours = brenvik::median(times.ours);
    const double bare = brenvik::median(times.bare);
    const bool isWithin = bare > 0 && ours / bare <= brenvik::kMaxRatioToBare;
    std::printf("%10lld %10zu %12.0f %12.0f %8.3f %8.2f  %s\n", static_cast<long long>(keys), times.bytes,
                ours * 1e6, bare * 1e6, bare > 0 ? ours / bare : 0.0, brenvik::kMaxRatioToBare,
                isWithin ? "ok" : "ABOVE");
    isGood = isGood && isWithin;
  }
  std::printf("\n");
  const bool isTokenGood = brenvik::compareTokenReads();
  return isGood && isTokenGood ? 0 : 1;
}

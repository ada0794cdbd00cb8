// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
//
// Copying, moving and unpacking beside the programs that everybody uses for it: cp, mv and bsdtar, each
// followed by sync(1) where ours answers only when the disk has everything. Each iteration does both, in
// turns, on fresh trees; wall time, as both may use all processors. Works in the directory that
// BRENVIK_BENCHMARK_SCRATCH names, else in the current one; the other file system of the moves is /dev/shm.
// The small trees stay until the end: a file system that has just deleted thousands of files is slow to make
// new ones, for everybody.
#include <benchmark/benchmark.h>
#include <fcntl.h>
#include <spawn.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <functional>
#include <map>
#include <string>
#include <vector>

#include "platform/files/linux/LinuxFileManager.h"
#include "platform/files/linux/ZipArchiveCopier.h"

namespace brenvik {
namespace {

namespace fs = std::filesystem;
using Clock = std::chrono::steady_clock;

constexpr int kFiles = 2000;
constexpr std::size_t kSmall = 4096;
constexpr std::size_t kLarge = std::size_t{200} << 20;

void require(bool good, const char* what) {
  if (good) return;
  std::fprintf(stderr, "%s failed\n", what);
  std::exit(2);
}

struct Scratch {
  fs::path here;
  fs::path there;  // on another file system
  Scratch() {
    const char* const named = std::getenv("BRENVIK_BENCHMARK_SCRATCH");
    here = make(named != nullptr ? named : ".");
    there = make("/dev/shm");
  }
  ~Scratch() {
    std::error_code ignored;
    fs::remove_all(here, ignored);
    fs::remove_all(there, ignored);
  }
  static fs::path make(const fs::path& parent) {
    std::string path = (parent / "files-benchmark-XXXXXX").string();
    require(::mkdtemp(path.data()) != nullptr, "scratch directory");
    return fs::canonical(path);
  }
  fs::path fresh(const fs::path& in) { return in / std::to_string(++number); }
  int number = 0;
};

Scratch& scratch() {
  static Scratch made;
  return made;
}

// Bytes that deflate makes about three quarters of.
void fill(const fs::path& path, std::size_t size, std::uint64_t seed) {
  std::ofstream out(path, std::ios::binary);
  std::string block(1 << 16, '\0');
  std::uint64_t state = seed * 2 + 1;
  while (size > 0) {
    for (char& c : block) {
      state = state * 6364136223846793005u + 1442695040888963407u;
      c = static_cast<char>(32 + (state >> 58));
    }
    const std::size_t part = std::min(size, block.size());
    out.write(block.data(), static_cast<std::streamsize>(part));
    size -= part;
  }
}

const fs::path& tree() {
  static const fs::path path = [] {
    const fs::path made = scratch().here / "tree";
    for (int i = 0; i < kFiles; ++i) {
      const fs::path folder = made / std::to_string(i % 20);
      fs::create_directories(folder);
      fill(folder / std::to_string(i), kSmall, static_cast<std::uint64_t>(i));
    }
    return made;
  }();
  return path;
}

const fs::path& largeFile() {
  static const fs::path path = [] {
    const fs::path made = scratch().here / "large";
    fill(made, kLarge, 1);
    return made;
  }();
  return path;
}

// A peer that waits for the disk as ours does: the work, then what it has written.
std::vector<std::string> andSync(const std::string& work, const std::vector<std::string>& arguments) {
  std::vector<std::string> command{"sh", "-ec", work, "sh"};
  command.insert(command.end(), arguments.begin(), arguments.end());
  return command;
}

// Runs a program and waits; the wall time in seconds.
double timeOf(const std::vector<std::string>& command) {
  std::vector<char*> arguments;
  for (const std::string& word : command) arguments.push_back(const_cast<char*>(word.c_str()));
  arguments.push_back(nullptr);
  const auto start = Clock::now();
  pid_t child = 0;
  require(::posix_spawnp(&child, arguments[0], nullptr, nullptr, arguments.data(), environ) == 0,
          arguments[0]);
  int status = -1;
  require(::waitpid(child, &status, 0) == child && status == 0, arguments[0]);
  return std::chrono::duration<double>(Clock::now() - start).count();
}

double timeOf(const std::function<bool()>& work, const char* what) {
  const auto start = Clock::now();
  const bool good = work();
  const double time = std::chrono::duration<double>(Clock::now() - start).count();
  require(good, what);
  return time;
}

fs::path zipOf(const char* name, const fs::path& parent, const char* item) {
  fs::path archive = scratch().here / name;
  if (!fs::exists(archive)) {
    (void)timeOf({"bsdtar", "--format", "zip", "-cf", archive.string(), "-C", parent.string(), item});
  }
  return archive;
}

PropertyList unpackOptions() {
  return PropertyList::dictionary({{"extractPKZip", PropertyList::boolean(true)},
                                   {"copyExtendedAttributes", PropertyList::boolean(true)},
                                   {"copyResources", PropertyList::boolean(true)}});
}

bool unpack(const fs::path& archive, const fs::path& to) {
  const auto copier = std::make_unique<ZipArchiveCopier>(BRENVIK_READER);
  return copier->copy(archive.string(), to.string(), unpackOptions()) == 0;
}

bool copyWhole(const fs::path& from, const fs::path& to, Durability durability = Durability::eventual) {
  LinuxFileManager files;
  return files.copyItem(from.string(), to.string(), IfPresent::fail, durability).succeeded();
}

struct Case {
  double most = 0;
  std::vector<double> ours;
  std::vector<double> peer;
};
std::map<std::string, Case> cases;

// One iteration: what each side does, in turns.
void measure(benchmark::State& state, const char* name, double most, const std::function<double()>& ours,
             const std::function<double()>& peer) {
  Case& one = cases[name];
  one.most = most;
  bool oursFirst = true;
  (void)ours();  // both once, so that the sources are in memory for either
  (void)peer();
  for (auto _ : state) {
    for (const bool mine : {oursFirst, !oursFirst}) {
      ::sync();  // nobody pays for writing back what the other wrote
      (mine ? one.ours : one.peer).push_back(mine ? ours() : peer());
    }
    oursFirst = !oursFirst;
    state.SetIterationTime(one.ours.back());
  }
}

void copyTree(benchmark::State& state) {
  measure(
      state, "tree of 2,000 files / cp -a", 0.85,
      [] {
        const fs::path to = scratch().fresh(scratch().here);
        return timeOf([&] { return copyWhole(tree(), to); }, "copy");
      },
      [] {
        return timeOf({"cp", "-a", tree().string(), scratch().fresh(scratch().here).string()});
      });
}

void copyTreeToTheDisk(benchmark::State& state) {
  measure(
      state, "tree of 2,000 / cp -a, sync", 1.00,
      [] {
        const fs::path to = scratch().fresh(scratch().here);
        return timeOf([&] { return copyWhole(tree(), to, Durability::onReturn); }, "copy");
      },
      [] {
        return timeOf(andSync("cp -a \"$1\" \"$2\"; sync -f \"$2\"",
                              {tree().string(), scratch().fresh(scratch().here).string()}));
      });
}

void copyLarge(benchmark::State& state) {
  const auto then = [](double time, const fs::path& made) {
    fs::remove(made);
    return time;
  };
  measure(
      state, "one file of 200 MiB / cp -a", 0.90,
      [&] {
        const fs::path to = scratch().fresh(scratch().here);
        return then(timeOf([&] { return copyWhole(largeFile(), to); }, "copy"), to);
      },
      [&] {
        const fs::path to = scratch().fresh(scratch().here);
        return then(timeOf({"cp", "-a", largeFile().string(), to.string()}), to);
      });
}

void moveAcross(benchmark::State& state) {
  const auto copied = [] {
    const fs::path from = scratch().fresh(scratch().here);
    require(copyWhole(tree(), from), "copy");
    ::sync();
    return from;
  };
  measure(
      state, "tree to another disk / mv, sync", 0.55,
      [&] {
        const fs::path from = copied();
        const fs::path to = scratch().fresh(scratch().there);
        return timeOf(
            [&] {
              LinuxFileManager files;
              return files.moveItem(from.string(), to.string(), IfPresent::fail).succeeded();
            },
            "move");
      },
      [&] {
        const fs::path from = copied();
        return timeOf(andSync("mv \"$1\" \"$2\"; sync -f \"$2\"; sync \"$3\"",
                              {from.string(), scratch().fresh(scratch().there).string(), scratch().here}));
      });
}

void unpackTree(benchmark::State& state) {
  const fs::path archive = zipOf("tree.zip", scratch().here, (tree(), "tree"));
  measure(
      state, "2,000 files / bsdtar -xf, sync", 1.00,
      [&] {
        const fs::path to = scratch().fresh(scratch().here);
        return timeOf([&] { return unpack(archive, to); }, "unpack");
      },
      [&] {
        const fs::path to = scratch().fresh(scratch().here);
        fs::create_directory(to);
        return timeOf(
            andSync("bsdtar -xf \"$1\" -C \"$2\"; sync -f \"$2\"", {archive.string(), to.string()}));
      });
}

void unpackLarge(benchmark::State& state) {
  const fs::path archive = zipOf("large.zip", scratch().here, (largeFile(), "large"));
  const auto then = [](double time, const fs::path& made) {
    fs::remove_all(made);
    return time;
  };
  measure(
      state, "200 MiB / bsdtar -xf, sync", 1.00,
      [&] {
        const fs::path to = scratch().fresh(scratch().here);
        return then(timeOf([&] { return unpack(archive, to); }, "unpack"), to);
      },
      [&] {
        const fs::path to = scratch().fresh(scratch().here);
        fs::create_directory(to);
        return then(
            timeOf(andSync("bsdtar -xf \"$1\" -C \"$2\"; sync -f \"$2\"", {archive.string(), to.string()})),
            to);
      });
}

// The moves last: they delete trees.
BENCHMARK(copyTree)->UseManualTime()->Iterations(7)->Unit(benchmark::kMillisecond);
BENCHMARK(copyTreeToTheDisk)->UseManualTime()->Iterations(7)->Unit(benchmark::kMillisecond);
BENCHMARK(unpackTree)->UseManualTime()->Iterations(7)->Unit(benchmark::kMillisecond);
BENCHMARK(copyLarge)->UseManualTime()->Iterations(7)->Unit(benchmark::kMillisecond);
BENCHMARK(unpackLarge)->UseManualTime()->Iterations(5)->Unit(benchmark::kMillisecond);
BENCHMARK(moveAcross)->UseManualTime()->Iterations(7)->Unit(benchmark::kMillisecond);

double median(std::vector<double> times) {
  std::sort(times.begin(), times.end());
  return times.empty() ? 0 : times[times.size() / 2];
}

// Peak memory of a process that does the work, and of the reader it starts; in a child, so that it is theirs
// alone. MiB.
bool printPeaks(const char* what, const std::function<bool()>& work) {
  std::fflush(stdout);
  const pid_t child = ::fork();
  if (child == 0) {
    if (!work()) ::_exit(2);
    rusage own{};
    rusage readers{};
    ::getrusage(RUSAGE_SELF, &own);
    ::getrusage(RUSAGE_CHILDREN, &readers);
    const double mine = static_cast<double>(own.ru_maxrss) / 1024;
    const double theirs = static_cast<double>(readers.ru_maxrss) / 1024;
    const bool isGood = mine < 8 && theirs < 16;
    std::printf("%-32s %8.1f %8.1f  %s\n", what, mine, theirs, isGood ? "ok" : "ABOVE");
    std::fflush(stdout);
    ::_exit(isGood ? 0 : 1);
  }
  int status = -1;
  return ::waitpid(child, &status, 0) == child && status == 0;
}

}  // namespace
}  // namespace brenvik

int main(int argc, char** argv) {
  using namespace brenvik;
  benchmark::Initialize(&argc, argv);
  if (benchmark::ReportUnrecognizedArguments(argc, argv)) return 2;
  (void)scratch();
  // First, while this process is small. The reader is told apart by being the only child.
  std::printf("%-32s %8s %8s\n", "peak memory, MiB (below 8, 16)", "helper", "reader");
  const fs::path trees = zipOf("tree.zip", scratch().here, (tree(), "tree"));
  const fs::path larges = zipOf("large.zip", scratch().here, (largeFile(), "large"));
  bool isGood = printPeaks("copy 2,000 files", [] { return copyWhole(tree(), scratch().here / "p1"); });
  isGood = printPeaks("copy 200 MiB", [] { return copyWhole(largeFile(), scratch().here / "p2"); }) && isGood;
  isGood = printPeaks("unpack 2,000 files", [&] { return unpack(trees, scratch().here / "p3"); }) && isGood;
  isGood = printPeaks("unpack 200 MiB", [&] { return unpack(larges, scratch().here / "p4"); }) && isGood;
  fs::remove(scratch().here / "p2");
  fs::remove_all(scratch().here / "p4");
  std::printf("\n");

  benchmark::RunSpecifiedBenchmarks();
  std::printf("\n%-32s %9s %9s %8s %8s\n", "", "ours, ms", "peer, ms", "ratio", "at most");
  for (const auto& [name, one] : cases) {
    const double ours = median(one.ours);
    const double peer = median(one.peer);
    const bool isWithin = peer > 0 && ours / peer <= one.most;
    std::printf("%-32s %9.1f %9.1f %8.3f %8.2f  %s\n", name.c_str(), ours * 1e3, peer * 1e3,
                peer > 0 ? ours / peer : 0.0, one.most, isWithin ? "ok" : "ABOVE");
    isGood = isGood && isWithin;
  }
  return isGood && !cases.empty() ? 0 : 1;
}

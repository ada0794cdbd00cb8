// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
//
// What a client waits for, with everything on one processor:
// - a call to the real daemon, beside a bare blocking ping-pong over the same kind of socket, and beside
//   sd-bus without a bus between;
// - a reply with the largest region that fits a datagram, beside a bare reply of the same size;
// - the start of the daemon to its first answer, beside a bare server that needs the C library alone;
// - a call to a daemon that has 4,000 clients, beside a call to one that has this client alone;
// - what the client library adds to a call.
// With a processor each for daemon and client: 1,000 calls in flight beside 1,000 calls one after another.
// And the daemon's private memory after its first answer, beside the bare server's.
//
// The daemon and the bare server are programs of this build, started as a service manager starts them. The
// daemon admits this program by an entitlement file that is written for the time being, so it wants the
// sandbox of the end-to-end tests and not the machine itself:
//
//   sudo tests/e2e/sandbox build/release $PWD/build/release/bench/TransportBenchmark
#include <brenvik/mobile_helper.h>
#include <fcntl.h>
#include <poll.h>
#include <sched.h>
#include <signal.h>
#include <stdlib.h>
#include <sys/prctl.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <systemd/sd-bus.h>
#include <unistd.h>

#include <array>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <memory>
#include <string>
#include <string_view>
#include <thread>
#include <utility>
#include <vector>

#include "BareServer.h"
#include "Paired.h"
#include "TableServer.h"
#include "interface/Messages.h"
#include "interface/Routines.h"

namespace brenvik {
namespace {

using Clock = std::chrono::steady_clock;

constexpr double kMaxRatioToBare = 1.20;
constexpr double kMaxRatioToBus = 0.55;
constexpr double kMaxRatioToBareRegion = 1.15;
constexpr double kMaxRatioToBareStart = 1.35;
constexpr double kMaxRatioToOneClient = 1.1;  // a call of one among many, beside a call of the only one
constexpr std::size_t kManyClients = 4000;
constexpr double kMaxLibraryShare = 0.15;  // of a bare ping-pong, beside a call without the library
constexpr double kMaxRatioInFlight = 0.6;  // of as many calls one after another
constexpr int kCallsInFlight = 1000;
constexpr long kMaxPrivateDirty = 160;  // KiB of the daemon's own after the first check-in

constexpr const char kEntitlementFile[] = "/etc/brenvik/entitlements.d/50-transport-benchmark.plist";

void require(bool holds, const char* what) {
  if (holds) return;
  std::perror(what);
  std::exit(2);
}

double microsecondsSince(Clock::time_point start) {
  return std::chrono::duration<double, std::micro>(Clock::now() - start).count();
}

// Where this program was let run at first.
cpu_set_t allowedAtFirst() {
  static const cpu_set_t allowed = [] {
    cpu_set_t set;
    require(::sched_getaffinity(0, sizeof set, &set) == 0, "sched_getaffinity");
    return set;
  }();
  return allowed;
}

// Everything that runs from here on, children included, shares one processor: the last one, where least else
// runs.
void pinToOneProcessor() {
  const cpu_set_t allowed = allowedAtFirst();
  std::size_t last = 0;
  for (std::size_t i = 0; i < CPU_SETSIZE; ++i) {
    if (CPU_ISSET(i, &allowed)) last = i;
  }
  cpu_set_t one;
  CPU_ZERO(&one);
  CPU_SET(last, &one);
  require(::sched_setaffinity(0, sizeof one, &one) == 0, "sched_setaffinity");
}

// Calls in flight are work for two: while it lasts, children included, any processor may do it.
class OnAllProcessors {
 public:
  OnAllProcessors() {
    const cpu_set_t all = allowedAtFirst();
    require(::sched_setaffinity(0, sizeof all, &all) == 0, "sched_setaffinity");
  }
  ~OnAllProcessors() { pinToOneProcessor(); }
  OnAllProcessors(const OnAllProcessors&) = delete;
  OnAllProcessors& operator=(const OnAllProcessors&) = delete;
};

std::filesystem::path self() { return std::filesystem::read_symlink("/proc/self/exe"); }

// Lets the daemon admit this program.
class Entitlement {
 public:
  Entitlement() {
    std::ofstream file(kEntitlementFile);
    file << "<plist version=\"1.0\"><dict><key>Executable</key><string>" << self().string()
         << "</string><key>Entitlements</key><dict><key>com.norvale.Teravox.BrenvikHelper.allow</key><true/>"
            "</dict></dict></plist>";
    file.close();
    require(file.good() && ::chmod(kEntitlementFile, 0644) == 0, kEntitlementFile);
  }
  ~Entitlement() { ::unlink(kEntitlementFile); }
  Entitlement(const Entitlement&) = delete;
  Entitlement& operator=(const Entitlement&) = delete;
};

// A server program started with a listening socket at which a client has left its check-in, as a service
// manager starts it when the first client comes.
class ServedProgram {
 public:
  explicit ServedProgram(const std::string& program) {
    static int number = 0;
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    const std::string path = "/tmp/transport-benchmark-" + std::to_string(++number);
    path.copy(address.sun_path, sizeof address.sun_path - 1);
    ::unlink(path.c_str());
    const UniqueFd listening(::socket(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC, 0));
    require(::bind(listening.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address) == 0 &&
                ::listen(listening.get(), 8) == 0,
            "listen");
    const UniqueFd service(::socket(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC, 0));
    require(::connect(service.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address) == 0,
            "connect");
    address_ = address;
    path_ = path;
    std::array<int, 2> life{};
    require(::socketpair(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC, 0, life.data()) == 0, "socketpair");
    life_ = UniqueFd(life[0]);
    sendCheckIn(service.get(), UniqueFd(life[1]));

    const auto before = Clock::now();
    start(program.c_str(), listening.get());
    channel_ = receiveCheckInReply(service.get());
    untilFirstReply_ = microsecondsSince(before);
  }
  ~ServedProgram() {
    ::unlink(path_.c_str());
    ::kill(process_, SIGKILL);
    ::waitpid(process_, nullptr, 0);
  }
  ServedProgram(const ServedProgram&) = delete;
  ServedProgram& operator=(const ServedProgram&) = delete;

  const std::string& path() const { return path_; }
  std::size_t clients() const { return 1 + others_.size() / 2; }
  // Checks in once more and keeps the client.
  void addClient() {
    const UniqueFd service(::socket(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC, 0));
    require(::connect(service.get(), reinterpret_cast<const sockaddr*>(&address_), sizeof address_) == 0,
            "connect");
    std::array<int, 2> life{};
    require(::socketpair(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC, 0, life.data()) == 0, "socketpair");
    others_.emplace_back(life[0]);
    sendCheckIn(service.get(), UniqueFd(life[1]));
    others_.push_back(receiveCheckInReply(service.get()));
  }

  // Memory that the program has to itself and that differs from its files, in KiB.
  long privateDirty() const {
    std::ifstream file("/proc/" + std::to_string(process_) + "/smaps_rollup");
    std::string word;
    long size = 0;
    while (file >> word && word != "Private_Dirty:") continue;
    require(static_cast<bool>(file >> size), "smaps_rollup");
    return size;
  }

  double untilFirstReply() const { return untilFirstReply_; }  // microseconds, from the start of the program

  // One request and its answer of `expected` bytes; microseconds.
  double exchange(const void* request, std::size_t size, std::size_t expected) {
    alignas(4096) static std::array<char, kLargestDatagram> answer;
    const auto before = Clock::now();
    const bool sent = ::send(channel_.get(), request, size, MSG_NOSIGNAL) >= 0;
    const ssize_t received = ::recv(channel_.get(), answer.data(), answer.size(), 0);
    const double time = microsecondsSince(before);
    require(sent && received == static_cast<ssize_t>(expected), "exchange");
    return time;
  }

 private:
  static void sendCheckIn(int service, UniqueFd life) {
    CheckInRequest request{};
    request.header = {kReplyDisposition | kComplexBit, sizeof request, 1, 0, 0, kCheckInRoutine.id};
    request.descriptorCount = 1;
    request.clientPort.disposition = kDispositionMoveSend;
    request.clientPort.type = kPortDescriptorType;
    require(sendWithDescriptor(service, &request, sizeof request, life.get()), "sendmsg");
  }
  static UniqueFd receiveCheckInReply(int service) {
    std::array<char, 64> bytes{};
    alignas(cmsghdr) std::array<char, CMSG_SPACE(sizeof(int))> control{};
    iovec io{bytes.data(), bytes.size()};
    msghdr message{};
    message.msg_iov = &io;
    message.msg_iovlen = 1;
    message.msg_control = control.data();
    message.msg_controllen = control.size();
    const ssize_t size = ::recvmsg(service, &message, MSG_CMSG_CLOEXEC);
    const cmsghdr* const item = CMSG_FIRSTHDR(&message);
    if (size != sizeof(CheckInReply) || item == nullptr) {
      std::fprintf(stderr, "not admitted\n");
      std::exit(2);
    }
    int fd = -1;
    std::memcpy(&fd, CMSG_DATA(item), sizeof fd);
    return UniqueFd(fd);
  }
  // Between vfork and exec nothing but system calls: the memory is the parent's.
  void start(const char* program, int listening) {
    static std::array<char, 32> pidText;
    static std::array<char, 16> count{"LISTEN_FDS=1"};
    static std::string name = std::string("LISTEN_FDNAMES=") + kServiceName;
    std::array<char*, 4> environment{pidText.data(), count.data(), name.data(), nullptr};
    std::array<char*, 2> arguments{const_cast<char*>(program), nullptr};
    static const int nowhere = ::open("/dev/null", O_WRONLY | O_CLOEXEC);
    process_ = ::vfork();
    if (process_ == 0) {
      ::prctl(PR_SET_PDEATHSIG, SIGKILL);
      ::dup2(nowhere, STDERR_FILENO);
      if (listening == 3) {
        ::fcntl(3, F_SETFD, 0);
      } else {
        ::dup2(listening, 3);
      }
      std::snprintf(pidText.data(), pidText.size(), "LISTEN_PID=%d", static_cast<int>(::getpid()));
      ::execve(program, arguments.data(), environment.data());
      ::_exit(127);
    }
    require(process_ > 0, "vfork");
  }

  std::string path_;
  sockaddr_un address_{};
  UniqueFd life_;
  UniqueFd channel_;
  std::vector<UniqueFd> others_;
  pid_t process_ = -1;
  double untilFirstReply_ = 0;
};

// A method of one 255-byte string that returns one integer, served and called by sd-bus without a bus
// between.
class BusPeer {
 public:
  BusPeer() {
    std::array<int, 2> ends{};
    require(::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, ends.data()) == 0, "socketpair");
    server_ = ::fork();
    if (server_ == 0) serve(ends[1]);
    ::close(ends[1]);
    require(sd_bus_new(&bus_) >= 0 && sd_bus_set_fd(bus_, ends[0], ends[0]) >= 0 && sd_bus_start(bus_) >= 0,
            "sd_bus_start");
  }
  ~BusPeer() {
    sd_bus_close_unref(bus_);
    ::kill(server_, SIGKILL);
    ::waitpid(server_, nullptr, 0);
  }
  BusPeer(const BusPeer&) = delete;
  BusPeer& operator=(const BusPeer&) = delete;

  double call() {
    static const std::string text(255, 'x');
    const auto before = Clock::now();
    sd_bus_message* reply = nullptr;
    int code = -1;
    const int result =
        sd_bus_call_method(bus_, nullptr, kPath, kInterface, "Call", nullptr, &reply, "s", text.c_str());
    const bool good = result >= 0 && sd_bus_message_read(reply, "i", &code) >= 0 && code == 5;
    sd_bus_message_unref(reply);
    const double time = microsecondsSince(before);
    require(good, "sd_bus_call_method");
    return time;
  }

 private:
  static constexpr const char kPath[] = "/brenvik";
  static constexpr const char kInterface[] = "brenvik.Benchmark";

  static int answer(sd_bus_message* message, void*, sd_bus_error*) {
    const char* text = nullptr;
    if (sd_bus_message_read(message, "s", &text) < 0) return -1;
    return sd_bus_reply_method_return(message, "i", 5);
  }
  [[noreturn]] static void serve(int fd) {
    ::prctl(PR_SET_PDEATHSIG, SIGKILL);
    const std::array<sd_bus_vtable, 3> methods{sd_bus_vtable SD_BUS_VTABLE_START(0),
                                               SD_BUS_METHOD("Call", "s", "i", &BusPeer::answer, 0),
                                               SD_BUS_VTABLE_END};
    sd_bus* bus = nullptr;
    const sd_id128_t id{{1, 2, 3, 4, 5, 6, 7, 8, 9, 10, 11, 12, 13, 14, 15, 16}};
    if (sd_bus_new(&bus) < 0 || sd_bus_set_fd(bus, fd, fd) < 0 || sd_bus_set_server(bus, 1, id) < 0 ||
        sd_bus_add_object_vtable(bus, nullptr, kPath, kInterface, methods.data(), nullptr) < 0 ||
        sd_bus_start(bus) < 0) {
      ::_exit(1);
    }
    for (;;) {
      const int handled = sd_bus_process(bus, nullptr);
      if (handled < 0) ::_exit(0);
      if (handled == 0 && sd_bus_wait(bus, UINT64_MAX) < 0) ::_exit(0);
    }
  }

  pid_t server_ = -1;
  sd_bus* bus_ = nullptr;
};

// One routine, which answers with a region of all that travels in line. It fills the region once: the
// transport gives the same memory again, and the bare server does not make its bytes anew either.
class RegionTable final : public RoutineTable {
 public:
  explicit RegionTable(SystemRegions& regions) noexcept : regions_(regions) {}
  Handler find(std::int32_t) const noexcept override {
    return [](void* context, const Request&, Reply& reply) {
      void* region = nullptr;
      constexpr std::size_t kLength = SystemRegions::kLongestInLine;
      const KernelReturn code = static_cast<SystemRegions*>(context)->allocate(&region, kLength);
      if (code != kern::success) {
        reply.setStatus(code);
        return Outcome::refused;
      }
      static void* filled = nullptr;
      if (std::exchange(filled, region) != region) std::memset(region, 'x', kLength);
      answerWithRegion(reply, region, kLength);
      return Outcome::accepted;
    };
  }
  void* context() const noexcept override { return &regions_; }

 private:
  SystemRegions& regions_;
};

bool compareCalls(const std::string& daemonPath, const std::string& barePath, int rounds) {
  ServedProgram daemon(daemonPath);
  ServedProgram bare(barePath);
  BusPeer bus;
  // A token that is no text: the routine is called, looks at it and refuses it, and no file is touched.
  String256Request request{};
  request.header = {kReplyDisposition, sizeof request, 1, 0, 0, kFirstRequestId};
  request.ndr = kNdrRecord;
  request.text[0] = '\xFF';
  static_assert(sizeof request == 288 && sizeof(StatusReply) == kBareReply);
  const auto callOf = [&request](ServedProgram& server) {
    return [&] { return server.exchange(&request, sizeof request, sizeof(StatusReply)); };
  };
  return comparePaired({.rounds = rounds, .unmeasured = 50, .measured = 1000},
                       {{"call of the daemon, 288 bytes in, 36 out", callOf(daemon)},
                        {"bare ping-pong, 288 bytes in, 36 out", callOf(bare)},
                        {"sd-bus peer to peer, 255 characters in", [&bus] { return bus.call(); }}},
                       {{0, 1, kMaxRatioToBare}, {0, 2, kMaxRatioToBus}});
}

// A client of the library, whose calls are refused at once: their token is no text.
class LibraryClient {
 public:
  explicit LibraryClient(const std::string& path) : client_(bvmh_client_create()) {
    require(bvmh_client_set_socket(client_, path.c_str()) == BVMH_OK && bvmh_connect(client_) == BVMH_OK,
            "bvmh_connect");
  }
  ~LibraryClient() { bvmh_client_free(client_); }
  LibraryClient(const LibraryClient&) = delete;
  LibraryClient& operator=(const LibraryClient&) = delete;

  double call() {
    const auto before = Clock::now();
    const std::int32_t code = BVMobileHelperSetVoicemailToken(client_, kToken);
    const double time = microsecondsSince(before);
    require(code == BVMH_FAILURE, "call");
    return time;
  }
  double manyInTurn() {
    const auto before = Clock::now();
    for (int i = 0; i < kCallsInFlight; ++i) (void)call();
    return microsecondsSince(before);
  }
  double manyInFlight() {
    const auto before = Clock::now();
    for (int i = 0; i < kCallsInFlight; ++i)
      require(BVMobileHelperSetVoicemailTokenBegin(client_, kToken, nullptr, nullptr) == BVMH_OK, "begin");
    for (int finished = 0; finished < kCallsInFlight;) {
      pollfd ready{bvmh_client_fd(client_), POLLIN, 0};
      require(::poll(&ready, 1, -1) == 1, "poll");
      bvmh_process(client_);
      for (bvmh_result result; bvmh_take_result(client_, 0, &result) == BVMH_OK; ++finished)
        require(result.code == BVMH_FAILURE, "result");
    }
    return microsecondsSince(before);
  }

 private:
  static constexpr const char* kToken = "\xFF";
  bvmh_client* client_;
};

bool compareLibrary(const std::string& daemonPath, const std::string& barePath, int rounds) {
  ServedProgram daemon(daemonPath);
  ServedProgram bare(barePath);
  LibraryClient library(daemon.path());
  String256Request request{};
  request.header = {kReplyDisposition, sizeof request, 1, 0, 0, kFirstRequestId};
  request.ndr = kNdrRecord;
  request.text[0] = '\xFF';
  const auto callOf = [&request](ServedProgram& server) {
    return [&] { return server.exchange(&request, sizeof request, sizeof(StatusReply)); };
  };
  const bool adds = comparePaired({.rounds = rounds, .unmeasured = 50, .measured = 1000},
                                  {{"call of the daemon by the library", [&] { return library.call(); }},
                                   {"the same without the library", callOf(daemon)},
                                   {"bare ping-pong", callOf(bare)}},
                                  {{0, 2, kMaxLibraryShare, 1}});
  const OnAllProcessors here;
  ServedProgram beside(daemonPath);
  LibraryClient busy(beside.path());
  const bool saves = comparePaired({.rounds = rounds, .unmeasured = 1, .measured = 5},
                                   {{"1,000 calls in flight", [&] { return busy.manyInFlight(); }},
                                    {"1,000 calls one after another", [&] { return busy.manyInTurn(); }}},
                                   {{0, 1, kMaxRatioInFlight}});
  return adds && saves;
}

bool compareManyClients(const std::string& daemonPath, int rounds) {
  rlimit descriptors{};
  require(::getrlimit(RLIMIT_NOFILE, &descriptors) == 0, "getrlimit");
  descriptors.rlim_cur = descriptors.rlim_max;
  require(::setrlimit(RLIMIT_NOFILE, &descriptors) == 0, "setrlimit");
  ServedProgram one(daemonPath);
  ServedProgram many(daemonPath);
  const auto before = Clock::now();
  while (many.clients() < kManyClients) many.addClient();
  std::printf("%-44s %9.2f us\n", "a check-in, the mean of 4,000",
              microsecondsSince(before) / static_cast<double>(kManyClients));
  String256Request request{};
  request.header = {kReplyDisposition, sizeof request, 1, 0, 0, kFirstRequestId};
  request.ndr = kNdrRecord;
  request.text[0] = '\xFF';
  const auto callOf = [&request](ServedProgram& server) {
    return [&] { return server.exchange(&request, sizeof request, sizeof(StatusReply)); };
  };
  return comparePaired(
      {.rounds = rounds, .unmeasured = 50, .measured = 1000},
      {{"call of one client among 4,000", callOf(many)}, {"call of the only client", callOf(one)}},
      {{0, 1, kMaxRatioToOneClient}});
}

bool compareRegions(const std::string& barePath, int rounds) {
  TableServer ours(
      [](const TableServer::Surroundings& here, const auto& serve) { serve(RegionTable(here.regions)); });
  ServedProgram bare(barePath);
  const EmptyRequest request{{kReplyDisposition, sizeof(EmptyRequest), 1, 0, 0, 1}};
  static_assert(sizeof request == kBareLargeRequest && kLargestDatagram == kBareLargest);
  return comparePaired(
      {.rounds = rounds, .unmeasured = 20, .measured = 400},
      {{"reply with a region, 65,536 bytes in all",
        [&] {
          const auto before = Clock::now();
          require(ours.exchange(&request, sizeof request) == kLargestDatagram, "exchange");
          return microsecondsSince(before);
        }},
       {"bare reply of 65,536 bytes", [&] { return bare.exchange(&request, sizeof request, kBareLargest); }}},
      {{0, 1, kMaxRatioToBareRegion}});
}

bool compareStarts(const std::string& daemonPath, const std::string& barePath, int rounds) {
  const auto startOf = [](const std::string& path) {
    return [&path] { return ServedProgram(path).untilFirstReply(); };
  };
  return comparePaired({.rounds = rounds, .unmeasured = 1, .measured = 15},
                       {{"start of the daemon to its first reply", startOf(daemonPath)},
                        {"start of a bare server to its first reply", startOf(barePath)}},
                       {{0, 1, kMaxRatioToBareStart}});
}

// Of programs that have answered their first check-in and wait for more.
bool compareMemory(const std::string& daemonPath, const std::string& barePath) {
  const auto memoryOf = [](const std::string& path) {
    // Until the disk has a program that was just built, its own pages are dirty, too.
    const UniqueFd file(::open(path.c_str(), O_RDONLY | O_CLOEXEC));
    require(::fsync(file.get()) == 0, path.c_str());
    const ServedProgram program(path);
    std::this_thread::sleep_for(std::chrono::milliseconds(20));  // what it does after its answer counts, too
    return program.privateDirty();
  };
  const long daemon = memoryOf(daemonPath);
  const bool within = daemon <= kMaxPrivateDirty;
  std::printf("%-44s %6ld KiB\n%-44s %6ld KiB, at most %ld  %s\n", "private dirty memory of a bare server",
              memoryOf(barePath), "private dirty memory of the daemon", daemon, kMaxPrivateDirty,
              within ? "ok" : "ABOVE");
  return within;
}

}  // namespace
}  // namespace brenvik

int main(int argc, char** argv) {
  using namespace brenvik;
  const int rounds = argc > 1 ? std::atoi(argv[1]) : 25;
  const std::string_view only = argc > 2 ? argv[2] : "";
  if (rounds < 1 || !(only.empty() || only == "calls" || only == "regions" || only == "starts" ||
                      only == "clients" || only == "library" || only == "memory")) {
    std::fprintf(
        stderr,
        "usage: TransportBenchmark [ROUNDS [calls | regions | starts | clients | library | memory]]\n");
    return 2;
  }
  pinToOneProcessor();
  const Entitlement entitlement;
  // As the installed system has it, or the daemon's last words of its start would be that it is missing.
  std::filesystem::create_directories(std::filesystem::path(bvmh_service_socket()).parent_path());
  const std::string bare = self().parent_path() / "BareServer";
  const std::string daemon = self().parent_path().parent_path() / "BrenvikMobileHelper";
  const auto isWanted = [only](std::string_view part) { return only.empty() || only == part; };
  const bool calls = !isWanted("calls") || compareCalls(daemon, bare, rounds);
  const bool regions = !isWanted("regions") || compareRegions(bare, rounds);
  const bool starts = !isWanted("starts") || compareStarts(daemon, bare, rounds);
  const bool clients = !isWanted("clients") || compareManyClients(daemon, rounds);
  const bool library = !isWanted("library") || compareLibrary(daemon, bare, rounds);
  const bool memory = !isWanted("memory") || compareMemory(daemon, bare);
  return calls && regions && starts && clients && library && memory ? 0 : 1;
}

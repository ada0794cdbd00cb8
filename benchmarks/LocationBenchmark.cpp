// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
//
// Two things. What a caller waits for who asks for its public address or for a place, beside an empty request
// that writes the same line into the same log, over the same channel to the same process: real transport,
// real routines, real queues; only the geo service never answers. What the line itself costs depends on who
// listens to the log; a request without it is shown too. And the offline gazetteer's look-ups, warm, at
// positions around random places, beside reading one row by its number from the same file.
//
// usage: LocationBenchmark GAZETTEER.db [PAIRS [LOOK-UPS]]
#include <benchmark/benchmark.h>
#include <time.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <memory>
#include <random>
#include <string>
#include <vector>

#include "Paired.h"
#include "TableServer.h"
#include "helper/location/GeoRequestState.h"
#include "helper/location/LocationRoutines.h"
#include "interface/Messages.h"
#include "platform/geo/linux/Gazetteer.h"

namespace brenvik {
namespace {

using Clock = std::chrono::steady_clock;

constexpr std::int32_t kEmpty = 1;
constexpr std::int32_t kWanIp = 2;
constexpr std::int32_t kCivicInfo = 3;
constexpr std::int32_t kOneUnifiedLine = 4;
constexpr std::int32_t kOneBsdLine = 5;
// With everything on one processor this is the price of waking another thread: see
// docs/decisions/12-location-hand-over.md.
constexpr double kMaxRatioToEmptyRequest = 3.0;
constexpr double kMaxLookUp = 100;  // microseconds, for 99 of 100

class GeoServiceNeverAnswers final : public GeoService {
 public:
  std::unique_ptr<ReverseGeocodeTicket> makeReverseGeocodeTicket(Coordinate, IncludeEta, ShiftLocations,
                                                                 const GeoTraits*) override {
    struct Ticket final : ReverseGeocodeTicket {
      void submit(ReverseGeocodeHandler, const GeoNetworkActivity*,
                  const std::shared_ptr<WorkQueue>&) override {}
    };
    return std::make_unique<Ticket>();
  }
  std::unique_ptr<GeoIpTicket> makeGeoIpTicket(const std::optional<std::string>&) override {
    struct Ticket final : GeoIpTicket {
      void submit(GeoIpHandler, const AuditToken*, const GeoNetworkActivity*,
                  const std::shared_ptr<WorkQueue>&) override {}
    };
    return std::make_unique<Ticket>();
  }
  std::optional<std::string> currentCountryCode() override { return std::nullopt; }
};

class NoTelephonyDaemon final : public TelephonyDaemon {
 public:
  void addIdentifierException(std::string_view) override {}
  std::unique_ptr<TelephonyDaemonConnection> create(std::function<void()>) noexcept override {
    return nullptr;
  }
};

class BenchmarkTable final : public RoutineTable {
 public:
  explicit BenchmarkTable(LocationRoutines& routines) noexcept : routines_(routines) {}
  Handler find(std::int32_t id) const noexcept override {
    switch (id) {
      case kWanIp:
        return [](void* context, const Request&, Reply& reply) {
          reply.setStatus(static_cast<LocationRoutines*>(context)->requestWanIPFromLocation(1));
          return Outcome::accepted;
        };
      case kCivicInfo:
        return [](void* context, const Request& request, Reply& reply) {
          const auto& message = request.as<CoordinateRequest>();
          reply.setStatus(static_cast<LocationRoutines*>(context)->requestCountryCodeFromLocation(
              1, message.latitude, message.longitude));
          return Outcome::accepted;
        };
      case kOneUnifiedLine:
        return [](void*, const Request&, Reply& reply) {
          logUnified(LogLevel::debug, "server_BVMobileHelperRequestWanIPFromLocation");
          reply.setStatus(kern::success);
          return Outcome::accepted;
        };
      case kOneBsdLine:
        return [](void*, const Request&, Reply& reply) {
          logBsd(SyslogPriority::error, "server_BVMobileHelperRequestCountryCodeFromLocation \n");
          reply.setStatus(kern::success);
          return Outcome::accepted;
        };
      default:
        return [](void*, const Request&, Reply& reply) {
          reply.setStatus(kern::success);
          return Outcome::accepted;
        };
    }
  }
  void* context() const noexcept override { return &routines_; }

 private:
  LocationRoutines& routines_;
};

// Sends the request and waits for its status; microseconds.
template <typename Message>
double exchange(TableServer& server, const Message& request) {
  const auto before = Clock::now();
  if (server.exchange(&request, sizeof request) != sizeof(StatusReply) ||
      server.reply<StatusReply>().returnCode != kern::success) {
    std::fprintf(stderr, "the server refuses\n");
    std::exit(2);
  }
  return std::chrono::duration<double, std::micro>(Clock::now() - before).count();
}

MessageHeader headerOf(std::int32_t id, std::size_t size) {
  return {kReplyDisposition, static_cast<std::uint32_t>(size), 1, 0, 0, id};
}

bool compareRequests(int pairs) {
  TableServer server([](const TableServer::Surroundings& here, const auto& serve) {
    SystemQueues queues(here.loop);
    GeoServiceNeverAnswers geo;
    NoTelephonyDaemon telephony;
    LocationRoutines routines(queues, geo, telephony, GeoRequestState::shared());
    serve(BenchmarkTable(routines));
  });
  const CoordinateRequest civicInfo{headerOf(kCivicInfo, sizeof(CoordinateRequest)), kNdrRecord, 48.8584,
                                    2.2945};
  // Each after the same pause, so that what a request set going has come to rest.
  constexpr useconds_t kRest = 300;
  const auto plain = [&server](std::int32_t id) {
    return [&server, request = EmptyRequest{headerOf(id, sizeof(EmptyRequest))}] {
      ::usleep(kRest);
      return exchange(server, request);
    };
  };
  const std::vector<Contestant> contestants{{"empty request", plain(kEmpty)},
                                            {"empty, one unified line", plain(kOneUnifiedLine)},
                                            {"public address asked for", plain(kWanIp)},
                                            {"empty, one BSD line", plain(kOneBsdLine)},
                                            {"civic address asked for", [&] {
                                               ::usleep(kRest);
                                               return exchange(server, civicInfo);
                                             }}};
  constexpr int kTurn = 100;
  return comparePaired({.rounds = std::max(1, pairs / kTurn), .unmeasured = 5, .measured = kTurn},
                       contestants, {{2, 1, kMaxRatioToEmptyRequest}, {4, 3, kMaxRatioToEmptyRequest}});
}

bool measureLookUps(const char* path, int count) {
  sqlite3* handle = nullptr;
  const bool opened =
      sqlite() != nullptr && sqlite()->open_v2(path, &handle, SQLITE_OPEN_READONLY, nullptr) == SQLITE_OK;
  const SqliteDatabase database(handle);
  if (!opened) {
    std::fprintf(stderr, "%s cannot be opened\n", path);
    std::exit(2);
  }
  std::vector<Coordinate> places;
  Query all(*sqlite(), handle, "select cell, data from near");
  while (all.step() == SQLITE_ROW) {
    // Twelve bytes a place, of which the first four are its position in the square: see make-gazetteer.
    const auto data = all.blob(1);
    for (std::size_t at = 0; at + 12 <= data.size(); at += 12) {
      const auto number = [&](std::size_t of) {
        return std::to_integer<int>(data[at + of]) + 256 * std::to_integer<int>(data[at + of + 1]);
      };
      places.push_back({static_cast<double>(all.integer(0) / 1440 * 25000 + number(2)) / 1e5 - 90,
                        static_cast<double>(all.integer(0) % 1440 * 25000 + number(0)) / 1e5 - 180});
    }
  }
  std::mt19937 random(1);
  std::normal_distribution<double> aside(0, 0.05);  // degrees; a walk around the town
  std::vector<Coordinate> positions;
  for (int i = 0; i < count; ++i) {
    const Coordinate& place = places.at(random() % places.size());
    positions.push_back({std::clamp(place.latitude + aside(random), -90.0, 90.0),
                         std::clamp(place.longitude + aside(random), -180.0, 180.0)});
  }

  Gazetteer gazetteer(path);
  Times times;
  Times bare;
  Query row(*sqlite(), handle, "select name from place where id = ?1");
  for (int round = 0; round < 2; ++round) {  // the first warms the caches up
    times.clear();
    bare.clear();
    for (const Coordinate& position : positions) {
      // The thread's own time: what else the machine does is not the gazetteer's.
      const auto now = [] {
        timespec time{};
        ::clock_gettime(CLOCK_THREAD_CPUTIME_ID, &time);
        return static_cast<double>(time.tv_sec) * 1e6 + static_cast<double>(time.tv_nsec) / 1e3;
      };
      double before = now();
      auto answer = gazetteer.lookUp(position);
      times.push_back(now() - before);
      if (answer.error) {
        std::fprintf(stderr, "%s\n", answer.error->description.c_str());
        std::exit(2);
      }
      before = now();
      row.bind(1, static_cast<std::int64_t>(random() % places.size() + 1));
      benchmark::DoNotOptimize(row.step());
      benchmark::DoNotOptimize(row.text(0));
      row.reset();
      bare.push_back(now() - before);
    }
  }
  const double median = quantile(times, 0.5);
  const double slow = quantile(times, 0.99);
  const bool within = slow < kMaxLookUp;
  std::printf("%-32s %8.1f us   %.1f times one row read by number (%.1f us)\n", "look-up, median", median,
              median / quantile(bare, 0.5), quantile(bare, 0.5));
  std::printf("%-32s %8.1f us   ratio %.3f to 0.1 ms, below 1  %s\n", "look-up, 99 of 100", slow,
              slow / kMaxLookUp, within ? "ok" : "ABOVE");
  return within;
}

}  // namespace
}  // namespace brenvik

int main(int argc, char** argv) {
  if (argc < 2) {
    std::fprintf(stderr, "usage: LocationBenchmark GAZETTEER.db [PAIRS [LOOK-UPS]]\n");
    return 2;
  }
  const bool requests = brenvik::compareRequests(argc > 2 ? std::atoi(argv[2]) : 3000);
  const bool lookUps = brenvik::measureLookUps(argv[1], argc > 3 ? std::atoi(argv[3]) : 20000);
  return requests && lookUps ? 0 : 1;
}

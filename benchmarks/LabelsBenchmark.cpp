// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
//
// Whole requests for the six labels in one language, over real channels to another process, beside an empty
// request over the same channel; and the routines alone. The serving process has the real transport and label
// routines behind a table of its own, and writes its log to /dev/null unless a journal listens.
#include <fcntl.h>
#include <signal.h>
#include <sys/prctl.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <unistd.h>

#include <array>
#include <chrono>
#include <cstdlib>
#include <cstring>
#include <limits>
#include <memory>
#include <string>
#include <vector>

#include "Ratios.h"
#include "helper/labels/LabelRoutines.h"
#include "interface/Messages.h"
#include "platform/ipc/fakes/HeapRegions.h"
#include "platform/ipc/linux/SystemPortSources.h"
#include "platform/labeler/linux/CatalogueLabeler.h"
#include "platform/log/linux/SystemLog.h"
#include "platform/plist/PropertyListCodec.h"
#include "platform/runloop/linux/SystemQueues.h"

namespace brenvik {
namespace {

constexpr std::int32_t kEmpty = 1;
constexpr std::int32_t kBadges = 2;
constexpr std::int32_t kNames = 3;

class BenchmarkTable final : public RoutineTable {
 public:
  explicit BenchmarkTable(LabelRoutines& routines) noexcept : routines_(routines) {}
  Handler find(std::int32_t id) const noexcept override {
    if (id == kEmpty) {
      return [](void*, const Request&, Reply& reply) {
        reply.setStatus(kern::success);
        return Outcome::accepted;
      };
    }
    return id == kBadges ? &answer<&LabelRoutines::CopyBadgeLabels>
                         : &answer<&LabelRoutines::CopyLocalizedLabels>;
  }
  void* context() const noexcept override { return &routines_; }

 private:
  template <auto method>
  static Outcome answer(void* context, const Request& request, Reply& reply) {
    const auto& message = request.as<LabelsRequest>();
    OutOfLinePayload payload;
    const KernelReturn code = (static_cast<LabelRoutines*>(context)->*method)(
        reinterpret_cast<const void*>(message.labels.address), message.labels.size,
        reinterpret_cast<const void*>(message.languages.address), message.languages.size, &payload);
    if (code != kern::success) {
      reply.setStatus(code);
      return Outcome::refused;
    }
    auto& result = reply.as<OutOfLineReply>();
    result.header.bits = kReplyDisposition | kComplexBit;
    result.header.size = sizeof result;
    result.descriptorCount = 1;
    result.payload = {reinterpret_cast<std::uint64_t>(payload.address),
                      1,
                      kVirtualCopy,
                      0,
                      kOutOfLineDescriptorType,
                      payload.length};
    result.ndr = kNdrRecord;
    result.byteCount = payload.length;
    return Outcome::accepted;
  }
  LabelRoutines& routines_;
};

// A process that serves the table until this one goes.
class Server {
 public:
  Server() {
    PortName port = kNullPort;
    if (ports_.allocateReceiveRight(&port) != kern::success ||
        ports_.insertSendRight(port) != kern::success) {
      std::abort();
    }
    client_ = UniqueFd(::fcntl(ports_.sendEnd(port)->get(), F_DUPFD_CLOEXEC, 0));
    child_ = ::fork();
    if (child_ == 0) serve(port);
    (void)ports_.dropReceiveRight(port);
  }
  ~Server() {
    ::kill(child_, SIGKILL);
    ::waitpid(child_, nullptr, 0);
  }
  // Sends a request and waits for its answer; its length in bytes.
  std::size_t exchange(const std::string& request) {
    if (::send(client_.get(), request.data(), request.size(), MSG_NOSIGNAL) < 0) std::abort();
    const ssize_t size = ::recv(client_.get(), reply_.data(), reply_.size(), 0);
    if (size < 0) std::abort();
    return static_cast<std::size_t>(size);
  }

 private:
  [[noreturn]] void serve(PortName port) {
    ::prctl(PR_SET_PDEATHSIG, SIGKILL);
    client_.reset();
    ::dup2(::open("/dev/null", O_WRONLY | O_CLOEXEC), STDERR_FILENO);
    SystemLog log("LabelsBenchmark");
    setLogSink(&log);
    const auto loop = SystemRunLoop::make();
    SystemRegions regions;
    SystemPortSources sources(ports_, regions);
    CatalogueLabeler labeler;
    LabelRoutines routines(labeler, regions);
    BenchmarkTable table(routines);
    const auto source = sources.makeRoutineSource(port, table, WantTrailer::no);
    if (loop == nullptr || source == nullptr || !source->addTo(*loop)) ::_exit(1);
    (void)loop->run(std::chrono::duration<double>(std::numeric_limits<double>::max()), ReturnAfterSource::no);
    ::_exit(0);
  }

  SystemPortSpace ports_;
  UniqueFd client_;
  pid_t child_ = -1;
  std::vector<char> reply_ = std::vector<char>(kLargestDatagram);
};

Server& server() {
  static Server instance;
  return instance;
}

std::string arrayOf(const std::vector<std::string>& texts) {
  std::vector<PropertyList> elements;
  for (const std::string& text : texts) elements.push_back(PropertyList::string(text));
  return serializePropertyList(PropertyList::array(std::move(elements)), PropertyListFormat::xml).value();
}

const std::string& sixKeys() {
  static const std::string bytes =
      arrayOf({"USER_LABEL_PRIMARY", "USER_LABEL_SECONDARY", "USER_LABEL_PERSONAL", "USER_LABEL_BUSINESS",
               "USER_LABEL_TRAVEL", "USER_LABEL_CELL_DATA"});
  return bytes;
}
const std::string& sixPairs() {
  static const std::string bytes =
      arrayOf({"USER_LABEL_PRIMARY", "", "USER_LABEL_SECONDARY", "", "USER_LABEL_PERSONAL", "",
               "USER_LABEL_BUSINESS", "", "USER_LABEL_TRAVEL", "", "USER_LABEL_CELL_DATA", ""});
  return bytes;
}
const std::string& german() {
  static const std::string bytes = arrayOf({"de-DE"});
  return bytes;
}

std::string emptyRequest() {
  std::string bytes(sizeof(MessageHeader), '\0');
  auto& header = *reinterpret_cast<MessageHeader*>(bytes.data());
  header = {kReplyDisposition, sizeof(MessageHeader), 1, 0, 0, kEmpty};
  return bytes;
}

std::string labelsRequest(std::int32_t id, const std::string& labels) {
  const auto roundUp = [](std::size_t size) { return (size + 7) / 8 * 8; };
  const std::size_t first = roundUp(sizeof(LabelsRequest));
  const std::size_t second = roundUp(first + labels.size());
  std::string bytes(second + german().size(), '\0');
  auto& request = *reinterpret_cast<LabelsRequest*>(bytes.data());
  request.header = {kReplyDisposition | kComplexBit, sizeof(LabelsRequest), 1, 0, 0, id};
  request.descriptorCount = 2;
  request.labels = {
      first, 0, kVirtualCopy, 0, kOutOfLineDescriptorType, static_cast<std::uint32_t>(labels.size())};
  request.languages = {
      second, 0, kVirtualCopy, 0, kOutOfLineDescriptorType, static_cast<std::uint32_t>(german().size())};
  request.ndr = kNdrRecord;
  request.labelsLength = request.labels.size;
  request.languagesLength = request.languages.size;
  labels.copy(bytes.data() + first, labels.size());
  german().copy(bytes.data() + second, german().size());
  return bytes;
}

void roundTrips(benchmark::State& state, const std::string& request, std::size_t shortestAnswer) {
  Server& peer = server();
  if (peer.exchange(request) < shortestAnswer) return state.SkipWithError("refused");
  for (auto _ : state) benchmark::DoNotOptimize(peer.exchange(request));
}

void emptyRoundTrip(benchmark::State& state) { roundTrips(state, emptyRequest(), sizeof(StatusReply)); }
void sixNamesRoundTrip(benchmark::State& state) {
  roundTrips(state, labelsRequest(kNames, sixKeys()), sizeof(OutOfLineReply));
}
void sixBadgesRoundTrip(benchmark::State& state) {
  roundTrips(state, labelsRequest(kBadges, sixPairs()), sizeof(OutOfLineReply));
}

// The routines alone, their lines dropped.
template <auto method>
void routine(benchmark::State& state, const std::string& labels) {
  setLogSink(nullptr);
  HeapRegions regions;
  CatalogueLabeler labeler;
  LabelRoutines routines(labeler, regions);
  for (auto _ : state) {
    OutOfLinePayload payload;
    if ((routines.*method)(labels.data(), static_cast<std::uint32_t>(labels.size()), german().data(),
                           static_cast<std::uint32_t>(german().size()), &payload) != kern::success) {
      return state.SkipWithError("refused");
    }
    regions.deallocate(payload.address, payload.length);
  }
}
void sixNamesRoutine(benchmark::State& state) {
  routine<&LabelRoutines::CopyLocalizedLabels>(state, sixKeys());
}
void sixBadgesRoutine(benchmark::State& state) {
  routine<&LabelRoutines::CopyBadgeLabels>(state, sixPairs());
}

BENCHMARK(emptyRoundTrip)->UseRealTime();
BENCHMARK(sixNamesRoundTrip)->UseRealTime();
BENCHMARK(sixBadgesRoundTrip)->UseRealTime();
BENCHMARK(sixNamesRoutine)->UseRealTime();
BENCHMARK(sixBadgesRoutine)->UseRealTime();

}  // namespace
}  // namespace brenvik

int main(int argc, char** argv) {
  return brenvik::runAndCompare(
      argc, argv,
      {{"six names / empty request", "sixNamesRoundTrip", "emptyRoundTrip", 3.0},
       {"six badges / empty request", "sixBadgesRoundTrip", "emptyRoundTrip", 3.0}});
}

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
//
// Whole requests for the six labels in one language, over real channels to another process, beside an empty
// request over the same channel; and the routines alone. The serving process has the real transport and label
// routines behind a table of its own.
#include <string>
#include <vector>

#include "Ratios.h"
#include "TableServer.h"
#include "helper/labels/LabelRoutines.h"
#include "interface/Messages.h"
#include "platform/ipc/fakes/HeapRegions.h"
#include "platform/labeler/linux/CatalogueLabeler.h"
#include "platform/plist/PropertyListCodec.h"

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
    return id == kBadges ? &answer<&LabelRoutines::copyBadgeLabels>
                         : &answer<&LabelRoutines::copyLocalizedLabels>;
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
    answerWithRegion(reply, payload.address, payload.length);
    return Outcome::accepted;
  }
  LabelRoutines& routines_;
};

TableServer& server() {
  static TableServer instance([](const TableServer::Surroundings& here, const auto& serve) {
    CatalogueLabeler labeler;
    LabelRoutines routines(labeler, here.regions);
    serve(BenchmarkTable(routines));
  });
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
  TableServer& peer = server();
  if (peer.exchange(request.data(), request.size()) < shortestAnswer) return state.SkipWithError("refused");
  for (auto _ : state) benchmark::DoNotOptimize(peer.exchange(request.data(), request.size()));
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
  routine<&LabelRoutines::copyLocalizedLabels>(state, sixKeys());
}
void sixBadgesRoutine(benchmark::State& state) {
  routine<&LabelRoutines::copyBadgeLabels>(state, sixPairs());
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

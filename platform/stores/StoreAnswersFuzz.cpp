// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
//
// Any answers of a store worker, over a real channel, to each operation of the helper. The first byte says
// how many datagrams there are and whether descriptors come along; each begins with its length, two bytes.
#include <fcntl.h>

#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdint>
#include <cstdlib>
#include <string>
#include <utility>
#include <vector>

#include "platform/stores/RemoteContacts.h"
#include "platform/stores/RemoteVoicemailStore.h"
#include "platform/stores/StoreMessages.h"

namespace {

using namespace brenvik;

void require(bool condition) {
  if (!condition) std::abort();
}

// A worker that has said everything already, and hung up.
class Answered final : public Worker {
 public:
  explicit Answered(std::vector<WorkerMessage> answers) : answers_(std::move(answers)) {}
  WorkerResult open(std::uint32_t, WorkerChannel* channel) noexcept override {
    WorkerChannel theirs;
    require(WorkerChannel::makePair(channel, &theirs) == WorkerResult::done);
    for (const WorkerMessage& answer : answers_) (void)theirs.send(answer);
    kept_ = std::move(theirs);  // or the requests could not be sent
    return WorkerResult::done;
  }
  void start() noexcept override {}
  void giveUp(WorkerChannel* channel) noexcept override { channel->close(); }

 private:
  const std::vector<WorkerMessage> answers_;
  WorkerChannel kept_;
};

class RootFolder final : public StoreFolder {
 public:
  State open(IfMissing, Opened* folder) noexcept override {
    *folder = {UniqueFd(::open("/", O_PATH | O_CLOEXEC)), 1, 1};
    return State::open;
  }
  bool prepare(const Opened&) noexcept override { return false; }
};

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  if (size == 0) return 0;
  const std::uint8_t how = *data++;
  --size;
  std::vector<WorkerMessage> answers;
  for (int i = 0; i <= (how & 3) && size >= 6; ++i) {
    const std::size_t length = std::min<std::size_t>(data[0] + 256U * data[1], size - 6);
    WorkerMessage& answer = answers.emplace_back();
    answer.kind = data[2] | static_cast<std::uint32_t>(data[3]) << 8 |
                  static_cast<std::uint32_t>(data[4]) << 16 | static_cast<std::uint32_t>(data[5]) << 24;
    const auto* const bytes = reinterpret_cast<const std::byte*>(data) + 6;
    answer.payload.assign(bytes, bytes + std::min(length, WorkerMessage::kLongestPayload));
    if ((how & 4) != 0) answer.descriptors.emplace_back(::open("/dev/null", O_RDONLY | O_CLOEXEC));
    data += 6 + length;
    size -= 6 + length;
  }
  constexpr std::chrono::milliseconds kNoPatience{0};
  RootFolder folder;
  Answered worker(std::move(answers));
  RemoteVoicemailStore store(worker, folder, kNoPatience);
  const auto tolerant = [](auto work) {
    try {
      work();
    } catch (const std::bad_alloc&) {  // what a worker may say as well
    }
  };
  tolerant([&] {
    const auto token = store.copyToken();
    require(!token || token->size() <= WorkerMessage::kLongestPayload);
  });
  tolerant([&] { store.setTokenForKey("key", "token"); });
  tolerant([&] { store.removeAllRecords(); });
  RemoteContacts contacts(worker, folder, kNoPatience);
  tolerant([&] {
    if (const auto manager = contacts.makeChannelManager()) {
      std::optional<std::string> error;
      const bool done = manager->remapChannelIdentifier("from", "to", &error);
      require(!done || !error);
      require(!error || error->size() <= stores::kLongestDescription);
    }
  });
  return 0;
}

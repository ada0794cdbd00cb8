// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/network/linux/RemoteGunzip.h"

#include <fcntl.h>
#include <poll.h>
#include <sys/eventfd.h>

#include <algorithm>
#include <cerrno>
#include <new>
#include <utility>

#include "platform/datagram/SealedMemory.h"
#include "platform/network/GunzipMessages.h"

namespace brenvik {
namespace {

using Clock = std::chrono::steady_clock;

// Signs of life before a file must be unpacked: at one every kAliveInterval, more than an hour of them.
constexpr int kMaxSignsOfLife = 1000;
constexpr GunzipOutcome kOutOfMemory{GunzipResult::outOfMemory, 0, 0};

UniqueFd duplicate(int fd) noexcept { return UniqueFd(::fcntl(fd, F_DUPFD_CLOEXEC, 0)); }

// The input's own memory, or a copy of it that is sealed. Invalid when there is no memory for it.
UniqueFd sealedMemoryOf(const GunzipInput& input) noexcept {
  if (input.sealedMemory >= 0) return duplicate(input.sealedMemory);
  return makeSealedMemory("brenvik-gzip", input.bytes);
}

}  // namespace

RemoteGunzip::RemoteGunzip(Worker& worker, std::chrono::milliseconds longestSilence) noexcept
    : worker_(worker), longestSilence_(longestSilence), stop_(::eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK)) {}

void RemoteGunzip::shutDown() noexcept {
  if (stop_.isValid()) (void)::eventfd_write(stop_.get(), 1);  // its count is far from full
}

GunzipOutcome RemoteGunzip::gunzipInto(const GunzipInput& input, int file, std::uint64_t room,
                                       std::uint64_t largestOutput) noexcept try {
  const GunzipQuestion question{input.bytes.size(), std::min(room, largestOutput), largestOutput};
  WorkerMessage message{static_cast<std::uint32_t>(NetworkMessage::ask), encode(question), {}};
  message.descriptors.push_back(sealedMemoryOf(input));
  message.descriptors.push_back(duplicate(file));
  if (!message.descriptors[0].isValid() || !message.descriptors[1].isValid()) return kOutOfMemory;

  WorkerChannel channel;
  auto result = worker_.open(static_cast<std::uint32_t>(NetworkWork::gunzip), &channel);
  if (result == WorkerResult::done) result = channel.send(message);
  message = {};
  if (result == WorkerResult::outOfMemory) return kOutOfMemory;
  if (result != WorkerResult::done) return {};
  return awaitOutcome(question, channel);
} catch (const std::bad_alloc&) {
  return kOutOfMemory;
}

// Until the worker answers, says nothing for too long, talks nonsense, or shutDown() is called.
GunzipOutcome RemoteGunzip::awaitOutcome(const GunzipQuestion& question, WorkerChannel& channel) {
  int signsOfLife = 0;
  for (auto heard = Clock::now();;) {
    const auto left = std::chrono::ceil<std::chrono::milliseconds>(heard + longestSilence_ - Clock::now());
    pollfd waited[] = {{channel.descriptor(), POLLIN, 0}, {stop_.get(), POLLIN, 0}};
    const int ready = ::poll(waited, 2, static_cast<int>(std::max<std::int64_t>(left.count(), 0)));
    if (ready < 0 && errno == EINTR) continue;
    if (waited[1].revents != 0) return {};
    WorkerMessage message;
    const auto result = ready <= 0 ? WorkerResult::timedOut : channel.receive(&message, Clock::now());
    if (result == WorkerResult::outOfMemory) return kOutOfMemory;
    if (result != WorkerResult::done) break;
    if (!message.descriptors.empty()) {
      channel.discard(&message);
      break;
    }
    const auto kind = static_cast<NetworkMessage>(message.kind);
    if (kind == NetworkMessage::refusal) return kOutOfMemory;
    if (kind == NetworkMessage::answer) {
      if (const auto outcome = decodeGunzipOutcome(message.payload, question)) return *outcome;
    }
    if (kind != NetworkMessage::alive || !message.payload.empty() || ++signsOfLife > kMaxSignsOfLife) break;
    heard = Clock::now();
  }
  worker_.giveUp(&channel);
  return {};
}

}  // namespace brenvik

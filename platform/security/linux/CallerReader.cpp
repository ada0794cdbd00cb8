// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/security/linux/CallerReader.h"

#include <fcntl.h>
#include <linux/capability.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <algorithm>
#include <new>
#include <utility>

namespace brenvik {
namespace {

constexpr int kInARow = 3;
// Enough for a worker that is at work.
constexpr std::chrono::milliseconds kLeastPatience{10};

}  // namespace

bool readsCallersByItself() noexcept {
  __user_cap_header_struct header{_LINUX_CAPABILITY_VERSION_3, 0};
  __user_cap_data_struct data[_LINUX_CAPABILITY_U32S_3] = {};
  return ::syscall(SYS_capget, &header, data) == 0 && (data[0].effective & (1U << CAP_SYS_PTRACE)) != 0;
}

std::optional<CallerFacts> RemoteCallerReader::read(int folder) {
  const auto began = now_();
  const Clock::duration patience = std::min<Clock::duration>(
      patience_, std::max<Clock::duration>(kLeastPatience, kInARow * patience_ - (paidAt_.load() - began)));
  for (int attempt = 0;; ++attempt) {
    WorkerChannel channel;
    WorkerMessage answer;
    const WorkerResult result = exchange(folder, began + patience, &channel, &answer);
    if (result == WorkerResult::outOfMemory) throw std::bad_alloc();
    if (result == WorkerResult::done) {
      if (auto facts = callers::decode(answer)) return facts;
    }
    if (result == WorkerResult::timedOut) {
      paidAt_ =
          std::min(std::max(paidAt_.load(), began) + 2 * patience, began + patience + kInARow * patience_);
      // It may be starting, and need more time than that.
      if (patience < patience_) return std::nullopt;
    }
    channel.discard(&answer);
    worker_.giveUp(&channel);
    if (result != WorkerResult::closed || attempt > 0) return std::nullopt;
  }
}

WorkerResult RemoteCallerReader::exchange(int folder, Clock::time_point deadline, WorkerChannel* channel,
                                          WorkerMessage* answer) {
  WorkerMessage question;
  question.kind = callers::kFacts;
  question.descriptors.emplace_back(::fcntl(folder, F_DUPFD_CLOEXEC, 0));
  if (!question.descriptors.back().isValid()) return WorkerResult::outOfMemory;
  const WorkerResult opened = worker_.open(callers::kFacts, channel);
  if (opened != WorkerResult::done) return opened;
  const WorkerResult sent = channel->send(question);
  return sent == WorkerResult::done ? channel->receiveShort(answer, deadline) : sent;
}

}  // namespace brenvik

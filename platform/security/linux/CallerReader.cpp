// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/security/linux/CallerReader.h"

#include <fcntl.h>

#include <new>
#include <utility>

namespace brenvik {

std::optional<CallerFacts> RemoteCallerReader::read(int folder) {
  const auto deadline = Clock::now() + patience_;
  for (int attempt = 0;; ++attempt) {
    WorkerChannel channel;
    WorkerMessage answer;
    const WorkerResult result = exchange(folder, deadline, &channel, &answer);
    if (result == WorkerResult::outOfMemory) throw std::bad_alloc();
    if (result == WorkerResult::done) {
      if (auto facts = callers::decode(answer)) return facts;
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

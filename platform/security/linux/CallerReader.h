// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <atomic>
#include <chrono>
#include <functional>
#include <optional>
#include <utility>

#include "platform/security/linux/CallerFacts.h"
#include "platform/worker/Worker.h"

namespace brenvik {

// True if this process may read all accounts' processes by itself (CAP_SYS_PTRACE), so that it asks nobody.
bool readsCallersByItself() noexcept;

// Reads what this process may not read by itself. Any thread.
class CallerReader {
 public:
  virtual ~CallerReader() = default;
  // `folder` is the process's open folder in /proc, and stays the caller's. Returns nothing if it cannot be
  // found out now. Throws std::bad_alloc, also if descriptors run out.
  virtual std::optional<CallerFacts> read(int folder) = 0;
};

// Asks the caller worker, over a channel for each question, and waits for its answer. One that has gone is
// replaced, and the new one asked once more; one that does not answer in time, or sends a malformed answer,
// is given up, and the next question has another. After three waits in vain, one after the other, waiting
// takes half of the time at most, however many questions come: the caller has others to serve.
class RemoteCallerReader final : public CallerReader {
 public:
  // A start of its service takes a tenth of a second on a busy machine, an answer some microseconds.
  static constexpr std::chrono::milliseconds kPatience{2000};
  using Clock = std::chrono::steady_clock;

  // `worker` must outlive this object. `now` is for tests; any thread calls it.
  explicit RemoteCallerReader(Worker& worker, std::chrono::milliseconds patience = kPatience,
                              std::function<Clock::time_point()> now = Clock::now)
      : worker_(worker), patience_(patience), now_(std::move(now)) {}

  std::optional<CallerFacts> read(int folder) override;

 private:
  WorkerResult exchange(int folder, Clock::time_point deadline, WorkerChannel* channel,
                        WorkerMessage* answer);

  Worker& worker_;
  const std::chrono::milliseconds patience_;
  const std::function<Clock::time_point()> now_;
  std::atomic<Clock::time_point> paidAt_{};  // when twice the time that was waited in vain has gone by
};

}  // namespace brenvik

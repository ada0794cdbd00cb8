// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <chrono>
#include <optional>

#include "platform/security/linux/CallerFacts.h"
#include "platform/worker/Worker.h"

namespace brenvik {

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
// is given up, and the next question has another.
class RemoteCallerReader final : public CallerReader {
 public:
  // A start of its service takes a tenth of a second on a busy machine, an answer some microseconds.
  static constexpr std::chrono::milliseconds kPatience{2000};

  // `worker` must outlive this object.
  explicit RemoteCallerReader(Worker& worker, std::chrono::milliseconds patience = kPatience)
      : worker_(worker), patience_(patience) {}

  std::optional<CallerFacts> read(int folder) override;

 private:
  using Clock = std::chrono::steady_clock;
  WorkerResult exchange(int folder, Clock::time_point deadline, WorkerChannel* channel,
                        WorkerMessage* answer);

  Worker& worker_;
  const std::chrono::milliseconds patience_;
};

}  // namespace brenvik

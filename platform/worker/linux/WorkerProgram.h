// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <sys/types.h>

#include <chrono>
#include <cstdint>
#include <functional>
#include <mutex>
#include <string>
#include <vector>

#include "platform/base/UniqueFd.h"
#include "platform/worker/Worker.h"

namespace brenvik {

// One worker, behind the socket of its named service. If nobody listens there, the worker is a child of this
// process (the program beside this one, or the installed one), unless it is a service only. The first open()
// connects or starts it, and so does the first open() after the worker's death. Failures are logged, with a
// limit on lines in a row. Any thread.
class WorkerProgram final : public Worker {
 public:
  struct Description {
    std::string service;    // name of the service
    std::string program;    // name of the program
    std::string bootstrap;  // folder of the services' sockets
    // Folders that may hold the program, best first; if empty, those of workerProgramFolders().
    std::vector<std::string> folders;
    // It is never started as a child: this process could not give it the rights that it needs.
    bool isOnlyService = false;
  };
  using Clock = std::chrono::steady_clock;

  // The most lines in a row, and the time after which one more is allowed.
  static constexpr int kLinesInARow = 5;
  static constexpr std::chrono::seconds kOneMoreLineEvery{10};

  explicit WorkerProgram(Description description, std::function<Clock::time_point()> now = &Clock::now);
  WorkerProgram(const WorkerProgram&) = delete;
  WorkerProgram& operator=(const WorkerProgram&) = delete;
  // Hangs up, and kills a child that does not exit.
  ~WorkerProgram() override;

  WorkerResult open(std::uint32_t work, WorkerChannel* channel) noexcept override;
  void start() noexcept override;
  void giveUp(WorkerChannel* channel) noexcept override;

  // Whether a worker is connected or being connected. Starts none, and does not wait.
  bool isRunning() const noexcept;

 private:
  struct Child {
    pid_t pid = -1;
    UniqueFd process;  // pidfd_open(2); invalid if there was no descriptor for it
  };

  WorkerResult reach();
  WorkerResult connectToService();
  WorkerResult startChild();
  int startProgram(const std::string& path, int theirs);
  void endWorker(std::chrono::milliseconds mayTake) noexcept;
  static bool isReaped(const Child& child, std::chrono::milliseconds patience) noexcept;
  bool mayLog() noexcept;

  const Description description_;
  const std::function<Clock::time_point()> now_;
  mutable std::mutex mutex_;  // guards everything below
  WorkerChannel connection_;
  std::uint64_t generation_ = 0;
  Child child_;
  std::vector<Child> dying_;  // killed, but not yet dead
  Clock::time_point linesPaidUntil_{};
  bool isSilent_ = false;  // within start()
};

// The folder of the running program, then the one where workers are installed.
std::vector<std::string> workerProgramFolders();

}  // namespace brenvik

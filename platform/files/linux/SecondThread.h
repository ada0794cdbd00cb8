// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <condition_variable>
#include <cstddef>
#include <deque>
#include <memory>
#include <mutex>
#include <thread>

namespace brenvik {

// What is to be done with the files of one directory, by one thread or by two at once.
class DirectoryWork {
 public:
  virtual ~DirectoryWork() = default;
  // Goes on with it; returns when no file is left to begin with.
  virtual void work(bool isOnSecondThread) noexcept = 0;
  virtual std::size_t files() const noexcept = 0;
};

// A second thread for the files of large trees, started when it is worth it and gone with the object. Two
// threads in one directory spend their time waiting for its lock: each takes directories of its own, and only
// the last one is shared. One thread owns the object and calls it.
class SecondThread {
 public:
  SecondThread() = default;
  SecondThread(const SecondThread&) = delete;
  SecondThread& operator=(const SecondThread&) = delete;
  // Waits for what is going on.
  ~SecondThread();

  // Whether a directory with so many files is to be handed over. To be asked once for each directory. May
  // throw std::bad_alloc, as may handOver.
  bool isWorth(std::size_t files);
  // The work is done soon, or by the end of drain(). May do other work that was handed over.
  void handOver(std::shared_ptr<DirectoryWork> work);
  // Helps until everything that was handed over is done.
  void drain();

 private:
  bool start();
  std::shared_ptr<DirectoryWork> takeWaiting();
  void run() noexcept;

  std::size_t seen_ = 0;
  bool cannotStart_ = false;
  std::mutex mutex_;  // guards what follows, to the thread
  std::condition_variable changed_;
  std::deque<std::shared_ptr<DirectoryWork>> waiting_;
  std::size_t waitingFiles_ = 0;
  std::shared_ptr<DirectoryWork> current_;  // what the second thread is at
  bool leaving_ = false;
  std::thread thread_;
};

}  // namespace brenvik

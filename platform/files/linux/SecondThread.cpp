// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/files/linux/SecondThread.h"

#include <system_error>
#include <utility>

namespace brenvik {
namespace {

// From this number of files on, starting a thread costs less than it saves; handing a directory over pays
// from a few files on.
constexpr std::size_t kWorthAThread = 64;
constexpr std::size_t kWorthHandingOver = 16;

// Enough that the second thread has work while the first one walks, few enough that neither their descriptors
// nor their memory matter.
constexpr std::size_t kMostWaiting = 8;
constexpr std::size_t kMostWaitingFiles = 4096;

}  // namespace

SecondThread::~SecondThread() {
  if (!thread_.joinable()) return;
  {
    const std::lock_guard lock(mutex_);
    leaving_ = true;
  }
  changed_.notify_all();
  thread_.join();
}

bool SecondThread::isWorth(std::size_t files) {
  seen_ += files;
  return files >= kWorthHandingOver && seen_ >= kWorthAThread && start();
}

bool SecondThread::start() {
  if (thread_.joinable()) return true;
  if (cannotStart_) return false;
  try {
    if (std::thread::hardware_concurrency() > 1) thread_ = std::thread([this]() noexcept { run(); });
  } catch (const std::system_error&) {  // no thread to be had: the caller does it all
  }
  cannotStart_ = !thread_.joinable();
  return !cannotStart_;
}

// With the mutex held, and something waiting.
std::shared_ptr<DirectoryWork> SecondThread::takeWaiting() {
  std::shared_ptr<DirectoryWork> first = std::move(waiting_.front());
  waiting_.pop_front();
  waitingFiles_ -= first->files();
  return first;
}

void SecondThread::handOver(std::shared_ptr<DirectoryWork> work) {
  const std::size_t files = work->files();
  for (;;) {
    std::shared_ptr<DirectoryWork> other;
    {
      const std::lock_guard lock(mutex_);
      if (waiting_.size() < kMostWaiting && waitingFiles_ < kMostWaitingFiles) {
        waiting_.push_back(std::move(work));
        waitingFiles_ += files;
        break;
      }
      other = takeWaiting();
    }
    other->work(false);
  }
  changed_.notify_all();
}

void SecondThread::drain() {
  for (;;) {
    std::shared_ptr<DirectoryWork> other;
    {
      const std::lock_guard lock(mutex_);
      if (waiting_.empty()) break;
      other = takeWaiting();
    }
    other->work(false);
  }
  std::unique_lock lock(mutex_);
  if (const std::shared_ptr<DirectoryWork> last = current_) {
    lock.unlock();
    last->work(false);
    lock.lock();
  }
  changed_.wait(lock, [this] { return current_ == nullptr; });
}

void SecondThread::run() noexcept {
  std::unique_lock lock(mutex_);
  for (;;) {
    changed_.wait(lock, [this] { return leaving_ || !waiting_.empty(); });
    if (waiting_.empty()) return;
    current_ = takeWaiting();
    // Only this thread changes current_.
    DirectoryWork& work = *current_;
    lock.unlock();
    work.work(true);
    lock.lock();
    current_.reset();
    if (waiting_.empty()) changed_.notify_all();
  }
}

}  // namespace brenvik

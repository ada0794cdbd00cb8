// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/ipc/linux/ClosingLine.h"

#include <pthread.h>
#include <sys/eventfd.h>
#include <sys/socket.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <chrono>
#include <condition_variable>
#include <csignal>
#include <ctime>
#include <deque>
#include <mutex>
#include <new>

namespace brenvik {
namespace {

// One account keeps one thread at most, so this many accounts must work together to hold up the others.
constexpr std::size_t kMaxThreads = 4;

// Enough for closing, and for what a sanitizer adds.
constexpr std::size_t kStackBytes = 256 * 1024;

// How long a close may linger before it is interrupted.
constexpr std::chrono::milliseconds kPatience{100};

// How long the end of the process waits for jobs that are left: most take microseconds.
constexpr std::chrono::milliseconds kLastWait{100};

// Interrupts a system call of the thread it is sent to, and does nothing else.
void interrupt(int) {}
int interruptSignal() noexcept { return SIGRTMIN; }

// Sends the signal to the calling thread every kPatience between start() and stop().
class Impatience {
 public:
  Impatience() noexcept {
    sigevent event{};
    event.sigev_notify = SIGEV_THREAD_ID;
    event.sigev_signo = interruptSignal();
    event._sigev_un._tid = ::gettid();
    exists_ = ::timer_create(CLOCK_MONOTONIC, &event, &timer_) == 0;
  }
  ~Impatience() {
    if (exists_) ::timer_delete(timer_);
  }
  Impatience(const Impatience&) = delete;
  Impatience& operator=(const Impatience&) = delete;
  void start() noexcept { set(kPatience); }
  void stop() noexcept { set(std::chrono::milliseconds(0)); }

 private:
  void set(std::chrono::nanoseconds time) noexcept {
    if (!exists_) return;
    const timespec each{0, time.count()};
    const itimerspec setting{each, each};
    ::timer_settime(timer_, 0, &setting, nullptr);
  }
  timer_t timer_{};
  bool exists_ = false;
};

struct Job {
  ClosingLine::Account account = 0;
  UniqueFd descriptor;            // to be closed
  ClosingLine::SharedFd channel;  // or: to be rid of one message
  std::uint64_t token = 0;
};

}  // namespace

struct ClosingLine::State {
  explicit State(std::size_t most) : capacity(most) {}
  bool push(Job&& job) noexcept;
  void startThread(const std::shared_ptr<State>& self) noexcept;
  void work();
  void run(Job& job);
  bool isBusy(Account account) const noexcept {
    return std::find(busy.begin(), busy.end(), account) != busy.end();
  }

  // Whether more accounts have jobs than threads wait for them.
  bool needsThread() const noexcept {
    std::array<Account, kMaxThreads> seen{};
    std::size_t count = 0;
    for (const Job& job : jobs) {
      if (isBusy(job.account) ||
          std::find(seen.data(), seen.data() + count, job.account) != seen.data() + count)
        continue;
      if (count == threads - busy.size()) return true;
      seen[count++] = job.account;
    }
    return false;
  }

  const std::size_t capacity;
  mutable std::mutex mutex;
  std::condition_variable jobCame;
  std::condition_variable jobDone;
  std::deque<Job> jobs;
  std::vector<Account> busy;  // one entry a thread at work
  std::vector<std::uint64_t> discarded;
  UniqueFd event;
  std::size_t threads = 0;
  bool stopping = false;
};

ClosingLine::ClosingLine(std::size_t capacity) : state_(std::make_shared<State>(capacity)) {}

ClosingLine::~ClosingLine() {
  std::unique_lock lock(state_->mutex);
  state_->stopping = true;
  state_->jobCame.notify_all();
  state_->jobDone.wait_for(lock, kLastWait, [this] { return state_->threads == 0; });
}

bool ClosingLine::State::push(Job&& job) noexcept {
  const std::lock_guard lock(mutex);
  if (stopping || jobs.size() >= capacity) return false;
  try {
    busy.reserve(kMaxThreads);
    if (job.token != 0) discarded.reserve(capacity + kMaxThreads);  // telling must not fail
    jobs.push_back(std::move(job));
  } catch (const std::bad_alloc&) {
    return false;
  }
  jobCame.notify_one();
  return true;
}

void ClosingLine::State::startThread(const std::shared_ptr<State>& self) noexcept {
  {
    const std::lock_guard lock(mutex);
    if (threads == kMaxThreads || !needsThread()) return;
    if (threads == 0) {
      struct sigaction action {};
      action.sa_handler = interrupt;
      (void)::sigaction(interruptSignal(), &action, nullptr);
    }
    ++threads;
  }
  pthread_attr_t attributes;
  bool started = false;
  if (::pthread_attr_init(&attributes) == 0) {
    (void)::pthread_attr_setstacksize(&attributes, kStackBytes);
    (void)::pthread_attr_setdetachstate(&attributes, PTHREAD_CREATE_DETACHED);
    auto* const argument = new (std::nothrow) std::shared_ptr<State>(self);
    pthread_t thread{};
    started = argument != nullptr && ::pthread_create(
                                         &thread, &attributes,
                                         [](void* given) -> void* {
                                           std::shared_ptr<State> state;
                                           {
                                             const std::unique_ptr<std::shared_ptr<State>> owned(
                                                 static_cast<std::shared_ptr<State>*>(given));
                                             state = std::move(*owned);
                                           }
                                           state->work();
                                           return nullptr;
                                         },
                                         argument) == 0;
    if (!started) delete argument;
    ::pthread_attr_destroy(&attributes);
  }
  if (started) return;
  // Without a thread the jobs wait for the next one to be pushed, which tries again.
  const std::lock_guard lock(mutex);
  --threads;
}

void ClosingLine::State::work() {
  (void)::pthread_setname_np(::pthread_self(), "closing");
  // Signals of the process are the main thread's.
  sigset_t others;
  ::sigfillset(&others);
  ::sigdelset(&others, interruptSignal());
  (void)::pthread_sigmask(SIG_SETMASK, &others, nullptr);
  Impatience impatience;

  std::unique_lock lock(mutex);
  for (;;) {
    // What one account sent waits behind what the same account sent before.
    const auto next =
        std::find_if(jobs.begin(), jobs.end(), [this](const Job& job) { return !isBusy(job.account); });
    if (next == jobs.end()) {
      if (stopping && jobs.empty()) break;
      jobCame.wait(lock);
      continue;
    }
    Job job = std::move(*next);
    jobs.erase(next);
    busy.push_back(job.account);
    lock.unlock();
    impatience.start();
    run(job);
    impatience.stop();
    lock.lock();
    if (job.token != 0) {
      try {
        discarded.push_back(job.token);
        const std::uint64_t one = 1;
        (void)!::write(event.get(), &one, sizeof one);
      } catch (const std::bad_alloc&) {
        // The channel stays unread, as one whose message is still being dropped.
      }
    }
    busy.erase(std::find(busy.begin(), busy.end(), job.account));
    // Another job of that account may be next, for a thread that sleeps.
    jobCame.notify_one();
    jobDone.notify_all();
  }
  --threads;
  jobDone.notify_all();
}

void ClosingLine::State::run(Job& job) {
  if (job.channel != nullptr) {
    // Without room for control data the kernel drops the descriptors, in this thread.
    (void)::recv(job.channel->get(), nullptr, 0, MSG_DONTWAIT | MSG_TRUNC);
    job.channel.reset();
  }
  job.descriptor.reset();
}

void ClosingLine::close(UniqueFd descriptor, Account account) noexcept {
  if (!descriptor.isValid()) return;
  Job job;
  job.account = account;
  job.descriptor = std::move(descriptor);
  if (state_->push(std::move(job))) state_->startThread(state_);
}

bool ClosingLine::discardMessage(SharedFd socket, Account account, std::uint64_t token) noexcept {
  {
    const std::lock_guard lock(state_->mutex);
    if (!state_->event.isValid()) state_->event.reset(::eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK));
    if (!state_->event.isValid()) return false;
  }
  Job job;
  job.account = account;
  job.channel = std::move(socket);
  job.token = token;
  if (!state_->push(std::move(job))) return false;
  state_->startThread(state_);
  return true;
}

bool ClosingLine::hasRoomFor(std::size_t count) const noexcept {
  const std::lock_guard lock(state_->mutex);
  return state_->jobs.size() + count <= state_->capacity;
}

int ClosingLine::readable() const noexcept {
  const std::lock_guard lock(state_->mutex);
  return state_->event.get();
}

std::vector<std::uint64_t> ClosingLine::takeDiscarded() {
  const std::lock_guard lock(state_->mutex);
  std::uint64_t count = 0;
  (void)!::read(state_->event.get(), &count, sizeof count);
  return std::exchange(state_->discarded, {});
}

void ClosingLine::drain() {
  std::unique_lock lock(state_->mutex);
  state_->jobDone.wait(lock, [this] { return state_->jobs.empty() && state_->busy.empty(); });
}

}  // namespace brenvik

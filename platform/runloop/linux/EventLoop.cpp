// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/runloop/linux/EventLoop.h"

#include <sched.h>
#include <sys/epoll.h>
#include <sys/eventfd.h>
#include <sys/timerfd.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <climits>
#include <ctime>
#include <new>
#include <utility>

#include "platform/base/Clock.h"
#include "platform/log/Log.h"

namespace brenvik {
namespace {

constexpr std::uint64_t kNanosecondsASecond = 1'000'000'000;

// The clock of the timers, CLOCK_BOOTTIME.
std::uint64_t nowNanoseconds() noexcept { return static_cast<std::uint64_t>(timeSinceBoot().count()); }

// Rounded up, so that nobody waits in a circle for the last fraction; the longest that can be said else.
int toMilliseconds(std::uint64_t microseconds) noexcept {
  if (microseconds == UINT64_MAX) return -1;
  return static_cast<int>(
      std::min<std::uint64_t>(microseconds / 1'000U + (microseconds % 1'000U != 0), INT_MAX));
}

std::uint64_t count(std::chrono::nanoseconds time) noexcept {
  return time.count() <= 0 ? 0 : static_cast<std::uint64_t>(time.count());
}

std::uint32_t eventsOf(Interest interest) noexcept {
  switch (interest) {
    case Interest::none:
      return 0;
    case Interest::reading:
      return EPOLLIN;
    case Interest::writing:
      return EPOLLOUT;
    case Interest::readingAndWriting:
      return std::uint32_t{EPOLLIN} | std::uint32_t{EPOLLOUT};
  }
  return 0;
}

Readiness readinessOf(std::uint32_t events) noexcept {
  return {.isReadable = (events & EPOLLIN) != 0,
          .isWritable = (events & EPOLLOUT) != 0,
          .hasHungUp = (events & EPOLLHUP) != 0,
          .hasFailed = (events & EPOLLERR) != 0};
}

// Runs what a task or a source brought along. One that lacks memory and has not coped with that itself is
// given up; whatever else waits has its turn.
template <typename Work>
void run(const Work& work) noexcept {
  try {
    work();
  } catch (const std::bad_alloc&) {
    logUnified(LogLevel::error, "A task was given up: out of memory");
  }
}

}  // namespace

struct EventLoop::Timer : TimerHeapItem {
  std::uint64_t interval = 0;  // nanoseconds; 0: once
  std::function<void()> handler;
  std::function<void()> failed;
  std::atomic<bool> valid{true};
  EventLoop* loop = nullptr;
};

class EventLoop::TimerHandle final : public LoopSource {
 public:
  TimerHandle(std::weak_ptr<EventLoop> loop, std::shared_ptr<Timer> timer) noexcept
      : loop_(std::move(loop)), timer_(std::move(timer)) {}
  ~TimerHandle() override { invalidate(); }
  void invalidate() noexcept override {
    if (!timer_->valid.exchange(false)) return;
    const auto loop = loop_.lock();
    if (loop == nullptr) return;
    if (loop->onLoopThread()) return loop->disarm(*timer_);
    try {
      loop->post([timer = timer_] { timer->loop->disarm(*timer); });
    } catch (const std::bad_alloc&) {
      // It goes when it is due.
    }
  }

 private:
  const std::weak_ptr<EventLoop> loop_;
  const std::shared_ptr<Timer> timer_;
};

// The epoll set. A source that outlives the loop still finds it.
class EventLoop::DescriptorSet {
 public:
  struct Entry {
    int fd;
    RunLoop::DescriptorHandler handler;
    int running = 0;  // how many calls of the handler have not returned: it may run the loop
    bool isRetired = false;
  };

  bool make() noexcept {
    epoll_.reset(::epoll_create1(EPOLL_CLOEXEC));
    return epoll_.isValid();
  }
  bool control(int operation, Entry& entry, Interest interest) noexcept {
    epoll_event event{};
    event.events = eventsOf(interest);
    event.data.ptr = &entry;
    return ::epoll_ctl(epoll_.get(), operation, entry.fd, &event) == 0;
  }
  int wait(epoll_event* ready, int most, int milliseconds) noexcept {
    const int count = ::epoll_wait(epoll_.get(), ready, most, milliseconds);
    return count < 0 ? -errno : count;
  }
  void handle(Entry* entry, std::uint32_t events) noexcept {
    ++entry->running;
    run([entry, readiness = readinessOf(events)] { entry->handler(readiness); });
    if (--entry->running == 0 && entry->isRetired) delete entry;
  }
  // An entry whose handler runs lives until that returns.
  void retire(std::unique_ptr<Entry> entry) noexcept {
    if (entry->running == 0) return;
    entry->isRetired = true;
    (void)entry.release();
  }

 private:
  UniqueFd epoll_;
};

class EventLoop::Descriptor final : public DescriptorSource {
 public:
  Descriptor(std::shared_ptr<DescriptorSet> set, int fd, RunLoop::DescriptorHandler handler)
      : set_(std::move(set)), entry_(new DescriptorSet::Entry{fd, std::move(handler)}) {}
  ~Descriptor() override { invalidate(); }

  bool watch(Interest interest) noexcept {
    watched_ = set_->control(EPOLL_CTL_ADD, *entry_, interest);
    return watched_;
  }
  const DescriptorSet::Entry* entry() const noexcept { return entry_.get(); }
  void invalidate() noexcept override {
    if (std::exchange(watched_, false)) (void)set_->control(EPOLL_CTL_DEL, *entry_, Interest::none);
    if (entry_ != nullptr) set_->retire(std::move(entry_));
  }
  bool setInterest(Interest interest) noexcept override {
    return watched_ && set_->control(EPOLL_CTL_MOD, *entry_, interest);
  }

 private:
  const std::shared_ptr<DescriptorSet> set_;
  std::unique_ptr<DescriptorSet::Entry> entry_;
  bool watched_ = false;
};

std::shared_ptr<EventLoop> EventLoop::make(For whom) try {
  std::shared_ptr<EventLoop> loop(new EventLoop);
  if (whom == For::thisThread) loop->thread_ = std::this_thread::get_id();
  loop->descriptors_ = std::make_shared<DescriptorSet>();
  if (!loop->descriptors_->make()) return nullptr;
  loop->wakeFd_.reset(::eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK));
  if (!loop->wakeFd_.isValid()) return nullptr;
  loop->wakeSource_ =
      loop->addDescriptor(loop->wakeFd_.get(), Interest::reading, [raw = loop.get()](Readiness) {
        std::uint64_t count = 0;
        (void)!::read(raw->wakeFd_.get(), &count, sizeof count);  // only to make it unreadable again
        raw->drainInbox();
      });
  if (loop->wakeSource_ == nullptr) return nullptr;
  if (whom == For::anotherThread && !loop->makeClock()) return nullptr;
  return loop;
} catch (const std::bad_alloc&) {
  return nullptr;
}

EventLoop::~EventLoop() = default;

bool EventLoop::makeClock() {
  if (clockSource_ != nullptr) return true;
  clockFd_.reset(::timerfd_create(CLOCK_BOOTTIME, TFD_CLOEXEC | TFD_NONBLOCK));
  if (!clockFd_.isValid()) return false;
  auto source = std::make_unique<Descriptor>(descriptors_, clockFd_.get(), [](Readiness) {});
  if (!source->watch(Interest::reading)) return false;
  clockEntry_ = source->entry();
  clockSource_ = std::move(source);
  return true;
}

bool EventLoop::onLoopThread() const noexcept {
  return thread_.load(std::memory_order_relaxed) == std::this_thread::get_id();
}

int EventLoop::runOnce(std::uint64_t timeOut) noexcept {
  thread_.store(std::this_thread::get_id(), std::memory_order_relaxed);
  for (;;) {
    setClock();
    // One at a time: what is ready and not handled now goes to the end of the kernel's queue, and a handler
    // may end the watching of any other.
    epoll_event ready{};
    int count = 0;
    if (!std::exchange(ownTasksAreNext_, false) || !hasOwnTasks_) {
      count = descriptors_->wait(&ready, 1, hasOwnTasks_ || clockWasSeenDue_ ? 0 : toMilliseconds(timeOut));
      if (count == -EINTR) return 0;
      if (count < 0) return count;
    }
    if (count == 0) return handleOwn();
    if (!handleReady(ready.data.ptr, ready.events)) continue;
    ownTasksAreNext_ = hasOwnTasks_;
    return 1;
  }
}

// No descriptor is ready: handles what the thread has posted to itself, else the timer that is due. 1 when
// there was one, 0 when not.
int EventLoop::handleOwn() noexcept {
  // The clock's descriptor may tell a moment later than the clock.
  if (!hasOwnTasks_) return handleTimer() ? 1 : 0;
  // Whoever has just got a reply goes first where there is one processor: it waited for that, not for this.
  (void)::sched_yield();
  drainInbox();
  return 1;
}

// Handles what epoll has reported. False when that was nothing yet.
bool EventLoop::handleReady(void* entry, std::uint32_t events) noexcept {
  if (entry != clockEntry_) {
    descriptors_->handle(static_cast<DescriptorSet::Entry*>(entry), events);
    return true;
  }
  // A descriptor that is ready at the same moment goes first: a check-in that has arrived beats the idle
  // countdown. They are all ahead of the clock in the kernel's queue, which has put it at the end: when it
  // comes round, each has had its turn.
  return std::exchange(clockWasSeenDue_, true) && handleTimer();
}

// Sets the timerfd to the first timer. It is not read: being set makes it unreadable, too.
void EventLoop::setClock() noexcept {
  const std::uint64_t wakeUp = timers_.wakeUp();
  if (wakeUp == clockIsSetTo_) return;
  itimerspec time{};  // of zeros: never
  if (wakeUp != UINT64_MAX) {
    const std::uint64_t due = std::max<std::uint64_t>(wakeUp, 1);
    time.it_value.tv_sec = static_cast<time_t>(due / kNanosecondsASecond);
    time.it_value.tv_nsec = static_cast<long>(due % kNanosecondsASecond);
  }
  (void)::timerfd_settime(clockFd_.get(), TFD_TIMER_ABSTIME, &time, nullptr);
  clockIsSetTo_ = wakeUp;
  clockWasSeenDue_ = false;
}

// Handles the timer that is due, if one is.
bool EventLoop::handleTimer() noexcept {
  clockWasSeenDue_ = false;
  const std::uint64_t now = nowNanoseconds();
  if (timers_.isEmpty() || timers_.first()->next > now) return false;
  const std::shared_ptr<Timer> timer = timers_.first();  // outlives a handler that cancels itself
  if (!timer->valid.load() || timer->interval == 0) {
    timers_.remove(*timer);
  } else {
    // Ticks that were missed are dropped; the rhythm stays.
    std::uint64_t next = timer->next + timer->interval;
    if (next <= now) next += ((now - next) / timer->interval + 1) * timer->interval;
    timers_.move(*timer, next);
  }
  if (timer->valid.load()) run(timer->handler);
  return true;
}

void EventLoop::wake() noexcept {
  const std::uint64_t one = 1;
  (void)!::write(wakeFd_.get(), &one, sizeof one);  // full: it is readable already
}

void EventLoop::post(std::function<void()> task) {
  bool first = false;
  {
    const std::lock_guard lock(inboxMutex_);
    first = inbox_.empty();
    inbox_.push_back(std::move(task));
  }
  if (onLoopThread()) {
    hasOwnTasks_ = true;  // it is awake
  } else if (first) {
    wake();
  }
}

void EventLoop::drainInbox() noexcept {
  std::vector<std::function<void()>> tasks;
  {
    const std::lock_guard lock(inboxMutex_);
    tasks.swap(inbox_);
  }
  hasOwnTasks_ = false;
  // What a task posts waits for the next wake-up, so that descriptors get their turn in between.
  for (auto& task : tasks) {
    run(task);
    task = nullptr;
  }
}

std::unique_ptr<DescriptorSource> EventLoop::addDescriptor(int fd, Interest interest,
                                                           RunLoop::DescriptorHandler handler) {
  auto descriptor = std::make_unique<Descriptor>(descriptors_, fd, std::move(handler));
  if (!descriptor->watch(interest)) return nullptr;
  return descriptor;
}

bool EventLoop::arm(const std::shared_ptr<Timer>& timer) noexcept {
  try {
    if (!makeClock()) return false;
    timers_.add(timer);
    return true;
  } catch (const std::bad_alloc&) {
    return false;
  }
}

void EventLoop::disarm(Timer& timer) noexcept { timers_.remove(timer); }

std::unique_ptr<LoopSource> EventLoop::addTimer(std::chrono::nanoseconds first,
                                                std::chrono::nanoseconds interval,
                                                std::chrono::nanoseconds leeway,
                                                std::function<void()> handler, std::function<void()> failed) {
  auto timer = std::make_shared<Timer>();
  timer->loop = this;
  timer->next = nowNanoseconds() + count(first);
  timer->interval = count(interval);
  timer->leeway = count(leeway);
  timer->handler = std::move(handler);
  timer->failed = std::move(failed);
  // First: a timer that runs is one that somebody can end.
  auto handle = std::make_unique<TimerHandle>(weak_from_this(), timer);
  if (onLoopThread()) {
    if (!arm(timer)) return nullptr;
  } else {
    post([timer] {
      if (timer->valid.load() && !timer->loop->arm(timer) && timer->failed) timer->failed();
    });
  }
  return handle;
}

void EventLoop::postAfter(std::chrono::nanoseconds delay, std::function<void()> task) {
  auto timer = std::make_shared<Timer>();
  timer->loop = this;
  timer->next = nowNanoseconds() + count(delay);
  timer->handler = std::move(task);
  const auto armOrRun = [timer] {
    if (!timer->loop->arm(timer)) timer->handler();
  };
  if (onLoopThread()) {
    armOrRun();
  } else {
    post(armOrRun);
  }
}

}  // namespace brenvik

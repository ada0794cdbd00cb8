// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/runloop/linux/EventLoop.h"

#include <sched.h>
#include <sys/epoll.h>
#include <sys/eventfd.h>
#include <time.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <climits>
#include <new>
#include <utility>

#include "platform/log/Log.h"

namespace brenvik {
namespace {

// Counts while the system sleeps, as a person's idea of "ten seconds later" does.
constexpr clockid_t kClock = CLOCK_BOOTTIME;

std::uint64_t nowMicroseconds() noexcept {
  timespec now{};
  ::clock_gettime(kClock, &now);
  return static_cast<std::uint64_t>(now.tv_sec) * 1'000'000U +
         static_cast<std::uint64_t>(now.tv_nsec) / 1'000U;
}

// Rounded up, so that nobody waits in a circle for the last fraction; the longest that can be said else.
int toMilliseconds(std::uint64_t microseconds) noexcept {
  if (microseconds == UINT64_MAX) return -1;
  return static_cast<int>(
      std::min<std::uint64_t>(microseconds / 1'000U + (microseconds % 1'000U != 0), INT_MAX));
}

// Rounded up, so that nothing fires early.
std::uint64_t toMicroseconds(std::chrono::nanoseconds time) noexcept {
  return time.count() <= 0 ? 0 : (static_cast<std::uint64_t>(time.count()) + 999U) / 1'000U;
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

struct EventLoop::Timer {
  std::uint64_t next = 0;      // microseconds of kClock
  std::uint64_t interval = 0;  // microseconds; 0: once
  std::uint64_t leeway = 1;
  std::function<void()> handler;
  std::function<void()> failed;
  std::atomic<bool> valid{true};
  EventLoop* loop = nullptr;
  SourcePointer source;  // loop thread only
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
  };

  bool make() noexcept {
    epoll_.reset(::epoll_create1(EPOLL_CLOEXEC));
    return epoll_.isValid();
  }
  bool control(int operation, Entry& entry, std::uint32_t events) noexcept {
    epoll_event interest{};
    interest.events = events;
    interest.data.ptr = &entry;
    return ::epoll_ctl(epoll_.get(), operation, entry.fd, &interest) == 0;
  }
  int wait(epoll_event* ready, int most, int milliseconds) noexcept {
    const int count = ::epoll_wait(epoll_.get(), ready, most, milliseconds);
    return count < 0 ? -errno : count;
  }
  void handle(Entry* entry, std::uint32_t events) noexcept {
    handling_ = entry;
    run([entry, events] { entry->handler(events); });
    handling_ = nullptr;
    gone_.reset();
  }
  // An entry whose handler runs lives until that returns.
  void retire(std::unique_ptr<Entry> entry) noexcept {
    if (entry.get() == handling_) gone_ = std::move(entry);
  }

 private:
  UniqueFd epoll_;
  Entry* handling_ = nullptr;
  std::unique_ptr<Entry> gone_;
};

class EventLoop::Descriptor final : public DescriptorSource {
 public:
  Descriptor(std::shared_ptr<DescriptorSet> set, int fd, RunLoop::DescriptorHandler handler)
      : set_(std::move(set)), entry_(new DescriptorSet::Entry{fd, std::move(handler)}) {}
  ~Descriptor() override { invalidate(); }

  bool watch(std::uint32_t events) noexcept {
    watched_ = set_->control(EPOLL_CTL_ADD, *entry_, events);
    return watched_;
  }
  const DescriptorSet::Entry* entry() const noexcept { return entry_.get(); }
  void invalidate() noexcept override {
    if (std::exchange(watched_, false)) (void)set_->control(EPOLL_CTL_DEL, *entry_, 0);
    if (entry_ != nullptr) set_->retire(std::move(entry_));
  }
  bool setEvents(std::uint32_t events) noexcept override {
    return watched_ && set_->control(EPOLL_CTL_MOD, *entry_, events);
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
  loop->wakeSource_ = loop->addDescriptor(loop->wakeFd_.get(), EPOLLIN, [raw = loop.get()](std::uint32_t) {
    std::uint64_t count = 0;
    (void)!::read(raw->wakeFd_.get(), &count, sizeof count);  // only to make it unreadable again
    raw->drainInbox();
  });
  if (loop->wakeSource_ == nullptr) return nullptr;
  if (whom == For::anotherThread) {
    // The library opens a clock's descriptor for its first timer and keeps it: later might be too late.
    sd_event_source* source = nullptr;
    if (!loop->makeTimers() || sd_event_add_time(loop->timers_.get(), &source, kClock, UINT64_MAX, 1,
                                                 &EventLoop::onTime, nullptr) < 0) {
      return nullptr;
    }
    sd_event_source_disable_unref(source);
  }
  return loop;
} catch (const std::bad_alloc&) {
  return nullptr;
}

EventLoop::~EventLoop() {
  // A timer's source holds a reference to the loop's event object.
  for (auto& [raw, timer] : armed_) timer->source.reset();
}

bool EventLoop::makeTimers() noexcept {
  if (timers_ != nullptr) return true;
  sd_event* event = nullptr;
  if (sd_event_new(&event) < 0) return false;
  std::unique_ptr<sd_event, Unref> timers(event);
  try {
    timersSource_ = addDescriptor(sd_event_get_fd(event), EPOLLIN, [](std::uint32_t) {});
  } catch (const std::bad_alloc&) {
  }
  if (timersSource_ == nullptr) return false;
  timers_ = std::move(timers);
  return true;
}

bool EventLoop::onLoopThread() const noexcept {
  return thread_.load(std::memory_order_relaxed) == std::this_thread::get_id();
}

int EventLoop::runOnce(std::uint64_t timeOut) noexcept {
  thread_.store(std::this_thread::get_id(), std::memory_order_relaxed);
  for (;;) {
    if (timers_ != nullptr && (!timersPrepared_ || timersChanged_)) {
      // One that is prepared takes no notice of a change before it has waited, too.
      if (timersPrepared_ && handleTimer() > 0) return 1;
      timersChanged_ = false;
      const int due = sd_event_prepare(timers_.get());
      if (due < 0) return due;
      if (due > 0) {
        (void)sd_event_dispatch(timers_.get());
        return 1;
      }
      timersPrepared_ = true;
    }
    // One at a time: what is ready and not handled now goes to the end of the kernel's queue, and a handler
    // may end the watching of any other.
    epoll_event ready{};
    int count = 0;
    if (!std::exchange(ownTasksAreNext_, false) || !hasOwnTasks_) {
      count = descriptors_->wait(&ready, 1, hasOwnTasks_ ? 0 : toMilliseconds(timeOut));
      if (count == -EINTR) continue;
      if (count < 0) return count;
      ownTasksAreNext_ = hasOwnTasks_ && count > 0;
    }
    if (count == 0) {
      if (!hasOwnTasks_) return 0;
      // Whoever has just got a reply goes first where there is one processor: it waited for that, not for
      // this.
      (void)::sched_yield();
      drainInbox();
      return 1;
    }
    const auto isTimers = [this](const epoll_event& event) {
      return timersSource_ != nullptr &&
             event.data.ptr == static_cast<const Descriptor*>(timersSource_.get())->entry();
    };
    if (isTimers(ready)) {
      // A descriptor that is ready at the same moment goes first: a check-in that has arrived beats the idle
      // countdown.
      std::array<epoll_event, 2> both{};
      count = descriptors_->wait(both.data(), static_cast<int>(both.size()), 0);
      const auto other = std::find_if_not(both.begin(), both.begin() + std::max(count, 0), isTimers);
      if (other == both.begin() + std::max(count, 0)) {
        if (handleTimer() > 0) return 1;
        continue;
      }
      ready = *other;
    }
    descriptors_->handle(static_cast<DescriptorSet::Entry*>(ready.data.ptr), ready.events);
    return 1;
  }
}

// Handles the timer that is due, if one is: 1.
int EventLoop::handleTimer() noexcept {
  timersPrepared_ = false;
  if (sd_event_wait(timers_.get(), 0) <= 0) return 0;
  (void)sd_event_dispatch(timers_.get());
  return 1;
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

std::unique_ptr<DescriptorSource> EventLoop::addDescriptor(int fd, std::uint32_t events,
                                                           RunLoop::DescriptorHandler handler) {
  auto descriptor = std::make_unique<Descriptor>(descriptors_, fd, std::move(handler));
  if (!descriptor->watch(events)) return nullptr;
  return descriptor;
}

int EventLoop::onTime(sd_event_source* source, std::uint64_t, void* userdata) noexcept {
  auto* const raw = static_cast<Timer*>(userdata);
  const std::shared_ptr<Timer> timer = raw->loop->armed_.at(raw);  // outlives a handler that cancels itself
  if (!timer->valid.load()) {
    timer->loop->disarm(*timer);
    return 0;
  }
  if (timer->interval > 0) {
    // Ticks that were missed are dropped; the rhythm stays.
    const std::uint64_t now = nowMicroseconds();
    timer->next += timer->interval;
    if (timer->next <= now) timer->next += ((now - timer->next) / timer->interval + 1) * timer->interval;
    sd_event_source_set_time(source, timer->next);
    sd_event_source_set_enabled(source, SD_EVENT_ONESHOT);
  } else {
    timer->loop->disarm(*timer);
  }
  run(timer->handler);
  return 0;
}

bool EventLoop::arm(const std::shared_ptr<Timer>& timer) noexcept {
  sd_event_source* source = nullptr;
  if (!makeTimers()) return false;
  timersChanged_ = true;
  if (sd_event_add_time(timers_.get(), &source, kClock, timer->next, timer->leeway, &EventLoop::onTime,
                        timer.get()) < 0) {
    return false;
  }
  timer->source.reset(source);
  try {
    armed_.emplace(timer.get(), timer);
    return true;
  } catch (const std::bad_alloc&) {
    timer->source.reset();
    return false;
  }
}

void EventLoop::disarm(Timer& timer) noexcept {
  timersChanged_ = true;
  timer.source.reset();
  armed_.erase(&timer);
}

std::unique_ptr<LoopSource> EventLoop::addTimer(std::chrono::nanoseconds first,
                                                std::chrono::nanoseconds interval,
                                                std::chrono::nanoseconds leeway,
                                                std::function<void()> handler, std::function<void()> failed) {
  auto timer = std::make_shared<Timer>();
  timer->loop = this;
  timer->next = nowMicroseconds() + toMicroseconds(first);
  timer->interval = toMicroseconds(interval);
  // 0 would mean the library's quarter of a second.
  timer->leeway = std::max<std::uint64_t>(toMicroseconds(leeway), 1);
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
  timer->next = nowMicroseconds() + toMicroseconds(delay);
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

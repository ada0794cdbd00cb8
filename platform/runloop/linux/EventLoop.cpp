// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/runloop/linux/EventLoop.h"

#include <sys/epoll.h>
#include <sys/eventfd.h>
#include <time.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>

namespace brenvik {
namespace {

// Descriptors are served before a timer that is due at the same moment: a check-in that has arrived beats the
// idle countdown.
constexpr std::int64_t kTimerPriority = SD_EVENT_PRIORITY_NORMAL + 10;

// Counts while the system sleeps, as a person's idea of "ten seconds later" does.
constexpr clockid_t kClock = CLOCK_BOOTTIME;

std::uint64_t nowMicroseconds() noexcept {
  timespec now{};
  ::clock_gettime(kClock, &now);
  return static_cast<std::uint64_t>(now.tv_sec) * 1'000'000U +
         static_cast<std::uint64_t>(now.tv_nsec) / 1'000U;
}

// Rounded up, so that nothing fires early.
std::uint64_t toMicroseconds(std::chrono::nanoseconds time) noexcept {
  return time.count() <= 0 ? 0 : (static_cast<std::uint64_t>(time.count()) + 999U) / 1'000U;
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
    if (loop->onLoopThread()) {
      loop->disarm(*timer_);
    } else {
      loop->post([timer = timer_] { timer->loop->disarm(*timer); });
    }
  }

 private:
  const std::weak_ptr<EventLoop> loop_;
  const std::shared_ptr<Timer> timer_;
};

class EventLoop::Descriptor final : public DescriptorSource {
 public:
  explicit Descriptor(RunLoop::DescriptorHandler handler)
      : state_(std::make_shared<State>(State{std::move(handler), {}})) {}
  ~Descriptor() override { invalidate(); }

  bool watch(sd_event* event, int fd, std::uint32_t events) noexcept {
    sd_event_source* source = nullptr;
    if (sd_event_add_io(event, &source, fd, events, &Descriptor::handle, state_.get()) < 0) return false;
    state_->source.reset(source);
    return true;
  }
  void invalidate() noexcept override { state_->source.reset(); }
  bool setEvents(std::uint32_t events) noexcept override {
    return state_->source != nullptr && sd_event_source_set_io_events(state_->source.get(), events) >= 0;
  }

 private:
  // Kept alive through a handler that destroys its own source.
  struct State : std::enable_shared_from_this<State> {
    State(RunLoop::DescriptorHandler h, SourcePointer s) : handler(std::move(h)), source(std::move(s)) {}
    RunLoop::DescriptorHandler handler;
    SourcePointer source;
  };
  static int handle(sd_event_source*, int, std::uint32_t events, void* userdata) noexcept {
    const auto state = static_cast<State*>(userdata)->shared_from_this();
    state->handler(events);
    return 0;
  }
  const std::shared_ptr<State> state_;
};

std::shared_ptr<EventLoop> EventLoop::make(For whom) {
  std::shared_ptr<EventLoop> loop(new EventLoop);
  if (whom == For::thisThread) loop->thread_ = std::this_thread::get_id();
  sd_event* event = nullptr;
  if (sd_event_new(&event) < 0) return nullptr;
  loop->event_.reset(event);
  loop->wakeFd_.reset(::eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK));
  if (!loop->wakeFd_.isValid()) return nullptr;
  sd_event_source* source = nullptr;
  const auto onWake = [](sd_event_source*, int fd, std::uint32_t, void* userdata) noexcept {
    std::uint64_t count = 0;
    (void)!::read(fd, &count, sizeof count);  // only to make it unreadable again
    static_cast<EventLoop*>(userdata)->drainInbox();
    return 0;
  };
  if (sd_event_add_io(event, &source, loop->wakeFd_.get(), EPOLLIN, onWake, loop.get()) < 0) return nullptr;
  loop->wakeSource_.reset(source);
  if (whom == For::anotherThread) {
    // The library opens a clock's descriptor for its first timer and keeps it: later might be too late.
    if (sd_event_add_time(event, &source, kClock, UINT64_MAX, 1, &EventLoop::onTime, nullptr) < 0) {
      return nullptr;
    }
    sd_event_source_disable_unref(source);
  }
  return loop;
}

EventLoop::~EventLoop() {
  // A timer's source holds a reference to the loop's event object.
  for (auto& [raw, timer] : armed_) timer->source.reset();
}

bool EventLoop::onLoopThread() const noexcept {
  return thread_.load(std::memory_order_relaxed) == std::this_thread::get_id();
}

void EventLoop::leaveToAnotherThread() noexcept { thread_.store({}, std::memory_order_relaxed); }

int EventLoop::runOnce(std::uint64_t timeOut) noexcept {
  thread_.store(std::this_thread::get_id(), std::memory_order_relaxed);
  return sd_event_run(event_.get(), timeOut);
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
  if (first) wake();
}

void EventLoop::drainInbox() noexcept {
  std::vector<std::function<void()>> tasks;
  {
    const std::lock_guard lock(inboxMutex_);
    tasks.swap(inbox_);
  }
  // What a task posts waits for the next wake-up, so that descriptors get their turn in between.
  for (auto& task : tasks) {
    task();
    task = nullptr;
  }
}

std::unique_ptr<DescriptorSource> EventLoop::addDescriptor(int fd, std::uint32_t events,
                                                           RunLoop::DescriptorHandler handler) {
  auto descriptor = std::make_unique<Descriptor>(std::move(handler));
  if (!descriptor->watch(event_.get(), fd, events)) return nullptr;
  return descriptor;
}

int EventLoop::onTime(sd_event_source* source, std::uint64_t, void* userdata) noexcept {
  auto* const raw = static_cast<Timer*>(userdata);
  const std::shared_ptr<Timer> timer = raw->loop->armed_.at(raw);  // outlives a handler that cancels itself
  if (!timer->valid.load()) return 0;
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
  timer->handler();
  return 0;
}

bool EventLoop::arm(const std::shared_ptr<Timer>& timer) noexcept {
  sd_event_source* source = nullptr;
  if (sd_event_add_time(event_.get(), &source, kClock, timer->next, timer->leeway, &EventLoop::onTime,
                        timer.get()) < 0) {
    return false;
  }
  timer->source.reset(source);
  sd_event_source_set_priority(source, kTimerPriority);
  armed_.emplace(timer.get(), timer);
  return true;
}

void EventLoop::disarm(Timer& timer) noexcept {
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
  if (onLoopThread()) {
    if (!arm(timer)) return nullptr;
  } else {
    post([timer] {
      if (timer->valid.load() && !timer->loop->arm(timer) && timer->failed) timer->failed();
    });
  }
  return std::make_unique<TimerHandle>(weak_from_this(), std::move(timer));
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

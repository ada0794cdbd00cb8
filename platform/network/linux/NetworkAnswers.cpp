// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/network/linux/NetworkAnswers.h"

#include <algorithm>
#include <array>
#include <deque>
#include <list>
#include <mutex>
#include <new>
#include <utility>

#include "platform/datagram/SealedMemory.h"
#include "platform/runloop/RunAndWait.h"

namespace brenvik {
namespace {

using Clock = std::chrono::steady_clock;
using std::chrono::milliseconds;

constexpr const char kQueueLabel[] = "network worker";
// Signs of life within one longest silence; a correct worker gives six. More are a flood.
constexpr int kMaxSignsOfLife = 60;
constexpr auto kTimerLeeway = milliseconds(100);

// An answer's descriptors must be sealed memory; the last close of any other descriptor could block for ever.
bool isSealedMemory(const UniqueFd& descriptor) noexcept { return sizeOfSealedMemory(descriptor.get()) >= 0; }

struct Question {
  NetworkWork work{};
  WorkerMessage message;
  milliseconds limit{0};
  NetworkAnswers::Handler handler;
};

// One for each sort of work.
struct Line {
  std::size_t open = 0;  // questions that the worker has
  std::deque<std::shared_ptr<Question>> waiting;
};
constexpr std::size_t kLines = static_cast<std::size_t>(NetworkWork::echo) + 1;

}  // namespace

class NetworkAnswers::Desk : public std::enable_shared_from_this<Desk> {
 public:
  Desk(WorkQueues& queues, Worker& worker, milliseconds longestSilence)
      : queues_(queues), worker_(worker), longestSilence_(longestSilence) {}

  void ask(std::shared_ptr<Question> question) noexcept {
    Ended why = Ended::cancelled;
    {
      const std::lock_guard lock(mutex_);
      if (!closed_) {
        try {
          if (queue_ == nullptr) {
            queue_ = queues_.makeSerial(kQueueLabel, QualityOfService::standard);
            loop_ = queue_.get();
          }
          queue_->post([self = shared_from_this(), question] { self->start(question); });
          used_ = true;
          return;
        } catch (const std::bad_alloc&) {  // memory, a thread or a descriptor is missing
          why = Ended::refused;
        }
      }
    }
    tell(*question, why, nullptr);
  }

  void cancel(const std::shared_ptr<const void>& question) noexcept {
    const std::lock_guard lock(mutex_);
    if (queue_ == nullptr) return;
    try {
      queue_->post([self = shared_from_this(), question] { self->abandon(question.get()); });
    } catch (const std::bad_alloc&) {
      // It goes on to its own limit.
    }
  }

  void shutDown() noexcept {
    std::shared_ptr<WorkQueue> queue;
    bool used = false;
    {
      const std::lock_guard lock(mutex_);
      closed_ = true;
      queue = std::move(queue_);
      used = used_;
    }
    if (queue == nullptr || !used) return;
    // Callers wait until this has run, so it must run even if memory is short for a while.
    runAndWait(*queue, [this] { abandonAll(); });
  }

 private:
  // A question that the worker has.
  struct Exchange {
    std::shared_ptr<Question> question;
    WorkerChannel channel;
    Clock::time_point deadline;
    Clock::time_point
        heard;  // when the worker last said something; on a clock that stands while the system sleeps
    int signsOfLife = 0;  // since the timer fired last
    std::unique_ptr<DescriptorSource> source;
    std::unique_ptr<WorkQueue::Timer> timer;
  };
  using Exchanges = std::list<Exchange>;

  // ---- all below: on the queue ----

  static bool tell(Question& question, Ended ended, WorkerMessage* answer) noexcept {
    const auto handler = std::move(question.handler);
    try {
      return handler(ended, answer);
    } catch (const std::bad_alloc&) {
      return true;  // whoever asked has a time-out, and the answer was none the worse for it
    }
  }

  void start(const std::shared_ptr<Question>& question) noexcept {
    try {
      auto& line = lineOf(*question);
      if (line.open >= kMaxOpen) return line.waiting.push_back(question);
      begin(question);
    } catch (const std::bad_alloc&) {
      tell(*question, Ended::refused, nullptr);
    }
  }

  Line& lineOf(const Question& question) noexcept { return lines_[static_cast<std::size_t>(question.work)]; }

  void begin(const std::shared_ptr<Question>& question) {
    const auto at = exchanges_.emplace(exchanges_.end());
    at->question = question;
    ++lineOf(*question).open;
    try {
      auto result = worker_.open(static_cast<std::uint32_t>(question->work), &at->channel);
      if (result == WorkerResult::done) result = at->channel.send(question->message);
      question->message = {};
      if (result != WorkerResult::done) {
        return end(at, result == WorkerResult::outOfMemory ? Ended::refused : Ended::unavailable, nullptr);
      }
      at->heard = Clock::now();
      at->deadline = at->heard + question->limit;
      const auto interval = std::min(question->limit, longestSilence_ / 2);
      at->timer = loop_->makeTimer(interval, interval, kTimerLeeway, [this, at] { passed(at); });
      at->source = loop_->watchDescriptor(at->channel.descriptor(), Interest::reading,
                                          [this, at](Readiness) { read(at); });
      if (at->timer != nullptr && at->timer->activate() && at->source != nullptr) return;
    } catch (const std::bad_alloc&) {  // as below
    }
    end(at, Ended::refused, nullptr);
  }

  void read(Exchanges::iterator at) noexcept {
    WorkerMessage message;
    switch (at->channel.receive(&message, Clock::now())) {
      case WorkerResult::done:
        break;
      case WorkerResult::timedOut:
        return;
      case WorkerResult::outOfMemory:
        return end(at, Ended::refused, nullptr);
      default:  // hung up, or nonsense
        return giveUp(at);
    }
    const bool isAnswer = message.kind == static_cast<std::uint32_t>(NetworkMessage::answer);
    if (!message.descriptors.empty() &&
        !(isAnswer && std::all_of(message.descriptors.begin(), message.descriptors.end(), isSealedMemory))) {
      at->channel.discard(&message);
      return giveUp(at);
    }
    switch (static_cast<NetworkMessage>(message.kind)) {
      case NetworkMessage::alive:
        at->heard = Clock::now();
        if (++at->signsOfLife > kMaxSignsOfLife || !message.payload.empty()) giveUp(at);
        return;
      case NetworkMessage::answer:
        return end(at, Ended::answered, &message);
      case NetworkMessage::refusal:
        return end(at, Ended::refused, nullptr);
      default:
        return giveUp(at);
    }
  }

  void passed(Exchanges::iterator at) noexcept {
    at->signsOfLife = 0;
    const auto now = Clock::now();
    if (now >= at->deadline || now - at->heard >= longestSilence_) giveUp(at);
  }

  void giveUp(Exchanges::iterator at) noexcept {
    at->source.reset();
    worker_.giveUp(&at->channel);
    end(at, Ended::unavailable, nullptr);
  }

  void end(Exchanges::iterator at, Ended ended, WorkerMessage* answer) noexcept {
    const auto question = std::move(at->question);
    // The handler of its source or timer is what runs here; both may go within it.
    Exchanges over;
    over.splice(over.begin(), exchanges_, at);
    at->source.reset();
    at->timer.reset();
    auto& line = lineOf(*question);
    --line.open;
    if (!tell(*question, ended, answer)) worker_.giveUp(&at->channel);
    over.clear();
    // One that cannot even begin ends here again: a loop, and no recursion, however many wait.
    if (std::exchange(admitting_, true)) return;
    while (line.open < kMaxOpen && !line.waiting.empty()) {
      const auto next = std::move(line.waiting.front());
      line.waiting.pop_front();
      start(next);
    }
    admitting_ = false;
  }

  void abandon(const void* question) noexcept {
    for (auto at = exchanges_.begin(); at != exchanges_.end(); ++at) {
      if (at->question.get() == question) return end(at, Ended::cancelled, nullptr);
    }
    for (auto& line : lines_) {
      const auto found = std::find_if(line.waiting.begin(), line.waiting.end(),
                                      [&](const auto& each) { return each.get() == question; });
      if (found == line.waiting.end()) continue;
      const auto abandoned = std::move(*found);
      line.waiting.erase(found);
      tell(*abandoned, Ended::cancelled, nullptr);
      return;
    }
  }

  void abandonAll() noexcept {
    for (auto& line : lines_) {
      const auto waiting = std::exchange(line.waiting, {});
      for (const auto& question : waiting) tell(*question, Ended::cancelled, nullptr);
    }
    while (!exchanges_.empty()) end(exchanges_.begin(), Ended::cancelled, nullptr);
  }

  WorkQueues& queues_;
  Worker& worker_;
  const milliseconds longestSilence_;
  std::mutex mutex_;  // guards the next four
  bool closed_ = false;
  bool used_ = false;
  std::shared_ptr<WorkQueue> queue_;
  WorkQueue* loop_ = nullptr;  // what queue_ owns, for use on it

  Exchanges exchanges_;
  std::array<Line, kLines> lines_;
  bool admitting_ = false;
};

NetworkAnswers::NetworkAnswers(WorkQueues& queues, Worker& worker, milliseconds longestSilence)
    : desk_(std::make_shared<Desk>(queues, worker, longestSilence)) {}

NetworkAnswers::~NetworkAnswers() { shutDown(); }

NetworkAnswers::Token NetworkAnswers::ask(NetworkWork work, WorkerMessage question, milliseconds limit,
                                          Handler handler) noexcept {
  std::shared_ptr<Question> made;
  try {
    made = std::make_shared<Question>();
  } catch (const std::bad_alloc&) {
    try {
      if (handler) (void)handler(Ended::refused, nullptr);
    } catch (const std::bad_alloc&) {  // whoever asked has a time-out
    }
    return {};
  }
  *made = {work, std::move(question), limit, std::move(handler)};
  Token token = made;
  desk_->ask(std::move(made));
  return token;
}

void NetworkAnswers::cancel(const Token& token) noexcept {
  if (const auto question = token.lock()) desk_->cancel(question);
}

void NetworkAnswers::shutDown() noexcept { desk_->shutDown(); }

}  // namespace brenvik

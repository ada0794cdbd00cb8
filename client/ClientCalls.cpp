// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include <sys/epoll.h>
#include <sys/eventfd.h>
#include <sys/timerfd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <chrono>
#include <cstring>
#include <iterator>
#include <new>
#include <utility>

#include "client/Client.h"

// The client's calls that do not block.
namespace brenvik::client {
namespace {

std::chrono::steady_clock::time_point now() noexcept { return std::chrono::steady_clock::now(); }

}  // namespace

int Client::descriptor() noexcept {
  systemError_ = 0;
  if (poll_.isValid()) return poll_.get();
  UniqueFd poll(::epoll_create1(EPOLL_CLOEXEC));
  UniqueFd timer(::timerfd_create(CLOCK_MONOTONIC, TFD_CLOEXEC | TFD_NONBLOCK));
  UniqueFd results(::eventfd(1, EFD_CLOEXEC | EFD_NONBLOCK));
  epoll_event event{};
  epoll_event unwatched{};
  event.events = EPOLLIN;
  if (!poll.isValid() || !timer.isValid() || !results.isValid() ||
      ::epoll_ctl(poll.get(), EPOLL_CTL_ADD, timer.get(), &event) != 0 ||
      ::epoll_ctl(poll.get(), EPOLL_CTL_ADD, results.get(), &unwatched) != 0) {
    systemError_ = errno;
    return -1;
  }
  poll_ = std::move(poll);
  timer_ = std::move(timer);
  results_ = std::move(results);
  watched_ = 0;
  watchesResults_ = false;
  armed_ = Deadline::never();
  rearm();
  return poll_.get();
}

void Client::rearm() noexcept {
  if (!poll_.isValid()) return;
  const bool isChannel = channel_.isValid() && channelNumber_ >= 0;
  const int socket = isChannel ? channel_.get() : checkIn_.descriptor();
  // Odd for a channel, even for a check-in's socket, 0 for none.
  const std::uint64_t key = isChannel ? 2 * channelSerial_ + 1 : socket >= 0 ? 2 * checkIn_.serial() : 0;
  const std::uint32_t events =
      EPOLLIN | (isChannel && !calls_.waiting().empty() ? std::uint32_t{EPOLLOUT} : 0U);
  if (watched_ != key || (key != 0 && watchedEvents_ != events)) {
    epoll_event event{};
    event.events = events;
    // A channel that is given up; a check-in's socket leaves by being closed.
    if (watched_ % 2 == 1 && watched_ != key && channel_.isValid())
      ::epoll_ctl(poll_.get(), EPOLL_CTL_DEL, channel_.get(), nullptr);
    const int operation = watched_ == key ? EPOLL_CTL_MOD : EPOLL_CTL_ADD;
    if (key != 0) ::epoll_ctl(poll_.get(), operation, socket, &event);
    watched_ = key;
    watchedEvents_ = events;
  }

  // Results that wait to be taken. A timer that is due at once would do the same at ten times the cost.
  if (watchesResults_ == calls_.finished().empty()) {
    watchesResults_ = !watchesResults_;
    epoll_event event{};
    event.events = watchesResults_ ? std::uint32_t{EPOLLIN} : 0U;
    ::epoll_ctl(poll_.get(), EPOLL_CTL_MOD, results_.get(), &event);
  }

  Deadline due = calls_.areFinished() ? Deadline::never() : earliest_;
  if (checkIn_.isUnderWay()) due = std::min(due, checkIn_.due());
  if (due == armed_) return;
  armed_ = due;
  itimerspec setting{};
  setting.it_value = due.forTimer();
  ::timerfd_settime(timer_.get(), TFD_TIMER_ABSTIME, &setting, nullptr);
}

BegunCall* Client::add(const RoutineFacts& routine, std::span<const std::byte> message, Regions regions,
                       void* context) noexcept {
  const bvmh_call number = ++lastCall_;
  try {
    BegunCall& call = *calls_.add(number);
    call.routine = &routine;
    call.deadline = Deadline::in(timeout_);
    call.result.context = context;
    call.result.message_id = routine.id;
    earliest_ = std::min(earliest_, call.deadline);
    call.message.assign(message.begin(), message.end());
    for (std::size_t i = 0; i < regions.size(); ++i)
      call.regions[i].assign(regions[i].begin(), regions[i].end());
    return &call;
  } catch (const std::bad_alloc&) {
    if (BegunCall* const half = calls_.find(number); half != nullptr) calls_.remove(*half);
    return nullptr;
  }
}

std::int32_t Client::begin(const RoutineFacts& routine, std::span<const std::byte> message, Regions regions,
                           void* context, bvmh_call* number) noexcept {
  if (number != nullptr) *number = 0;
  systemError_ = 0;
  if (!wantsChannel_) return BVMH_ERROR_NOT_CONNECTED;
  if (calls_.size() >= BVMH_MOST_CALLS) return BVMH_ERROR_TOO_MANY_CALLS;
  const BegunCall* const call = add(routine, message, regions, context);
  if (call == nullptr) return BVMH_ERROR_NO_MEMORY;
  if (number != nullptr) *number = call->result.call;
  // Those before it wait for room, which is noticed elsewhere.
  if (channel_.isValid() && calls_.waiting().size() == 1) sendWaiting();
  startCheckIn();
  rearm();
  return BVMH_OK;
}

std::int32_t Client::beginConnect(void* context, bvmh_call* number) noexcept {
  if (number != nullptr) *number = 0;
  systemError_ = 0;
  if (calls_.size() >= BVMH_MOST_CALLS) return BVMH_ERROR_TOO_MANY_CALLS;
  const BegunCall* const call = add(kCheckInRoutine, {}, {}, context);
  if (call == nullptr) return BVMH_ERROR_NO_MEMORY;
  if (number != nullptr) *number = call->result.call;
  wantsChannel_ = true;
  if (channel_.isValid()) sendWaiting();
  startCheckIn();
  rearm();
  return BVMH_OK;
}

void Client::process() noexcept {
  systemError_ = 0;
  settle();
  rearm();
}

void Client::settle() noexcept {
  if (channel_.isValid()) receiveAnswers();
  if (channel_.isValid()) sendWaiting();
  if (earliest_.hasPassed()) expire();
  ensureChannel();
}

// It is process() that takes it further. So calls that are begun in a row are all begun, and end alike.
void Client::startCheckIn() noexcept {
  if (!channel_.isValid() && !checkIn_.isUnderWay()) checkIn_.start(address_);
}

void Client::ensureChannel() noexcept {
  while (!channel_.isValid() && !calls_.waiting().empty()) {
    startCheckIn();
    const auto code = checkIn_.advance();
    if (!code) return;
    checkInEnded(*code);
  }
  // Nobody waits for it any longer.
  if (!channel_.isValid()) checkIn_.abandon();
}

void Client::checkInEnded(std::int32_t code) noexcept {
  if (code == BVMH_OK) {
    useChannel(checkIn_.takeChannel());
    wantsChannel_ = true;
    wasConnected_ = true;
    sendWaiting();
    return;
  }
  finishAll(calls_.waiting(), code, checkIn_.systemError());
  wantsChannel_ = wantsChannel_ && wasConnected_;
}

void Client::sendWaiting() noexcept {
  while (channel_.isValid() && !calls_.waiting().empty()) {
    const auto place = calls_.waiting().begin();
    BegunCall& call = *place;
    if (call.routine == &kCheckInRoutine) {
      finish(call, BVMH_OK);
      continue;
    }
    std::array<std::span<const std::byte>, kMaxRegions> regions;
    for (std::size_t i = 0; i < call.routine->descriptors; ++i) regions[i] = call.regions[i];
    Outgoing request;
    if (!request.lay(call.message, std::span(regions).first(call.routine->descriptors))) {
      finish(call, BVMH_ERROR_SYSTEM, errno);
      continue;
    }
    // It keeps its number while it waits for room.
    if (call.replyPort == kNullPort) call.replyPort = nextReplyPort();
    const MessageHeader header = headerOf(*call.routine, call.replyPort);
    std::memcpy(call.message.data(), &header, sizeof header);
    Waiting waiting = Waiting::never;
    switch (
        sendMessage(channel_.get(), request.parts(), request.descriptors(), Deadline::never(), &waiting)) {
      case Io::done:
        if (Questions::isQuestion(call.routine->id))
          questions_.asked(call.routine->id, call.publicNumber(), now());
        calls_.markSent(place);
        break;
      case Io::timedOut:
        return;
      case Io::reset:
        sawReset_ = true;
        [[fallthrough]];
      case Io::closed:
        // Answers may still be there; after the last of them the end is.
        if (std::exchange(call.wasReturned, true)) finish(call, BVMH_ERROR_HELPER_GONE);
        receiveAnswers();
        if (channel_.isValid()) channelEnded();
        return;
      case Io::failed:
        finish(call, BVMH_ERROR_SYSTEM, errno);
        break;
    }
  }
}

void Client::receiveAnswers() noexcept {
  do {
    if (!buffer_.ensure()) {
      finishAll(calls_.sent(), BVMH_ERROR_NO_MEMORY, 0);
      return closeChannel();
    }
    switch (receiveMessage(channel_.get(), buffer_.bytes(), Deadline::never(), Waiting::never, &incoming_)) {
      case Io::done:
        if (!readAnswer()) closeChannel();
        incoming_ = Incoming{};
        break;
      case Io::timedOut:
        return;
      case Io::reset:
        // It comes before answers that are still there.
        sawReset_ = true;
        continue;
      case Io::closed:
        return channelEnded();
      case Io::failed:
        finishAll(calls_.sent(), BVMH_ERROR_SYSTEM, errno);
        return closeChannel();
    }
    // One more look would only say that there is nothing, unless the end of the channel is to be seen.
  } while (channel_.isValid() && (sawReset_ || !calls_.sent().empty() || unanswered_ != 0));
}

bool Client::readAnswer() noexcept {
  const std::span<const std::byte> datagram = std::as_bytes(buffer_.bytes()).first(incoming_.length);
  const auto answered = answeredPort(datagram);
  auto& sent = calls_.sent();
  auto found = sent.begin();
  if (answered) {
    // Answers come in the order of the requests, so it is the first one, unless that was given up.
    while (found != sent.end() && found->replyPort != *answered) ++found;
    if (found == sent.end() && isLateAnswer(*answered, lastReplyPort_)) return true;
  }
  Reply reply;
  if (answered && found != sent.end() && readReply(*found->routine, datagram, &incoming_, &reply)) {
    const std::int32_t code =
        reply.code == BVMH_OK ? readResult(*found->routine, reply, &found->result) : reply.code;
    finish(*found, code);
    if (code != BVMH_ERROR_PROTOCOL) return true;
  } else if (!sent.empty()) {
    finish(found == sent.end() ? sent.front() : *found, BVMH_ERROR_PROTOCOL);
  }
  // What a helper that lies has done with the others, nobody knows.
  finishAll(sent, BVMH_ERROR_ANSWER_LOST, 0);
  return false;
}

// The helper reads a request when it has answered the one before. So the oldest without an answer may have
// been carried out, unless the kernel says that it was left unread; the others have not been.
void Client::channelEnded() noexcept {
  auto& sent = calls_.sent();
  const bool isUnread = sawReset_ && sent.size() == 1 && sent.front().replyPort == lastReplyPort_;
  if (!sent.empty() && !isUnread) finish(sent.front(), BVMH_ERROR_ANSWER_LOST);
  while (!sent.empty()) {
    const auto last = std::prev(sent.end());
    if (std::exchange(last->wasReturned, true)) {
      finish(*last, BVMH_ERROR_HELPER_GONE);
    } else {
      calls_.markReturned(last);
    }
  }
  for (BegunCall& each : calls_.waiting()) each.replyPort = kNullPort;
  closeChannel();
}

void Client::expire() noexcept {
  const Deadline current = Deadline::in(std::chrono::milliseconds(0));
  earliest_ = Deadline::never();
  for (BegunCalls::List* const list : {&calls_.waiting(), &calls_.sent()}) {
    for (auto each = list->begin(); each != list->end();) {
      BegunCall& call = *each++;
      if (call.deadline > current) {
        earliest_ = std::min(earliest_, call.deadline);
        continue;
      }
      if (call.state == BegunCall::State::sent) ++unanswered_;
      finish(call, BVMH_ERROR_TIMED_OUT);
    }
  }
}

void Client::finish(BegunCall& call, std::int32_t code, int systemError) noexcept {
  const bool mayBeCarriedOut =
      code == BVMH_OK || code == BVMH_ERROR_TIMED_OUT || code == BVMH_ERROR_ANSWER_LOST;
  if (!mayBeCarriedOut) questions_.refused(call.routine->id, call.publicNumber());
  calls_.finish(call, code, systemError);
}

void Client::finishAll(BegunCalls::List& calls, std::int32_t code, int systemError) noexcept {
  while (!calls.empty()) finish(calls.front(), code, systemError);
}

std::int32_t Client::takeResult(bvmh_call number, bvmh_result* result) noexcept {
  *result = bvmh_result{};
  BegunCall* call = nullptr;
  if (number != 0) {
    call = calls_.find(number);
  } else if (!calls_.finished().empty()) {
    call = &calls_.finished().front();
  } else if (!calls_.areFinished()) {
    return BVMH_ERROR_IN_PROGRESS;
  }
  if (call == nullptr) return BVMH_ERROR_NO_SUCH_CALL;
  if (call->state != BegunCall::State::finished) return BVMH_ERROR_IN_PROGRESS;
  *result = call->result;
  call->result.region = bvmh_region{};  // the caller's
  calls_.remove(*call);
  rearm();
  return BVMH_OK;
}

std::int32_t Client::cancel(bvmh_call number) noexcept {
  BegunCall* const call = calls_.find(number);
  if (call == nullptr) return BVMH_ERROR_NO_SUCH_CALL;
  if (call->state == BegunCall::State::sent) ++unanswered_;
  calls_.remove(*call);
  if (calls_.waiting().empty()) checkIn_.abandon();
  rearm();
  return BVMH_OK;
}

std::int32_t Client::matchPush(const bvmh_event& event, bvmh_call* number) noexcept {
  return questions_.answered(event.kind, now(), number);
}

}  // namespace brenvik::client

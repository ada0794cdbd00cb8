// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <sys/un.h>

#include <atomic>
#include <chrono>
#include <cstddef>
#include <cstdint>
#include <span>

#include "client/BegunCalls.h"
#include "client/CheckIn.h"
#include "client/Questions.h"
#include "client/Reply.h"

namespace brenvik::client {

// One client of the helper: its death-watch port, its channel, and the calls on it. One thread at a time,
// except for interrupt(). All results are codes of mobile_helper.h.
class Client {
 public:
  Client() noexcept;
  Client(const Client&) = delete;
  Client& operator=(const Client&) = delete;

  void setTimeout(std::uint32_t milliseconds) noexcept;
  // Returns false if the path is empty or does not fit a socket address. Null: the path compiled in.
  bool setSocket(const char* path) noexcept;

  std::int32_t connect() noexcept;
  void disconnect() noexcept;
  int systemError() const noexcept { return systemError_; }

  // Sends the message, whose header it completes, with the bytes of its out-of-line descriptors, and waits
  // for the reply. `regions` are in the order of the descriptors, whose addresses and sizes it fills in.
  // On success, *result has what the routine returned; else its region is empty.
  std::int32_t call(const RoutineFacts& routine, std::span<std::byte> message, Regions regions,
                    bvmh_result* result) noexcept;
  // May be called on any thread and in signal handlers.
  void interrupt() noexcept;

  // The rest is for calls that do not block. descriptor() returns -1 on failure; see systemError().
  int descriptor() noexcept;
  std::int32_t begin(const RoutineFacts& routine, std::span<const std::byte> message, Regions regions,
                     void* context, bvmh_call* number) noexcept;
  std::int32_t beginConnect(void* context, bvmh_call* number) noexcept;
  void process() noexcept;
  std::int32_t takeResult(bvmh_call number, bvmh_result* result) noexcept;
  std::int32_t cancel(bvmh_call number) noexcept;
  std::int32_t matchPush(const bvmh_event& event, bvmh_call* number) noexcept;

 private:
  enum class Exchange : std::uint8_t {
    answered,
    notTaken,  // the peer closed without reading the request
    lost,      // the peer closed after it had read the request
    timedOut,
    broken,  // an answer, but not one of the protocol's
    failed,  // see systemError_
    noMemory,
    interrupted,
  };

  // Blocking calls, in Client.cpp.
  std::int32_t checkIn(Deadline deadline) noexcept;
  std::int32_t callAmongBegun(const RoutineFacts& routine, std::span<const std::byte> message,
                              Regions regions, bvmh_result* result) noexcept;
  // Sends the message, whose header it completes, and waits for its reply where no begun call is under way.
  Exchange exchangeAlone(const RoutineFacts& routine, std::span<std::byte> message, const Outgoing& request,
                         Deadline deadline, Waiting waiting, Reply* reply) noexcept;
  // Writes that reply into the result and returns the code of the call.
  std::int32_t finishAlone(const RoutineFacts& routine, const Reply& reply, bvmh_result* result) noexcept;
  Exchange exchange(const RoutineFacts& routine, const Outgoing& request, PortName replyPort,
                    Deadline deadline, Waiting waiting, Reply* reply) noexcept;
  Exchange awaitReply(const RoutineFacts& routine, PortName replyPort, Deadline deadline, Waiting waiting,
                      Reply* reply) noexcept;
  Waiting armSocketTimeout() noexcept;
  std::int32_t codeOf(Exchange outcome) const noexcept;
  // Waits until there is something to do, an interruption, or the deadline.
  void waitForWork(Deadline deadline) noexcept;
  // Whether there was an interruption; clears it.
  bool takeInterruption() noexcept;

  // Uses the channel, for blocking and begun calls.
  void useChannel(CheckIn::Channel channel) noexcept;
  void closeChannel() noexcept;
  PortName nextReplyPort() noexcept;
  MessageHeader headerOf(const RoutineFacts& routine, PortName replyPort) const noexcept;
  bool isLateAnswer(PortName answered, PortName replyPort) noexcept;
  // Writes a good reply into the result.
  std::int32_t readResult(const RoutineFacts& routine, const Reply& reply, bvmh_result* result) noexcept;

  // Begun calls, in ClientCalls.cpp.
  BegunCall* add(const RoutineFacts& routine, std::span<const std::byte> message, Regions regions,
                 void* context) noexcept;
  void settle() noexcept;  // all that needs no waiting
  void startCheckIn() noexcept;
  void ensureChannel() noexcept;
  void checkInEnded(std::int32_t code) noexcept;
  void sendWaiting() noexcept;
  void receiveAnswers() noexcept;
  bool readAnswer() noexcept;  // false when the channel is of no more use
  void expire() noexcept;
  void channelEnded() noexcept;
  void finishAll(BegunCalls::List& calls, std::int32_t code, int systemError) noexcept;
  void finish(BegunCall& call, std::int32_t code, int systemError = 0) noexcept;
  void rearm() noexcept;  // descriptor()

  sockaddr_un address_{};
  std::chrono::milliseconds timeout_;
  std::chrono::milliseconds armedTimeout_{0};  // what the channel's SO_RCVTIMEO says; 0: nothing yet
  CheckIn checkIn_;
  UniqueFd deathWatch_;  // our end; the helper watches the other one
  UniqueFd channel_;
  std::uint64_t channelSerial_ = 0;
  bool wantsChannel_ = false;  // between connect and disconnect
  bool wasConnected_ = false;  // a check-in since then has succeeded
  PortName lastReplyPort_ = 0;
  std::uint32_t sentOnChannel_ = 0;  // reply port numbers that this channel has seen
  std::uint32_t unanswered_ = 0;     // of these, requests that were given up
  bool sawReset_ = false;            // the peer left a request of this channel unread
  int systemError_ = 0;
  Buffer buffer_;
  Incoming incoming_;

  BegunCalls calls_;
  bvmh_call lastCall_ = 0;
  Deadline earliest_ = Deadline::never();  // no call on its way has an earlier deadline
  Questions questions_;

  // What descriptor() waits for.
  UniqueFd timer_;
  UniqueFd results_;  // always readable; watched while results wait to be taken
  UniqueFd poll_;
  bool watchesResults_ = false;
  std::uint64_t watched_ = 0;        // which socket; 0: none
  std::uint32_t watchedEvents_ = 0;  // and what for
  Deadline armed_ = Deadline::never();

  // Interruption. A call that waits alone is woken by shutting its channel down, since nothing else ends a
  // recvmsg in another thread, and a second descriptor to wait for would cost every call a system call; see
  // docs/decisions/17-interrupted-calls.md.
  std::atomic<int> interrupters_ = 0;      // that are in interrupt() just now
  std::atomic<bool> interrupted_ = false;  // and no call has returned because of it
  std::atomic<bool> waitsOnChannel_ = false;
  std::atomic<bool> wasCut_ = false;  // the channel was shut down
  std::atomic<int> channelNumber_ = -1;
  std::atomic<int> wakeNumber_ = -1;
  UniqueFd wake_;  // an eventfd, made by the first wait in poll
};

}  // namespace brenvik::client

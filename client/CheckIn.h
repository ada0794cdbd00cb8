// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <sys/un.h>

#include <cstdint>
#include <optional>

#include "client/Reply.h"

namespace brenvik::client {

// A check-in with its retries, which never waits. Its user waits for descriptor() and due(), then calls
// advance().
class CheckIn {
 public:
  struct Channel {
    UniqueFd socket;
    UniqueFd deathWatch;  // our end; the helper watches the other one
  };

  bool isUnderWay() const noexcept { return step_ != Step::none; }
  // Precondition: none is under way.
  void start(const sockaddr_un& address) noexcept;
  // Continues as far as it can without waiting. Returns the code when it has ended; after BVMH_OK,
  // takeChannel() returns the channel.
  std::optional<std::int32_t> advance() noexcept;
  void abandon() noexcept;

  // Readable when advance() has something to read; -1 when only time matters.
  int descriptor() const noexcept { return step_ == Step::awaitReply ? service_.get() : -1; }
  // A number that changes with each new socket behind descriptor().
  std::uint64_t serial() const noexcept { return serial_; }
  // When advance() must be called even if descriptor() is not readable.
  Deadline due() const noexcept { return due_; }
  Channel takeChannel() noexcept { return std::move(channel_); }
  // The errno behind the code.
  int systemError() const noexcept { return systemError_; }

 private:
  enum class Step : std::uint8_t { none, connect, awaitReply, pause };

  std::optional<std::int32_t> connect() noexcept;
  std::optional<std::int32_t> ask() noexcept;
  std::optional<std::int32_t> readAnswer() noexcept;
  // After a failed try, schedules the next one; returns the code if there is none.
  std::optional<std::int32_t> tryEnded(std::int32_t code) noexcept;
  std::int32_t systemFailure() noexcept;

  Step step_ = Step::none;
  sockaddr_un address_{};
  std::uint64_t serial_ = 0;
  std::uint32_t tries_ = 0;
  std::uint32_t knocks_ = 0;  // of this try, at a full backlog
  bool hadLeft_ = false;
  Deadline due_ = Deadline::never();
  UniqueFd service_;
  Channel channel_;
  int systemError_ = 0;
};

}  // namespace brenvik::client

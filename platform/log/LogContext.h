// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <sys/types.h>

#include <array>
#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <span>
#include <string>
#include <string_view>

// On whose behalf a line is written: fields that the journal keeps beside the text, so that
// `journalctl BRENVIK_CALLER_EXE=/usr/libexec/brenvik/brenvikd` finds what one program has caused.
namespace brenvik {

// A client, as the journal shows it. Never changed, and shared by all that its requests set going.
struct LogCaller {
  pid_t pid = 0;
  uid_t uid = 0;
  std::string executable;  // empty: not known
  std::string unit;        // empty: none, or not known
};

// Which client a port was made for. Any thread.
class LogCallers {
 public:
  // The process's own.
  static LogCallers& shared();

  void add(std::uint32_t port, std::shared_ptr<const LogCaller> caller);
  void remove(std::uint32_t port) noexcept;
  std::shared_ptr<const LogCaller> find(std::uint32_t port) const noexcept;  // null when not known

 private:
  mutable std::mutex mutex_;
  std::map<std::uint32_t, std::shared_ptr<const LogCaller>> callers_;
};

// Whoever this thread works for. `routine` is the name of a routine of the protocol, with static storage.
struct LogContext {
  std::shared_ptr<const LogCaller> caller;
  std::string_view routine;
};

// While it lives, lines of this thread carry the fields. Scopes nest: the innermost counts. Making one costs
// two stores, no allocation and no system call; a port is looked up only when a line is written or work is
// handed on.
class LogScope {
 public:
  // A request that has come by a client's port.
  LogScope(std::string_view routine, std::uint32_t port) noexcept
      : routine_(routine), port_(port), outer_(innermost) {
    innermost = this;
  }
  // Work done for another thread's request. `context` must outlive this object.
  explicit LogScope(const LogContext& context) noexcept
      : routine_(context.routine), context_(&context), outer_(innermost) {
    innermost = this;
  }
  LogScope(const LogScope&) = delete;
  LogScope& operator=(const LogScope&) = delete;
  ~LogScope() { innermost = outer_; }

  // Of this thread; empty outside of any scope.
  static LogContext current() noexcept;
  static bool isActive() noexcept { return innermost != nullptr; }

 private:
  static thread_local constinit const LogScope* innermost;

  const std::string_view routine_;
  const std::uint32_t port_ = 0;
  const LogContext* const context_ = nullptr;
  const LogScope* const outer_;
};

// The task, to be run on another thread or later in the present context: its lines carry the same fields.
// Outside of any scope that is the task itself.
std::function<void()> inCurrentLogContext(std::function<void()> task);

// The fields of the line that this thread writes now, for sinks.
class LogFields {
 public:
  struct Field {
    std::string_view key;
    std::string_view value;
  };
  LogFields() noexcept;
  LogFields(const LogFields&) = delete;
  LogFields& operator=(const LogFields&) = delete;

  static constexpr std::size_t kMaxFields = 5;
  std::span<const Field> all() const noexcept { return {fields_.data(), count_}; }

 private:
  void add(std::string_view key, std::string_view value) noexcept {
    if (!value.empty()) fields_[count_++] = {key, value};
  }
  const LogContext context_;
  std::array<char, 12> pid_;
  std::array<char, 12> uid_;
  std::array<Field, kMaxFields> fields_;
  std::size_t count_ = 0;
};

}  // namespace brenvik

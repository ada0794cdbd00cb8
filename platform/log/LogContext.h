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

// The client for which a line is written. The journal keeps it in fields beside the text, so that
// `journalctl BRENVIK_CALLER_EXE=/usr/libexec/brenvik/brenvikd` finds the lines that one program has caused.
namespace brenvik {

// A client, as the journal shows it. Immutable; all work that its requests start shares it.
struct LogCaller {
  pid_t pid = 0;
  uid_t uid = 0;
  std::string executable;  // empty: unknown
  std::string unit;        // empty: none, or unknown
};

// Maps each port to the client that it was made for. Any thread.
class LogCallers {
 public:
  // The process's own object.
  static LogCallers& shared();

  void add(std::uint32_t port, std::shared_ptr<const LogCaller> caller);
  void remove(std::uint32_t port) noexcept;
  std::shared_ptr<const LogCaller> find(std::uint32_t port) const noexcept;  // null: unknown

 private:
  mutable std::mutex mutex_;
  std::map<std::uint32_t, std::shared_ptr<const LogCaller>> callers_;
};

// The request that this thread works for. `routine` is the name of a routine of the protocol, with static
// storage.
struct LogContext {
  std::shared_ptr<const LogCaller> caller;
  std::string_view routine;
};

// While it lives, lines of this thread carry the fields. Scopes nest; the innermost counts. Making one costs
// two stores, no allocation and no system call; the port is looked up only when a line is written or work is
// posted.
class LogScope {
 public:
  // For a request that arrived on a client's port.
  LogScope(std::string_view routine, std::uint32_t port) noexcept
      : routine_(routine), port_(port), outer_(innermost) {
    innermost = this;
  }
  // For work on another thread's request. `context` must outlive this object.
  explicit LogScope(const LogContext& context) noexcept
      : routine_(context.routine), context_(&context), outer_(innermost) {
    innermost = this;
  }
  LogScope(const LogScope&) = delete;
  LogScope& operator=(const LogScope&) = delete;
  ~LogScope() { innermost = outer_; }

  // This thread's context; empty outside any scope.
  static LogContext current() noexcept;
  static bool isActive() noexcept { return innermost != nullptr; }

 private:
  static thread_local constinit const LogScope* innermost;

  const std::string_view routine_;
  const std::uint32_t port_ = 0;
  const LogContext* const context_ = nullptr;
  const LogScope* const outer_;
};

// Wraps a task that runs later or on another thread, so that its lines carry the fields of the current
// context. Outside any scope it returns the task itself. Throws std::bad_alloc.
std::function<void()> inCurrentLogContext(std::function<void()> task);

// For sinks: the fields of the line that this thread is writing.
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

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/log/LogContext.h"

#include <charconv>
#include <utility>

namespace brenvik {
namespace {

template <typename Number>
std::string_view written(Number number, std::array<char, 12>* text) noexcept {
  const auto [end, error] = std::to_chars(text->data(), text->data() + text->size(), number);
  return {text->data(), static_cast<std::size_t>(end - text->data())};
}

}  // namespace

thread_local constinit const LogScope* LogScope::innermost = nullptr;

LogCallers& LogCallers::shared() {
  static LogCallers callers;
  return callers;
}

void LogCallers::add(std::uint32_t port, std::shared_ptr<const LogCaller> caller) {
  const std::lock_guard lock(mutex_);
  callers_.insert_or_assign(port, std::move(caller));
}

void LogCallers::remove(std::uint32_t port) noexcept {
  const std::lock_guard lock(mutex_);
  callers_.erase(port);
}

std::shared_ptr<const LogCaller> LogCallers::find(std::uint32_t port) const noexcept {
  const std::lock_guard lock(mutex_);
  const auto found = callers_.find(port);
  return found == callers_.end() ? nullptr : found->second;
}

LogContext LogScope::current() noexcept {
  if (innermost == nullptr) return {};
  if (innermost->context_ != nullptr) return *innermost->context_;
  return {LogCallers::shared().find(innermost->port_), innermost->routine_};
}

std::function<void()> inCurrentLogContext(std::function<void()> task) {
  if (!LogScope::isActive()) return task;
  return [context = LogScope::current(), task = std::move(task)] {
    const LogScope scope(context);
    task();
  };
}

LogFields::LogFields() noexcept : context_(LogScope::current()) {
  if (context_.caller != nullptr) {
    add("BRENVIK_CALLER_PID", written(context_.caller->pid, &pid_));
    add("BRENVIK_CALLER_UID", written(context_.caller->uid, &uid_));
    add("BRENVIK_CALLER_EXE", context_.caller->executable);
    add("BRENVIK_CALLER_UNIT", context_.caller->unit);
  }
  add("BRENVIK_ROUTINE", context_.routine);
}

}  // namespace brenvik

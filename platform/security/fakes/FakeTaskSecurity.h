// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <functional>
#include <map>
#include <mutex>
#include <new>
#include <string>
#include <utility>

#include "platform/security/TaskSecurity.h"

namespace brenvik {

// The task-security service of a world that the test describes: processes, by id and version, and what they
// hold. Any thread may ask; `whileAsked` is to be set before.
class FakeTaskSecurity final : public TaskSecurity {
 public:
  // A process that exists; without this no task is made for it.
  void addProcess(const AuditToken& caller) {
    const std::lock_guard lock(mutex_);
    held_[keyOf(caller)];
  }
  // A process that exists and holds the entitlement.
  void grant(const AuditToken& caller, std::string_view name, PropertyList value, bool error = false) {
    const std::lock_guard lock(mutex_);
    held_[keyOf(caller)][std::string(name)] = {std::move(value), error};
  }
  // The process is gone, with all it held.
  void removeProcess(const AuditToken& caller) {
    const std::lock_guard lock(mutex_);
    held_.erase(keyOf(caller));
  }

  std::unique_ptr<SecurityTask> makeTask(const AuditToken& caller) noexcept override {
    const std::lock_guard lock(mutex_);
    ++tasksWanted_;
    if (!held_.contains(keyOf(caller))) return nullptr;
    return std::make_unique<Task>(*this, caller);
  }

  std::string explainNoTask(const AuditToken&) noexcept override { return "the caller has ended"; }

  // How often a task was asked for, and how often a task was asked for a value.
  int tasksWanted() const {
    const std::lock_guard lock(mutex_);
    return tasksWanted_;
  }
  int questions() const {
    const std::lock_guard lock(mutex_);
    return questions_;
  }

  int explanations() const {
    const std::lock_guard lock(mutex_);
    return explanations_;
  }

  // What every process is and why it is refused, to be set before.
  SecurityTask::Caller described{"/usr/libexec/program", "program.service"};
  bool hasNoMemoryToDescribe = false;
  std::string refusal = "no file names it";
  std::function<void()> whileAsked;  // runs within each question, no lock held

 private:
  using Key = std::pair<pid_t, std::uint32_t>;
  static Key keyOf(const AuditToken& caller) { return {caller.pid(), caller.pidVersion()}; }

  class Task final : public SecurityTask {
   public:
    Task(FakeTaskSecurity& owner, const AuditToken& caller) : owner_(owner), caller_(caller) {}
    Answer copyEntitlement(std::string_view name) noexcept override {
      if (owner_.whileAsked) owner_.whileAsked();
      const std::lock_guard lock(owner_.mutex_);
      ++owner_.questions_;
      const auto process = owner_.held_.find(keyOf(caller_));
      if (process == owner_.held_.end()) return {};
      const auto answer = process->second.find(std::string(name));
      return answer == process->second.end() ? Answer{} : answer->second;
    }

    std::string explainRefusal(std::string_view) noexcept override {
      const std::lock_guard lock(owner_.mutex_);
      ++owner_.explanations_;
      return owner_.refusal;
    }
    Caller describeCaller() const override {
      if (owner_.hasNoMemoryToDescribe) throw std::bad_alloc();
      return owner_.described;
    }

   private:
    FakeTaskSecurity& owner_;
    const AuditToken caller_;
  };

  mutable std::mutex mutex_;
  std::map<Key, std::map<std::string, SecurityTask::Answer>> held_;
  int tasksWanted_ = 0;
  int questions_ = 0;
  int explanations_ = 0;
};

}  // namespace brenvik

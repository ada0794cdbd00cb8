// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "helper/entitlement/EntitlementCheck.h"

#include <algorithm>
#include <map>
#include <mutex>
#include <optional>
#include <string>
#include <utility>

namespace brenvik {
namespace {

struct Grant {
  std::string name;
  std::uint32_t pidVersion;
  std::shared_ptr<const LogCaller> described;  // null when memory was lacking
};

// Null without memory: a line then lacks its fields, and that is all.
std::shared_ptr<const LogCaller> describeCaller(const AuditToken& caller, const SecurityTask* task) noexcept
    try {
  LogCaller described{caller.pid(), caller.uid(), {}, {}};
  if (task != nullptr) {
    auto facts = task->describeCaller();
    described.executable = std::move(facts.executable);
    described.unit = std::move(facts.unit);
  }
  return std::make_shared<const LogCaller>(std::move(described));
} catch (...) {
  return nullptr;
}

}  // namespace

struct EntitlementCheck::State {
  struct Containers {
    std::multimap<pid_t, Grant> grants;
    std::map<pid_t, std::shared_ptr<ProcessExitSource>> watchers;
  };

  // The process has exited. Runs as the watcher's own handler, and ends that watcher.
  void evict(pid_t pid) noexcept {
    const std::lock_guard lock(mutex);
    if (!containers) return;
    containers->grants.erase(pid);
    const auto watcher = containers->watchers.find(pid);
    if (watcher == containers->watchers.end()) return;
    watcher->second->cancel();
    containers->watchers.erase(watcher);
  }

  // Not held while the security service is asked: a slow answer for one caller would keep exits waiting.
  mutable std::mutex mutex;
  std::optional<Containers> containers{std::in_place};  // none after the teardown
};

EntitlementCheck::EntitlementCheck(TaskSecurity& security, WorkQueues& queues, RefusalLog::Clock now)
    : security_(security), queues_(queues), state_(std::make_shared<State>()), refusals_(std::move(now)) {}

std::chrono::nanoseconds EntitlementCheck::steadyTime() {
  return std::chrono::steady_clock::now().time_since_epoch();
}

EntitlementCheck::~EntitlementCheck() { tearDown(); }

bool EntitlementCheck::HasEntitlement(std::string_view name, const AuditToken& caller) noexcept {
  const pid_t pid = caller.pid();
  {
    const std::lock_guard lock(state_->mutex);
    if (state_->containers) {
      const auto [first, last] = state_->containers->grants.equal_range(pid);
      // The version must be the same, too: a process may get the id of one that has exited and ask before the
      // exit handler has run, and must not live on its predecessor's grant.
      const bool known = std::any_of(first, last, [&](const auto& entry) {
        return entry.second.name == name && entry.second.pidVersion == caller.pidVersion();
      });
      if (known) return true;
    }
  }
  const auto task = security_.makeTask(caller);
  const auto described = describeCaller(caller, task.get());
  const LogContext context{described, LogScope::current().routine};
  const LogScope scope(context);
  const SecurityTask::Answer answer = task != nullptr ? task->copyEntitlement(name) : SecurityTask::Answer{};
  const bool isGranted = !answer.error && answer.value.asBoolean() == true;
  try {
    if (isGranted) {
      remember(name, caller, described);
    } else if (described != nullptr) {
      refusals_.refused(*described, std::string(name).c_str(), [&] {
        return task != nullptr ? task->explainRefusal(name) : security_.explainNoTask(caller);
      });
    }
  } catch (...) {
    // Out of memory: refused without a line, or granted all the same; the next question is asked afresh.
    state_->evict(pid);
  }
  return isGranted;
}

std::shared_ptr<const LogCaller> EntitlementCheck::describe(const AuditToken& caller) const noexcept {
  const std::lock_guard lock(state_->mutex);
  if (!state_->containers) return nullptr;
  const auto [first, last] = state_->containers->grants.equal_range(caller.pid());
  const auto grant = std::find_if(
      first, last, [&](const auto& entry) { return entry.second.pidVersion == caller.pidVersion(); });
  return grant == last ? nullptr : grant->second.described;
}

void EntitlementCheck::remember(std::string_view name, const AuditToken& caller,
                                std::shared_ptr<const LogCaller> described) {
  const pid_t pid = caller.pid();
  std::shared_ptr<ProcessExitSource> source;
  {
    const std::lock_guard lock(state_->mutex);
    if (!state_->containers) return;
    auto& [grants, watchers] = *state_->containers;
    if (!grants.contains(pid)) {
      // No cancel handler: the source goes with its entry.
      source = queues_.makeProcessExitSource(pid, caller.pidVersion(),
                                             [weak = std::weak_ptr<State>(state_), pid] {
                                               if (const auto state = weak.lock()) state->evict(pid);
                                             },
                                             {});
    }
    if (source != nullptr) watchers.insert_or_assign(pid, source);
    grants.emplace(pid, Grant{std::string(name), caller.pidVersion(), std::move(described)});
  }
  if (source == nullptr) return;
  // Without the lock: a process that has exited by now is told of at once, and where the telling cannot be
  // posted it happens within this very call. Evicted or torn down meanwhile, the source is cancelled, and
  // this does nothing.
  source->activate();
}

void EntitlementCheck::tearDown() noexcept {
  refusals_.flush();
  const std::lock_guard lock(state_->mutex);
  if (!state_->containers) return;
  for (const auto& [pid, source] : state_->containers->watchers) source->cancel();
  state_->containers.reset();
}

std::size_t EntitlementCheck::grants() const noexcept {
  const std::lock_guard lock(state_->mutex);
  return state_->containers ? state_->containers->grants.size() : 0;
}

std::size_t EntitlementCheck::watchers() const noexcept {
  const std::lock_guard lock(state_->mutex);
  return state_->containers ? state_->containers->watchers.size() : 0;
}

}  // namespace brenvik

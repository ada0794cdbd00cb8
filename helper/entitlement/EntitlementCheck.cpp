// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "helper/entitlement/EntitlementCheck.h"

#include <algorithm>
#include <map>
#include <mutex>
#include <optional>
#include <string>

namespace brenvik {
namespace {

struct Grant {
  std::string name;
  std::uint32_t pidVersion;
};

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

EntitlementCheck::EntitlementCheck(TaskSecurity& security, WorkQueues& queues)
    : security_(security), queues_(queues), state_(std::make_shared<State>()) {}

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
  {
    const auto task = security_.makeTask(caller);
    if (task == nullptr) return false;
    const SecurityTask::Answer answer = task->copyEntitlement(name);
    if (answer.error || answer.value.asBoolean() != true) return false;
  }
  try {
    remember(name, caller);
  } catch (...) {
    // Out of memory: granted all the same; the next question is asked afresh.
  }
  return true;
}

void EntitlementCheck::remember(std::string_view name, const AuditToken& caller) {
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
    const auto grant = grants.emplace(pid, Grant{std::string(name), caller.pidVersion()});
    try {
      if (source != nullptr) watchers.insert_or_assign(pid, source);
    } catch (...) {
      grants.erase(grant);
      throw;
    }
  }
  if (source == nullptr) return;
  // Without the lock: a process that has exited by now is told of at once, and where the telling cannot be
  // posted it happens within this very call. Evicted or torn down meanwhile, the source is cancelled, and
  // this does nothing.
  try {
    source->activate();
  } catch (...) {
    state_->evict(pid);  // nobody would tell of its exit
  }
}

void EntitlementCheck::tearDown() noexcept {
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

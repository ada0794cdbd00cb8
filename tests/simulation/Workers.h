// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <cerrno>
#include <functional>
#include <map>
#include <memory>
#include <new>
#include <optional>
#include <string>
#include <string_view>
#include <utility>

#include "platform/base/Utf8.h"
#include "platform/contacts/ContactsChannelManager.h"
#include "platform/files/ArchiveCopier.h"
#include "platform/ipc/AuditToken.h"
#include "platform/log/Log.h"
#include "platform/security/TaskSecurity.h"
#include "platform/voicemail/VoicemailStore.h"

// The roles that a worker process plays for the helper, as the helper sees them: the worker can die. Each
// answers then what the real one does, which has already asked a second worker in vain. A worker that dies
// between two requests, or whose successor answers, shows nothing at these interfaces.
namespace brenvik::simulation {

// How the worker ends during the request under way, without an answer.
enum class WorkerEnd { none, beforeTheWork, afterTheWork };

// The store worker's tokens. They outlive the helper.
class SimulatedVoicemailStore final : public VoicemailStore {
 public:
  WorkerEnd end = WorkerEnd::none;

  void expectUse() noexcept override {}
  void setToken(const std::string* token) override {
    change([&] { token_ = token != nullptr ? std::optional(*token) : std::nullopt; });
  }
  void setTokenForKey(const std::string& key, const std::string& token) override {
    change([&] {
      std::string copy = token;
      tokens_[key].swap(copy);
    });
  }
  void removeAllRecords() override {
    change([&] { tokens_.clear(); });
  }
  std::optional<std::string> copyToken() override {
    return read([&] { return token_; });
  }
  std::optional<std::string> copyTokenForKey(const std::string& key) override {
    return read([&] {
      const auto found = tokens_.find(key);
      return found == tokens_.end() ? std::nullopt : std::optional(found->second);
    });
  }

 private:
  static constexpr const char* kNotWritten = "The voicemail store could not be written";
  static constexpr const char* kNotRead = "The voicemail store could not be read";

  template <class Work>
  void change(Work work) try {
    if (end != WorkerEnd::beforeTheWork) work();
    if (end != WorkerEnd::none) logUnified(LogLevel::error, "%s", kNotWritten);
  } catch (const std::bad_alloc&) {
    logUnified(LogLevel::error, "%s", kNotWritten);
    throw;
  }
  template <class Work>
  std::optional<std::string> read(Work work) try {
    if (end == WorkerEnd::none) return work();
    logUnified(LogLevel::error, "%s", kNotRead);
    return std::nullopt;
  } catch (const std::bad_alloc&) {
    logUnified(LogLevel::error, "%s", kNotRead);
    throw;
  }

  std::optional<std::string> token_;
  std::map<std::string, std::string> tokens_;
};

// Which channel each contact is bound to, by the contact. The same worker keeps them.
using ContactChannels = std::map<int, std::string>;

class SimulatedContacts final : public ContactsService {
 public:
  ContactChannels channels;
  bool isReachable = true;
  std::optional<std::string> failWith;
  WorkerEnd end = WorkerEnd::none;

  std::unique_ptr<ContactsChannelManager> makeChannelManager() override {
    return isReachable ? std::make_unique<Manager>(*this) : nullptr;
  }

 private:
  class Manager final : public ContactsChannelManager {
   public:
    explicit Manager(SimulatedContacts& contacts) noexcept : contacts_(contacts) {}
    bool remapChannelIdentifier(std::string_view from, std::string_view to,
                                std::optional<std::string>* error) noexcept override try {
      if (contacts_.end != WorkerEnd::beforeTheWork) {
        *error = isValidUtf8(from) && isValidUtf8(to) ? contacts_.failWith : "not UTF-8";
        if (!error->has_value()) contacts_.remap(from, to);
      }
      if (contacts_.end != WorkerEnd::none) *error = "the contacts could not be reached";
      return !error->has_value();
    } catch (const std::bad_alloc&) {
      error->reset();  // it needs memory, too
      return false;
    }

   private:
    SimulatedContacts& contacts_;
  };

  // All or none, as in one transaction.
  void remap(std::string_view from, std::string_view to) {
    ContactChannels changed = channels;
    for (auto& [contact, channel] : changed) {
      if (channel == from) channel = to;
    }
    channels.swap(changed);
  }
};

// The archive reader. One that dies after the end of the archive was heard from has done its work.
struct SimulatedArchives {
  std::optional<int> fatalError;
  int result = 0;
  WorkerEnd end = WorkerEnd::none;
  int living = 0;

  inline ArchiveCopierFactory factory();
};

class SimulatedArchiveCopier final : public ArchiveCopier {
 public:
  explicit SimulatedArchiveCopier(SimulatedArchives& archives) noexcept : archives_(archives) {
    ++archives_.living;
  }
  SimulatedArchiveCopier(const SimulatedArchiveCopier&) = delete;
  SimulatedArchiveCopier& operator=(const SimulatedArchiveCopier&) = delete;
  ~SimulatedArchiveCopier() override { --archives_.living; }

  void setFileErrorHandler(std::function<int(const ArchiveFileError&)>) override {}
  void setFatalErrorHandler(std::function<void(int)> handler) override { onFatalError_ = std::move(handler); }
  int copy(const std::string&, const std::string&, const PropertyList&) noexcept override {
    const bool hasDied = archives_.end == WorkerEnd::beforeTheWork;
    const auto fatal = hasDied ? std::optional(EPIPE) : archives_.fatalError;
    if (fatal && onFatalError_) onFatalError_(*fatal);
    return hasDied ? EPIPE : archives_.result;
  }

 private:
  SimulatedArchives& archives_;
  std::function<void(int)> onFatalError_;
};

inline ArchiveCopierFactory SimulatedArchives::factory() {
  return [this] { return std::make_unique<SimulatedArchiveCopier>(*this); };
}

// The caller worker. Without it nothing is known of a caller: no task is made, or, if it dies later, the task
// has no value.
class SimulatedSecurity final : public TaskSecurity {
 public:
  WorkerEnd end = WorkerEnd::none;
  // What a process that runs now holds; nothing if it does not run.
  std::function<std::optional<SecurityTask::Answer>(const AuditToken& caller)> holds;

  std::unique_ptr<SecurityTask> makeTask(const AuditToken& caller) noexcept override try {
    if (end == WorkerEnd::beforeTheWork || !holds(caller)) return nullptr;
    return std::make_unique<Task>(*this, caller);
  } catch (const std::bad_alloc&) {
    return nullptr;
  }
  std::string explainNoTask(const AuditToken&) noexcept override { return "it has ended"; }

 private:
  class Task final : public SecurityTask {
   public:
    Task(SimulatedSecurity& owner, const AuditToken& caller) noexcept : owner_(owner), caller_(caller) {}
    Answer copyEntitlement(std::string_view name) noexcept override try {
      if (owner_.end != WorkerEnd::none || name != "com.norvale.Teravox.BrenvikHelper.allow") return {};
      return owner_.holds(caller_).value_or(Answer());
    } catch (const std::bad_alloc&) {
      return {{}, true};
    }
    std::string explainRefusal(std::string_view) noexcept override { return "no file"; }
    Caller describeCaller() const override { return {"/usr/libexec/program", "program.service"}; }

   private:
    SimulatedSecurity& owner_;
    const AuditToken caller_;
  };
};

}  // namespace brenvik::simulation

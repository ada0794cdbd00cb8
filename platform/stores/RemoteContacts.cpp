// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/stores/RemoteContacts.h"

#include <fcntl.h>

#include <new>
#include <utility>

#include "platform/stores/StoreMessages.h"

namespace brenvik {
namespace {

using Clock = std::chrono::steady_clock;

class RemoteManager final : public ContactsChannelManager {
 public:
  RemoteManager(Worker& worker, Clock::time_point deadline) : worker_(worker), deadline_(deadline) {}

  // What the worker says of the folder. Without an answer it is `open`, and the remap will say what happened.
  stores::ContactsOutcome open(const UniqueFd& folder) {
    WorkerMessage message;
    message.kind = stores::kOpenContacts;
    UniqueFd copy(::fcntl(folder.get(), F_DUPFD_CLOEXEC, 0));
    if (!copy.isValid()) return stores::ContactsOutcome::outOfMemory;
    message.descriptors.push_back(std::move(copy));
    WorkerResult result = WorkerResult::closed;
    WorkerMessage answer;
    // A worker that dies is replaced once: nothing is changed yet.
    for (int attempt = 0; attempt < 2 && result == WorkerResult::closed; ++attempt) {
      result = worker_.open(static_cast<std::uint32_t>(stores::Work::contacts), &channel_);
      if (result != WorkerResult::done) break;
      result = channel_.send(message);
      if (result == WorkerResult::done) result = channel_.receive(&answer, deadline_);
      if (result == WorkerResult::closed) worker_.giveUp(&channel_);
    }
    if (result == WorkerResult::done) {
      if (const auto outcome = stores::decodeContactsOutcome(answer)) return *outcome;
      channel_.discard(&answer);
      result = WorkerResult::malformed;
    }
    if (result == WorkerResult::outOfMemory) {
      channel_.close();
      return stores::ContactsOutcome::outOfMemory;
    }
    failWith(result);
    return stores::ContactsOutcome::open;
  }

  bool remapChannelIdentifier(std::string_view from, std::string_view to,
                              std::optional<std::string>* error) noexcept override {
    try {
      if (failure_ == nullptr) {
        WorkerMessage message = stores::encode(stores::RemapRequest{std::string(from), std::string(to)});
        WorkerResult result = channel_.send(message);
        if (result == WorkerResult::done) result = channel_.receive(&message, deadline_);
        if (result == WorkerResult::done) {
          if (auto answer = stores::decodeRemapAnswer(message)) {
            if (answer->error) *error = std::move(answer->error);
            return answer->done;
          }
          channel_.discard(&message);
          result = WorkerResult::malformed;
        }
        failWith(result);
      }
      *error = failure_;
    } catch (const std::bad_alloc&) {
      // The error stays absent: it needs memory, too. What the worker still says answers nothing any more.
      channel_.close();
      failure_ = "out of memory";
    }
    return false;
  }

 private:
  void failWith(WorkerResult result) noexcept {
    // A lack of memory is this process's own.
    if (result == WorkerResult::outOfMemory)
      channel_.close();
    else
      worker_.giveUp(&channel_);
    switch (result) {
      case WorkerResult::timedOut:
        failure_ = "the contacts did not answer in time";
        return;
      case WorkerResult::outOfMemory:
        failure_ = "out of memory";
        return;
      case WorkerResult::done:
      case WorkerResult::closed:
      case WorkerResult::full:
      case WorkerResult::malformed:
      case WorkerResult::unavailable:
        failure_ = "the contacts could not be reached";
        return;
    }
  }

  Worker& worker_;
  const Clock::time_point deadline_;
  WorkerChannel channel_;
  const char* failure_ = nullptr;  // why no remap can succeed
};

}  // namespace

std::unique_ptr<ContactsChannelManager> RemoteContacts::makeChannelManager() {
  auto manager = std::make_unique<RemoteManager>(worker_, Clock::now() + patience_);
  StoreFolder::Opened folder;
  const StoreFolder::State state = folder_.open(StoreFolder::IfMissing::fail, &folder);
  if (state == StoreFolder::State::outOfMemory) throw std::bad_alloc();
  if (state != StoreFolder::State::open) return nullptr;
  (void)folder_.prepare(folder);
  switch (manager->open(folder.descriptor)) {
    case stores::ContactsOutcome::open:
      return manager;
    case stores::ContactsOutcome::noDatabase:
      return nullptr;
    case stores::ContactsOutcome::outOfMemory:
      throw std::bad_alloc();
  }
  return nullptr;
}

}  // namespace brenvik

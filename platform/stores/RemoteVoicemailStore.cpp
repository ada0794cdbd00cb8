// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/stores/RemoteVoicemailStore.h"

#include <fcntl.h>
#include <sys/stat.h>

#include <new>
#include <utility>

#include "platform/log/Log.h"

namespace brenvik {

using stores::Operation;
using stores::VoicemailAnswer;
using stores::VoicemailOutcome;
using stores::VoicemailRequest;

// Sends the request, with the folder when the worker does not have it yet. A worker that has gone since the
// last request is replaced once: it has seen nothing of this one.
WorkerResult RemoteVoicemailStore::send(const VoicemailRequest& request, const StoreFolder::Opened& folder) {
  WorkerMessage message = stores::encode(request);
  for (int attempt = 0;; ++attempt) {
    const bool isNew = !channel_.isOpen() || !told_.descriptor.isValid() || !told_.isSameAs(folder);
    if (isNew) {
      (void)folder_.prepare(folder);
      message.descriptors.clear();
      UniqueFd copy(::fcntl(folder.descriptor.get(), F_DUPFD_CLOEXEC, 0));
      if (!copy.isValid()) return WorkerResult::outOfMemory;
      message.descriptors.push_back(std::move(copy));
    }
    if (!channel_.isOpen()) {
      const WorkerResult opened =
          worker_.open(static_cast<std::uint32_t>(stores::Work::voicemail), &channel_);
      if (opened != WorkerResult::done) return opened;
    }
    const WorkerResult sent = channel_.send(message);
    if (sent == WorkerResult::done) {
      if (isNew) {
        // Held, so that no other folder can have its numbers.
        told_ = {std::move(message.descriptors.back()), folder.device, folder.inode};
      }
      return sent;
    }
    if (sent == WorkerResult::outOfMemory) {
      channel_.close();
      return sent;
    }
    worker_.giveUp(&channel_);
    if (sent != WorkerResult::closed || attempt > 0) return sent;
  }
}

RemoteVoicemailStore::Result RemoteVoicemailStore::exchange(VoicemailRequest* request,
                                                            VoicemailAnswer* answer) {
  const auto deadline = Clock::now() + patience_;
  const auto ifMissing =
      stores::writes(request->operation) ? StoreFolder::IfMissing::create : StoreFolder::IfMissing::fail;
  StoreFolder::Opened folder;
  switch (folder_.open(ifMissing, &folder)) {
    case StoreFolder::State::open:
      break;
    case StoreFolder::State::missing:
      return ifMissing == StoreFolder::IfMissing::fail ? Result::done : Result::failed;
    case StoreFolder::State::unusable:
      return Result::failed;
    case StoreFolder::State::outOfMemory:
      return Result::outOfMemory;
  }
  bool isRepeated = false;
  for (;;) {
    const Received received = ask(request, folder, deadline, answer);
    // Whatever the worker was ended by; each operation is the same when it is done twice.
    if (received == Received::workerDied && !std::exchange(isRepeated, true)) continue;
    if (received == Received::outOfMemory) return Result::outOfMemory;
    if (received != Received::answer) return Result::failed;
    if (answer->outcome == VoicemailOutcome::outOfMemory) return Result::outOfMemory;
    if (answer->outcome != VoicemailOutcome::notAllowed) return Result::done;
    if (std::exchange(request->insists, true)) return Result::failed;
    (void)folder_.prepare(folder);  // somebody of root's has put a file there since
  }
}

// Asks once and waits for the answer.
RemoteVoicemailStore::Received RemoteVoicemailStore::ask(VoicemailRequest* request,
                                                         const StoreFolder::Opened& folder,
                                                         Clock::time_point deadline,
                                                         VoicemailAnswer* answer) {
  request->serial = ++serial_;
  const WorkerResult sent = send(*request, folder);
  if (sent != WorkerResult::done) {
    return sent == WorkerResult::outOfMemory ? Received::outOfMemory : Received::nothing;
  }
  WorkerMessage message;
  const WorkerResult received = channel_.receive(&message, deadline);
  if (received == WorkerResult::outOfMemory) {
    channel_.close();
    return Received::outOfMemory;
  }
  auto decoded = received == WorkerResult::done ? stores::decodeVoicemailAnswer(message) : std::nullopt;
  if (decoded && decoded->serial == request->serial) {
    *answer = std::move(*decoded);
    return Received::answer;
  }
  channel_.discard(&message);
  // Nobody would know what an answer that comes later answers.
  worker_.giveUp(&channel_);
  return received == WorkerResult::closed ? Received::workerDied : Received::nothing;
}

void RemoteVoicemailStore::expectUse() noexcept {
  if (std::exchange(isExpected_, true)) return;
  StoreFolder::Opened folder;
  struct stat info {};
  if (folder_.open(StoreFolder::IfMissing::fail, &folder) == StoreFolder::State::open &&
      ::fstatat(folder.descriptor.get(), stores::kVoicemailFile, &info, AT_SYMLINK_NOFOLLOW) == 0) {
    worker_.start();
  }
}

std::optional<std::string> RemoteVoicemailStore::perform(Operation operation, const std::string* key,
                                                         const std::string* token) {
  Result result = Result::outOfMemory;
  VoicemailAnswer answer;
  try {
    VoicemailRequest request;
    request.operation = operation;
    if (key != nullptr) request.key = *key;
    if (token != nullptr) request.token = *token;
    result = exchange(&request, &answer);
  } catch (const std::bad_alloc&) {
    // What the worker says now answers nothing any more. The lack is this process's own.
    channel_.close();
    answer = {};
  }
  const bool isToldByWorker =
      result == Result::outOfMemory && answer.outcome == VoicemailOutcome::outOfMemory;
  if (result != Result::done && !isToldByWorker) {
    if (stores::writes(operation))
      logUnified(LogLevel::error, "The voicemail store could not be written");
    else
      logUnified(LogLevel::error, "The voicemail store could not be read");
  }
  if (result == Result::outOfMemory) throw std::bad_alloc();
  return result == Result::done ? std::move(answer.token) : std::nullopt;
}

void RemoteVoicemailStore::setToken(const std::string* token) {
  perform(token == nullptr ? Operation::clearToken : Operation::setToken, nullptr, token);
}

void RemoteVoicemailStore::setTokenForKey(const std::string& key, const std::string& token) {
  perform(Operation::setTokenForKey, &key, &token);
}

void RemoteVoicemailStore::removeAllRecords() { perform(Operation::removeAllRecords, nullptr, nullptr); }

std::optional<std::string> RemoteVoicemailStore::copyToken() {
  return perform(Operation::readToken, nullptr, nullptr);
}

std::optional<std::string> RemoteVoicemailStore::copyTokenForKey(const std::string& key) {
  return perform(Operation::readTokenForKey, &key, nullptr);
}

}  // namespace brenvik

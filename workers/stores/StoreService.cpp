// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "workers/stores/StoreService.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <memory>
#include <new>
#include <utility>

#include "platform/contacts/linux/SqliteContacts.h"
#include "platform/stores/StoreMessages.h"
#include "platform/voicemail/linux/SqliteVoicemailStore.h"

namespace brenvik {
namespace {

using stores::Operation;
using stores::VoicemailAnswer;
using stores::VoicemailOutcome;
using stores::VoicemailRequest;

constexpr auto kForEver = std::chrono::steady_clock::time_point::max();

bool isFolder(int fd) noexcept {
  struct stat info {};
  return ::fstat(fd, &info) == 0 && S_ISDIR(info.st_mode);
}

class VoicemailService {
 public:
  // False when the request cannot be understood.
  bool serve(WorkerMessage& message, WorkerMessage* answer) {
    const auto request = stores::decodeVoicemailRequest(message);
    if (!request) return false;
    if (!message.descriptors.empty()) {
      if (!isFolder(message.descriptors[0].get())) return false;
      folder_ = std::move(message.descriptors[0]);
    }
    if (!folder_.isValid()) return false;
    VoicemailAnswer result = perform(*request);
    result.serial = request->serial;
    *answer = stores::encode(result);
    return true;
  }

 private:
  VoicemailAnswer perform(const VoicemailRequest& request) {
    if (!request.insists && isForbidden(request.operation))
      return {.outcome = VoicemailOutcome::notAllowed, .token = {}};
    try {
      return {.token = run(request)};
    } catch (const std::bad_alloc&) {
      return {.outcome = VoicemailOutcome::outOfMemory, .token = {}};
    }
  }

  std::optional<std::string> run(const VoicemailRequest& request) {
    switch (request.operation) {
      case Operation::setToken:
        store_.setToken(&request.token);
        break;
      case Operation::clearToken:
        store_.setToken(nullptr);
        break;
      case Operation::setTokenForKey:
        store_.setTokenForKey(request.key, request.token);
        break;
      case Operation::removeAllRecords:
        store_.removeAllRecords();
        break;
      case Operation::readToken:
        return store_.copyToken();
      case Operation::readTokenForKey:
        return store_.copyTokenForKey(request.key);
    }
    return std::nullopt;
  }

  bool isForbidden(Operation operation) const noexcept {
    const auto mayNot = [this](const char* name, int how) {
      return ::faccessat(folder_.get(), name, how, AT_EACCESS) != 0 && (errno == EACCES || errno == EPERM);
    };
    return mayNot(stores::kVoicemailFile, R_OK | W_OK) ||
           (stores::writes(operation) && mayNot(".", W_OK | X_OK));
  }

  UniqueFd folder_;
  SqliteVoicemailStore store_{[this](SqliteVoicemailStore::Purpose) { return folder_.get(); }};
};

class RemapService {
 public:
  bool serve(WorkerMessage& message, WorkerMessage* answer) {
    if (manager_ == nullptr) return open(message, answer);
    const auto request = stores::decodeRemapRequest(message);
    if (!request) return false;
    stores::RemapAnswer result;
    result.done = manager_->remapChannelIdentifier(request->from, request->to, &result.error);
    *answer = stores::encode(result);
    return true;
  }

 private:
  bool open(WorkerMessage& message, WorkerMessage* answer) {
    if (message.kind != stores::kOpenContacts || !message.payload.empty() ||
        message.descriptors.size() != 1 || !isFolder(message.descriptors[0].get())) {
      return false;
    }
    folder_ = std::move(message.descriptors[0]);
    auto outcome = stores::ContactsOutcome::outOfMemory;
    try {
      manager_ = contacts_.makeChannelManager();
      outcome = manager_ != nullptr ? stores::ContactsOutcome::open : stores::ContactsOutcome::noDatabase;
    } catch (const std::bad_alloc&) {  // is the answer
    }
    *answer = stores::encode(outcome);
    return true;
  }

  UniqueFd folder_;
  SqliteContacts contacts_{[this] { return folder_.get(); }};
  std::unique_ptr<ContactsChannelManager> manager_;
};

template <class Service>
void serveWith(WorkerChannel& channel) {
  Service service;
  WorkerMessage message;
  WorkerMessage answer;
  while (channel.receive(&message, kForEver) == WorkerResult::done && service.serve(message, &answer) &&
         channel.send(answer) == WorkerResult::done) {
  }
}

}  // namespace

void serveStore(std::uint32_t work, WorkerChannel channel) noexcept {
  try {
    switch (static_cast<stores::Work>(work)) {
      case stores::Work::voicemail:
        return serveWith<VoicemailService>(channel);
      case stores::Work::contacts:
        return serveWith<RemapService>(channel);
    }
  } catch (const std::bad_alloc&) {  // hanging up is the answer
  }
}

}  // namespace brenvik

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <chrono>
#include <cstdint>
#include <optional>
#include <string>

#include "platform/stores/StoreFolder.h"
#include "platform/stores/StoreMessages.h"
#include "platform/voicemail/VoicemailStore.h"
#include "platform/worker/Worker.h"

namespace brenvik {

// The voicemail store, kept by the store worker. The folder is looked for here with each operation, and the
// worker gets its descriptor; it is made for "mobile" by the first change. A worker that is too late is given
// up, and the operation has failed like one of the store's.
class RemoteVoicemailStore final : public VoicemailStore {
 public:
  // How long an operation is waited for: the second that the store itself takes at most for other processes
  // and their statements, and what the disk takes.
  static constexpr std::chrono::milliseconds kPatience{1500};

  // Both outlive this object.
  RemoteVoicemailStore(Worker& worker, StoreFolder& folder, std::chrono::milliseconds patience = kPatience)
      : worker_(worker), folder_(folder), patience_(patience) {}

  void setToken(const std::string* token) override;
  void setTokenForKey(const std::string& key, const std::string& token) override;
  void removeAllRecords() override;
  std::optional<std::string> copyToken() override;
  std::optional<std::string> copyTokenForKey(const std::string& key) override;

 private:
  using Clock = std::chrono::steady_clock;
  enum class Result { done, failed, outOfMemory };
  std::optional<std::string> perform(stores::Operation operation, const std::string* key,
                                     const std::string* token);
  Result exchange(stores::VoicemailRequest* request, stores::VoicemailAnswer* answer);
  enum class Received { answer, nothing, workerDied, outOfMemory };
  Received ask(stores::VoicemailRequest* request, const StoreFolder::Opened& folder,
               Clock::time_point deadline, stores::VoicemailAnswer* answer);
  WorkerResult send(const stores::VoicemailRequest& request, const StoreFolder::Opened& folder);

  Worker& worker_;
  StoreFolder& folder_;
  const std::chrono::milliseconds patience_;
  WorkerChannel channel_;
  std::uint32_t serial_ = 0;
  StoreFolder::Opened told_;  // the folder that the worker works in
};

}  // namespace brenvik

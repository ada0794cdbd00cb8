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

// The voicemail store, which the store worker keeps. Each operation looks for the folder here and sends the
// worker its descriptor; the first change makes the folder for "mobile". If the worker misses its deadline,
// it is given up, and the operation counts as a failure of the store.
class RemoteVoicemailStore final : public VoicemailStore {
 public:
  // The time limit of an operation: at most one second that the store takes for other processes and their
  // statements, and the time that the disk takes.
  static constexpr std::chrono::milliseconds kPatience{1500};

  // Both must outlive this object.
  RemoteVoicemailStore(Worker& worker, StoreFolder& folder, std::chrono::milliseconds patience = kPatience)
      : worker_(worker), folder_(folder), patience_(patience) {}

  // If there is a store, whatever it holds, starts the worker.
  void expectUse() noexcept override;
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
  bool isExpected_ = false;
  StoreFolder::Opened told_;  // the folder that the worker works in
};

}  // namespace brenvik

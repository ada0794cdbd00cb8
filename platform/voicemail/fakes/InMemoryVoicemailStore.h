// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <map>
#include <optional>
#include <string>
#include <vector>

#include "platform/voicemail/VoicemailStore.h"

namespace brenvik {

// A store that forgets everything with the object, and remembers in which order it was used.
class InMemoryVoicemailStore final : public VoicemailStore {
 public:
  std::vector<std::string> calls;  // names of the operations

  bool exhausted = false;  // there is no memory
  int failures = 0;        // for so many operations there will be none

  bool setToken(const std::string* token) noexcept override {
    calls.push_back(token == nullptr ? "clearToken" : "setToken");
    if (fails()) return false;
    token_ = token == nullptr ? std::nullopt : std::optional(*token);
    return true;
  }
  bool setTokenForKey(const std::string& key, const std::string& token) noexcept override {
    calls.push_back("setTokenForKey");
    if (fails()) return false;
    tokens_[key] = token;
    return true;
  }
  bool removeAllRecords() noexcept override {
    calls.push_back("removeAllRecords");
    if (fails()) return false;
    tokens_.clear();
    return true;
  }
  bool readToken(std::optional<std::string>* token) noexcept override {
    calls.push_back("readToken");
    const bool failed = fails();
    *token = failed ? std::nullopt : token_;
    return !failed;
  }
  bool readTokenForKey(const std::string& key, std::optional<std::string>* token) noexcept override {
    calls.push_back("readTokenForKey");
    const auto found = tokens_.find(key);
    const bool failed = fails();
    *token = failed || found == tokens_.end() ? std::nullopt : std::optional(found->second);
    return !failed;
  }

 private:
  bool fails() noexcept {
    if (exhausted) return true;
    if (failures == 0) return false;
    --failures;
    return true;
  }

  std::optional<std::string> token_;
  std::map<std::string, std::string> tokens_;
};

}  // namespace brenvik

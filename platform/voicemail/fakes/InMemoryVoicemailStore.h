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

  bool setToken(const std::string* token) noexcept override {
    calls.push_back(token == nullptr ? "clearToken" : "setToken");
    if (!exhausted) token_ = token == nullptr ? std::nullopt : std::optional(*token);
    return !exhausted;
  }
  bool setTokenForKey(const std::string& key, const std::string& token) noexcept override {
    calls.push_back("setTokenForKey");
    if (!exhausted) tokens_[key] = token;
    return !exhausted;
  }
  bool removeAllRecords() noexcept override {
    calls.push_back("removeAllRecords");
    if (!exhausted) tokens_.clear();
    return !exhausted;
  }
  bool readToken(std::optional<std::string>* token) noexcept override {
    calls.push_back("readToken");
    *token = exhausted ? std::nullopt : token_;
    return !exhausted;
  }
  bool readTokenForKey(const std::string& key, std::optional<std::string>* token) noexcept override {
    calls.push_back("readTokenForKey");
    const auto found = tokens_.find(key);
    *token = exhausted || found == tokens_.end() ? std::nullopt : std::optional(found->second);
    return !exhausted;
  }

 private:
  std::optional<std::string> token_;
  std::map<std::string, std::string> tokens_;
};

}  // namespace brenvik

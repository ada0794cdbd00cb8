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

  void setToken(const std::string* token) noexcept override {
    calls.push_back(token == nullptr ? "clearToken" : "setToken");
    token_ = token == nullptr ? std::nullopt : std::optional(*token);
  }
  void setTokenForKey(const std::string& key, const std::string& token) noexcept override {
    calls.push_back("setTokenForKey");
    tokens_[key] = token;
  }
  void removeAllRecords() noexcept override {
    calls.push_back("removeAllRecords");
    tokens_.clear();
  }
  std::optional<std::string> copyToken() noexcept override {
    calls.push_back("copyToken");
    return token_;
  }
  std::optional<std::string> copyTokenForKey(const std::string& key) noexcept override {
    calls.push_back("copyTokenForKey");
    const auto found = tokens_.find(key);
    return found == tokens_.end() ? std::nullopt : std::optional(found->second);
  }

 private:
  std::optional<std::string> token_;
  std::map<std::string, std::string> tokens_;
};

}  // namespace brenvik

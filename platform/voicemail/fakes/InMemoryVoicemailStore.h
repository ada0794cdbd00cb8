// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <map>
#include <new>
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
  int expected = 0;        // how often expectUse() was called

  void expectUse() noexcept override { ++expected; }
  void setToken(const std::string* token) override {
    begin(token == nullptr ? "clearToken" : "setToken");
    token_ = token == nullptr ? std::nullopt : std::optional(*token);
  }
  void setTokenForKey(const std::string& key, const std::string& token) override {
    begin("setTokenForKey");
    tokens_[key] = token;
  }
  void removeAllRecords() override {
    begin("removeAllRecords");
    tokens_.clear();
  }
  std::optional<std::string> copyToken() override {
    begin("copyToken");
    return token_;
  }
  std::optional<std::string> copyTokenForKey(const std::string& key) override {
    begin("copyTokenForKey");
    const auto found = tokens_.find(key);
    return found == tokens_.end() ? std::nullopt : std::optional(found->second);
  }

 private:
  void begin(const char* call) {
    calls.emplace_back(call);
    if (!exhausted && failures == 0) return;
    if (!exhausted) --failures;
    throw std::bad_alloc();
  }

  std::optional<std::string> token_;
  std::map<std::string, std::string> tokens_;
};

}  // namespace brenvik

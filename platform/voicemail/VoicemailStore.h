// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <optional>
#include <string>

namespace brenvik {

// The voicemail store's access tokens: one general token, and further tokens by key. Texts are UTF-8 without
// NUL. Main thread; waits for another process that holds the store for about a second at most. Reports no
// failure: a store that cannot be opened has no tokens, and what cannot be written is dropped. What a setter
// stored before it returned survives a crash and a power cut. Throws nothing.
class VoicemailStore {
 public:
  virtual ~VoicemailStore() = default;

  // Null clears the general token.
  virtual void setToken(const std::string* token) noexcept = 0;
  virtual void setTokenForKey(const std::string& key, const std::string& token) noexcept = 0;
  // Removes the tokens of all keys.
  virtual void removeAllRecords() noexcept = 0;
  virtual std::optional<std::string> copyToken() noexcept = 0;
  virtual std::optional<std::string> copyTokenForKey(const std::string& key) noexcept = 0;
};

}  // namespace brenvik

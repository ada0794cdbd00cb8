// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <optional>
#include <string>

namespace brenvik {

// The voicemail store's access tokens: one general token, and further tokens by key. Texts are UTF-8 without
// NUL. Main thread; an operation waits for other processes and runs what they have put into the store for a
// second at most. A failure of the store is logged and not reported: one that cannot be opened has no tokens,
// and what cannot be written is dropped. What a setter stored before it returned survives a crash and a power
// cut. Throws nothing; each operation returns false when this process ran out of memory, and then nothing is
// known of the store, or nothing changed there.
class VoicemailStore {
 public:
  virtual ~VoicemailStore() = default;

  // Null clears the general token.
  virtual bool setToken(const std::string* token) noexcept = 0;
  virtual bool setTokenForKey(const std::string& key, const std::string& token) noexcept = 0;
  // Removes the tokens of all keys.
  virtual bool removeAllRecords() noexcept = 0;
  // The token, or none.
  virtual bool readToken(std::optional<std::string>* token) noexcept = 0;
  virtual bool readTokenForKey(const std::string& key, std::optional<std::string>* token) noexcept = 0;

  // For callers that treat "out of memory" like "no token".
  std::optional<std::string> copyToken() noexcept {
    std::optional<std::string> token;
    return readToken(&token) ? token : std::nullopt;
  }
  std::optional<std::string> copyTokenForKey(const std::string& key) noexcept {
    std::optional<std::string> token;
    return readTokenForKey(key, &token) ? token : std::nullopt;
  }
};

}  // namespace brenvik

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
// cut. All throw std::bad_alloc when memory did not suffice, here or in the store's worker; then nothing is
// known of the store, or nothing changed there.
class VoicemailStore {
 public:
  virtual ~VoicemailStore() = default;

  // Null clears the general token.
  virtual void setToken(const std::string* token) = 0;
  virtual void setTokenForKey(const std::string& key, const std::string& token) = 0;
  // Removes the tokens of all keys.
  virtual void removeAllRecords() = 0;
  // The token, or none.
  virtual std::optional<std::string> copyToken() = 0;
  virtual std::optional<std::string> copyTokenForKey(const std::string& key) = 0;
};

}  // namespace brenvik

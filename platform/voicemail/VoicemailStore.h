// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <optional>
#include <string>

namespace brenvik {

// The voicemail store's access tokens: one general token, and further tokens by key. Texts are UTF-8 without
// NUL. Main thread; an operation waits for other processes, and runs triggers that they have put into the
// store, for at most one second. Failures of the store are logged and not reported: a store that cannot be
// opened has no tokens, and a change that cannot be written is dropped. A change that a setter has stored
// survives a crash and a power cut. All throw std::bad_alloc if memory runs out, here or in the store's
// worker; then the tokens are unknown, or nothing was changed.
class VoicemailStore {
 public:
  virtual ~VoicemailStore() = default;

  // The store will probably be used soon: makes ready what its first use would wait for. Waits for nothing,
  // fails silently, and changes nothing in the store. Calls after the first one do nothing.
  virtual void expectUse() noexcept = 0;

  // Null clears the general token.
  virtual void setToken(const std::string* token) = 0;
  virtual void setTokenForKey(const std::string& key, const std::string& token) = 0;
  // Removes the tokens of all keys.
  virtual void removeAllRecords() = 0;
  // Returns the token, or nothing.
  virtual std::optional<std::string> copyToken() = 0;
  virtual std::optional<std::string> copyTokenForKey(const std::string& key) = 0;
};

}  // namespace brenvik

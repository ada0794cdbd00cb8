// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "helper/voicemail/VoicemailOperations.h"

#include <exception>
#include <optional>
#include <string>

#include "platform/base/Utf8.h"

namespace brenvik {
namespace {

// The field as text, or nothing when it is not UTF-8.
std::optional<std::string> textOf(char* field) {
  field[VoicemailOperations::kField - 1] = '\0';
  const std::string_view text = textOfField(field, VoicemailOperations::kField);
  return isValidUtf8(text) ? std::optional(std::string(text)) : std::nullopt;
}

// The conversion of a token that is longer or not text fails, and nobody looks at that: the field is empty.
void writeToken(const std::optional<std::string>& token, char* field) {
  field[0] = '\0';
  if (!token || token->size() >= VoicemailOperations::kField || !isValidUtf8(*token)) return;
  field[token->copy(field, token->size())] = '\0';
}

// The routines' own boundary: nothing is thrown past it. A text that there is no memory for could not be
// converted.
template <typename Work>
KernelReturn guarded(Work work) noexcept {
  try {
    return work();
  } catch (const std::exception&) {
    return kern::failure;
  }
}

// The status of a routine that takes a text, for which the store had memory or not.
KernelReturn codeFor(bool hadMemory) noexcept { return hadMemory ? kern::success : kern::failure; }

}  // namespace

KernelReturn VoicemailOperations::setVoicemailToken(PortName, char* token) noexcept {
  return guarded([&] {
    const std::optional<std::string> text = textOf(token);
    if (!text) return kern::failure;
    return codeFor(store_.setToken(&*text));
  });
}

KernelReturn VoicemailOperations::setVoicemailTokenForKey(PortName, char* key, char* token) noexcept {
  return guarded([&] {
    const std::optional<std::string> keyText = textOf(key);
    const std::optional<std::string> tokenText = textOf(token);
    if (!keyText || !tokenText) return kern::failure;
    return codeFor(store_.setTokenForKey(*keyText, *tokenText));
  });
}

KernelReturn VoicemailOperations::clearVoicemailToken(PortName) noexcept {
  (void)store_.setToken(nullptr);  // the routine has one status; the store logs what it could not do
  return kern::success;
}

KernelReturn VoicemailOperations::resetVoicemailStore(PortName) noexcept {
  // Each step by itself: when the first one fails, the records go all the same.
  (void)store_.setToken(nullptr);
  (void)store_.removeAllRecords();
  return kern::success;
}

KernelReturn VoicemailOperations::copyVoicemailTokenForKey(PortName, char* key, char* token) noexcept {
  return guarded([&] {
    const std::optional<std::string> keyText = textOf(key);
    if (!keyText) return kern::failure;
    std::optional<std::string> value;
    if (!store_.readTokenForKey(*keyText, &value)) return kern::failure;
    writeToken(value, token);
    return kern::success;
  });
}

KernelReturn VoicemailOperations::copyVoicemailToken(PortName, char* token) noexcept {
  std::optional<std::string> value;
  (void)store_.readToken(&value);  // what cannot be read is absent, and the store logs it
  writeToken(value, token);
  return kern::success;
}

KernelReturn VoicemailOperations::isVoicemailServiceSubscribed(PortName, std::uint8_t* subscribed) noexcept {
  return guarded([&] {
    std::call_once(lookedUp_, [this] { query_ = library_.lookUpSubscriptionQuery(); });
    *subscribed = query_ != nullptr && query_() ? 1 : 0;
    return kern::success;
  });
}

}  // namespace brenvik

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "helper/voicemail/VoicemailOperations.h"

#include <optional>
#include <string>

#include "platform/base/Guarded.h"
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

}  // namespace

KernelReturn VoicemailOperations::setVoicemailToken(PortName, char* token) noexcept {
  return guarded(kern::failure, [&] {
    const std::optional<std::string> text = textOf(token);
    if (!text) return kern::failure;
    store_.setToken(&*text);
    return kern::success;
  });
}

KernelReturn VoicemailOperations::setVoicemailTokenForKey(PortName, char* key, char* token) noexcept {
  return guarded(kern::failure, [&] {
    const std::optional<std::string> keyText = textOf(key);
    const std::optional<std::string> tokenText = textOf(token);
    if (!keyText || !tokenText) return kern::failure;
    store_.setTokenForKey(*keyText, *tokenText);
    return kern::success;
  });
}

KernelReturn VoicemailOperations::clearVoicemailToken(PortName) noexcept {
  // The routine has one status; the store logs what it could not do.
  return guarded(kern::success, [&] {
    store_.setToken(nullptr);
    return kern::success;
  });
}

KernelReturn VoicemailOperations::resetVoicemailStore(PortName port) noexcept {
  // Each step by itself: when the first one fails, the records go all the same.
  (void)clearVoicemailToken(port);
  return guarded(kern::success, [&] {
    store_.removeAllRecords();
    return kern::success;
  });
}

KernelReturn VoicemailOperations::copyVoicemailTokenForKey(PortName, char* key, char* token) noexcept {
  return guarded(kern::failure, [&] {
    const std::optional<std::string> keyText = textOf(key);
    if (!keyText) return kern::failure;
    writeToken(store_.copyTokenForKey(*keyText), token);
    return kern::success;
  });
}

KernelReturn VoicemailOperations::copyVoicemailToken(PortName, char* token) noexcept {
  // A token that cannot be read counts as absent, and the store logs it.
  token[0] = '\0';
  return guarded(kern::success, [&] {
    writeToken(store_.copyToken(), token);
    return kern::success;
  });
}

KernelReturn VoicemailOperations::isVoicemailServiceSubscribed(PortName, std::uint8_t* subscribed) noexcept {
  return guarded(kern::failure, [&] {
    std::call_once(lookedUp_, [this] { query_ = library_.lookUpSubscriptionQuery(); });
    *subscribed = query_ != nullptr && query_() ? 1 : 0;
    if (*subscribed != 0) store_.expectUse();
    return kern::success;
  });
}

}  // namespace brenvik

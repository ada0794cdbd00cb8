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

// The routines' own boundary: nothing is thrown past it.
template <typename Work>
KernelReturn guarded(Work work) noexcept {
  try {
    return work();
  } catch (const std::exception&) {
    return kern::resourceShortage;
  }
}

// What the store says, of its operations or of one of them.
KernelReturn codeFor(bool hadMemory) noexcept { return hadMemory ? kern::success : kern::resourceShortage; }

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
  return codeFor(store_.setToken(nullptr));
}

KernelReturn VoicemailOperations::resetVoicemailStore(PortName) noexcept {
  return codeFor(store_.setToken(nullptr) && store_.removeAllRecords());
}

KernelReturn VoicemailOperations::copyVoicemailTokenForKey(PortName, char* key, char* token) noexcept {
  return guarded([&] {
    const std::optional<std::string> keyText = textOf(key);
    if (!keyText) return kern::failure;
    std::optional<std::string> value;
    if (!store_.readTokenForKey(*keyText, &value)) return kern::resourceShortage;
    writeToken(value, token);
    return kern::success;
  });
}

KernelReturn VoicemailOperations::copyVoicemailToken(PortName, char* token) noexcept {
  std::optional<std::string> value;
  if (!store_.readToken(&value)) return kern::resourceShortage;
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

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <cstddef>
#include <cstdint>
#include <mutex>

#include "interface/Wire.h"
#include "platform/voicemail/VisualVoicemail.h"
#include "platform/voicemail/VoicemailStore.h"

namespace brenvik {

// The requests that set, clear and read the tokens of the voicemail store. Keys and tokens are fields of
// kField bytes; the last byte of a field of the request is overwritten with a NUL. Status 0, or 5 when a text
// is not valid UTF-8; then the store is not called. 5 as well from a routine that takes a text, when there is
// no memory for it. What the store could not do is told by its log lines only. The port is not used. Main
// thread; nothing throws.
class VoicemailOperations {
 public:
  static constexpr std::size_t kField = 256;

  // References must outlive the object. One object a process: it looks the subscription query up once.
  VoicemailOperations(VoicemailStore& store, VisualVoicemailLibrary& library)
      : store_(store), library_(library) {}

  KernelReturn setVoicemailToken(PortName port, char* token) noexcept;
  KernelReturn setVoicemailTokenForKey(PortName port, char* key, char* token) noexcept;
  KernelReturn clearVoicemailToken(PortName port) noexcept;
  // The general token first, then the records; the second also when the first failed.
  KernelReturn resetVoicemailStore(PortName port) noexcept;

  // Write the token and a NUL into the reply's field; an empty text when there is none or it does not fit.
  KernelReturn copyVoicemailTokenForKey(PortName port, char* key, char* token) noexcept;
  KernelReturn copyVoicemailToken(PortName port, char* token) noexcept;

  // 1 or 0; 0 as well when the system has no visual voicemail.
  KernelReturn isVoicemailServiceSubscribed(PortName port, std::uint8_t* subscribed) noexcept;

 private:
  VoicemailStore& store_;
  VisualVoicemailLibrary& library_;
  std::once_flag lookedUp_;
  SubscriptionQuery query_ = nullptr;
};

}  // namespace brenvik

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

// The requests that set, clear and read the tokens of the voicemail store. Main thread; nothing throws.
//
// Keys and tokens are fields of kField bytes, UTF-8 with a NUL; the last byte of a field of the request is
// overwritten with a NUL. The port is not used.
//
// The statuses: kern::success (0); kern::failure (5) when a text is not valid UTF-8, and then the store is
// not called, or when memory does not suffice in a routine that takes a text. The routines without a text
// always return kern::success. No status tells what the store could not do; the store logs that.
class VoicemailOperations {
 public:
  static constexpr std::size_t kField = 256;

  // References must outlive the object. One object a process: it looks the subscription query up once.
  VoicemailOperations(VoicemailStore& store, VisualVoicemailLibrary& library)
      : store_(store), library_(library) {}

  // Set the general token, or the token of the key.
  KernelReturn setVoicemailToken(PortName port, char* token) noexcept;
  KernelReturn setVoicemailTokenForKey(PortName port, char* key, char* token) noexcept;
  // Removes the general token.
  KernelReturn clearVoicemailToken(PortName port) noexcept;
  // Removes the general token, then the tokens of all keys, the latter also when the former failed.
  KernelReturn resetVoicemailStore(PortName port) noexcept;

  // Write the token and a NUL into the reply's field of kField bytes; an empty text when there is no token,
  // it cannot be read, it is not valid UTF-8 or it does not fit. The field is left alone with kern::failure.
  KernelReturn copyVoicemailTokenForKey(PortName port, char* key, char* token) noexcept;
  KernelReturn copyVoicemailToken(PortName port, char* token) noexcept;

  // *subscribed: 1 or 0; 0 as well when the system has no visual voicemail.
  KernelReturn isVoicemailServiceSubscribed(PortName port, std::uint8_t* subscribed) noexcept;

 private:
  VoicemailStore& store_;
  VisualVoicemailLibrary& library_;
  std::once_flag lookedUp_;
  SubscriptionQuery query_ = nullptr;
};

}  // namespace brenvik

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
// A routine with a text returns kern::failure (5) if the text is not valid UTF-8, without calling the store,
// or if memory runs out. Otherwise, and for routines without a text, the status is kern::success (0). No
// status tells whether the store succeeded; the store logs its failures.
class VoicemailOperations {
 public:
  static constexpr std::size_t kField = 256;

  // References must outlive the object. Make one object per process: it looks up the subscription query once.
  VoicemailOperations(VoicemailStore& store, VisualVoicemailLibrary& library)
      : store_(store), library_(library) {}

  // Set the general token, or the token of the key.
  KernelReturn setVoicemailToken(PortName port, char* token) noexcept;
  KernelReturn setVoicemailTokenForKey(PortName port, char* key, char* token) noexcept;
  // Removes the general token.
  KernelReturn clearVoicemailToken(PortName port) noexcept;
  // Removes the general token, then, even if that failed, the tokens of all keys.
  KernelReturn resetVoicemailStore(PortName port) noexcept;

  // Write the token and a NUL into the reply's field of kField bytes; an empty text if there is no token, or
  // it cannot be read, is not valid UTF-8 or does not fit. With kern::failure the field is left alone.
  KernelReturn copyVoicemailTokenForKey(PortName port, char* key, char* token) noexcept;
  KernelReturn copyVoicemailToken(PortName port, char* token) noexcept;

  // Sets *subscribed to 1 or 0; 0 also if the system has no visual voicemail.
  KernelReturn isVoicemailServiceSubscribed(PortName port, std::uint8_t* subscribed) noexcept;

 private:
  VoicemailStore& store_;
  VisualVoicemailLibrary& library_;
  std::once_flag lookedUp_;
  SubscriptionQuery query_ = nullptr;
};

}  // namespace brenvik

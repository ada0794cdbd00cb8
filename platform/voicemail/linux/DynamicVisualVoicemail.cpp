// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/voicemail/linux/DynamicVisualVoicemail.h"

#include <dlfcn.h>

namespace brenvik {

SubscriptionQuery DynamicVisualVoicemail::lookUpSubscriptionQuery() noexcept {
  if (library_.empty()) return nullptr;  // to dlopen that names this program
  // Kept for the life of the process: the query may be called until its end.
  void* const library = ::dlopen(library_.c_str(), RTLD_LAZY | RTLD_LOCAL);
  if (library == nullptr) return nullptr;
  return reinterpret_cast<SubscriptionQuery>(::dlsym(library, symbol_.c_str()));
}

}  // namespace brenvik

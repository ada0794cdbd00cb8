// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/radio/linux/SdBus.h"

#include <dlfcn.h>

namespace brenvik {
namespace {

template <typename Function>
bool find(void* library, const char* name, Function& function) noexcept {
  function = reinterpret_cast<Function>(::dlsym(library, name));
  return function != nullptr;
}

}  // namespace

bool SdBus::load() noexcept {
  if (isLoaded_) return true;
  // Everything bound now: a symbol that is missing shows here and not in the middle of a call.
  void* const library = ::dlopen(library_, RTLD_NOW | RTLD_LOCAL | RTLD_NODELETE);
  if (library == nullptr) return false;
  isLoaded_ = find(library, "sd_bus_new", create) && find(library, "sd_bus_set_address", setAddress) &&
              find(library, "sd_bus_set_bus_client", setBusClient) && find(library, "sd_bus_start", start) &&
              find(library, "sd_bus_close_unref", closeUnref) &&
              find(library, "sd_bus_message_new_method_call", newMethodCall) &&
              find(library, "sd_bus_message_append", append) &&
              find(library, "sd_bus_message_set_auto_start", setAutoStart) &&
              find(library, "sd_bus_message_unref", unrefMessage) &&
              find(library, "sd_bus_call_async", callAsync) &&
              find(library, "sd_bus_slot_unref", unrefSlot) && find(library, "sd_bus_process", process) &&
              find(library, "sd_bus_wait", wait);
  (void)::dlclose(library);  // RTLD_NODELETE: what was found stays
  return isLoaded_;
}

}  // namespace brenvik

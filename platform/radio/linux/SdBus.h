// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <systemd/sd-bus.h>

namespace brenvik {

// The functions of sd-bus(3) that are used here. The first load() loads the library with dlopen(3), and it
// stays in the process. It depends on six others, which a process that never uses a bus does not need. One
// thread at a time.
class SdBus {
 public:
  // `library` is not copied; it must outlive the object.
  explicit SdBus(const char* library) noexcept : library_(library) {}

  // Returns false if the library or one of its functions cannot be loaded; then call none of them. The next
  // call tries again, since the cause may have been a lack of memory or descriptors. Reads files: not on the
  // main loop.
  bool load() noexcept;

  decltype(&::sd_bus_new) create = nullptr;
  decltype(&::sd_bus_set_address) setAddress = nullptr;
  decltype(&::sd_bus_set_bus_client) setBusClient = nullptr;
  decltype(&::sd_bus_start) start = nullptr;
  decltype(&::sd_bus_close_unref) closeUnref = nullptr;
  decltype(&::sd_bus_message_new_method_call) newMethodCall = nullptr;
  decltype(&::sd_bus_message_append) append = nullptr;
  decltype(&::sd_bus_message_set_auto_start) setAutoStart = nullptr;
  decltype(&::sd_bus_message_unref) unrefMessage = nullptr;
  decltype(&::sd_bus_call_async) callAsync = nullptr;
  decltype(&::sd_bus_slot_unref) unrefSlot = nullptr;
  decltype(&::sd_bus_process) process = nullptr;
  decltype(&::sd_bus_wait) wait = nullptr;

 private:
  const char* const library_;
  bool isLoaded_ = false;
};

}  // namespace brenvik

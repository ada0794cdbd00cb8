// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <systemd/sd-bus.h>

namespace brenvik {

// The functions of sd-bus(3) that are used here. The library is loaded (dlopen(3)) by the first load(), and
// stays in the process: it brings six others along, which a process that never speaks to a bus need not have.
// One thread at a time.
class SdBus {
 public:
  // `library` is kept, not copied.
  explicit SdBus(const char* library) noexcept : library_(library) {}

  // False when the library or one of its functions cannot be loaded: then none may be called. The next call
  // looks again, since only memory or descriptors may have been missing. Reads files: not on the main loop.
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

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <cstdint>
#include <functional>

#include "interface/Wire.h"
#include "platform/ipc/OutOfLinePayload.h"
#include "platform/ipc/RegionAllocator.h"
#include "platform/plist/PropertyList.h"
#include "platform/preferences/PreferencesStore.h"

namespace brenvik {

// Reads the file at the path as a dictionary property list; returns no value if it is missing, unreadable or
// not a dictionary. Keeps nothing between calls. May throw std::bad_alloc.
using DictionaryReader = std::function<PropertyList(const char* path)>;

// The routines that carry preference values and property-list files between the helper and its callers.
// Main loop only; keeps nothing between requests.
//
// Text arguments are the 256-byte fields of the request; the last byte of each is overwritten with a NUL.
// `port` is not used. The status is a kernel-style code: 5 on failure, also for a lack of memory; the
// allocator's code if it refuses the region of a payload. A payload is made only on success.
class PreferenceTransfer {
 public:
  // The references must outlive the object.
  PreferenceTransfer(PreferencesStore& preferences, RegionAllocator& regions, DictionaryReader readDictionary)
      : preferences_(preferences), regions_(regions), readDictionary_(std::move(readDictionary)) {}

  // Stores the property list serialized in these bytes (any format) under the key, for the current user on
  // any host. A single byte of any value removes the key. The caller still owns the bytes.
  KernelReturn setPreferenceValue(PortName port, char* domain, char* key, const void* valueBytes,
                                  std::uint32_t valueLength) noexcept;

  // Return the key's value, for the current user on any host or in application scope. A key without a value
  // is a success with an empty payload.
  KernelReturn copyPreferenceValue(PortName port, char* domain, char* key,
                                   OutOfLinePayload* payload) noexcept;
  KernelReturn copyAppPreferenceValue(PortName port, char* domain, char* key,
                                      OutOfLinePayload* payload) noexcept;

  // Returns the file's dictionary. Accepts any file that the helper can read; no path policy applies.
  KernelReturn loadPlistFile(PortName port, char* path, OutOfLinePayload* payload) noexcept;

 private:
  enum class Scope { currentUser, application };
  KernelReturn copyValue(Scope scope, char* domain, char* key, OutOfLinePayload* payload) noexcept;

  PreferencesStore& preferences_;
  RegionAllocator& regions_;
  const DictionaryReader readDictionary_;
};

}  // namespace brenvik

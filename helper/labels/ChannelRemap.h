// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <cstdint>

#include "interface/Wire.h"
#include "platform/contacts/ContactsChannelManager.h"

namespace brenvik {

// The request that lets contacts follow a line whose channel identifier changes. Main loop only.
class ChannelRemap {
 public:
  // The service must outlive the object.
  explicit ChannelRemap(ContactsService& contacts) noexcept : contacts_(contacts) {}

  // `from` and `to` are fields of 64 bytes that need not be terminated. Always kern::success; *success is 1
  // or 0.
  KernelReturn remapContactsChannel(const char* from, const char* to, std::uint8_t* success) noexcept;

  // Moves every contact's reference from one channel to the other. The texts are NUL-terminated. Returns true
  // if that was done, and also if the contacts cannot be reached.
  bool remapChannelIdentifier(const char* from, const char* to) noexcept;

 private:
  ContactsService& contacts_;
};

}  // namespace brenvik

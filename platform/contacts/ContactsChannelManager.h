// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <memory>
#include <optional>
#include <string>
#include <string_view>

namespace brenvik {

// The contacts service's view of channels: which contact is bound to which line. One object serves one
// request. Main loop only.
class ContactsChannelManager {
 public:
  virtual ~ContactsChannelManager() = default;

  // Moves every reference from one channel identifier to another, all of them or none. Returns true if they
  // were moved or there were none. On failure *error describes the cause in English; on success it is left
  // alone. A text that is not valid UTF-8 is a failure. May take seconds while another program writes.
  virtual bool remapChannelIdentifier(std::string_view from, std::string_view to,
                                      std::optional<std::string>* error) noexcept = 0;
};

// Makes managers. Main loop only.
class ContactsService {
 public:
  virtual ~ContactsService() = default;
  // Returns a new manager, or null if the contacts cannot be reached. Throws std::bad_alloc.
  virtual std::unique_ptr<ContactsChannelManager> makeChannelManager() = 0;
};

}  // namespace brenvik

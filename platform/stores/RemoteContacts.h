// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <chrono>

#include "platform/contacts/ContactsChannelManager.h"
#include "platform/stores/StoreFolder.h"
#include "platform/worker/Worker.h"

namespace brenvik {

// The contacts, changed by the store worker. A manager has a channel of its own, which gets the descriptor of
// the folder as it was found when the manager was made.
class RemoteContacts final : public ContactsService {
 public:
  // From the making of a manager on: the two seconds that it takes at most for other programs and their
  // statements, and the time for undoing what was written meanwhile.
  static constexpr std::chrono::milliseconds kPatience{3000};

  // Both outlive this object and its managers.
  RemoteContacts(Worker& worker, StoreFolder& folder, std::chrono::milliseconds patience = kPatience)
      : worker_(worker), folder_(folder), patience_(patience) {}

  // If the worker cannot be reached there is still a manager; its remap fails and says why. Null would mean
  // that there are no contacts.
  std::unique_ptr<ContactsChannelManager> makeChannelManager() override;

 private:
  Worker& worker_;
  StoreFolder& folder_;
  const std::chrono::milliseconds patience_;
};

}  // namespace brenvik

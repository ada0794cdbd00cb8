// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <chrono>

#include "platform/contacts/ContactsChannelManager.h"
#include "platform/stores/StoreFolder.h"
#include "platform/worker/Worker.h"

namespace brenvik {

// The contacts, which the store worker changes. Each manager has its own channel, and sends the worker the
// descriptor of the folder that was found when the manager was made.
class RemoteContacts final : public ContactsService {
 public:
  // The time limit from the construction of a manager: two seconds at most for other programs and their
  // statements, and the time for rolling back.
  static constexpr std::chrono::milliseconds kPatience{3000};

  // Both must outlive this object and its managers.
  RemoteContacts(Worker& worker, StoreFolder& folder, std::chrono::milliseconds patience = kPatience)
      : worker_(worker), folder_(folder), patience_(patience) {}

  // If the worker cannot be reached, it still returns a manager, whose remap fails and says why, because null
  // would mean that there are no contacts.
  std::unique_ptr<ContactsChannelManager> makeChannelManager() override;

 private:
  Worker& worker_;
  StoreFolder& folder_;
  const std::chrono::milliseconds patience_;
};

}  // namespace brenvik

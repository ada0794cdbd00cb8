// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/ipc/linux/RefusalLimit.h"

#include <algorithm>
#include <new>

namespace brenvik {

bool RefusalLimit::allows(uid_t account, Time now) const noexcept {
  const auto entry = paidUntil_.find(account);
  return entry == paidUntil_.end() || entry->second - now <= kOneMoreEvery * (kBurst - 1);
}

void RefusalLimit::refused(uid_t account, Time now) noexcept {
  if (paidUntil_.size() >= kMaxAccounts) {
    std::erase_if(paidUntil_, [now](const auto& entry) { return entry.second <= now; });
    if (paidUntil_.size() >= kMaxAccounts) paidUntil_.erase(paidUntil_.begin());
  }
  try {
    Time& paid = paidUntil_[account];
    paid = std::max(paid, now) + kOneMoreEvery;
  } catch (const std::bad_alloc&) {
    // Not counted: the next one is.
  }
}

}  // namespace brenvik

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <sys/types.h>

#include <memory>
#include <mutex>

#include "helper/mobile/CString.h"
#include "platform/accounts/AccountDirectory.h"

namespace brenvik {

// The "mobile" account, which owns the telephony daemon and user data. The first accessor called looks it up;
// the answer never changes afterwards. Any thread. If memory runs out, the accessor throws std::bad_alloc,
// and the next call looks the account up again.
class MobileUser {
 public:
  // `accounts` and `allocator` must outlive this object.
  explicit MobileUser(AccountDirectory& accounts,
                      CStringAllocator& allocator = defaultCStringAllocator()) noexcept;
  MobileUser(const MobileUser&) = delete;
  MobileUser& operator=(const MobileUser&) = delete;
  ~MobileUser();

  // The path of its home directory, without a trailing slash (except "/"); null if there is none. Valid as
  // long as this object lives.
  const char* homeDirectory();
  // 0 if there is no such account.
  uid_t uid();
  gid_t gid();

  // The process's one object. The first call makes it, with its `accounts`; it is never destroyed.
  static MobileUser& shared(AccountDirectory& accounts);

 private:
  void fillOnce();
  void fill();

  AccountDirectory& accounts_;
  CStringAllocator& allocator_;
  std::mutex mutex_;
  bool filled_ = false;
  char* homeDirectory_ = nullptr;
  uid_t uid_ = 0;
  gid_t gid_ = 0;
};

}  // namespace brenvik

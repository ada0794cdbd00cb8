// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <sys/types.h>

#include <memory>
#include <mutex>

#include "helper/mobile/CString.h"
#include "platform/accounts/AccountDirectory.h"

namespace brenvik {

// The "mobile" account, under which the telephony daemon and user data live. Looked up once, by whichever
// accessor is called first; the answer never changes afterwards. Any thread. A look-up that lacks memory
// throws std::bad_alloc and gives no answer; the next one is the first again.
class MobileUser {
 public:
  // `accounts` and `allocator` must outlive this object.
  explicit MobileUser(AccountDirectory& accounts,
                      CStringAllocator& allocator = defaultCStringAllocator()) noexcept;
  MobileUser(const MobileUser&) = delete;
  MobileUser& operator=(const MobileUser&) = delete;
  ~MobileUser();

  // The path of its home directory, without a trailing slash (but for "/"), or null when there is none: to be
  // treated as absent. Lives as long as this object.
  const char* homeDirectory();
  // 0 when there is no such account.
  uid_t uid();
  gid_t gid();

  // The process's one object, made on first use with the directory of that first call and never destroyed.
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

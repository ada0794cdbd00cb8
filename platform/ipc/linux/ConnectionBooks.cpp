// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/ipc/linux/ConnectionBooks.h"

namespace brenvik {

void ConnectionBooks::add(Entry& entry) {
  std::list<Entry*> all{&entry};
  std::list<Entry*> own{&entry};
  auto& account = accounts_[entry.account_];  // the last that can fail
  entry.inAll_ = all.begin();
  entry.inAccount_ = own.begin();
  entry.book_ = Entry::Book::strangers;
  strangers_.splice(strangers_.end(), all);
  account.splice(account.end(), own);
}

void ConnectionBooks::admit(Entry& entry) noexcept {
  if (entry.book_ != Entry::Book::strangers) return;
  const auto account = accounts_.find(entry.account_);
  account->second.erase(entry.inAccount_);
  if (account->second.empty()) accounts_.erase(account);
  admitted_.splice(admitted_.end(), strangers_, entry.inAll_);
  entry.book_ = Entry::Book::admitted;
}

void ConnectionBooks::remove(Entry& entry) noexcept {
  admit(entry);
  if (entry.book_ != Entry::Book::admitted) return;
  admitted_.erase(entry.inAll_);
  entry.book_ = Entry::Book::none;
}

ConnectionBooks::Entry* ConnectionBooks::overdueAfter(const Entry& entry) const noexcept {
  const auto account = accounts_.find(entry.account_);
  if (account != accounts_.end() && account->second.size() > kMaxStrangersPerAccount) {
    return account->second.front();
  }
  return strangers_.size() > kMaxStrangers ? strangers_.front() : nullptr;
}

ConnectionBooks::Entry* ConnectionBooks::overdueAdmitted() const noexcept {
  return admitted_.size() > kMaxAdmitted ? admitted_.front() : nullptr;
}

}  // namespace brenvik

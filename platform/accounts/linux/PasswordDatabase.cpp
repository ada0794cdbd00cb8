// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/accounts/linux/PasswordDatabase.h"

#include <cerrno>
#include <new>

#include "platform/base/PasswordEntry.h"

namespace brenvik {
namespace {

std::optional<PasswordEntry> entryOf(const char* name) {
  std::optional<PasswordEntry> entry;
  const int error = readPasswordEntry(name, &entry);
  if (error == ENOMEM || error == EMFILE || error == ENFILE) throw std::bad_alloc();
  return entry;
}

}  // namespace

std::optional<AccountIds> PasswordDatabase::idsOf(const char* name) {
  const auto entry = entryOf(name);
  return entry ? std::optional(AccountIds{entry->uid, entry->gid}) : std::nullopt;
}

std::optional<std::string> PasswordDatabase::homeDirectoryOf(const char* name) {
  auto entry = entryOf(name);
  return entry && !entry->home.empty() ? std::optional(std::move(entry->home)) : std::nullopt;
}

}  // namespace brenvik

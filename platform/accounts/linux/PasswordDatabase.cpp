// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/accounts/linux/PasswordDatabase.h"

#include <pwd.h>

#include <array>
#include <cerrno>
#include <new>
#include <vector>

namespace brenvik {
namespace {

// One line of /etc/passwd fits the first many times over; an entry beyond the second is not an account.
constexpr std::size_t kUsualEntry = 1024;
constexpr std::size_t kLargestEntry = std::size_t{1} << 20;

// Calls `use` with the entry of the account while it stands; false when there is none.
template <typename Use>
bool withEntry(const char* name, const Use& use) {
  std::array<char, kUsualEntry> usual;
  std::vector<char> larger;
  char* text = usual.data();
  std::size_t size = usual.size();
  for (;;) {
    passwd entry{};
    passwd* found = nullptr;
    errno = 0;
    const int error = ::getpwnam_r(name, &entry, text, size, &found);
    if (error == ERANGE && size < kLargestEntry) {
      larger.resize(size * 4);
      text = larger.data();
      size = larger.size();
      continue;
    }
    // A look-up that lacked memory may say that there is no such account; errno keeps the truth.
    if (found == nullptr && errno == ENOMEM) throw std::bad_alloc();
    if (error == ENOMEM || error == EMFILE || error == ENFILE) throw std::bad_alloc();
    if (error != 0 || found == nullptr) return false;
    use(*found);
    return true;
  }
}

}  // namespace

std::optional<AccountIds> PasswordDatabase::idsOf(const char* name) {
  std::optional<AccountIds> ids;
  withEntry(name, [&ids](const passwd& entry) { ids = AccountIds{entry.pw_uid, entry.pw_gid}; });
  return ids;
}

std::optional<std::string> PasswordDatabase::homeDirectoryOf(const char* name) {
  std::optional<std::string> home;
  withEntry(name, [&home](const passwd& entry) {
    if (entry.pw_dir != nullptr && *entry.pw_dir != '\0') home = entry.pw_dir;
  });
  return home;
}

}  // namespace brenvik

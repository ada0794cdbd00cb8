// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/base/PasswordEntry.h"

#include <pwd.h>

#include <array>
#include <cerrno>
#include <vector>

namespace brenvik {
namespace {

// One line of /etc/passwd fits the first many times over; an entry beyond the second is not an account.
constexpr std::size_t kUsualEntry = 1024;
constexpr std::size_t kLargestEntry = std::size_t{1} << 20;

template <typename LookUp>
int read(const LookUp& lookUp, std::optional<PasswordEntry>* entry) {
  entry->reset();
  std::array<char, kUsualEntry> usual;
  std::vector<char> larger;
  char* text = usual.data();
  std::size_t size = usual.size();
  for (;;) {
    passwd row{};
    passwd* found = nullptr;
    errno = 0;
    const int error = lookUp(&row, text, size, &found);
    if (error == ERANGE && size < kLargestEntry) {
      larger.resize(size * 4);
      text = larger.data();
      size = larger.size();
      continue;
    }
    // A look-up that lacked memory may say that there is no such account; errno keeps the truth.
    if (found == nullptr && errno == ENOMEM) return ENOMEM;
    if (error == 0 && found != nullptr) {
      *entry = {found->pw_uid, found->pw_gid, found->pw_dir != nullptr ? found->pw_dir : ""};
    }
    return error;
  }
}

}  // namespace

int readPasswordEntry(const char* name, std::optional<PasswordEntry>* entry) {
  return read([name](auto... where) { return ::getpwnam_r(name, where...); }, entry);
}

int readPasswordEntry(uid_t uid, std::optional<PasswordEntry>* entry) {
  return read([uid](auto... where) { return ::getpwuid_r(uid, where...); }, entry);
}

}  // namespace brenvik

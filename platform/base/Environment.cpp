// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/base/Environment.h"

#include <unistd.h>

#include <algorithm>
#include <string_view>

namespace brenvik {

void clearEnvironmentExcept(std::initializer_list<const char*> names) noexcept {
  if (environ == nullptr) return;
  char** kept = environ;
  for (char** each = environ; *each != nullptr; ++each) {
    const std::string_view entry(*each);
    // An entry without "=" has no name that anybody could look for.
    const std::string_view name = entry.substr(0, entry.find('='));
    const bool isKept = name.size() < entry.size() &&
                        std::any_of(names.begin(), names.end(), [name](const char* n) { return name == n; });
    if (isKept) *kept++ = *each;
  }
  *kept = nullptr;
}

}  // namespace brenvik

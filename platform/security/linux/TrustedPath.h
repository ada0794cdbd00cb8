// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <sys/stat.h>

#include <string>

namespace brenvik {

// Where a path leads, and whether only root can change that: every folder on the way and every link that is
// followed belongs to root, and no such folder may be written by group or others. A folder with the sticky
// bit may, because nobody can rename root's entries there.
struct TrustedPath {
  enum class Outcome {
    trusted,    // `facts` are of what stands at `place`; its own owner and mode are for the caller to judge
    untrusted,  // somebody else than root can change what stands at `place`
    missing,    // nothing can be reached there: `error` says why
    unknown,    // it cannot be found out now: `error` says why
  };
  Outcome outcome = Outcome::unknown;
  struct stat facts = {};
  std::string place;  // without links; of what is untrusted: the folder or link at fault
  int error = 0;
};

// `path` is absolute. Nothing but std::bad_alloc is thrown.
TrustedPath walkTrustedPath(const std::string& path);

// Whether only root can have made it and can change it.
bool isRootsAlone(const struct stat& facts) noexcept;

}  // namespace brenvik

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <sys/stat.h>

#include <string>

namespace brenvik {

// The target of a path, and whether only root can change it. That is so if root owns every folder on the path
// and every link that is followed, and neither group nor others may write to such a folder, unless it has the
// sticky bit, because then nobody can rename root's entries there.
struct TrustedPath {
  enum class Outcome {
    trusted,    // `facts` describe the item at `place`; the caller must check its own owner and mode
    untrusted,  // another account than root can change the item at `place`
    missing,    // there is no item that can be reached; `error` says why
    unknown,    // it cannot be found out now; `error` says why
  };
  Outcome outcome = Outcome::unknown;
  struct stat facts = {};
  std::string place;  // without links; if untrusted, the folder or link at fault
  int error = 0;
};

// `path` must be absolute. Throws only std::bad_alloc.
TrustedPath walkTrustedPath(const std::string& path);

// Whether only root can have made the item and can change it.
bool isRootsAlone(const struct stat& facts) noexcept;

}  // namespace brenvik

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <string_view>

namespace brenvik {

// Whether an archive's entry may have this path. It must be UTF-8, relative, made of names other than "." and
// ".." joined by single slashes, without backslashes and control characters; each name has at most 255 bytes,
// the path 1,024 bytes and 100 names. The caller cuts off a directory's final slash first. Any thread.
bool isCleanEntryPath(std::string_view path) noexcept;

// Whether a link at this clean path may point to the target. The target must be relative and stay inside the
// tree wherever other links lead. ".." is allowed only at its beginning, where it leads up through
// directories that are not links.
bool staysInside(std::string_view linkPath, std::string_view target) noexcept;

}  // namespace brenvik

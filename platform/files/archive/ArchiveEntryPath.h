// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <string_view>

namespace brenvik {

// True for a path that an archive's entry may have: UTF-8, relative, of plain names ("." and ".." are none)
// joined by single slashes, without backslash and control characters; names of at most 255 bytes, 1,024 in
// all, 100 names deep. A directory's final slash is to be cut off before. Any thread.
bool isCleanEntryPath(std::string_view path) noexcept;

// True when a link at the (clean) path may point to the target: relative, and inside the tree wherever other
// links lead. ".." may stand only at its beginning, where it leads up through directories that are no links.
bool staysInside(std::string_view linkPath, std::string_view target) noexcept;

}  // namespace brenvik

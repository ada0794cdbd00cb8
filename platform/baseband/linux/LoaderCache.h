// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <cstddef>
#include <span>
#include <string_view>

namespace brenvik {

// Whether the loader's cache (the bytes of /etc/ld.so.cache) may list a library of this name. In a cache of
// an unknown format it searches for the name's bytes, so false is always certain. Any thread.
bool mayBeInLoaderCache(std::span<const std::byte> cache, std::string_view name) noexcept;

}  // namespace brenvik

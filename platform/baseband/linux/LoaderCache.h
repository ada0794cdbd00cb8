// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <cstddef>
#include <span>
#include <string_view>

namespace brenvik {

// Whether the loader's cache (the bytes of /etc/ld.so.cache) may know a library of this name. A cache whose
// form is not understood is searched for the name's bytes, so the answer "no" can be relied on.
bool mayBeInLoaderCache(std::span<const std::byte> cache, std::string_view name) noexcept;

}  // namespace brenvik

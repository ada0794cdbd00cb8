// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <cstddef>
#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <vector>

namespace brenvik::tools {

// RFC 4648, section 4, with padding.
std::string toBase64(std::span<const std::byte> bytes);
// White space is skipped. Returns nothing for input that RFC 4648 does not allow.
std::optional<std::vector<std::byte>> fromBase64(std::string_view text);

}  // namespace brenvik::tools

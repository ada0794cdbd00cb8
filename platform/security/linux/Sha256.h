// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <array>
#include <cstdint>
#include <optional>
#include <string_view>

namespace brenvik {

using Sha256Digest = std::array<std::uint8_t, 32>;

// Returns the digest of a file's bytes, from the descriptor's position to the end. Returns nothing if the
// file cannot be read, or there is no libcrypto, which the first call loads. Any thread.
std::optional<Sha256Digest> sha256OfFile(int fd) noexcept;

// 64 hexadecimal digits, either case; nothing for any other text.
std::optional<Sha256Digest> parseSha256(std::string_view hex) noexcept;

}  // namespace brenvik

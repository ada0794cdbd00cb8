// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <cstddef>
#include <span>
#include <string_view>

namespace brenvik::client {

// The text under a key of a binary property list whose top level is a dictionary; contract as
// bvmh_event_text. Reads any bytes safely.
std::ptrdiff_t textOfBinaryDictionary(std::span<const std::byte> document, std::string_view key,
                                      std::span<char> buffer) noexcept;

}  // namespace brenvik::client

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <cstddef>

// What the bare server (BareServer.cpp) sends and tells apart by size, in bytes.
namespace brenvik {

inline constexpr std::size_t kBareLargest = 65536;
inline constexpr std::size_t kBareCheckInReply = 40;
inline constexpr std::size_t kBareReply = 36;
inline constexpr std::ptrdiff_t kBareLargeRequest = 24;  // answered with kBareLargest bytes

}  // namespace brenvik

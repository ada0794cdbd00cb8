// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <string_view>

namespace brenvik {

// Whether a request for the URL can be made at all: https, a host, a port that is a number, no blanks and no
// control characters. The HTTP client, which may stand in another process, has the last word.
bool isUsableUrl(std::string_view url) noexcept;

}  // namespace brenvik

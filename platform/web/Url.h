// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <string_view>

namespace brenvik {

// Whether a request for the URL is possible: https, a host, a numeric port, no blanks and no control
// characters. The HTTP client, which may be in another process, can still refuse it.
bool isUsableUrl(std::string_view url) noexcept;

}  // namespace brenvik

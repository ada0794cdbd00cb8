// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <string>

namespace brenvik {

// A gzip file of one member with this content. Ends the process when zlib cannot make it.
std::string gzipOf(const std::string& content);

}  // namespace brenvik

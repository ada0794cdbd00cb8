// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <string>

// What to do about it, for more than one command.
namespace brenvik::tools {

// "root", or "user 1234" where the account has no name.
std::string accountOfThisProcess();

// When the account may not connect to a socket of the helper's.
std::string groupAdvice();

}  // namespace brenvik::tools

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <string>

// Advice that more than one command gives.
namespace brenvik::tools {

// "root", or "user 1234" where the account has no name.
std::string accountOfThisProcess();

// For an account that may not connect to a socket of the helper.
std::string groupAdvice();

}  // namespace brenvik::tools

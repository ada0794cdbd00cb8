// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "helper/requests/RequestTable.h"

#include <gtest/gtest.h>
TEST(Placeholder, Builds) {}

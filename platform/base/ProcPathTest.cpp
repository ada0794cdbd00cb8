// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/base/ProcPath.h"

#include <gtest/gtest.h>

#include <limits>
#include <string>

namespace brenvik {
namespace {

TEST(ProcPathTest, NamesAFileOfAProcess) {
  EXPECT_STREQ(ProcPath(1, "stat").c_str(), "/proc/1/stat");
  EXPECT_STREQ(ProcPath(4194304, "loginuid").c_str(), "/proc/4194304/loginuid");
}

TEST(ProcPathTest, TheLongestNumberAndNameFit) {
  EXPECT_EQ(ProcPath(std::numeric_limits<pid_t>::min(), "123456789012345").c_str(),
            std::string("/proc/-2147483648/123456789012345"));
  EXPECT_STREQ(ProcPath(7, "1234567890123456").c_str(), "/proc/7/123456789012345");
}

}  // namespace
}  // namespace brenvik

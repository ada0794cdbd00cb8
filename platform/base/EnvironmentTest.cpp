// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/base/Environment.h"

#include <gtest/gtest.h>
#include <unistd.h>

#include <array>
#include <cstdlib>
#include <string>
#include <vector>

namespace brenvik {
namespace {

// The process's environment while this stands.
class AnotherEnvironment {
 public:
  explicit AnotherEnvironment(std::vector<std::string> entries)
      : entries_(std::move(entries)), before_(environ) {
    for (std::string& entry : entries_) pointers_.push_back(entry.data());
    pointers_.push_back(nullptr);
    environ = pointers_.data();
  }
  AnotherEnvironment(const AnotherEnvironment&) = delete;
  AnotherEnvironment& operator=(const AnotherEnvironment&) = delete;
  ~AnotherEnvironment() { environ = before_; }

 private:
  std::vector<std::string> entries_;
  std::vector<char*> pointers_;
  char** const before_;
};

std::vector<std::string> environment() {
  std::vector<std::string> entries;
  for (char** each = environ; each != nullptr && *each != nullptr; ++each) entries.emplace_back(*each);
  return entries;
}

TEST(EnvironmentTest, OnlyTheNamedVariablesStayHoweverOftenTheyAreThere) {
  const AnotherEnvironment here({"SSLKEYLOGFILE=/tmp/keys", "LISTEN_FDS=1", "https_proxy=http://x",
                                 "LISTEN_FDSX=2", "LISTEN_FD=3", "TZ=", "LISTEN_FDS=4", "LISTEN_PID=5"});
  clearEnvironmentExcept({"LISTEN_FDS", "LISTEN_PID"});
  EXPECT_EQ(environment(), (std::vector<std::string>{"LISTEN_FDS=1", "LISTEN_FDS=4", "LISTEN_PID=5"}));
  EXPECT_EQ(std::getenv("SSLKEYLOGFILE"), nullptr);
}

TEST(EnvironmentTest, WhatIsNoVariableGoesAndOneWithoutAValueStays) {
  const AnotherEnvironment here({"LISTEN_FDS", "", "=", "=x", "LISTEN_PID="});
  clearEnvironmentExcept({"LISTEN_FDS", "LISTEN_PID"});
  EXPECT_EQ(environment(), std::vector<std::string>{"LISTEN_PID="});
}

TEST(EnvironmentTest, WithoutNamesNothingStaysAndVariablesCanBeSetAfterwards) {
  const AnotherEnvironment here({"A=1", "B=2"});
  clearEnvironmentExcept({});
  EXPECT_TRUE(environment().empty());
  ASSERT_EQ(::setenv("C", "3", 1), 0);
  EXPECT_EQ(environment(), std::vector<std::string>{"C=3"});
  ::unsetenv("C");
}

TEST(EnvironmentTest, NoEnvironmentAtAllIsLeftAsItIs) {
  const AnotherEnvironment here({});
  environ = nullptr;
  clearEnvironmentExcept({"A"});
  EXPECT_EQ(environ, nullptr);
}

}  // namespace
}  // namespace brenvik

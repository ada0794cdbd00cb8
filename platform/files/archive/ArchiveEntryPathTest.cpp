// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/files/archive/ArchiveEntryPath.h"

#include <gtest/gtest.h>

#include <string>

namespace brenvik {
namespace {

TEST(ArchiveEntryPathTest, PlainRelativePathsAreClean) {
  for (const char* path : {"a", "a/b", "a b/c.d", "..a", "a..", "...", "日本/ö", ".hidden", "a/._b"}) {
    EXPECT_TRUE(isCleanEntryPath(path)) << path;
  }
  EXPECT_TRUE(isCleanEntryPath(std::string(255, 'n')));
}

TEST(ArchiveEntryPathTest, PathsThatLeaveOrMayBeMisreadAreNotClean) {
  for (const char* path : {"", "/", "/a", "a/", "a//b", ".", "..", "./a", "a/.", "a/..", "../a", "a/../b",
                           "a\\b", "a\nb", "a\x7f", "a\xff", "\xed\xa0\x80"}) {
    EXPECT_FALSE(isCleanEntryPath(path)) << path;
  }
  EXPECT_FALSE(isCleanEntryPath(std::string("a\0b", 3)));
  EXPECT_FALSE(isCleanEntryPath(std::string(256, 'n')));
  std::string longPath = "d";
  while (longPath.size() < 1024) longPath += "/" + std::string(100, 'd');
  EXPECT_FALSE(isCleanEntryPath(longPath));
  std::string deep = "d";
  for (int i = 1; i < 100; ++i) deep += "/d";
  EXPECT_TRUE(isCleanEntryPath(deep));
  EXPECT_FALSE(isCleanEntryPath(deep + "/d"));
}

TEST(ArchiveEntryPathTest, LinksMayPointAnywhereInsideTheTree) {
  EXPECT_TRUE(staysInside("link", "file"));
  EXPECT_TRUE(staysInside("link", "a/b/c"));
  EXPECT_TRUE(staysInside("a/link", "../file"));
  EXPECT_TRUE(staysInside("a/b/link", "../../c/d"));
  EXPECT_TRUE(staysInside("a/link", ".."));
  EXPECT_TRUE(staysInside("a/link", "./../b/"));
}

TEST(ArchiveEntryPathTest, LinksOutAreRefusedAndSoIsGoingUpBehindAName) {
  EXPECT_FALSE(staysInside("link", ""));
  EXPECT_FALSE(staysInside("link", "/etc"));
  EXPECT_FALSE(staysInside("link", ".."));
  EXPECT_FALSE(staysInside("a/link", "../../x"));
  // "x" may be a link to a directory that lies less deep.
  EXPECT_FALSE(staysInside("a/b/link", "x/.."));
  EXPECT_FALSE(staysInside("a/b/link", "../x/../y"));
  EXPECT_FALSE(staysInside("link", "a\nb"));
  EXPECT_FALSE(staysInside("link", "a\\b"));
  EXPECT_FALSE(staysInside("link", std::string(1025, 'x')));
}

}  // namespace
}  // namespace brenvik

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/baseband/linux/LoaderCache.h"

#include <gtest/gtest.h>

#include <cstdint>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <string>
#include <vector>

namespace brenvik {
namespace {

bool asked(const std::string& cache, std::string_view name) {
  return mayBeInLoaderCache(std::as_bytes(std::span(cache)), name);
}

void append(std::string* bytes, std::uint32_t value) {
  bytes->append(reinterpret_cast<const char*>(&value), sizeof value);
}

// A cache of these names as ldconfig lays one out; `claimed` entries are said to be there.
std::string cacheOf(const std::vector<std::string>& names, std::uint32_t claimed) {
  std::string bytes = "glibc-ld.so.cache1.1";
  append(&bytes, claimed);
  for (int i = 0; i < 6; ++i) append(&bytes, 0);
  std::string texts;
  for (const std::string& name : names) {
    append(&bytes, 3);
    append(&bytes, static_cast<std::uint32_t>(48 + names.size() * 24 + texts.size()));
    for (int i = 0; i < 4; ++i) append(&bytes, 0);
    texts += name + '\0' + "/lib/" + name + '\0';
  }
  return bytes + texts;
}

TEST(LoaderCacheTest, KnowsTheNamesInItAndNoOther) {
  const std::string cache = cacheOf({"libz.so.1", "libbaseband.so.0", "liba.so"}, 3);
  EXPECT_TRUE(asked(cache, "libz.so.1"));
  EXPECT_TRUE(asked(cache, "libbaseband.so.0"));
  EXPECT_TRUE(asked(cache, "liba.so"));
  EXPECT_FALSE(asked(cache, "libbaseband.so"));
  EXPECT_FALSE(asked(cache, "libbaseband.so.0.1"));
  EXPECT_FALSE(asked(cache, "baseband.so.0"));
}

TEST(LoaderCacheTest, OneThatIsNotUnderstoodIsSearchedWhole) {
  EXPECT_TRUE(asked("ld.so-1.7.0 and so on libbaseband.so.0", "libbaseband.so.0"));
  EXPECT_FALSE(asked("ld.so-1.7.0 and so on", "libbaseband.so.0"));
  EXPECT_FALSE(asked("", "libbaseband.so.0"));
}

TEST(LoaderCacheTest, LyingCountsAndOffsetsAreNotFollowed) {
  const std::string cache = cacheOf({"libbaseband.so.0"}, 1);
  EXPECT_TRUE(asked(cacheOf({"libbaseband.so.0"}, 0xFFFFFFFF), "libbaseband.so.0"));
  for (std::size_t size = 0; size < cache.size(); ++size) {
    EXPECT_FALSE(asked(cache.substr(0, size), "libother.so.0")) << size;
  }
  std::string far = cache;
  const std::uint32_t offset = 0xFFFFFFF0;
  std::memcpy(far.data() + 48 + 4, &offset, sizeof offset);
  EXPECT_TRUE(asked(far, "libbaseband.so.0"));
}

TEST(LoaderCacheTest, ANameThatBeginsAtTheEndIsNoReasonToSayNo) {
  std::string cache = cacheOf({"libz.so.1"}, 1) + "libbaseband.so.0";
  const auto end = static_cast<std::uint32_t>(cache.size());
  std::memcpy(cache.data() + 48 + 4, &end, sizeof end);
  EXPECT_TRUE(asked(cache, "libbaseband.so.0"));
}

TEST(LoaderCacheTest, ThisSystemsOwnCacheIsUnderstood) {
  std::ifstream file("/etc/ld.so.cache", std::ios::binary);
  if (!file) GTEST_SKIP() << "this system has none";
  const std::string cache{std::istreambuf_iterator<char>(file), {}};
  EXPECT_TRUE(asked(cache, "libc.so.6"));
  EXPECT_FALSE(asked(cache, "libc.so"));
}

}  // namespace
}  // namespace brenvik

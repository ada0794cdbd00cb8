// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "helper/lasd/VersionText.h"

#include <dlfcn.h>
#include <gtest/gtest.h>
#include <locale.h>
#include <sys/mman.h>
#include <unistd.h>

#include <algorithm>
#include <string>
#include <string_view>

#include "platform/base/fakes/FailingCalls.h"

extern "C" locale_t newlocale(int mask, const char* name, locale_t base) noexcept {
  if (brenvik::FailingCall::failsNow("newlocale")) return nullptr;
  const auto real = reinterpret_cast<decltype(&newlocale)>(::dlsym(RTLD_NEXT, "newlocale"));
  return real(mask, name, base);
}

namespace brenvik {
namespace {

struct Case {
  const char* left;
  const char* right;
  bool same;
};

TEST(VersionTextTest, VersionsCompareByTheTable) {
  const std::string huge(5000, '9');
  const Case cases[] = {
      {"", "", true},
      {"2.0", "2.00", true},
      {"2.0", "2", false},
      {"2.0", "2.0.0", false},
      {"ABC", "abc", true},
      {"1.10", "1.1", false},
      {"1.010", "1.10", true},
      {"007", "7", true},
      {"0", "000", true},
      {"0", "", false},
      {"1a2b", "01A002B", true},
      {"1a2b", "1a2c", false},
      {"10", "9", false},
      {"v2", "V02", true},
      {"2-beta", "2-BETA", true},
      {"2", "2 ", false},
      {"12", "1.2", false},
      {"a1", "a", false},
      {"\xC3\x89t\xC3\xA9", "\xC3\xA9T\xC3\x89", true},  // E and e with acute accent
      {"\xC3\xA9", "e", false},
      {"\xD0\x96", "\xD0\xB6", true},          // Cyrillic zhe
      {"\xCE\xA3", "\xCF\x83", true},          // Greek sigma
      {"\xEF\xBC\x91", "1", false},            // a full-width one is no ASCII digit
      {"\xEF\xBC\xA1", "\xEF\xBD\x81", true},  // a full-width A
      {"\xF0\x9D\x9F\x8F", "1", false},
      {"AZ", "az", true},
      {"@[`{", "`{@[", false},                         // beside the letters
      {"\xF0\x90\x90\x80", "\xF0\x90\x90\xA8", true},  // Deseret long i
      {"\xF0\x90\x90\x80", "\xF0\x90\x90\xA9", false},
      {"\xE0\xB8\x81", "8\x81", false},  // Thai ko kai, and no UTF-8
      {"\xC0z", "\xC3\xA0z", false},     // Latin-1, and a with grave accent
      {"\xE1\xBA", "\xE1\xBB", false},
      {"\xC3", "\xC3", true},  // cut characters compare as their bytes
      {"\xC3", "\xC4", false},
      {huge.c_str(), huge.c_str(), true},
  };
  for (const auto& [left, right, same] : cases) {
    EXPECT_EQ(sameVersion(left, right), same) << left << " | " << right;
    EXPECT_EQ(sameVersion(right, left), same) << right << " | " << left;
  }
  EXPECT_FALSE(sameVersion(huge, huge + "0"));
  EXPECT_TRUE(sameVersion("000" + huge, huge)) << "no value is too large";
}

TEST(VersionTextTest, ANulIsACharacterLikeOthers) {
  EXPECT_FALSE(sameVersion(std::string("1\0a", 3), std::string("1\0b", 3)));
  EXPECT_TRUE(sameVersion(std::string("1\0a", 3), std::string("01\0A", 4)));
}

TEST(VersionTextTest, NoByteBeyondATextIsRead) {
  const auto page = static_cast<std::size_t>(::sysconf(_SC_PAGESIZE));
  void* const pages = ::mmap(nullptr, 2 * page, PROT_READ | PROT_WRITE, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0);
  ASSERT_NE(pages, MAP_FAILED);
  char* const end = static_cast<char*>(pages) + page;
  ASSERT_EQ(::mprotect(end, page, PROT_NONE), 0);
  for (const std::string text : {"", "1", "a", "1a", "a1", "\xC3", "\xE1\xBA", "\xF0\x90\x90", "\xC3\xA9"}) {
    const std::string_view atEnd(end - text.size(), text.size());
    std::copy(text.begin(), text.end(), end - text.size());
    EXPECT_TRUE(sameVersion(atEnd, text));
    EXPECT_FALSE(sameVersion(atEnd, text + "2b"));
    EXPECT_FALSE(sameVersion(text + "b2", atEnd));
  }
  ::munmap(pages, 2 * page);
}

TEST(VersionTextDeathTest, WithoutTablesOfOtherLettersThoseCompareAsTheyAreUntilThereAreTables) {
  testing::FLAGS_gtest_death_test_style = "threadsafe";  // a process of its own, which has no tables yet
  EXPECT_EXIT(
      {
        const FailingCall noTables("newlocale", ENOMEM);
        const bool holds = sameVersion("ABC", "abc") && !sameVersion("\xC3\x89", "\xC3\xA9") &&
                           noTables.failures() == 1 && sameVersion("\xC3\x89", "\xC3\xA9");
        ::_exit(holds ? 7 : 1);
      },
      testing::ExitedWithCode(7), "");
}

}  // namespace
}  // namespace brenvik

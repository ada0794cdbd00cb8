// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/web/WebTypes.h"

#include <gtest/gtest.h>

#include <limits>
#include <map>
#include <set>
#include <vector>

namespace brenvik {
namespace {

TEST(WebTypesTest, HeadersAreFoundWhateverTheCaseOfTheirNames) {
  HeaderMap headers{{"Content-Type", "application/gzip"}};
  EXPECT_EQ(headers.find("content-TYPE")->second, "application/gzip");
  EXPECT_EQ(headers.find("Content_Type"), headers.end());
  headers["CONTENT-TYPE"] = "text/plain";
  EXPECT_EQ(headers.size(), 1U);
}

TEST(WebTypesTest, HeaderNamesAreOrderedAndBytesAboveAsciiCompareAsTheyAre) {
  const HeaderNameLess less;
  EXPECT_TRUE(less("accept", "Content-Type"));
  EXPECT_FALSE(less("Content-Type", "accept"));
  EXPECT_TRUE(less("Accept", "accept-encoding"));
  EXPECT_TRUE(less("z", "\xC3\x89"));
  EXPECT_NE(less("\xC3\x89", "\xC3\xA9"), less("\xC3\xA9", "\xC3\x89"));
}

TEST(WebTypesTest, SuccessIsTheValueOneAndGetTheValueZero) {
  EXPECT_EQ(static_cast<int>(WebErrorKind::none), 1);
  EXPECT_EQ(static_cast<int>(WebRequestType::get), 0);
}

TEST(WebTypesTest, EveryErrorKindHasAnOwnTextAndAStrayValueAText) {
  std::set<std::string> texts;
  for (int kind = 0; kind <= static_cast<int>(WebErrorKind::unusableUrl); ++kind) {
    texts.insert(textOfErrorKind(static_cast<WebErrorKind>(kind)));
  }
  EXPECT_EQ(texts.size(), 18U);
  EXPECT_STREQ(textOfErrorKind(static_cast<WebErrorKind>(99)), "unknown error");
}

TEST(WebTypesTest, AWrongClockIsSaidInWords) {
  EXPECT_STREQ(textOfErrorKind(WebErrorKind::certificateClock),
               "server certificate not valid at this time, check the system clock");
}

TEST(WebTypesTest, StatusCodesHaveTheirNamesAndUnlistedOnesTheirClass) {
  // The reason phrases of RFC 9110 section 15, and of RFC 6585 and RFC 7725.
  const std::map<int, const char*> named{{0, "no status"},
                                         {200, "OK"},
                                         {201, "Created"},
                                         {202, "Accepted"},
                                         {204, "No Content"},
                                         {206, "Partial Content"},
                                         {301, "Moved Permanently"},
                                         {302, "Found"},
                                         {303, "See Other"},
                                         {304, "Not Modified"},
                                         {307, "Temporary Redirect"},
                                         {308, "Permanent Redirect"},
                                         {400, "Bad Request"},
                                         {401, "Unauthorized"},
                                         {403, "Forbidden"},
                                         {404, "Not Found"},
                                         {405, "Method Not Allowed"},
                                         {406, "Not Acceptable"},
                                         {408, "Request Timeout"},
                                         {410, "Gone"},
                                         {416, "Range Not Satisfiable"},
                                         {429, "Too Many Requests"},
                                         {451, "Unavailable For Legal Reasons"},
                                         {500, "Internal Server Error"},
                                         {501, "Not Implemented"},
                                         {502, "Bad Gateway"},
                                         {503, "Service Unavailable"},
                                         {504, "Gateway Timeout"}};
  for (const auto& [code, text] : named) EXPECT_STREQ(textOfStatusCode(code), text) << code;
  const std::map<const char*, std::vector<int>> classes{
      {"Informational", {100, 102, 199}},
      {"Successful", {203, 226, 299}},
      {"Redirection", {300, 399}},
      {"Client Error", {418, 499}},
      {"Server Error", {505, 599}},
      {"unknown status", {std::numeric_limits<int>::min(), -1, 1, 99, 600, 999}}};
  for (const auto& [text, codes] : classes) {
    for (const int code : codes) EXPECT_STREQ(textOfStatusCode(code), text) << code;
  }
}

}  // namespace
}  // namespace brenvik

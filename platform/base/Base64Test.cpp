// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/base/Base64.h"

#include <gtest/gtest.h>
#include <sys/mman.h>
#include <unistd.h>

#include <cstring>
#include <optional>
#include <random>
#include <string>

namespace brenvik {
namespace {

std::string encoded(std::string_view bytes) {
  std::string text(base64Size(bytes.size()), '?');
  EXPECT_EQ(encodeBase64(bytes.data(), bytes.size(), text.data()), text.data() + text.size());
  return text;
}

std::optional<std::string> decoded(std::string_view text) {
  std::string bytes(base64DecodedRoom(text.size()), '?');
  const char* const end = decodeBase64(text, bytes.data());
  if (end == nullptr) return std::nullopt;
  bytes.resize(static_cast<std::size_t>(end - bytes.data()));
  return bytes;
}

TEST(Base64Test, HoldsTheVectorsOfRfc4648) {
  const std::pair<const char*, const char*> vectors[] = {{"", ""},
                                                         {"f", "Zg=="},
                                                         {"fo", "Zm8="},
                                                         {"foo", "Zm9v"},
                                                         {"foob", "Zm9vYg=="},
                                                         {"fooba", "Zm9vYmE="},
                                                         {"foobar", "Zm9vYmFy"},
                                                         {"\xFF\xFB\xBF", "//u/"}};
  for (const auto& [bytes, text] : vectors) {
    EXPECT_EQ(encoded(bytes), text);
    EXPECT_EQ(decoded(text), bytes);
  }
}

TEST(Base64Test, AnyBytesComeBackHoweverTheTextIsSpaced) {
  std::mt19937 random(20240229);
  for (std::size_t size = 0; size < 300; ++size) {
    std::string bytes(size, '\0');
    for (char& byte : bytes) byte = static_cast<char>(random());
    const std::string text = encoded(bytes);
    ASSERT_EQ(decoded(text), bytes);
    std::string spaced;
    for (const char digit : text) {
      spaced += digit;
      if (random() % 5 == 0) spaced += " \t\r\n"[random() % 4];
    }
    ASSERT_EQ(decoded(spaced), bytes) << spaced;
  }
}

TEST(Base64Test, ASpaceIsNoDigitWhereverItStands) {
  for (const char* text : {" AAAA", "A AAA", "AA AA", "AAA A", "AAAA "})
    EXPECT_EQ(decoded(text), std::string(3, '\0')) << text;
}

TEST(Base64Test, WhatFollowsTheTextIsNotRead) {
  const auto page = static_cast<std::size_t>(::sysconf(_SC_PAGESIZE));
  void* const pages = ::mmap(nullptr, 2 * page, PROT_READ | PROT_WRITE, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0);
  ASSERT_NE(pages, MAP_FAILED);
  char* const end = static_cast<char*>(pages) + page;
  ASSERT_EQ(::mprotect(end, page, PROT_NONE), 0);
  for (const std::string text : {"Z", "Zm", "Zm9", "Zm9v", "Zm9vY", "Zm9vYm", "Zm9vYmF"}) {
    std::memcpy(end - text.size(), text.data(), text.size());
    EXPECT_EQ(decoded({end - text.size(), text.size()}).has_value(), text == "Zm9v") << text;
  }
  ::munmap(pages, 2 * page);
}

TEST(Base64Test, NothingElseIsBase64) {
  for (const char* text : {"Z", "Zg", "Zg=", "Zg===", "Zm8", "Zm8==", "Zm9v=", "=", "====", "Z===", "Zg=v",
                           "Zg==Zg==", "Zm9*", "Zm9-", "Zm9v.", "Zg==Z", "Z=g="}) {
    EXPECT_EQ(decoded(text), std::nullopt) << text;
  }
  EXPECT_EQ(decoded(std::string_view("Zm\0v", 4)), std::nullopt);
}

}  // namespace
}  // namespace brenvik

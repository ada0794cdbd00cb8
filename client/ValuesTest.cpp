// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include <gtest/gtest.h>

#include <cstring>
#include <limits>
#include <memory>
#include <string>
#include <string_view>

#include "client/include/brenvik/mobile_helper.h"
#include "platform/base/fakes/FailingAllocations.h"

// Values in C. What a property list may look like is tested in platform/plist.
namespace brenvik::client {
namespace {

struct FreeValue {
  void operator()(bvmh_value* value) const { bvmh_value_free(value); }
};
using Value = std::unique_ptr<bvmh_value, FreeValue>;

Value read(std::string_view bytes) {
  bvmh_value* value = nullptr;
  EXPECT_EQ(bvmh_value_read(bytes.data(), bytes.size(), &value), BVMH_OK);
  return Value(value);
}

std::string write(const bvmh_value* value) {
  bvmh_region region{};
  EXPECT_EQ(bvmh_value_write(value, &region), BVMH_OK);
  std::string bytes(static_cast<const char*>(region.bytes), region.size);
  bvmh_region_free(&region);
  return bytes;
}

std::string textAt(const bvmh_value* value, std::size_t index) {
  const Value element(bvmh_value_at(value, index));
  const char* text = bvmh_value_get_text(element.get(), nullptr);
  return text == nullptr ? "(no text)" : text;
}

TEST(ValuesTest, EveryTypeGoesToAPropertyListAndComesBack) {
  const Value made(bvmh_value_new_dictionary());
  bvmh_value* const list = bvmh_value_new_array();
  EXPECT_EQ(bvmh_value_append(list, bvmh_value_new_text("n\xC3\xB8rsk")), BVMH_OK);
  EXPECT_EQ(bvmh_value_append(list, bvmh_value_new_dictionary()), BVMH_OK);
  EXPECT_EQ(bvmh_value_set(made.get(), "boolean", bvmh_value_new_boolean(true)), BVMH_OK);
  EXPECT_EQ(bvmh_value_set(made.get(), "integer", bvmh_value_new_integer(-3)), BVMH_OK);
  EXPECT_EQ(bvmh_value_set(made.get(), "unsigned", bvmh_value_new_unsigned(UINT64_MAX)), BVMH_OK);
  EXPECT_EQ(bvmh_value_set(made.get(), "real", bvmh_value_new_real(0.5)), BVMH_OK);
  EXPECT_EQ(bvmh_value_set(made.get(), "data", bvmh_value_new_data("\0\xFF", 2)), BVMH_OK);
  EXPECT_EQ(bvmh_value_set(made.get(), "date", bvmh_value_new_date(1'000'000'000)), BVMH_OK);
  EXPECT_EQ(bvmh_value_set(made.get(), "array", list), BVMH_OK);

  const std::string bytes = write(made.get());
  EXPECT_TRUE(bytes.starts_with("bplist00"));
  const Value back = read(bytes);
  ASSERT_EQ(bvmh_value_type_of(back.get()), BVMH_VALUE_DICTIONARY);
  ASSERT_EQ(bvmh_value_count(back.get()), 7U);
  EXPECT_STREQ(bvmh_value_key_at(back.get(), 0), "boolean");
  EXPECT_EQ(bvmh_value_key_at(back.get(), 7), nullptr);
  const auto at = [&](const char* key) { return Value(bvmh_value_find(back.get(), key)); };
  bool boolean = false;
  EXPECT_TRUE(bvmh_value_get_boolean(at("boolean").get(), &boolean));
  EXPECT_TRUE(boolean);
  std::int64_t integer = 0;
  EXPECT_TRUE(bvmh_value_get_integer(at("integer").get(), &integer));
  EXPECT_EQ(integer, -3);
  std::uint64_t large = 0;
  EXPECT_TRUE(bvmh_value_get_unsigned(at("unsigned").get(), &large));
  EXPECT_EQ(large, UINT64_MAX);
  EXPECT_FALSE(bvmh_value_get_integer(at("unsigned").get(), &integer));
  EXPECT_FALSE(bvmh_value_get_unsigned(at("integer").get(), &large));
  double real = 0;
  EXPECT_TRUE(bvmh_value_get_real(at("real").get(), &real));
  EXPECT_EQ(real, 0.5);
  EXPECT_TRUE(bvmh_value_get_date(at("date").get(), &real));
  EXPECT_EQ(real, 1'000'000'000);
  const Value data = at("data");
  std::size_t size = 0;
  EXPECT_EQ(std::memcmp(bvmh_value_get_data(data.get(), &size), "\0\xFF", 2), 0);
  EXPECT_EQ(size, 2U);
  const Value array = at("array");
  EXPECT_EQ(bvmh_value_type_of(array.get()), BVMH_VALUE_ARRAY);
  EXPECT_EQ(textAt(array.get(), 0), "n\xC3\xB8rsk");
  EXPECT_EQ(bvmh_value_type_of(Value(bvmh_value_at(array.get(), 1)).get()), BVMH_VALUE_DICTIONARY);
  EXPECT_EQ(bvmh_value_at(array.get(), 2), nullptr);
  EXPECT_EQ(bvmh_value_find(back.get(), "absent"), nullptr);
}

TEST(ValuesTest, ReadsXmlAsTheHelperAnswersIt) {
  const Value value = read(
      "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<plist version=\"1.0\"><array><string>A</string>"
      "<date>2001-01-01T00:00:00Z</date></array></plist>");
  EXPECT_EQ(textAt(value.get(), 0), "A");
  double date = 0;
  EXPECT_TRUE(bvmh_value_get_date(Value(bvmh_value_at(value.get(), 1)).get(), &date));
  EXPECT_EQ(date, 978307200);
}

TEST(ValuesTest, TextsMayHoldNulsAndAreClosedWithOne) {
  const Value value =
      read(std::string_view("bplist00\x53"
                            "a\0b\x08\0\0\0\0\0\0\1\1\0\0\0\0\0\0\0\1\0\0\0\0\0\0\0\0\0\0\0\0\0\0\0\x0C",
                            8 + 4 + 1 + 32));
  std::size_t length = 0;
  const char* text = bvmh_value_get_text(value.get(), &length);
  ASSERT_NE(text, nullptr);
  EXPECT_EQ(std::string_view(text, length + 1), std::string_view("a\0b\0", 4));
}

TEST(ValuesTest, AContainerCanBeReadAndChangedInTurns) {
  const Value array(bvmh_value_new_array());
  for (int i = 0; i < 5; ++i) {
    EXPECT_EQ(bvmh_value_append(array.get(), bvmh_value_new_text(std::to_string(i).c_str())), BVMH_OK);
    EXPECT_EQ(bvmh_value_count(array.get()), static_cast<std::size_t>(i) + 1);
    EXPECT_EQ(textAt(array.get(), static_cast<std::size_t>(i)), std::to_string(i));
  }
  const Value copy(bvmh_value_copy(array.get()));
  EXPECT_EQ(bvmh_value_append(copy.get(), bvmh_value_new_integer(5)), BVMH_OK);
  EXPECT_EQ(bvmh_value_count(array.get()), 5U);
  EXPECT_EQ(bvmh_value_count(copy.get()), 6U);
}

TEST(ValuesTest, SettingAKeyAgainReplacesItsValueInItsPlace) {
  const Value dictionary(bvmh_value_new_dictionary());
  for (const char* value : {"one", "two"}) {
    EXPECT_EQ(bvmh_value_set(dictionary.get(), "a", bvmh_value_new_text(value)), BVMH_OK);
    EXPECT_EQ(bvmh_value_set(dictionary.get(), "b", bvmh_value_new_text("b")), BVMH_OK);
  }
  for (int i = 0; i < 10'000; ++i)
    ASSERT_EQ(bvmh_value_set(dictionary.get(), "b", bvmh_value_new_integer(i)), BVMH_OK);
  EXPECT_EQ(bvmh_value_count(dictionary.get()), 2U);
  EXPECT_EQ(textAt(dictionary.get(), 0), "two");
  std::int64_t last = 0;
  EXPECT_TRUE(bvmh_value_get_integer(Value(bvmh_value_at(dictionary.get(), 1)).get(), &last));
  EXPECT_EQ(last, 9999);
}

TEST(ValuesTest, WhatDoesNotFitIsRefusedAndChangesNothing) {
  const Value array(bvmh_value_new_array());
  const Value dictionary(bvmh_value_new_dictionary());
  const Value text(bvmh_value_new_text("x"));
  const auto refused = BVMH_ERROR_INVALID_ARGUMENT;
  EXPECT_EQ(bvmh_value_append(array.get(), nullptr), refused);
  EXPECT_EQ(bvmh_value_append(array.get(), array.get()), refused);
  EXPECT_EQ(bvmh_value_append(text.get(), bvmh_value_new_boolean(true)), refused);
  EXPECT_EQ(bvmh_value_append(dictionary.get(), bvmh_value_new_boolean(true)), refused);
  EXPECT_EQ(bvmh_value_append(nullptr, bvmh_value_new_boolean(true)), refused);
  EXPECT_EQ(bvmh_value_set(dictionary.get(), nullptr, bvmh_value_new_boolean(true)), refused);
  EXPECT_EQ(bvmh_value_set(dictionary.get(), "\xFF", bvmh_value_new_boolean(true)), refused);
  EXPECT_EQ(bvmh_value_set(dictionary.get(), "k", nullptr), refused);
  EXPECT_EQ(bvmh_value_set(dictionary.get(), "k", dictionary.get()), refused);
  EXPECT_EQ(bvmh_value_set(array.get(), "k", bvmh_value_new_boolean(true)), refused);
  EXPECT_EQ(bvmh_value_count(array.get()) + bvmh_value_count(dictionary.get()), 0U);
  EXPECT_EQ(bvmh_value_new_text("\xC3"), nullptr);
  EXPECT_EQ(bvmh_value_new_text(nullptr), nullptr);
  EXPECT_EQ(bvmh_value_new_data(nullptr, 1), nullptr);
  std::int64_t integer = 7;
  EXPECT_FALSE(bvmh_value_get_integer(text.get(), &integer));
  EXPECT_FALSE(bvmh_value_get_integer(nullptr, &integer));
  EXPECT_EQ(integer, 7);
  EXPECT_EQ(bvmh_value_get_text(array.get(), nullptr), nullptr);
  EXPECT_EQ(bvmh_value_get_data(text.get(), nullptr), nullptr);
  EXPECT_EQ(bvmh_value_type_of(nullptr), BVMH_VALUE_NONE);
  EXPECT_EQ(bvmh_value_count(nullptr), 0U);
  EXPECT_EQ(bvmh_value_copy(nullptr), nullptr);
  bvmh_value_free(nullptr);
  bvmh_region region{};
  EXPECT_EQ(bvmh_value_write(nullptr, &region), refused);
  EXPECT_EQ(bvmh_value_write(text.get(), nullptr), refused);
}

TEST(ValuesTest, EmptyDataIsData) {
  const Value data(bvmh_value_new_data(nullptr, 0));
  std::size_t size = 1;
  EXPECT_NE(bvmh_value_get_data(data.get(), &size), nullptr);
  EXPECT_EQ(size, 0U);
}

TEST(ValuesTest, BytesThatAreNoPropertyListAreRefused) {
  for (const std::string_view bytes : {"", "x", "<plist>", "bplist00", "<plist><string>a</string>"}) {
    bvmh_value* value = bvmh_value_new_boolean(true);
    const Value before(value);
    EXPECT_EQ(bvmh_value_read(bytes.data(), bytes.size(), &value), BVMH_ERROR_NOT_A_VALUE) << bytes;
    EXPECT_EQ(value, nullptr);
  }
  bvmh_value* value = nullptr;
  EXPECT_EQ(bvmh_value_read(nullptr, 1, &value), BVMH_ERROR_INVALID_ARGUMENT);
  EXPECT_EQ(bvmh_value_read("x", 1, nullptr), BVMH_ERROR_INVALID_ARGUMENT);
}

TEST(ValuesTest, ADeepValueIsNotWrittenAndCanBeFreed) {
  Value value(bvmh_value_new_array());
  bvmh_region region{};
  for (int depth = 1; depth < 512; ++depth) {
    bvmh_value* const outer = bvmh_value_new_array();
    ASSERT_EQ(bvmh_value_append(outer, value.release()), BVMH_OK);
    value.reset(outer);
  }
  EXPECT_EQ(bvmh_value_write(value.get(), &region), BVMH_OK);
  bvmh_region_free(&region);
  for (int depth = 0; depth < 100'000; ++depth) {
    bvmh_value* const outer = bvmh_value_new_array();
    ASSERT_EQ(bvmh_value_append(outer, value.release()), BVMH_OK);
    value.reset(outer);
  }
  EXPECT_EQ(bvmh_value_write(value.get(), &region), BVMH_ERROR_NOT_A_VALUE);
  EXPECT_EQ(region.bytes, nullptr);
}

TEST(ValuesTest, WithoutMemoryEveryStepSaysSoAndNothingIsLost) {
  if (!FailingAllocations::kWork) GTEST_SKIP();
  long failed = 0;
  for (long first = 0; first < 200; ++first) {
    const Value array(bvmh_value_new_array());
    ASSERT_EQ(bvmh_value_append(array.get(), bvmh_value_new_text("the first, which is a little longer")),
              BVMH_OK);
    bvmh_value* const second = bvmh_value_new_text("the second, which is a little longer, too");
    std::int32_t code = BVMH_OK;
    long failures = 0;
    {
      const FailingAllocations failing(first, FailingAllocations::HowMany::one);
      code = bvmh_value_append(array.get(), second);
      failures = FailingAllocations::failures();
    }
    EXPECT_EQ(code, failures == 0 ? BVMH_OK : BVMH_ERROR_NO_MEMORY);
    EXPECT_EQ(bvmh_value_count(array.get()), failures == 0 ? 2U : 1U);
    bvmh_region region{};
    {
      const FailingAllocations failing(first, FailingAllocations::HowMany::one);
      code = bvmh_value_write(array.get(), &region);
      failures += FailingAllocations::failures();
    }
    bvmh_region_free(&region);
    EXPECT_TRUE(code == BVMH_OK || code == BVMH_ERROR_NO_MEMORY);
    EXPECT_EQ(textAt(array.get(), 0), "the first, which is a little longer");
    failed += failures;
    if (failures == 0) break;
  }
  EXPECT_GT(failed, 1);
}

}  // namespace
}  // namespace brenvik::client

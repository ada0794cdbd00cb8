// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/plist/PropertyList.h"

#include <gtest/gtest.h>

#include "platform/plist/PropertyListCodec.h"

namespace brenvik {
namespace {
PropertyList parse(std::string_view text) { return parsePropertyList(std::as_bytes(std::span(text))); }

TEST(PropertyListTest, Smoke) {
  const PropertyList value = parse(
      "<plist><dict><key>a</key><array><integer>-5</integer><string>x&amp;y</string><data>AQID</data><true/"
      "><real>1.5</real><date>2020-02-29T12:34:56Z</date></array></dict></plist>");
  ASSERT_TRUE(value);
  const auto xml = serializePropertyList(value, PropertyListFormat::xml);
  ASSERT_TRUE(xml);
  EXPECT_EQ(parse(*xml), value) << *xml;
  const auto binary = serializePropertyList(value, PropertyListFormat::binary);
  ASSERT_TRUE(binary);
  EXPECT_EQ(parse(*binary), value);
}
}  // namespace
}  // namespace brenvik

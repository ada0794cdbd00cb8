// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <cmath>
#include <limits>

#include "platform/plist/PropertyListCodec.h"

namespace brenvik {
namespace {

PropertyList parse(std::string_view text) { return parsePropertyList(std::as_bytes(std::span(text))); }

// The value inside the least that the reader asks for around it.
PropertyList parseValue(const std::string& element) { return parse("<plist>" + element + "</plist>"); }

std::string writtenAsXml(const PropertyList& value) {
  return serializePropertyList(value, PropertyListFormat::xml).value_or("(refused)");
}

constexpr double kInfinity = std::numeric_limits<double>::infinity();
constexpr double kNan = std::numeric_limits<double>::quiet_NaN();

constexpr std::string_view kHead =
    "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n"
    "<!DOCTYPE plist PUBLIC \"-//Apple//DTD PLIST 1.0//EN\" "
    "\"http://www.apple.com/DTDs/PropertyList-1.0.dtd\">\n"
    "<plist version=\"1.0\">\n";

std::string framed(std::string_view body) { return std::string(kHead) + std::string(body) + "</plist>\n"; }

PropertyList bytes(std::string_view content) { return PropertyList::data(std::as_bytes(std::span(content))); }

TEST(XmlWriterTest, WritesEveryTypeIndentedByTabs) {
  const PropertyList value = PropertyList::dictionary(
      {{"text", PropertyList::string("plain")},
       {"list", PropertyList::array({PropertyList::boolean(true), PropertyList::boolean(false),
                                     PropertyList::integer(-5), PropertyList::unsignedInteger(UINT64_MAX),
                                     PropertyList::array({PropertyList::real(0.25)})})},
       {"blob", bytes(std::string_view("\1\2\3\4", 4))},
       {"when", PropertyList::date(0)},
       {"none", PropertyList::array({})},
       {"nothing", PropertyList::dictionary({})},
       {"", PropertyList::string("")}});
  EXPECT_EQ(writtenAsXml(value), framed("<dict>\n"
                                        "\t<key>text</key>\n"
                                        "\t<string>plain</string>\n"
                                        "\t<key>list</key>\n"
                                        "\t<array>\n"
                                        "\t\t<true/>\n"
                                        "\t\t<false/>\n"
                                        "\t\t<integer>-5</integer>\n"
                                        "\t\t<integer>18446744073709551615</integer>\n"
                                        "\t\t<array>\n"
                                        "\t\t\t<real>0.25</real>\n"
                                        "\t\t</array>\n"
                                        "\t</array>\n"
                                        "\t<key>blob</key>\n"
                                        "\t<data>\n"
                                        "\tAQIDBA==\n"
                                        "\t</data>\n"
                                        "\t<key>when</key>\n"
                                        "\t<date>2001-01-01T00:00:00Z</date>\n"
                                        "\t<key>none</key>\n"
                                        "\t<array/>\n"
                                        "\t<key>nothing</key>\n"
                                        "\t<dict/>\n"
                                        "\t<key></key>\n"
                                        "\t<string></string>\n"
                                        "</dict>\n"));
}

TEST(XmlWriterTest, EscapesWhatXmlGivesAMeaningInValuesAndKeys) {
  EXPECT_EQ(writtenAsXml(PropertyList::dictionary({{"<&>", PropertyList::string("a\"b'\r\n\t&<>]]>")}})),
            framed("<dict>\n\t<key>&lt;&amp;&gt;</key>\n"
                   "\t<string>a\"b'&#13;\n\t&amp;&lt;&gt;]]&gt;</string>\n</dict>\n"));
}

TEST(XmlWriterTest, EscapesAtEveryPlaceOfTextsOfEveryLength) {
  for (std::size_t length = 1; length < 40; ++length) {
    for (std::size_t at = 0; at < length; ++at) {
      std::string content(length, 'x');
      content[at] = '<';
      std::string expected = content;
      expected.replace(at, 1, "&lt;");
      EXPECT_EQ(writtenAsXml(PropertyList::string(content)), framed("<string>" + expected + "</string>\n"));
    }
  }
  std::string large(100000, '&');
  const PropertyList value = PropertyList::string(large);
  EXPECT_EQ(parse(writtenAsXml(value)), value);
}

TEST(XmlWriterTest, RefusesCharactersThatXmlCannotCarry) {
  for (const std::string& bad :
       {std::string("a\0b", 3), std::string("\x01"), std::string("\x1F"), std::string("\x0B"),
        std::string("\xEF\xBF\xBE"), std::string("\xEF\xBF\xBF"),
        std::string(30, 'x') + "\x08" + std::string(30, 'x')}) {
    const PropertyList value = PropertyList::string(bad);
    ASSERT_TRUE(value);
    EXPECT_FALSE(serializePropertyList(value, PropertyListFormat::xml)) << bad;
    EXPECT_FALSE(serializePropertyList(PropertyList::dictionary({{bad, value}}), PropertyListFormat::xml))
        << bad;
    EXPECT_TRUE(serializePropertyList(value, PropertyListFormat::binary)) << bad;
  }
  for (const char* good : {"\x7F", "\xC2\x80", "\xEF\xBF\xBD", "\xEF\xBE\xBF", "\xF0\x9F\xBF\xBF"}) {
    const PropertyList value = PropertyList::string(good);
    EXPECT_EQ(parse(writtenAsXml(value)), value) << good;
  }
}

TEST(XmlWriterTest, RealsAreShortestAndComeBackAsTheyWere) {
  EXPECT_EQ(writtenAsXml(PropertyList::real(0.1)), framed("<real>0.1</real>\n"));
  EXPECT_EQ(writtenAsXml(PropertyList::real(-kInfinity)), framed("<real>-inf</real>\n"));
  EXPECT_EQ(writtenAsXml(PropertyList::real(-std::numeric_limits<double>::quiet_NaN())),
            framed("<real>nan</real>\n"));
  for (const double number :
       {5e-324, 1.7976931348623157e308, -0.0, 1.0 / 3, 1e23, 123456789012345680.0, kInfinity}) {
    const PropertyList again = parse(writtenAsXml(PropertyList::real(number)));
    EXPECT_EQ(again.asReal(), number);
    EXPECT_EQ(std::signbit(again.asReal().value()), std::signbit(number));
  }
}

TEST(XmlWriterTest, DatesKeepTheSecondThatHasBegunAndTheYearsOfTheForm) {
  auto dateText = [](double seconds) { return writtenAsXml(PropertyList::date(seconds)); };
  EXPECT_EQ(dateText(0.999), framed("<date>2001-01-01T00:00:00Z</date>\n"));
  EXPECT_EQ(dateText(-0.5), framed("<date>2000-12-31T23:59:59Z</date>\n"));
  EXPECT_EQ(dateText(-978307200), framed("<date>1970-01-01T00:00:00Z</date>\n"));
  EXPECT_EQ(dateText(-63113904000.0), framed("<date>0001-01-01T00:00:00Z</date>\n"));
  EXPECT_EQ(dateText(252423993599.0), framed("<date>9999-12-31T23:59:59Z</date>\n"));
  for (const double bad : {-63113904000.5, 252423993600.0, 1e300, kInfinity, -kInfinity, kNan}) {
    EXPECT_EQ(dateText(bad), "(refused)") << bad;
  }
}

TEST(XmlWriterTest, DataIsWrappedAt76CharactersAndComesBackAtEveryLength) {
  EXPECT_EQ(writtenAsXml(bytes(std::string(58, '\0'))),
            framed("<data>\n" + std::string(76, 'A') + "\nAA==\n</data>\n"));
  EXPECT_EQ(writtenAsXml(bytes("")), framed("<data>\n</data>\n"));
  std::string content;
  for (int length = 0; length < 300; ++length) {
    const PropertyList value = PropertyList::array({bytes(content)});
    EXPECT_EQ(parse(writtenAsXml(value)), value) << length;
    content.push_back(static_cast<char>(length * 37));
  }
}

TEST(XmlReaderTest, TakesADocumentWithoutDeclarationAndTypeAndOneWithAll) {
  EXPECT_EQ(parse("<plist><true/></plist>").asBoolean(), true);
  EXPECT_EQ(parse("\xEF\xBB\xBF<?xml version='1.0' encoding = \"utf-8\" standalone='yes' ?>\r\n<!-- one -->\n"
                  "<?an instruction?><!DOCTYPE plist SYSTEM \"file://localhost/x.dtd\"><!---->\n"
                  "<plist version='1.0' ><!-- two --><true/><?three?> </plist >\n<!-- four --> ")
                .asBoolean(),
            true);
  EXPECT_TRUE(parse("<!DOCTYPE plist><plist><true/></plist>"));
  EXPECT_TRUE(parse("<!DOCTYPE plist PUBLIC '-//x//y' \"z'\" ><plist><true/></plist>"));
  EXPECT_TRUE(parse(" <plist><true/></plist>"));
}

TEST(XmlReaderTest, RefusesWhatIsWrongAroundTheValue) {
  for (const char* bad :
       {"",
        " ",
        "<",
        "plist",
        "<plist",
        "<plist>",
        "<plist/>",
        "<plist></plist>",
        "<plist>text</plist>",
        "<plist><true/>",
        "<plist><true/></plist",
        "<plist><true/></plist>x",
        "<plist><true/></plist><plist/>",
        "<plist><true/><true/></plist>",
        "<plist><true/>x</plist>",
        "<true/>",
        "<dict></dict>",
        "<Plist><true/></Plist>",
        "<plist2><true/></plist2>",
        "<plist><true/></dict>",
        " <?xml version=\"1.0\"?><plist><true/></plist>",
        "<?xml version=\"1.1\"?><plist><true/></plist>",
        "<?xml?><plist><true/></plist>",
        "<?xml encoding=\"UTF-8\"?><plist><true/></plist>",
        "<?xml version=\"1.0\" encoding=\"ISO-8859-1\"?><plist><true/></plist>",
        "<?xml version=\"1.0\" encoding=\"UTF-16\"?><plist><true/></plist>",
        "<?xml version=\"1.0\"encoding=\"UTF-8\"?><plist><true/></plist>",
        "<?xml version=\"1.0\" standalone=\"yes\" encoding=\"UTF-8\"?><plist><true/></plist>",
        "<?xml version=\"1.0\" standalone=\"maybe\"?><plist><true/></plist>",
        "<?xml version=\"1.0\"><plist><true/></plist>",
        "<?XML a?><plist><true/></plist>",
        "<? a?><plist><true/></plist>",
        "<?a b><plist><true/></plist>",
        "<!-- a -- b --><plist><true/></plist>",
        "<!-- a ---><plist><true/></plist>",
        "<!-- <plist><true/></plist>",
        "<!DOCTYPE dict><plist><true/></plist>",
        "<!DOCTYPEplist><plist><true/></plist>",
        "<!DOCTYPE plist><!DOCTYPE plist><plist><true/></plist>",
        "<plist><!DOCTYPE plist><true/></plist>",
        "<!DOCTYPE plist PUBLIC \"{\" \"x\"><plist><true/></plist>",
        "<!DOCTYPE plist PUBLIC \"x\"><plist><true/></plist>",
        "<!DOCTYPE plist SYSTEM><plist><true/></plist>",
        "<plist version=1><true/></plist>",
        "<plist other=\"1\"><true/></plist>",
        "<plist version=\"1\" version=\"1\"><true/></plist>",
        "<plist version=\"<\"><true/></plist>",
        "<plist version=\"&lt;\"><true/></plist>",
        "<plistversion=\"1.0\"><true/></plist>",
        "<plist xmlns:a=\"b\"><true/></plist>"}) {
    EXPECT_FALSE(parse(bad)) << bad;
  }
}

// The text in UTF-16, its bytes in this order, without a mark. ASCII and U+1F600 only.
std::string utf16(std::string_view text, bool isBigEndian) {
  std::string bytes;
  const auto add = [&](unsigned unit) {
    const char high = static_cast<char>(unit >> 8);
    const char low = static_cast<char>(unit);
    bytes += isBigEndian ? high : low;
    bytes += isBigEndian ? low : high;
  };
  for (std::size_t i = 0; i < text.size(); ++i) {
    if (text[i] != '\xF0') {
      add(static_cast<unsigned char>(text[i]));
      continue;
    }
    add(0xD83D);
    add(0xDE00);
    i += 3;
  }
  return bytes;
}

TEST(XmlReaderTest, ReadsUtf16WithItsMarkWhateverItsByteOrder) {
  const std::string smile = "\xF0\x9F\x98\x80";
  for (const bool isBigEndian : {true, false}) {
    const std::string mark = isBigEndian ? "\xFE\xFF" : "\xFF\xFE";
    for (const char* declaration :
         {"", "<?xml version='1.0'?>", "<?xml version='1.0' encoding='UTF-16'?>\r\n",
          "<?xml version='1.0' encoding='utf-16' standalone='yes'?>"}) {
      const std::string document =
          declaration + ("<plist><dict><key>a</key><string>x&amp;" + smile + "\r\n</string></dict></plist>");
      EXPECT_EQ(parse(mark + utf16(document, isBigEndian)).find("a").asString(), "x&" + smile + "\n")
          << declaration;
      EXPECT_FALSE(parse(utf16(document, isBigEndian))) << "without a mark it could be anything";
      EXPECT_FALSE(parse(mark + mark + utf16(document, isBigEndian)));
      EXPECT_FALSE(parse(mark + utf16(document, isBigEndian) + "\n")) << "half a character";
      EXPECT_FALSE(parse(mark + utf16(document, !isBigEndian)));
    }
    for (const char* name :
         {"UTF-8", "US-ASCII", "UTF-16LE", "UTF-16BE", "UTF-1", "UTF-160", "ISO-8859-1", ""}) {
      EXPECT_FALSE(parse(
          mark + utf16(std::string("<?xml version='1.0' encoding='") + name + "'?><plist><true/></plist>",
                       isBigEndian)))
          << name;
    }
    const std::string around[] = {utf16("<plist><string>", isBigEndian),
                                  utf16("</string></plist>", isBigEndian)};
    const auto withUnits = [&](std::string_view units) {
      std::string text(units);
      for (std::size_t i = 0; !isBigEndian && i < text.size(); i += 2) std::swap(text[i], text[i + 1]);
      return parse(mark + around[0] + text + around[1]);
    };
    using namespace std::string_view_literals;
    EXPECT_EQ(withUnits("\x20\xAC"sv).asString(), "\xE2\x82\xAC");
    EXPECT_EQ(withUnits("\xFE\xFF"sv).asString(), "\xEF\xBB\xBF") << "inside a text it is a character";
    for (const std::string_view bad : {"\xD8\x3D"sv, "\xDE\x00"sv, "\xD8\x3D\x00a"sv, "\xDE\x00\xD8\x3D"sv,
                                       "\xFF\xFE"sv, "\x00\x00"sv, "\x00\x01"sv}) {
      EXPECT_FALSE(withUnits(bad));
    }
    EXPECT_FALSE(parse(mark));
    EXPECT_FALSE(parse(mark.substr(0, 1)));
  }
}

TEST(XmlReaderTest, ReadsWhatDeclaresUsAsciiAndIsIt) {
  for (const char* name : {"US-ASCII", "us-ascii"}) {
    const std::string declaration = std::string("<?xml version='1.0' encoding='") + name + "'?>";
    EXPECT_EQ(parse(declaration + "<plist><string>a&#233;</string></plist>").asString(), "a\xC3\xA9");
    EXPECT_FALSE(parse(declaration + "<plist><string>\xC3\xA9</string></plist>"));
    EXPECT_FALSE(parse(declaration + "<plist><true/></plist><!-- \xC3\xA9 -->"));
  }
  EXPECT_FALSE(parse("<?xml version='1.0' encoding='ASCII'?><plist><true/></plist>"));
}

TEST(XmlReaderTest, RefusesEveryEntityButThePredefinedAndAnyInternalDocumentType) {
  EXPECT_FALSE(parse("<!DOCTYPE plist []><plist><true/></plist>"));
  EXPECT_FALSE(parse("<!DOCTYPE plist [<!ENTITY a \"b\">]><plist><string>&a;</string></plist>"));
  EXPECT_FALSE(parse(
      "<!DOCTYPE plist SYSTEM \"x\" [<!ENTITY % a SYSTEM \"/etc/passwd\"> %a;]><plist><true/></plist>"));
  EXPECT_FALSE(parseValue("<string>&a;</string>"));
  EXPECT_FALSE(parseValue("<string>&nbsp;</string>"));
  EXPECT_EQ(parseValue("<string>&lt;&gt;&amp;&quot;&apos;</string>").asString(), "<>&\"'");
}

TEST(XmlReaderTest, ReadsCharacterReferencesOfCharactersOnly) {
  EXPECT_EQ(parseValue("<string>&#65;&#x42;&#x0000e9;&#8364;&#x1F600;&#13;&#10;&#9;</string>").asString(),
            "AB\xC3\xA9\xE2\x82\xAC\xF0\x9F\x98\x80\r\n\t");
  for (const char* bad : {"&#0;",     "&#1;",       "&#x1F;",
                          "&#xD800;", "&#xDFFF;",   "&#xFFFE;",
                          "&#xFFFF;", "&#x110000;", "&#99999999999999999999;",
                          "&#;",      "&#x;",       "&#X41;",
                          "&#-1;",    "&# 65;",     "&#65",
                          "&",        "&;",         "&lt",
                          "&lt ;",    "&LT;"}) {
    EXPECT_FALSE(parseValue(std::string("<string>") + bad + "</string>")) << bad;
  }
}

TEST(XmlReaderTest, TextIsJoinedAcrossSectionsCommentsAndInstructions) {
  EXPECT_EQ(
      parseValue("<string>a<!-- no -->b<![CDATA[<c>&amp;]]]]><![CDATA[>d]]><?no?>e</string>").asString(),
      "ab<c>&amp;]]>de");
  EXPECT_EQ(parseValue("<string><![CDATA[]]></string>").asString(), "");
  EXPECT_EQ(parseValue("<integer>1<!-- -->2</integer>").asInteger(), 12);
  EXPECT_EQ(parseValue("<dict><key>a&amp;b</key><true/></dict>").find("a&b").asBoolean(), true);
  EXPECT_EQ(parseValue("<string>a > b ]] > c]>d</string>").asString(), "a > b ]] > c]>d");
  for (const char* bad :
       {"a]]>b", "<![CDATA[a", "<![CDATA[a]]", "<![cdata[a]]>", "a<b/>c", "<!-- -- -->", "<?xml a?>"}) {
    EXPECT_FALSE(parseValue(std::string("<string>") + bad + "</string>")) << bad;
  }
}

TEST(XmlReaderTest, LineEndsBecomeLineFeeds) {
  EXPECT_EQ(parseValue("<string>a\r\nb\rc\n\r\r\nd</string>").asString(), "a\nb\nc\n\n\nd");
  EXPECT_EQ(parseValue("<string><![CDATA[a\r\nb\r]]>\r</string>").asString(), "a\nb\n\n");
}

TEST(XmlReaderTest, RefusesBytesThatAreNoXmlCharacters) {
  for (const std::string& bad :
       {std::string(1, '\0'), std::string("\x01"), std::string("\x0B"), std::string("\x1F"),
        std::string("\xC3"), std::string("\xC0\x80"), std::string("\xED\xA0\x80"),
        std::string("\xEF\xBF\xBE"), std::string("\xEF\xBF\xBF"), std::string("\xF4\x90\x80\x80")}) {
    EXPECT_FALSE(parseValue("<string>a" + bad + "b</string>"));
    EXPECT_FALSE(parseValue("<string>a</string><!--" + bad + "-->"));
    EXPECT_FALSE(parse("<plist><true/></plist>" + bad));
  }
  EXPECT_EQ(parseValue("<string>\x7F\xC2\x80\xEF\xBF\xBD</string>").asString(), "\x7F\xC2\x80\xEF\xBF\xBD");
}

TEST(XmlReaderTest, ReadsEmptyElementsInBothForms) {
  EXPECT_EQ(parseValue("<string/>").asString(), "");
  EXPECT_EQ(parseValue("<string></string>").asString(), "");
  EXPECT_EQ(parseValue("<data />").asData().value().size(), 0u);
  EXPECT_EQ(parseValue("<array/>"), PropertyList::array({}));
  EXPECT_EQ(parseValue("<array> </array >"), PropertyList::array({}));
  EXPECT_EQ(parseValue("<dict\n/>"), PropertyList::dictionary({}));
  EXPECT_EQ(parseValue("<dict><!-- --></dict>"), PropertyList::dictionary({}));
  EXPECT_EQ(parseValue("<true></true>").asBoolean(), true);
  EXPECT_EQ(parseValue("<false/>").asBoolean(), false);
  EXPECT_EQ(parseValue("<dict><key/><true/></dict>").find("").asBoolean(), true);
  for (const char* bad :
       {"<integer/>", "<real/>", "<date/>", "<integer></integer>", "<true>x</true>", "<true/ >", "< true/>",
        "<true></false>", "<true", "<true/", "<true>", "<true></true"}) {
    EXPECT_FALSE(parseValue(bad)) << bad;
  }
}

TEST(XmlReaderTest, RefusesElementsInTheWrongPlaceAndUnknownOnes) {
  for (const char* bad : {"<>a</>",
                          "< >a</ >",
                          "<></>",
                          "< />",
                          "</>",
                          "<key>a</key>",
                          "<array><key>a</key></array>",
                          "<dict><string>a</string></dict>",
                          "<dict><key>a</key></dict>",
                          "<dict><key>a</key><key>b</key></dict>",
                          "<dict><key>a</key><true/><true/></dict>",
                          "<dict>a<key>a</key><true/></dict>",
                          "<array>&#32;</array>",
                          "<array><![CDATA[ ]]></array>",
                          "<array><plist/></array>",
                          "<array><null/></array>",
                          "<array><String/></array>",
                          "<array></dict>",
                          "<array><array></array>",
                          "</array>",
                          "<array></array></array>",
                          "<array a=\"b\"/>",
                          "<string a=\"b\">x</string>",
                          "<string>x</string1>",
                          "<string1>x</string1>",
                          "<string>x</strin>",
                          "<set/>",
                          "<dict><key>a</key>x<true/></dict>"}) {
    EXPECT_FALSE(parseValue(bad)) << bad;
  }
}

TEST(XmlReaderTest, ReadsIntegersOfBothRangesAndHexadecimalOnes) {
  auto number = [](const char* text) { return parseValue(std::string("<integer>") + text + "</integer>"); };
  EXPECT_EQ(number("0").asInteger(), 0);
  EXPECT_EQ(number("-0").asInteger(), 0);
  EXPECT_EQ(number("+7").asInteger(), 7);
  EXPECT_EQ(number(" \n\t007 \r").asInteger(), 7);
  EXPECT_EQ(number("-9223372036854775808").asInteger(), INT64_MIN);
  EXPECT_EQ(number("9223372036854775807").asInteger(), INT64_MAX);
  EXPECT_EQ(number("9223372036854775808").asUnsignedInteger(), std::uint64_t{1} << 63);
  EXPECT_EQ(number("18446744073709551615").asUnsignedInteger(), UINT64_MAX);
  EXPECT_EQ(number("0xfF").asInteger(), 255);
  EXPECT_EQ(number("0XFFFFFFFFFFFFFFFF").asUnsignedInteger(), UINT64_MAX);
  for (const char* bad : {"", " ", "-", "+", "--1", "+-1", "1 2", "1.0", "1e3", "0x", "0xg", "-0x1", "x1",
                          "1_000", "-9223372036854775809", "18446744073709551616", "0x10000000000000000"}) {
    EXPECT_FALSE(number(bad)) << bad;
  }
}

TEST(XmlReaderTest, ReadsReals) {
  auto number = [](const char* text) { return parseValue(std::string("<real>") + text + "</real>"); };
  EXPECT_EQ(number("1").asReal(), 1.0);
  EXPECT_EQ(number("\n -1.5e-3 ").asReal(), -1.5e-3);
  EXPECT_EQ(number("+2.5").asReal(), 2.5);
  EXPECT_EQ(number(".5").asReal(), 0.5);
  EXPECT_EQ(number("inf").asReal(), INFINITY);
  EXPECT_EQ(number("-Infinity").asReal(), -INFINITY);
  EXPECT_TRUE(std::isnan(number("NaN").asReal().value()));
  for (const char* bad :
       {"", "x", "1,5", "+-1", "++1", "1e", "0x1p3", "nan(1)", "nanx", "1 2", "1f", "1e999"}) {
    EXPECT_FALSE(number(bad)) << bad;
  }
}

TEST(XmlReaderTest, ReadsDatesThatExist) {
  auto date = [](const char* text) { return parseValue(std::string("<date>") + text + "</date>"); };
  EXPECT_EQ(date("2001-01-01T00:00:00Z").asDate(), 0.0);
  EXPECT_EQ(date("1970-01-01T00:00:00Z").asDate(), -978307200.0);
  EXPECT_EQ(date("2024-02-29T23:59:59Z").asDate(), 730943999.0);
  EXPECT_EQ(date("0001-01-01T00:00:00Z").asDate(), -63113904000.0);
  EXPECT_EQ(date("9999-12-31T23:59:59Z").asDate(), 252423993599.0);
  for (const char* bad : {"",
                          "2023-02-29T00:00:00Z",
                          "2024-13-01T00:00:00Z",
                          "2024-00-01T00:00:00Z",
                          "2024-01-00T00:00:00Z",
                          "2024-01-32T00:00:00Z",
                          "2024-01-01T24:00:00Z",
                          "2024-01-01T00:60:00Z",
                          "2024-01-01T00:00:60Z",
                          "0000-01-01T00:00:00Z",
                          "2024-01-01T00:00:00",
                          "2024-01-01T00:00:00z",
                          "2024-01-01 00:00:00Z",
                          "2024-1-1T00:00:00Z",
                          "2024-01-01",
                          "+024-01-01T00:00:00Z",
                          " 2024-01-01T00:00:00Z",
                          "2024-01-01T00:00:00Z\n",
                          "2024-01-01T00:00:00.5Z",
                          "10000-01-01T00:00:00Z"}) {
    EXPECT_FALSE(date(bad)) << bad;
  }
}

TEST(XmlReaderTest, ReadsBase64WithWhiteSpaceAnywhere) {
  auto content = [](const std::string& text) -> std::string {
    const PropertyList value = parseValue("<data>" + text + "</data>");
    if (!value) return "(refused)";
    const auto found = value.asData().value();
    return {reinterpret_cast<const char*>(found.data()), found.size()};
  };
  EXPECT_EQ(content("\n\t"), "");
  EXPECT_EQ(content("aGVsbG8gd29ybGQh"), "hello world!");
  EXPECT_EQ(content(" aGV\tsb\nG8 = "), "hello");
  EXPECT_EQ(content("aGVsbA=\r\n="), "hell");
  EXPECT_EQ(content("aGVs<!-- -->bA=="), "hell");
  EXPECT_EQ(content("+/+/"), "\xFB\xFF\xBF");
  for (const char* bad : {"a", "aG", "aGV", "aGVsb", "=", "====", "a===", "aG=", "aG=V",
                          "aGVs=", "aGVsbA==bA==", "aGVs-_==", "aG*V", "aGVsbA===", "aG==aGVs"}) {
    EXPECT_EQ(content(bad), "(refused)") << bad;
  }
}

TEST(XmlReaderTest, OfEqualKeysTheLastStands) {
  const PropertyList value = parseValue(
      "<dict><key>a</key><integer>1</integer><key>b</key><integer>2</integer><key>a</key><integer>3</"
      "integer></dict>");
  ASSERT_EQ(value.size(), 2u);
  EXPECT_EQ(value.keyAt(0), "a");
  EXPECT_EQ(value.at(0).asInteger(), 3);
  EXPECT_EQ(value.find("b").asInteger(), 2);
}

TEST(XmlReaderTest, TakesTheDeepestDocumentAllowedAndNoneThatIsDeeper) {
  auto nested = [](std::size_t levels) {
    std::string document = "<plist>";
    for (std::size_t i = 0; i < levels; ++i) document += "<array>";
    for (std::size_t i = 0; i < levels; ++i) document += "</array>";
    return parse(document + "</plist>");
  };
  const PropertyList deepest = nested(kMaxPropertyListDepth);
  ASSERT_TRUE(deepest);
  for (const PropertyListFormat format : {PropertyListFormat::xml, PropertyListFormat::binary}) {
    const auto written = serializePropertyList(deepest, format);
    ASSERT_TRUE(written);
    EXPECT_EQ(parse(*written), deepest);
  }
  EXPECT_FALSE(nested(kMaxPropertyListDepth + 1));
  EXPECT_FALSE(nested(100000));
  std::string unclosed = "<plist>";
  for (int i = 0; i < 100000; ++i) unclosed += "<dict><key>k</key>";
  EXPECT_FALSE(parse(unclosed));
}

TEST(XmlReaderTest, TakesTheLargestFormAllowedAndNoneThatIsLarger) {
#ifdef __SANITIZE_THREAD__
  GTEST_SKIP() << "64 MiB a byte at a time, and no second thread";
#endif
  const std::size_t frame = writtenAsXml(PropertyList::string("")).size();
  std::string content(kLargestXmlForm - frame, 'x');
  std::string document = writtenAsXml(PropertyList::string(content));
  EXPECT_EQ(document.size(), kLargestXmlForm);
  EXPECT_EQ(parse(document).asString().value().size(), content.size());
  document.push_back('\n');
  EXPECT_FALSE(parse(document));
  content.push_back('x');
  const PropertyList larger = PropertyList::string(content);
  ASSERT_TRUE(larger);
  EXPECT_FALSE(serializePropertyList(larger, PropertyListFormat::xml));
  EXPECT_FALSE(serializePropertyList(larger, PropertyListFormat::binary));
}

TEST(XmlReaderTest, RefusesADocumentThatIndentationWouldMakeTooLarge) {
  // A few hundred bytes a line come from depth alone.
  std::string document = "<plist>";
  for (int i = 0; i < 500; ++i) document += "<array>";
  const std::string tail = [] {
    std::string tags;
    for (int i = 0; i < 500; ++i) tags += "</array>";
    return tags + "</plist>";
  }();
  std::string few = document;
  for (int i = 0; i < 120000; ++i) few += "<true/>";
  EXPECT_TRUE(parse(few + tail));
  std::string many = document;
  for (int i = 0; i < 140000; ++i) many += "<true/>";
  EXPECT_FALSE(parse(many + tail));
}

TEST(XmlReaderTest, NoTruncationIsTaken) {
  std::string document = writtenAsXml(PropertyList::dictionary(
      {{"list", PropertyList::array({PropertyList::integer(12), PropertyList::real(1.5), bytes("abcd"),
                                     PropertyList::date(0), PropertyList::string("a&b")})}}));
  document.pop_back();  // the line feed at the end is not missed
  for (std::size_t length = 0; length < document.size(); ++length) {
    EXPECT_FALSE(parse(document.substr(0, length))) << length;
  }
  EXPECT_TRUE(parse(document));
}

}  // namespace
}  // namespace brenvik

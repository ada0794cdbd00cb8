// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
//
// Every document that the XML reader takes is well-formed, as expat judges it, and holds the text that expat
// finds. (Not the other way round: expat knows all of XML, and we know property lists.)
#include <expat.h>
#include <gtest/gtest.h>

#include <memory>
#include <random>

#include "platform/plist/PropertyListCodec.h"

namespace brenvik {
namespace {

using namespace std::string_literals;

struct Judgement {
  bool wellFormed = false;
  std::vector<std::string> texts;  // of keys and strings, in order
};

Judgement judge(const std::string& document) {
  struct State {
    std::vector<std::string> texts;
    bool inText = false;
  } state;
  // Without a given encoding: expat must come to the one that we assume.
  const std::unique_ptr<XML_ParserStruct, void (*)(XML_Parser)> parser(XML_ParserCreate(nullptr),
                                                                       XML_ParserFree);
  XML_SetUserData(parser.get(), &state);
  XML_SetElementHandler(
      parser.get(),
      [](void* user, const XML_Char* name, const XML_Char**) {
        auto& self = *static_cast<State*>(user);
        self.inText = name == "key"s || name == "string"s;
        if (self.inText) self.texts.emplace_back();
      },
      [](void* user, const XML_Char*) { static_cast<State*>(user)->inText = false; });
  XML_SetCharacterDataHandler(parser.get(), [](void* user, const XML_Char* text, int length) {
    auto& self = *static_cast<State*>(user);
    if (self.inText) self.texts.back().append(text, static_cast<std::size_t>(length));
  });
  const auto status = XML_Parse(parser.get(), document.data(), static_cast<int>(document.size()), XML_TRUE);
  return {status == XML_STATUS_OK, std::move(state.texts)};
}

void collect(const PropertyList& value, std::vector<std::string>& texts) {
  if (const auto text = value.asString()) texts.emplace_back(*text);
  for (std::size_t i = 0; i < value.size(); ++i) {
    if (value.is(PropertyList::Type::dictionary)) texts.emplace_back(value.keyAt(i));
    collect(value.at(i), texts);
  }
}

// Little documents full of what XML has, and of what it nearly has.
std::string randomDocument(std::mt19937& random) {
  static const std::vector<std::string> kProlog{"",
                                                "",
                                                "\xEF\xBB\xBF",
                                                "<?xml version=\"1.0\"?>",
                                                "<?xml version='1.0' encoding='utf-8' standalone='no' ?>\n",
                                                "<?xml version='1.0' encoding='US-ASCII'?>",
                                                "<?xml version='1.0' encoding='UTF-16'?>",
                                                " ",
                                                "<!-- c -->",
                                                "<?p i?>",
                                                "<!DOCTYPE plist>",
                                                "<!DOCTYPE plist PUBLIC \"a\" 'b'>",
                                                "<!DOCTYPE plist SYSTEM \"s\" >"};
  static const std::vector<std::string> kText{"a",
                                              "]]",
                                              "]]>",
                                              ">",
                                              "]",
                                              "&amp;",
                                              "&lt;",
                                              "&#65;",
                                              "&#x1F600;",
                                              "&#13;",
                                              "&#0;",
                                              "&#xFFFE;",
                                              "&a;",
                                              "&",
                                              "\r\n",
                                              "\r",
                                              "\n",
                                              "\t",
                                              " ",
                                              "<![CDATA[",
                                              "]]>",
                                              "<![CDATA[x]]>",
                                              "<!--",
                                              "-->",
                                              "<!-- y -->",
                                              "--",
                                              "<?p?>",
                                              "<?xml?>",
                                              "<?P z",
                                              "?>",
                                              "\xC3\xA9",
                                              "\xEF\xBF\xBD",
                                              "\xEF\xBF\xBE",
                                              "\xED\xA0\x80",
                                              "\xF0\x9F\x98\x80",
                                              "\x7F",
                                              "\x01",
                                              "\"",
                                              "'",
                                              "<",
                                              "0"};
  auto pick = [&random](const std::vector<std::string>& from) { return from[random() % from.size()]; };
  auto text = [&] {
    std::string all;
    for (std::size_t count = random() % 5; count > 0; --count) all += pick(kText);
    return all;
  };
  std::string document;
  for (std::size_t count = random() % 4; count > 0; --count) document += pick(kProlog);
  document += random() % 4 != 0 ? "<plist>" : "<plist version='" + text() + "' >";
  document += random() % 2 != 0
                  ? "<string>" + text() + "</string>"
                  : "<dict><key>" + text() + "</key><array ><string>" + text() + "</string></array></dict>";
  document += "</plist>";
  if (random() % 4 == 0) document += text();
  return document;
}

std::string mutated(const std::string& document, std::mt19937& random) {
  static const std::string kBytes = "<>/!?-[]&;#x\"'= \r\n\t0aX.:_\x01\x7F\xC3\xEF\xBF\xBE";
  std::string changed = document;
  for (std::size_t count = 1 + random() % 3; count > 0 && !changed.empty(); --count) {
    const std::size_t at = random() % changed.size();
    const char byte = kBytes[random() % kBytes.size()];
    switch (random() % 4) {
      case 0:
        changed[at] = byte;
        break;
      case 1:
        changed.insert(at, 1, byte);
        break;
      case 2:
        changed.erase(at, 1 + random() % 3);
        break;
      default:
        changed.insert(at, changed.substr(random() % changed.size(), random() % 12));
        break;
    }
  }
  return changed;
}

// The document in UTF-16 with its mark; what is no UTF-8 in it becomes halves of pairs.
std::string asUtf16(const std::string& document, bool isBigEndian) {
  std::string bytes;
  const auto add = [&](unsigned unit) {
    bytes += static_cast<char>(isBigEndian ? unit >> 8 : unit);
    bytes += static_cast<char>(isBigEndian ? unit : unit >> 8);
  };
  add(0xFEFF);
  for (std::size_t i = 0; i < document.size();) {
    const auto lead = static_cast<unsigned char>(document[i]);
    const std::size_t length = lead < 0x80 ? 1 : lead < 0xE0 ? 2 : lead < 0xF0 ? 3 : 4;
    unsigned c = length == 1 ? lead : lead & (0x7FU >> length);
    bool isWhole = i + length <= document.size() && (lead < 0x80 || lead >= 0xC0);
    for (std::size_t at = i + 1; isWhole && at < i + length; ++at) {
      const auto next = static_cast<unsigned char>(document[at]);
      isWhole = (next & 0xC0) == 0x80;
      c = c << 6 | (next & 0x3F);
    }
    if (!isWhole) {
      add(lead % 2 == 0 ? 0xD83D : 0xDE00);
      ++i;
      continue;
    }
    i += length;
    if (c >= 0x10000) {
      add(0xD800 | ((c - 0x10000) >> 10 & 0x3FF));
      add(0xDC00 | (c & 0x3FF));
    } else {
      add(c);
    }
  }
  return bytes;
}

struct Tally {
  int taken = 0;
  int refused = 0;
};

void compare(const std::string& document, Tally& tally) {
  const PropertyList value = parsePropertyList(std::as_bytes(std::span(document)));
  if (!value) {
    ++tally.refused;
    return;
  }
  ++tally.taken;
  const Judgement judgement = judge(document);
  ASSERT_TRUE(judgement.wellFormed) << document;
  std::vector<std::string> ours;
  collect(value, ours);
  // A key given twice is one entry to us, with the value that stands last: expat has more texts then.
  if (ours.size() == judgement.texts.size()) {
    ASSERT_EQ(ours, judgement.texts) << document;
  }
}

TEST(XmlOracleTest, WhatIsTakenOfRandomMarkupIsWellFormedAndHasTheSameTexts) {
  std::mt19937 random(1);
  Tally tally;
  for (int i = 0; i < 60000 && !HasFatalFailure(); ++i) compare(randomDocument(random), tally);
  EXPECT_GT(tally.taken, 1000);
  EXPECT_GT(tally.refused, 1000);
}

TEST(XmlOracleTest, WhatIsTakenOfRandomMarkupInUtf16IsWellFormedAndHasTheSameTexts) {
  std::mt19937 random(4);
  Tally tally;
  for (int i = 0; i < 60000 && !HasFatalFailure(); ++i) {
    std::string document = asUtf16(randomDocument(random), i % 2 == 0);
    // Now and then a bit turned, a byte lost.
    if (i % 5 == 0) document[random() % document.size()] ^= static_cast<char>(1U << random() % 8);
    if (i % 7 == 0) document.erase(random() % document.size(), 1 + random() % 2);
    compare(document, tally);
  }
  EXPECT_GT(tally.taken, 1000);
  EXPECT_GT(tally.refused, 1000);
}

TEST(XmlOracleTest, WhatIsTakenOfMutatedDocumentsIsWellFormedAndHasTheSameTexts) {
  const std::vector<std::string> documents{
      "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n"
      "<!DOCTYPE plist PUBLIC \"-//Example//DTD PLIST 1.0//EN\" \"http://example.org/PropertyList.dtd\">\n"
      "<plist version=\"1.0\">\n<dict>\n\t<key>a&amp;b</key>\n\t<string>x<![CDATA[<y>]]>z</string>\n"
      "\t<key>c</key><array><integer>1</integer><true/><data>AQID</data></array>\n</dict>\n</plist>\n",
      "<?pi?><!-- comment "
      "--><plist><array><string>\xC3\xA9\xF0\x9F\x98\x80&#8364;</string><string/><dict/></array></plist>",
      "<plist><string>]]</string></plist><!-- after -->"};
  std::mt19937 random(2);
  Tally tally;
  for (int i = 0; i < 60000 && !HasFatalFailure(); ++i) {
    compare(mutated(documents[static_cast<std::size_t>(i) % documents.size()], random), tally);
  }
  EXPECT_GT(tally.taken, 1000);
  EXPECT_GT(tally.refused, 1000);
}

TEST(XmlOracleTest, WhatTheWriterWritesIsWellFormedAndHasTheSameTexts) {
  std::mt19937 random(3);
  for (int i = 0; i < 3000; ++i) {
    std::vector<PropertyList> strings;
    std::vector<std::string> texts;
    for (std::size_t count = random() % 5; count > 0; --count) {
      std::string text;
      for (std::size_t length = random() % 40; length > 0; --length) {
        static const std::string kCharacters = "abc<>&'\"\r\n\t ]\x7F";
        text += random() % 8 == 0 ? "\xE2\x82\xAC"s : kCharacters.substr(random() % kCharacters.size(), 1);
      }
      strings.push_back(PropertyList::string(text));
      texts.push_back(std::move(text));
    }
    const auto written = serializePropertyList(PropertyList::array(strings), PropertyListFormat::xml);
    ASSERT_TRUE(written);
    const Judgement judgement = judge(*written);
    ASSERT_TRUE(judgement.wellFormed) << *written;
    ASSERT_EQ(judgement.texts, texts) << *written;
  }
}

}  // namespace
}  // namespace brenvik

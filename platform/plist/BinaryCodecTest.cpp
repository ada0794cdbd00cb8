// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/resource.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <cmath>
#include <ctime>
#include <functional>
#include <limits>

#include "platform/plist/PropertyListCodec.h"

namespace brenvik {
namespace {

using namespace std::string_literals;

PropertyList parse(std::string_view text) { return parsePropertyList(std::as_bytes(std::span(text))); }

std::string big(std::uint64_t value, std::size_t width) {
  std::string bytes;
  for (std::size_t i = width; i-- > 0;) bytes.push_back(static_cast<char>(i < 8 ? value >> (8 * i) : 0));
  return bytes;
}

// What a file says of itself, right or wrong.
struct Trailer {
  std::uint64_t offsetWidth = 2;
  std::uint64_t referenceWidth = 1;
  std::uint64_t objects = 0;
  std::uint64_t top = 0;
  std::uint64_t table = 0;
  std::string bytes() const {
    return big(0, 6) + big(offsetWidth, 1) + big(referenceWidth, 1) + big(objects, 8) + big(top, 8) +
           big(table, 8);
  }
};

std::string file(const std::vector<std::string>& objects, std::size_t referenceWidth = 1,
                 std::size_t offsetWidth = 2, std::uint64_t top = 0) {
  std::string document = "bplist00";
  std::string offsets;
  for (const std::string& object : objects) {
    offsets += big(document.size(), offsetWidth);
    document += object;
  }
  const Trailer trailer{offsetWidth, referenceWidth, objects.size(), top, document.size()};
  return document + offsets + trailer.bytes();
}

PropertyList parseObject(const std::string& object) { return parse(file({object})); }

std::string writtenAsBinary(const PropertyList& value) {
  return serializePropertyList(value, PropertyListFormat::binary).value_or("(refused)");
}

PropertyList bytes(std::string_view content) { return PropertyList::data(std::as_bytes(std::span(content))); }

#ifdef __SANITIZE_ADDRESS__
constexpr long kHeldBack =
    64 * 1024;  // freed memory that AddressSanitizer keeps from being used again, in KiB
#else
constexpr long kHeldBack = 0;
#endif

// Of this process, which other work on the machine does not lengthen. A virtual machine that stands still
// may, so where it is more than `enough` the work is done again: the least of three counts.
double processorSeconds(double enough, const std::function<void()>& work) {
  double least = HUGE_VAL;
  for (int i = 0; i < 3 && least >= enough; ++i) {
    const std::clock_t start = std::clock();
    work();
    least = std::min(least, static_cast<double>(std::clock() - start) / CLOCKS_PER_SEC);
  }
  return least;
}

// Most memory, in KiB, that a process of its own needs for the work beyond what it needs for none.
long peakMemory(const std::function<void()>& work) {
  auto peak = [](const std::function<void()>& task) {
    const pid_t child = ::fork();
    if (child == 0) {
      task();
      ::_exit(0);
    }
    int status = -1;
    struct rusage usage {};
    EXPECT_EQ(::wait4(child, &status, 0, &usage), child);
    EXPECT_EQ(status, 0);
    return usage.ru_maxrss;
  };
  const long none = peak([] {});
  return peak(work) - none;
}

TEST(BinaryReaderTest, ReadsEveryScalar) {
  EXPECT_EQ(parseObject("\x08").asBoolean(), false);
  EXPECT_EQ(parseObject("\x09").asBoolean(), true);
  EXPECT_EQ(parseObject("\x10\xFF").asInteger(), 255);
  EXPECT_EQ(parseObject("\x11\xFF\xFE").asInteger(), 65534);
  EXPECT_EQ(parseObject("\x12\xFF\xFF\xFF\xFD").asInteger(), 4294967293);
  EXPECT_EQ(parseObject("\x13\xFF\xFF\xFF\xFF\xFF\xFF\xFF\xFC").asInteger(), -4);
  EXPECT_EQ(parseObject("\x13\x7F\xFF\xFF\xFF\xFF\xFF\xFF\xFF").asInteger(), INT64_MAX);
  EXPECT_EQ(parseObject("\x22" + big(0xBFC00000, 4)).asReal(), -1.5);
  EXPECT_EQ(parseObject("\x23" + big(0x3FF8000000000000, 8)).asReal(), 1.5);
  EXPECT_EQ(parseObject("\x33" + big(0x4059000000000000, 8)).asDate(), 100.0);
  EXPECT_EQ(parseObject("\x52hi").asString(), "hi");
  EXPECT_EQ(parseObject("\x50").asString(), "");
  EXPECT_EQ(parseObject("\x5F\x10\x10"s + std::string(16, 'x')).asString(), std::string(16, 'x'));
  EXPECT_EQ(parseObject("\x5F\x13"s + big(3, 8) + "abc").asString(), "abc");
  EXPECT_EQ(parseObject("\x42\0\xFF"s), bytes("\0\xFF"s));
  EXPECT_EQ(parseObject("\x40"), bytes(""));
  EXPECT_EQ(parseObject("\xA0"), PropertyList::array({}));
  EXPECT_EQ(parseObject("\xD0"), PropertyList::dictionary({}));
}

TEST(BinaryReaderTest, ReadsIntegersOfSixteenBytesThatFitEightOnly) {
  EXPECT_EQ(parseObject("\x14" + big(0, 8) + big(5, 8)).asInteger(), 5);
  EXPECT_EQ(parseObject("\x14" + big(0, 8) + big(UINT64_MAX, 8)).asUnsignedInteger(), UINT64_MAX);
  EXPECT_EQ(parseObject("\x14" + big(UINT64_MAX, 8) + big(UINT64_MAX, 8)).asInteger(), -1);
  EXPECT_EQ(parseObject("\x14" + big(UINT64_MAX, 8) + big(std::uint64_t{1} << 63, 8)).asInteger(), INT64_MIN);
  EXPECT_FALSE(parseObject("\x14" + big(1, 8) + big(0, 8)));
  EXPECT_FALSE(parseObject("\x14" + big(UINT64_MAX, 8) + big(0, 8)));
  EXPECT_FALSE(parseObject("\x14" + big(UINT64_MAX - 1, 8) + big(UINT64_MAX, 8)));
}

TEST(BinaryReaderTest, ReadsUtf16AndRefusesUnpairedSurrogates) {
  EXPECT_EQ(parseObject("\x65\0A\0\xE9\x20\xAC\xD8\x3D\xDE\0"s).asString(),
            "A\xC3\xA9\xE2\x82\xAC\xF0\x9F\x98\x80");
  EXPECT_EQ(parseObject("\x61\xFF\xFF").asString(), "\xEF\xBF\xBF");
  EXPECT_EQ(parseObject("\x62\xDB\xFF\xDF\xFF").asString(), "\xF4\x8F\xBF\xBF");
  EXPECT_FALSE(parseObject("\x61\xD8\x3D"));
  EXPECT_FALSE(parseObject("\x61\xDE\0"s));
  EXPECT_FALSE(parseObject("\x62\xD8\x3D\0A"s));
  EXPECT_FALSE(parseObject("\x62\xD8\x3D\xD8\x3D"));
  EXPECT_FALSE(parseObject("\x62\xDE\0\xD8\x3D"s));
}

TEST(BinaryReaderTest, RefusesKindsThatAreNoValues) {
  for (const std::string& bad : {"\x00"s,
                                 "\x01"s,
                                 "\x07"s,
                                 "\x0A"s,
                                 "\x0C"s,
                                 "\x0F"s,
                                 "\x15" + big(0, 32),
                                 "\x20\x01"s,
                                 "\x21\x01\x02"s,
                                 "\x24" + big(0, 16),
                                 "\x30" + big(0, 8),
                                 "\x32" + big(0, 8),
                                 "\x34" + big(0, 16),
                                 "\x71x"s,
                                 "\x88" + big(0, 9),
                                 "\x90"s,
                                 "\xB0"s,
                                 "\xC0"s,
                                 "\xE0"s,
                                 "\xF0"s,
                                 "\x51\xE9"s,
                                 "\x5F\x20\x01"s,
                                 "\x5F\x14" + big(1, 16) + "x",
                                 "\x5F\x01x"s,
                                 "\x5F"s,
                                 "\x5F\x10"s}) {
    EXPECT_FALSE(parseObject(bad)) << testing::PrintToString(bad);
  }
}

TEST(BinaryReaderTest, AReferenceOfAKeyedArchiveIsADictionaryWithItsNumber) {
  const PropertyList value = parse(file({"\xA2\x01\x02", "\x80\x05", "\x83\xFF\xFF\xFF\xFE"}));
  EXPECT_EQ(value,
            PropertyList::array({PropertyList::dictionary({{"CF$UID", PropertyList::integer(5)}}),
                                 PropertyList::dictionary({{"CF$UID", PropertyList::integer(4294967294)}})}));
  EXPECT_EQ(value.at(0).find("CF$UID").asInteger(), 5);
}

TEST(BinaryReaderTest, ADictionaryHasItsKeysBeforeItsValuesAndTheLastOfEqualKeysStands) {
  const std::string document =
      file({"\xD3\x01\x02\x03\x04\x05\x06", "\x51k", "\x51m", "\x51k", "\x10\x01", "\x10\x02", "\x10\x03"});
  const PropertyList value = parse(document);
  ASSERT_EQ(value.size(), 2u);
  EXPECT_EQ(value.keyAt(0), "k");
  EXPECT_EQ(value.find("k").asInteger(), 3);
  EXPECT_EQ(value.find("m").asInteger(), 2);
  EXPECT_FALSE(parse(file({"\xD1\x01\x01", "\x10\x01"}))) << "a key that is no string";
  EXPECT_FALSE(parse(file({"\xD1\x01\x02", "\xA0", "\x10\x01"}))) << "a key that is no string";
}

TEST(BinaryReaderTest, ReadsEveryWidthOfReferencesAndOffsetsAndAnyTop) {
  for (std::size_t width = 1; width <= 8; ++width) {
    const std::string array = "\xA2" + big(0, width) + big(2, width);
    const PropertyList value = parse(file({"\x51"
                                           "a",
                                           array, "\x08"},
                                          width, width, 1));
    EXPECT_EQ(value, PropertyList::array({PropertyList::string("a"), PropertyList::boolean(false)})) << width;
  }
}

TEST(BinaryReaderTest, SharedReferencesAreSharedAndNotCopied) {
  const PropertyList value =
      parse(file({"\xA3\x01\x01\x01", "\xA1\x02", "\x5F\x10\x14" + std::string(20, 'x')}));
  ASSERT_EQ(value.size(), 3u);
  EXPECT_EQ(value.at(0).at(0).asString().value().data(), value.at(2).at(0).asString().value().data());
  EXPECT_LT(writtenAsBinary(value).size(), 90u);
}

TEST(BinaryReaderTest, RefusesTrailersThatLie) {
  const std::string object = "\x51x";
  const std::string body = "bplist00" + object + big(8, 2);
  const Trailer good{2, 1, 1, 0, 10};
  ASSERT_TRUE(parse(body + good.bytes()));
  auto refused = [&](auto change) {
    Trailer trailer = good;
    change(trailer);
    return !parse(body + trailer.bytes());
  };
  for (const std::uint64_t lie : {std::uint64_t{0}, std::uint64_t{9}, std::uint64_t{255}}) {
    EXPECT_TRUE(refused([&](Trailer& t) { t.offsetWidth = lie; }));
    EXPECT_TRUE(refused([&](Trailer& t) { t.referenceWidth = lie; }));
  }
  for (const std::uint64_t lie :
       {std::uint64_t{0}, std::uint64_t{2}, std::uint64_t{3}, std::uint64_t{1} << 32, std::uint64_t{1} << 62,
        std::uint64_t{1} << 63, UINT64_MAX}) {
    EXPECT_TRUE(refused([&](Trailer& t) { t.objects = lie; }));
  }
  for (const std::uint64_t lie : {std::uint64_t{1}, std::uint64_t{1} << 63, UINT64_MAX}) {
    EXPECT_TRUE(refused([&](Trailer& t) { t.top = lie; }));
  }
  for (const std::uint64_t lie : {std::uint64_t{0}, std::uint64_t{7}, std::uint64_t{8}, std::uint64_t{11},
                                  std::uint64_t{12}, std::uint64_t{44}, std::uint64_t{1} << 63, UINT64_MAX}) {
    EXPECT_TRUE(refused([&](Trailer& t) { t.table = lie; })) << lie;
  }
  EXPECT_FALSE(parse("bplist01" + object + big(8, 2) + good.bytes()));
  EXPECT_FALSE(parse("bplist00"));
  EXPECT_FALSE(parse("bplist00" + good.bytes()));
}

TEST(BinaryReaderTest, RefusesOffsetsAndLengthsThatLeadOutOfTheObjects) {
  for (const std::uint64_t lie : {0u, 7u, 10u, 11u, 30u, 65535u}) {
    EXPECT_FALSE(parse("bplist00\x51x" + big(lie, 2) + Trailer{2, 1, 1, 0, 10}.bytes())) << lie;
  }
  for (const std::string& bad : {"\x52x"s,
                                 "\x11\x01"s,
                                 "\x13" + big(0, 7),
                                 "\x14" + big(0, 15),
                                 "\x22\0\0\0"s,
                                 "\x23" + big(0, 7),
                                 "\x33" + big(0, 7),
                                 "\x41"s,
                                 "\x61\0"s,
                                 "\x5F\x10\x02x"s,
                                 "\x5F\x13" + big(UINT64_MAX, 8) + "x",
                                 "\x6F\x13" + big(std::uint64_t{1} << 63, 8) + "xx",
                                 "\x4F\x12" + big(UINT32_MAX, 4),
                                 "\xA1"s,
                                 "\xD1\0"s,
                                 "\xAF\x13" + big(UINT64_MAX, 8),
                                 "\xDF\x13" + big(std::uint64_t{1} << 63, 8) + "\0\0"s,
                                 "\x80"s,
                                 "\x81\x01"s,
                                 "\xA1\x01"s,
                                 "\xA1\xFF"s}) {
    EXPECT_FALSE(parseObject(bad)) << testing::PrintToString(bad);
  }
}

TEST(BinaryReaderTest, RefusesCyclesOfEveryLength) {
  EXPECT_FALSE(parse(file({"\xA1\0"s})));
  EXPECT_FALSE(parse(file({"\xA1\x01", "\xA1\0"s})));
  EXPECT_FALSE(parse(file({"\xA2\x01\x02", "\x08", "\xD1\x03\x04", "\x51k", "\xA1\x02"})));
  EXPECT_FALSE(parse(file({"\xD1\x01\0"s, "\x51k"})));
}

// So many arrays, each within the one before.
std::string nested(std::size_t levels) {
  std::vector<std::string> objects;
  for (std::size_t i = 0; i + 1 < levels; ++i) objects.push_back("\xA1" + big(i + 1, 4));
  objects.emplace_back("\xA0");
  return file(objects, 4, 4);
}

TEST(BinaryReaderTest, TakesTheDeepestDocumentAllowedAndNoneThatIsDeeper) {
  EXPECT_TRUE(parse(nested(kMaxPropertyListDepth)));
  EXPECT_FALSE(parse(nested(kMaxPropertyListDepth + 1)));
  const std::string hostile = nested(100000);
  EXPECT_FALSE(parse(hostile));
  EXPECT_LT(peakMemory([&] { (void)parse(hostile); }), 8 * 1024);
}

TEST(BinaryReaderTest, FindsAPathThatIsTooDeepThroughSharedParts) {
  // The first element of the top is looked at first and is 300 deep; the second reaches it at a depth of 300.
  std::vector<std::string> objects{"\xA2" + big(1, 4) + big(301, 4)};
  for (std::size_t i = 1; i < 300; ++i) objects.push_back("\xA1" + big(i + 1, 4));
  objects.emplace_back("\xA0");
  for (std::size_t i = 301; i < 600; ++i) objects.push_back("\xA1" + big(i + 1, 4));
  objects.push_back("\xA1" + big(1, 4));
  EXPECT_FALSE(parse(file(objects, 4, 4)));
  objects[301] = "\xA1" + big(500, 4);
  EXPECT_TRUE(parse(file(objects, 4, 4)));
}

// Each level has `width` references to the next: width to the power of levels leaves.
std::string bomb(std::size_t levels, std::size_t width) {
  std::vector<std::string> objects;
  for (std::size_t i = 0; i < levels; ++i) {
    objects.push_back((width < 15 ? big(0xA0 + width, 1) : "\xAF\x10" + big(width, 1)) +
                      std::string(width, static_cast<char>(i + 1)));
  }
  objects.emplace_back("\x57leaf???");
  return file(objects, 1, 1);
}

TEST(BinaryReaderTest, RefusesATinyFileThatWouldBeHugeAsXmlAtOnceAndInLittleMemory) {
  // Ten million leaves of 26 bytes and more.
  const std::string hundredsOfMegabytes = bomb(7, 10);
  ASSERT_LT(hundredsOfMegabytes.size(), 140u);
  const std::string beyondCounting = bomb(200, 30);
  for (const std::string& hostile : {hundredsOfMegabytes, beyondCounting, bomb(250, 2), bomb(60, 100)}) {
    EXPECT_LT(processorSeconds(0.5, [&] { EXPECT_FALSE(parse(hostile)); }), 0.5);
    EXPECT_LT(peakMemory([&] { (void)parse(hostile); }), 4 * 1024);
  }
  EXPECT_TRUE(parse(bomb(4, 10))) << "sharing within the limit is fine";
}

TEST(BinaryReaderTest, ASharedExpansionIsMeasuredToTheByte) {
#ifdef __SANITIZE_THREAD__
  GTEST_SKIP() << "64 MiB a byte at a time, and no second thread";
#endif
  // One of everything, many times over, and a text that fills the form up to its last byte.
  const PropertyList everything = PropertyList::array(
      {PropertyList::integer(-12345), PropertyList::unsignedInteger(UINT64_MAX), PropertyList::real(-0.1),
       PropertyList::real(std::numeric_limits<double>::quiet_NaN()), PropertyList::date(-1e9),
       PropertyList::boolean(true), PropertyList::boolean(false), PropertyList::string("<&>\r\n"),
       bytes(std::string(58, 'x')), bytes(""), PropertyList::array({}), PropertyList::dictionary({}),
       PropertyList::dictionary(
           {{"a&b", PropertyList::array({PropertyList::dictionary({{"k", bytes("abc")}})})}})});
  auto document = [&](std::size_t copies, std::size_t filling) {
    return PropertyList::dictionary({{"copies", PropertyList::array(std::vector(copies, everything))},
                                     {"filling", PropertyList::string(std::string(filling, 'x'))}});
  };
  const std::size_t one = serializePropertyList(document(1, 0), PropertyListFormat::xml).value().size();
  const std::size_t two = serializePropertyList(document(2, 0), PropertyListFormat::xml).value().size();
  const std::size_t copies = (kLargestXmlForm - one) / (two - one) - 10;
  const std::size_t filling = kLargestXmlForm - one - (copies - 1) * (two - one);
  const PropertyList largest = document(copies, filling);
  const auto xml = serializePropertyList(largest, PropertyListFormat::xml);
  ASSERT_TRUE(xml);
  EXPECT_EQ(xml->size(), kLargestXmlForm);
  const std::string binary = writtenAsBinary(largest);
  EXPECT_LT(binary.size(), 500000u);
  EXPECT_EQ(parse(binary), largest);

  const PropertyList larger = document(copies, filling + 1);
  EXPECT_FALSE(serializePropertyList(larger, PropertyListFormat::xml));
  EXPECT_EQ(writtenAsBinary(larger), "(refused)");
  // What our writer refuses to write, by hand: the text's length and one byte more of it.
  std::string grown = binary;
  const std::size_t at = grown.find(std::string(filling, 'x'));
  ASSERT_NE(at, std::string::npos);
  const std::uint64_t count = filling + 1;
  std::size_t width = filling < 256 ? 1 : filling < 65536 ? 2 : 4;
  ASSERT_EQ(grown.substr(at - width, width), big(filling, width));
  grown.replace(at - width, width, big(count, width));
  // The last x is followed by the table or by the next object, so the text must not grow into it: put the new
  // text at the end of the objects instead.
  const std::size_t trailer = grown.size() - 32;
  const auto number = [&](std::size_t from, std::size_t bytesWide) {
    std::uint64_t value = 0;
    for (std::size_t i = 0; i < bytesWide; ++i)
      value = value << 8 | static_cast<unsigned char>(grown[from + i]);
    return value;
  };
  const std::uint64_t offsetWidth = number(trailer + 6, 1);
  const std::uint64_t table = number(trailer + 24, 8);
  const std::string object = grown.substr(at - width - 2, width + 2) + std::string(filling + 1, 'x');
  std::string rebuilt = grown.substr(0, table) + object;
  for (std::size_t entry = table; entry < trailer; entry += offsetWidth) {
    const bool isText = number(entry, offsetWidth) == at - width - 2;
    rebuilt += isText ? big(table, offsetWidth) : grown.substr(entry, offsetWidth);
  }
  rebuilt += grown.substr(trailer, 24) + big(table + object.size(), 8);
  EXPECT_FALSE(parse(rebuilt));
  const std::size_t lengthAt = table + 2;
  rebuilt.replace(lengthAt, width, big(filling, width));
  EXPECT_EQ(parse(rebuilt), largest) << "the same file with the length that fits";
}

TEST(BinaryReaderTest, RefusesObjectsThatOverlapToBeCopiedAgainAndAgain) {
  // Thousands of objects that are all the same bytes, claimed from one offset on.
  constexpr std::size_t kObjects = 4000;
  const std::string text = "\x5F\x11" + big(60000, 2) + std::string(60000, 'x');
  std::string array = "\xAF\x11" + big(kObjects, 2);
  for (std::size_t i = 0; i < kObjects; ++i) array += big(i + 1, 2);
  std::string document = "bplist00" + text + array;
  const std::size_t table = document.size();
  document += big(8 + text.size(), 4);
  for (std::size_t i = 0; i < kObjects; ++i) document += big(8, 4);
  document += Trailer{4, 2, kObjects + 1, 0, table}.bytes();
  EXPECT_FALSE(parse(document));
  EXPECT_LT(peakMemory([&] { (void)parse(document); }), 4 * 1024);

  // The same with arrays of many references.
  const std::string shared = "\xAF\x11" + big(30000, 2) + std::string(60000, '\xFF');
  document = "bplist00" + shared + array;
  document += big(8 + shared.size(), 4);
  for (std::size_t i = 0; i < kObjects; ++i) document += big(8, 4);
  document += Trailer{4, 2, kObjects + 1, 0, 8 + shared.size() + array.size()}.bytes();
  EXPECT_FALSE(parse(document));
}

TEST(BinaryReaderTest, NoTruncationIsTakenAndNoFlippedBitDoesHarm) {
  const std::string document = writtenAsBinary(PropertyList::dictionary(
      {{"numbers",
        PropertyList::array({PropertyList::integer(1), PropertyList::integer(-1),
                             PropertyList::integer(70000), PropertyList::unsignedInteger(UINT64_MAX),
                             PropertyList::real(1.5), PropertyList::date(5)})},
       {"texts", PropertyList::array({PropertyList::string("plain and longer than fifteen"),
                                      PropertyList::string("\xC3\xA9\xF0\x9F\x98\x80"), bytes("some data")})},
       {"nested",
        PropertyList::dictionary({{"a", PropertyList::array({})}, {"b", PropertyList::boolean(true)}})}}));
  ASSERT_TRUE(parse(document));
  for (std::size_t length = 0; length < document.size(); ++length) {
    EXPECT_FALSE(parse(document.substr(0, length))) << length;
  }
  const long peak = peakMemory([&] {
    for (std::size_t at = 0; at < document.size(); ++at) {
      for (int change = 1; change < 256; ++change) {
        std::string changed = document;
        changed[at] = static_cast<char>(changed[at] ^ change);
        const PropertyList value = parse(changed);
        if (!value) continue;
        (void)serializePropertyList(value, PropertyListFormat::xml);
        const auto again = serializePropertyList(value, PropertyListFormat::binary);
        if (!again || !(parse(*again) == value)) ::_exit(1);
      }
    }
  });
  EXPECT_LT(peak, kHeldBack + 4 * 1024);
}

TEST(BinaryWriterTest, WritesEqualScalarsAndSharedContainersOnce) {
  const PropertyList shared =
      PropertyList::array({PropertyList::string("x"), PropertyList::string("x"), PropertyList::integer(9)});
  const std::string written = writtenAsBinary(
      PropertyList::array({shared, shared, PropertyList::string("x"), PropertyList::integer(9)}));
  EXPECT_EQ(written, file({"\xA4\x01\x01\x02\x03", "\xA3\x02\x02\x03", "\x51x", "\x10\x09"}, 1, 1));
}

TEST(BinaryWriterTest, DoesNotTakeValuesOfDifferentTypesForOne) {
  const PropertyList value = PropertyList::array(
      {PropertyList::integer(1), PropertyList::boolean(true), PropertyList::real(5e-324),
       PropertyList::date(5e-324), PropertyList::string("a"), bytes("a"), PropertyList::array({}),
       PropertyList::dictionary({}), PropertyList::integer(0), PropertyList::boolean(false),
       PropertyList::real(0.0), PropertyList::real(-0.0), PropertyList::string(""), bytes("")});
  const PropertyList again = parse(writtenAsBinary(value));
  EXPECT_EQ(again, value);
  EXPECT_TRUE(std::signbit(again.at(11).asReal().value()));
  EXPECT_FALSE(std::signbit(again.at(10).asReal().value()));
}

TEST(BinaryWriterTest, UsesTheNarrowestFormOfEveryNumber) {
  auto object = [](const PropertyList& value) {
    const std::string written = writtenAsBinary(value);
    return written.substr(8, written.size() - 8 - 32 - 1);
  };
  EXPECT_EQ(object(PropertyList::integer(255)), "\x10\xFF");
  EXPECT_EQ(object(PropertyList::integer(256)), "\x11\x01\0"s);
  EXPECT_EQ(object(PropertyList::integer(65536)), "\x12\0\x01\0\0"s);
  EXPECT_EQ(object(PropertyList::integer(std::int64_t{1} << 32)), "\x13" + big(std::uint64_t{1} << 32, 8));
  EXPECT_EQ(object(PropertyList::integer(-1)), "\x13" + big(UINT64_MAX, 8));
  EXPECT_EQ(object(PropertyList::unsignedInteger(UINT64_MAX)), "\x14" + big(0, 8) + big(UINT64_MAX, 8));
  EXPECT_EQ(object(PropertyList::real(1.5)), "\x23" + big(0x3FF8000000000000, 8));
  EXPECT_EQ(object(PropertyList::string("\xC3\xA9\xF0\x9F\x98\x80")), "\x63\0\xE9\xD8\x3D\xDE\0"s);
}

TEST(BinaryWriterTest, WidthsOfOffsetsAndReferencesGrowWithTheDocument) {
  for (const std::size_t count :
       {1u, 14u, 15u, 100u, 254u, 255u, 256u, 300u, 65534u, 65535u, 65536u, 70000u}) {
    std::vector<PropertyList> elements;
    for (std::size_t i = 0; i < count; ++i)
      elements.push_back(PropertyList::integer(static_cast<std::int64_t>(i)));
    const PropertyList value = PropertyList::array(elements);
    const std::string written = writtenAsBinary(value);
    EXPECT_EQ(written[written.size() - 25], count < 256 ? 1 : count < 65536 ? 2 : 4) << count;
    EXPECT_EQ(parse(written), value) << count;
  }
}

TEST(BinaryWriterTest, TextsOfEveryLengthComeBack) {
  for (const std::size_t length : {0u, 14u, 15u, 16u, 255u, 256u, 65535u, 65536u, 100000u}) {
    std::string accented;
    for (std::size_t i = 0; i < length; ++i) accented += "\xC3\xA9";
    const PropertyList value =
        PropertyList::array({PropertyList::string(std::string(length, 'x')), PropertyList::string(accented),
                             bytes(std::string(length, '\xFE'))});
    EXPECT_EQ(parse(writtenAsBinary(value)), value) << length;
  }
}

TEST(BinaryWriterTest, RefusesNoValueAndWhatIsNestedTooDeep) {
  EXPECT_EQ(writtenAsBinary(PropertyList()), "(refused)");
  PropertyList value = PropertyList::array({});
  for (std::size_t i = 1; i < kMaxPropertyListDepth; ++i) value = PropertyList::array({value});
  EXPECT_EQ(parse(writtenAsBinary(value)), value);
  value = PropertyList::array({value});
  EXPECT_FALSE(serializePropertyList(value, PropertyListFormat::binary));
  EXPECT_FALSE(serializePropertyList(value, PropertyListFormat::xml));
}

TEST(BinaryWriterTest, FindsAPathThatIsTooDeepThroughSharedParts) {
  PropertyList part = PropertyList::array({PropertyList::integer(1)});
  for (int i = 1; i < 300; ++i) part = PropertyList::array({part});
  PropertyList path = part;
  for (int i = 0; i < 300; ++i) path = PropertyList::array({path});
  EXPECT_FALSE(serializePropertyList(PropertyList::array({part, path}), PropertyListFormat::binary));
  EXPECT_FALSE(serializePropertyList(PropertyList::array({path, part}), PropertyListFormat::binary));
}

TEST(BinaryWriterTest, AnExponentialValueIsRefusedInBothFormatsAtOnce) {
  PropertyList value = PropertyList::array({PropertyList::array({})});
  for (int i = 0; i < 400; ++i) value = PropertyList::array({value, value});
  for (const PropertyListFormat format : {PropertyListFormat::xml, PropertyListFormat::binary}) {
    EXPECT_LT(processorSeconds(10, [&] { EXPECT_FALSE(serializePropertyList(value, format)); }), 10);
  }
}

}  // namespace
}  // namespace brenvik

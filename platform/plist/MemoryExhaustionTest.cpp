// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
//
// Every allocation of every operation fails once, alone and with all that follow it. Not with
// a sanitizer, which has the C library's functions to itself.
#include <gtest/gtest.h>

#include <functional>
#include <optional>

#include "platform/base/fakes/FailingMalloc.h"
#include "platform/plist/PropertyListCodec.h"

#ifndef BRENVIK_MALLOC_IS_TAKEN

namespace brenvik {
namespace {

// `operation` has a result, or throws std::bad_alloc; `check` tells whether the last result was right.
void failEveryAllocation(const std::function<void()>& operation, const std::function<bool()>& check) {
  operation();
  ASSERT_TRUE(check());
  for (const auto howMany : {FailingMalloc::HowMany::one, FailingMalloc::HowMany::all}) {
    long failed = 0;
    while (true) {
      std::optional<FailingMalloc> failing(std::in_place, failed, howMany);
      bool isDone = true;
      try {
        operation();
      } catch (const std::bad_alloc&) {
        isDone = false;
      }
      failing.reset();
      if (FailingMalloc::failures() == 0) break;
      if (isDone) {
        ASSERT_TRUE(check()) << "allocation " << failed;
      }
      ++failed;
    }
    EXPECT_GT(failed, 0);
  }
}

PropertyList sample() {
  std::vector<std::pair<std::string, PropertyList>> entries;
  for (int i = 0; i < 40; ++i) {
    const std::string name = "entry " + std::to_string(i);
    entries.emplace_back(name, PropertyList::array({PropertyList::integer(i), PropertyList::real(i + 0.5),
                                                    PropertyList::string(std::string(300, '<') + name),
                                                    PropertyList::array({PropertyList::date(i)})}));
  }
  return PropertyList::dictionary(entries);
}

class MemoryExhaustionTest : public testing::TestWithParam<PropertyListFormat> {};

TEST_P(MemoryExhaustionTest, ReadingGivesTheValueOrThrows) {
  const PropertyList value = sample();
  const std::string document = serializePropertyList(value, GetParam()).value();
  PropertyList read;
  failEveryAllocation([&] { read = parsePropertyList(std::as_bytes(std::span(document))); },
                      [&] { return read == value; });
}

TEST_P(MemoryExhaustionTest, WritingGivesTheDocumentOrThrows) {
  const PropertyList value = sample();
  const std::string document = serializePropertyList(value, GetParam()).value();
  std::optional<std::string> written;
  failEveryAllocation(
      [&] {
        written.reset();
        written = serializePropertyList(value, GetParam());
      },
      [&] { return written == document; });
}

INSTANTIATE_TEST_SUITE_P(BothFormats, MemoryExhaustionTest,
                         testing::Values(PropertyListFormat::xml, PropertyListFormat::binary));

TEST(MemoryExhaustionTest, ReadingWhatMustBeMeasuredExactlyGivesTheValueOrThrows) {
  // So many small things that the quick bound of the size as XML does not do.
  const PropertyList row = PropertyList::array(std::vector(1000, PropertyList::boolean(true)));
  const PropertyList value = PropertyList::array(std::vector(3000, row));
  const std::string document = serializePropertyList(value, PropertyListFormat::binary).value();
  PropertyList read;
  failEveryAllocation([&] { read = parsePropertyList(std::as_bytes(std::span(document))); },
                      [&] { return read == value; });
}

TEST(MemoryExhaustionTest, BuildingGivesTheValueOrThrows) {
  const PropertyList part = PropertyList::string(std::string(1000, 'x'));
  const PropertyList whole = PropertyList::dictionary({{"a", part}, {"b", PropertyList::array({part})}});
  PropertyList made;
  failEveryAllocation([&] { made = whole.withEntry("c", part); },
                      [&] { return made.size() == 3 && made.find("c") == part; });
  failEveryAllocation([&] { made = PropertyList::string("a text that takes memory"); },
                      [&] { return made.asString() == "a text that takes memory"; });
  std::vector<PropertyList> elements;
  std::vector<std::pair<std::string, PropertyList>> entries;
  failEveryAllocation(
      [&] {
        {
          const FailingMalloc::Pause pause;
          elements = {part, whole};
          entries = {{"part", part}, {"whole", whole}};
        }
        (void)PropertyList::array(elements);
        made = PropertyList::dictionary(entries);
      },
      [&] { return made.find("whole") == whole; });
}

TEST(MemoryExhaustionTest, ComparisonGivesTheAnswerOrThrows) {
  const PropertyList one = sample();
  const PropertyList other = sample();
  bool equal = false;
  failEveryAllocation([&] { equal = one == other; }, [&] { return equal; });
}

}  // namespace
}  // namespace brenvik

#else

TEST(MemoryExhaustionTest, NeedsTheAllocatorForItself) { GTEST_SKIP() << "a sanitizer has it"; }

#endif

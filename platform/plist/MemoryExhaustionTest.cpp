// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
//
// Every allocation of every operation fails once, alone and with all that follow it. The C library's
// functions are replaced for this program; sanitizers have replaced them already, so there these tests are
// skipped.
#include <gtest/gtest.h>

#include <cstdlib>
#include <functional>

#include "platform/plist/PropertyListCodec.h"

#if defined(__SANITIZE_ADDRESS__) || defined(__SANITIZE_THREAD__)
#define BRENVIK_MALLOC_IS_TAKEN
#elif defined(__has_feature)
#if __has_feature(address_sanitizer) || __has_feature(thread_sanitizer)
#define BRENVIK_MALLOC_IS_TAKEN
#endif
#endif

#ifndef BRENVIK_MALLOC_IS_TAKEN

namespace {

constinit thread_local bool armed = false;
constinit thread_local bool allFollowing = false;
constinit thread_local long untilFailure = 0;
constinit thread_local long failures = 0;

bool failsNow() {
  if (!armed || untilFailure-- > 0) return false;
  if (untilFailure != -1 && !allFollowing) return false;
  ++failures;
  return true;
}

}  // namespace

extern "C" {
// The names under which the C library keeps its own functions reachable.
// NOLINTBEGIN(bugprone-reserved-identifier)
void* __libc_malloc(std::size_t size);
void* __libc_calloc(std::size_t count, std::size_t size);
void* __libc_realloc(void* memory, std::size_t size);
// NOLINTEND(bugprone-reserved-identifier)
void* malloc(std::size_t size) { return failsNow() ? nullptr : __libc_malloc(size); }
void* calloc(std::size_t count, std::size_t size) {
  return failsNow() ? nullptr : __libc_calloc(count, size);
}
void* realloc(void* memory, std::size_t size) { return failsNow() ? nullptr : __libc_realloc(memory, size); }
}

namespace brenvik {
namespace {

// `operation` has a result, or throws std::bad_alloc; `check` tells whether the last result was right.
void failEveryAllocation(const std::function<void()>& operation, const std::function<bool()>& check) {
  operation();
  ASSERT_TRUE(check());
  for (const bool following : {false, true}) {
    long failed = 0;
    while (true) {
      armed = true;
      allFollowing = following;
      untilFailure = failed;
      failures = 0;
      bool isDone = true;
      try {
        operation();
      } catch (const std::bad_alloc&) {
        isDone = false;
      }
      armed = false;
      if (failures == 0) break;
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
        const bool wasArmed = std::exchange(armed, false);
        elements = {part, whole};
        entries = {{"part", part}, {"whole", whole}};
        armed = wasArmed;
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

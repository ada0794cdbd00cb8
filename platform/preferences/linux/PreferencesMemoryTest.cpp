// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
//
// Every allocation of a set and of a read fails once, alone and with all that follow it. Not
// with a sanitizer, which has the C library's functions to itself.
#include <gtest/gtest.h>

#include <optional>
#include <span>
#include <string>

#include "platform/base/fakes/FailingMalloc.h"
#include "platform/log/Log.h"
#include "platform/plist/PropertyListCodec.h"
#include "platform/preferences/linux/TestHome.h"

#ifndef BRENVIK_MALLOC_IS_TAKEN

namespace brenvik {
namespace {

constexpr auto kUser = UserScope::currentUser;
constexpr auto kHost = HostScope::anyHost;
constexpr const char kDomain[] = "com.example.memory";

class PreferencesMemoryTest : public testing::TestWithParam<FailingMalloc::HowMany> {
 protected:
  PreferencesMemoryTest() { setLogSink(nullptr); }

  // Runs `work` with one allocation after the other failing, until it needs no more.
  template <typename Prepare, typename Work>
  void failEveryAllocation(Prepare prepare, Work work) {
    long next = 0;
    while (true) {
      ASSERT_NO_FATAL_FAILURE(prepare());
      std::optional<FailingMalloc> failing(std::in_place, next, GetParam());
      const bool answer = work();
      failing.reset();
      SCOPED_TRACE("allocation " + std::to_string(next));
      ASSERT_NO_FATAL_FAILURE(check(answer));
      if (FailingMalloc::failures() == 0) break;
      ++next;
    }
    EXPECT_TRUE(wasAnswered) << "without a failure it succeeds";
    EXPECT_GT(next, 10);
  }

  // False when memory ran out.
  template <typename Work>
  static bool isDone(Work work) {
    try {
      work();
      return true;
    } catch (const std::bad_alloc&) {
      return false;
    }
  }

  void check(bool answer) {
    wasAnswered = answer;
    ASSERT_EQ(home.files(), std::vector<std::string>{std::string(kDomain) + ".plist"})
        << "a good file was moved";
    const std::string bytes = TestHome::read(home.file(kDomain));
    const PropertyList stored = parsePropertyList(std::as_bytes(std::span(bytes)));
    if (answer) {
      ASSERT_EQ(stored, after);
    } else {
      // Each key by itself: one of the values may have been lost when it was set.
      for (std::size_t i = 0; i < after.size(); ++i) {
        const PropertyList found = stored.find(after.keyAt(i));
        ASSERT_TRUE(found == after.at(i) || found == before.find(after.keyAt(i))) << after.keyAt(i);
      }
      ASSERT_LE(stored.size(), after.size());
    }
  }

  TestHome home;
  bool wasAnswered = false;
  const PropertyList value = PropertyList::array({PropertyList::string("new"), PropertyList::integer(7)});
  const PropertyList before =
      PropertyList::dictionary({{"key", PropertyList::string("old")},
                                {"nested", PropertyList::array({PropertyList::dictionary({})})}});
  PropertyList after = before;
  std::unique_ptr<FilePreferences> store;
};

TEST_P(PreferencesMemoryTest, ASetIsStoredWholeOrNotAnsweredAndAGoodFileStaysInItsPlace) {
  after = before.withEntry("key", value).withEntry("another", value);
  for (const bool isCached : {false, true}) {
    failEveryAllocation(
        [&] {
          home.write(kDomain, *serializePropertyList(before, PropertyListFormat::binary));
          store = home.open();
          if (isCached) {
            ASSERT_TRUE(store->copyValue("key", kDomain, kUser, kHost));
          }
        },
        [&] {
          // Each of them is tried, whatever became of those before.
          const bool isKept = isDone([&] { store->setValue("key", value, kDomain, kUser, kHost); });
          const bool isOtherKept = isDone([&] { store->setValue("another", value, kDomain, kUser, kHost); });
          bool isStored = false;
          return isDone([&] { isStored = store->synchronize(kDomain, kUser, kHost); }) && isKept &&
                 isOtherKept && isStored;
        });
    // And when there is memory again, all is well.
    store->setValue("key", value, kDomain, kUser, kHost);
    store->setValue("another", value, kDomain, kUser, kHost);
    EXPECT_TRUE(store->synchronize(kDomain, kUser, kHost));
    EXPECT_EQ(store->copyValue("another", kDomain, kUser, kHost), value);
  }
}

TEST_P(PreferencesMemoryTest, AReadGivesTheValueOrThrowsAndAGoodFileStaysInItsPlace) {
  failEveryAllocation(
      [&] {
        home.write(kDomain, *serializePropertyList(before, PropertyListFormat::binary));
        store = home.open();
      },
      [&] {
        PropertyList found;
        const bool isKnown = isDone([&] { found = store->copyApplicationValue("nested", kDomain); });
        const FailingMalloc::Pause pause;
        EXPECT_TRUE(!isKnown || found == before.find("nested"));
        return isKnown;
      });
}

INSTANTIATE_TEST_SUITE_P(AloneAndWithAllThatFollow, PreferencesMemoryTest,
                         testing::Values(FailingMalloc::HowMany::one, FailingMalloc::HowMany::all));

}  // namespace
}  // namespace brenvik

#endif

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include <gtest/gtest.h>

#include <cerrno>
#include <memory>
#include <optional>
#include <string>

#include "platform/log/fakes/RecordingLog.h"
#include "platform/preferences/PreferencesStore.h"
#include "platform/preferences/fakes/InMemoryPreferences.h"
#include "platform/preferences/linux/TestHome.h"

// What every preferences store promises, asked of the one with files and of the one that stands in for it.
namespace brenvik {
namespace {

struct InMemoryRig {
  InMemoryDisk disk;
  std::unique_ptr<PreferencesStore> open() { return std::make_unique<InMemoryPreferences>(disk); }
  void setFull(bool isFull) { disk.setFull(isFull); }
};

struct FileRig {
  TestHome home;
  std::optional<SystemCalls> calls;
  std::unique_ptr<PreferencesStore> open() { return home.open(); }
  void setFull(bool isFull) {
    calls.reset();
    if (isFull) calls.emplace().failWrite = ENOSPC;
  }
};

template <typename Rig>
class PreferencesContractTest : public testing::Test {
 protected:
  static constexpr auto kUser = UserScope::currentUser;
  static constexpr auto kHost = HostScope::anyHost;

  static void set(PreferencesStore& store, std::string_view key, std::string_view text) {
    store.setValue(key, PropertyList::string(text), kDomain, kUser, kHost);
  }
  static bool sync(PreferencesStore& store) { return store.synchronize(kDomain, kUser, kHost); }
  static std::string get(PreferencesStore& store, std::string_view key) {
    const PropertyList value = store.copyValue(key, kDomain, kUser, kHost);
    return value ? std::string(value.asString().value_or("(no string)")) : "(none)";
  }

  static constexpr std::string_view kDomain = "com.example.contract";
  RecordingLog log;
  Rig rig;
  std::unique_ptr<PreferencesStore> ours = rig.open();
  std::unique_ptr<PreferencesStore> other = rig.open();
};

using Rigs = testing::Types<InMemoryRig, FileRig>;
TYPED_TEST_SUITE(PreferencesContractTest, Rigs);

TYPED_TEST(PreferencesContractTest, ASetValueIsSeenHereAtOnceAndByOthersOnceItIsSynchronized) {
  EXPECT_EQ(this->get(*this->ours, "key"), "(none)");
  EXPECT_EQ(this->get(*this->other, "key"), "(none)");
  this->set(*this->ours, "key", "value");
  EXPECT_EQ(this->get(*this->ours, "key"), "value");
  EXPECT_TRUE(this->sync(*this->other));
  EXPECT_EQ(this->get(*this->other, "key"), "(none)");
  EXPECT_TRUE(this->sync(*this->ours));
  EXPECT_EQ(this->get(*this->other, "key"), "value") << "a read alone sees it";
  EXPECT_TRUE(this->log.entries().empty());
}

TYPED_TEST(PreferencesContractTest, WhatOthersReplaceOrRemoveIsSeenByTheNextRead) {
  this->set(*this->ours, "key", "ours");
  this->set(*this->ours, "stays", "here");
  ASSERT_TRUE(this->sync(*this->ours));
  ASSERT_EQ(this->get(*this->ours, "key"), "ours");
  this->set(*this->other, "key", "theirs");
  ASSERT_TRUE(this->sync(*this->other));
  EXPECT_EQ(this->get(*this->ours, "key"), "theirs");
  EXPECT_EQ(this->ours->copyApplicationValue("key", this->kDomain).asString(), "theirs");
  this->other->setValue("key", {}, this->kDomain, this->kUser, this->kHost);
  ASSERT_TRUE(this->sync(*this->other));
  EXPECT_EQ(this->get(*this->ours, "key"), "(none)");
  EXPECT_FALSE(this->ours->copyApplicationValue("key", this->kDomain));
  EXPECT_EQ(this->get(*this->ours, "stays"), "here");
  // A value that waits to be stored is still the one that is read.
  this->set(*this->ours, "key", "waiting");
  this->set(*this->other, "key", "again");
  ASSERT_TRUE(this->sync(*this->other));
  EXPECT_EQ(this->get(*this->ours, "key"), "waiting");
  EXPECT_TRUE(this->sync(*this->ours));
  EXPECT_EQ(this->get(*this->other, "key"), "waiting");
}

TYPED_TEST(PreferencesContractTest, AValueThatWasNotSynchronizedDiesWithItsStore) {
  this->set(*this->ours, "key", "value");
  this->ours.reset();
  EXPECT_TRUE(this->sync(*this->other));
  EXPECT_EQ(this->get(*this->other, "key"), "(none)");
}

TYPED_TEST(PreferencesContractTest, NoValueRemovesTheKey) {
  this->set(*this->ours, "key", "value");
  this->set(*this->ours, "stays", "here");
  ASSERT_TRUE(this->sync(*this->ours));
  this->ours->setValue("key", {}, this->kDomain, this->kUser, this->kHost);
  EXPECT_EQ(this->get(*this->ours, "key"), "(none)");
  EXPECT_EQ(this->get(*this->other, "key"), "value");
  EXPECT_TRUE(this->sync(*this->ours));
  EXPECT_EQ(this->get(*this->ours, "key"), "(none)");
  EXPECT_EQ(this->get(*this->other, "key"), "(none)");
  EXPECT_EQ(this->get(*this->other, "stays"), "here");
  this->ours->setValue("never there", {}, this->kDomain, this->kUser, this->kHost);
  EXPECT_TRUE(this->sync(*this->ours));
}

TYPED_TEST(PreferencesContractTest, TwoStoresKeepEachOthersKeysAndTheLastOneSetsTheSameKey) {
  this->set(*this->ours, "mine", "1");
  this->set(*this->ours, "both", "ours");
  this->set(*this->other, "theirs", "2");
  this->set(*this->other, "both", "other's");
  EXPECT_TRUE(this->sync(*this->ours));
  EXPECT_TRUE(this->sync(*this->other));
  EXPECT_TRUE(this->sync(*this->ours));
  for (PreferencesStore* store : {this->ours.get(), this->other.get()}) {
    EXPECT_EQ(this->get(*store, "mine"), "1");
    EXPECT_EQ(this->get(*store, "theirs"), "2");
    EXPECT_EQ(this->get(*store, "both"), "other's");
  }
}

TYPED_TEST(PreferencesContractTest, EveryTypeComesBackAsItWasSet) {
  const std::byte bytes[] = {std::byte{0}, std::byte{255}};
  const auto everything = PropertyList::dictionary(
      {{"yes", PropertyList::boolean(true)},
       {"no", PropertyList::boolean(false)},
       {"small", PropertyList::integer(INT64_MIN)},
       {"large", PropertyList::unsignedInteger(UINT64_MAX)},
       {"real", PropertyList::real(-0.1)},
       {"text", PropertyList::string("gr\xC3\xBC\xC3\x9F\xE2\x82\xAC\xF0\x9F\x98\x80")},
       {"control", PropertyList::string(std::string_view("\0\x01", 2))},
       {"empty", PropertyList::string("")},
       {"data", PropertyList::data(bytes)},
       {"date", PropertyList::date(123456789.5)},
       {"array", PropertyList::array({PropertyList::array({}), PropertyList::dictionary({})})}});
  for (std::size_t i = 0; i < everything.size(); ++i) {
    this->ours->setValue(everything.keyAt(i), everything.at(i), this->kDomain, this->kUser, this->kHost);
  }
  this->ours->setValue("all", everything, this->kDomain, this->kUser, this->kHost);
  ASSERT_TRUE(this->sync(*this->ours));
  for (PreferencesStore* store : {this->ours.get(), this->other.get()}) {
    for (std::size_t i = 0; i < everything.size(); ++i) {
      const std::string_view key = everything.keyAt(i);
      EXPECT_EQ(store->copyValue(key, this->kDomain, this->kUser, this->kHost), everything.at(i)) << key;
    }
    EXPECT_EQ(store->copyValue("all", this->kDomain, this->kUser, this->kHost), everything);
  }
}

TYPED_TEST(PreferencesContractTest, AnyTextIsAKeyAndNothingElseIs) {
  const std::string keys[] = {
      "", "a", "\xC3\xA9", "\xF0\x9F\x98\x80", std::string("nul\0", 4), std::string(70'000, 'k')};
  for (const std::string& key : keys) this->set(*this->ours, key, "of " + key.substr(0, 8));
  ASSERT_TRUE(this->sync(*this->ours));
  for (const std::string& key : keys) EXPECT_EQ(this->get(*this->other, key), "of " + key.substr(0, 8));

  this->set(*this->ours, "\xFF", "no");
  this->set(*this->ours, "good", "yes");
  EXPECT_FALSE(this->sync(*this->ours));
  EXPECT_EQ(this->log.entries().size(), 1u);
  EXPECT_EQ(this->get(*this->ours, "\xFF"), "(none)");
  EXPECT_EQ(this->get(*this->ours, "good"), "yes") << "the others were stored";
}

TYPED_TEST(PreferencesContractTest, AValueTooDeepToBeReadBackIsNotStored) {
  const auto nested = [](std::size_t levels) {
    PropertyList value = PropertyList::integer(1);
    for (std::size_t i = 0; i < levels; ++i) value = PropertyList::array({value});
    return value;
  };
  this->set(*this->ours, "other", "stays");
  this->ours->setValue("deep", nested(511), this->kDomain, this->kUser, this->kHost);
  EXPECT_TRUE(this->sync(*this->ours));
  this->ours->setValue("deeper", nested(512), this->kDomain, this->kUser, this->kHost);
  EXPECT_FALSE(this->sync(*this->ours));
  ASSERT_EQ(this->log.entries().size(), 1u);
  EXPECT_EQ(this->log.entries()[0].level, static_cast<int>(LogLevel::error));

  EXPECT_EQ(this->get(*this->other, "other"), "stays");
  EXPECT_EQ(this->other->copyValue("deep", this->kDomain, this->kUser, this->kHost), nested(511));
  EXPECT_EQ(this->get(*this->ours, "deeper"), "(none)");
}

// The innermost level of a deep value may be empty, and counts all the same.
TYPED_TEST(PreferencesContractTest, AValueTooDeepForItsEmptyContainersIsNotStoredEither) {
  const auto nested = [](PropertyList innermost, std::size_t levels) {
    for (std::size_t i = 1; i < levels; ++i) innermost = PropertyList::array({innermost});
    return innermost;
  };
  this->set(*this->ours, "other", "stays");
  for (const PropertyList& empty : {PropertyList::array({}), PropertyList::dictionary({})}) {
    this->log.clear();
    this->ours->setValue("deep", nested(empty, 511), this->kDomain, this->kUser, this->kHost);
    EXPECT_TRUE(this->sync(*this->ours));
    this->ours->setValue("deeper", nested(empty, 512), this->kDomain, this->kUser, this->kHost);
    EXPECT_FALSE(this->sync(*this->ours));
    EXPECT_EQ(this->log.entries().size(), 1u);

    EXPECT_TRUE(this->sync(*this->other));
    EXPECT_EQ(this->get(*this->other, "other"), "stays") << "the domain can still be read";
    EXPECT_EQ(this->other->copyValue("deep", this->kDomain, this->kUser, this->kHost), nested(empty, 511));
    EXPECT_EQ(this->get(*this->ours, "deeper"), "(none)");
  }
}

TYPED_TEST(PreferencesContractTest, ScopesAndDomainsAreApart) {
  const PreferencesScope scopes[] = {{UserScope::currentUser, HostScope::anyHost},
                                     {UserScope::currentUser, HostScope::currentHost},
                                     {UserScope::anyUser, HostScope::anyHost},
                                     {UserScope::anyUser, HostScope::currentHost}};
  int number = 0;
  for (const std::string_view domain : {"one", "two"}) {
    for (const auto [user, host] : scopes) {
      this->ours->setValue("key", PropertyList::integer(++number), domain, user, host);
      EXPECT_TRUE(this->ours->synchronize(domain, user, host));
    }
  }
  number = 0;
  for (const std::string_view domain : {"one", "two"}) {
    for (const auto [user, host] : scopes) {
      EXPECT_EQ(this->other->copyValue("key", domain, user, host).asInteger(), ++number);
    }
  }
}

TYPED_TEST(PreferencesContractTest, ApplicationScopeLooksInThisHostThenThisUserThenAnyUser) {
  const auto set = [this](PreferencesStore& store, UserScope user, HostScope host, const char* text) {
    store.setValue("key", PropertyList::string(text), this->kDomain, user, host);
    return store.synchronize(this->kDomain, user, host);
  };
  const auto found = [this] {
    EXPECT_TRUE(this->ours->synchronizeApplication(this->kDomain));
    return std::string(this->ours->copyApplicationValue("key", this->kDomain).asString().value_or("(none)"));
  };
  EXPECT_TRUE(set(*this->other, UserScope::anyUser, HostScope::currentHost, "not looked at"));
  EXPECT_EQ(found(), "(none)");
  EXPECT_TRUE(set(*this->other, UserScope::anyUser, HostScope::anyHost, "any user"));
  EXPECT_EQ(found(), "any user");
  EXPECT_TRUE(set(*this->other, UserScope::currentUser, HostScope::anyHost, "this user"));
  EXPECT_EQ(found(), "this user");
  EXPECT_TRUE(set(*this->other, UserScope::currentUser, HostScope::currentHost, "this host"));
  EXPECT_EQ(found(), "this host");
  this->other->setValue("key", {}, this->kDomain, UserScope::currentUser, HostScope::currentHost);
  EXPECT_TRUE(this->other->synchronize(this->kDomain, UserScope::currentUser, HostScope::currentHost));
  EXPECT_EQ(found(), "this user");
}

TYPED_TEST(PreferencesContractTest, SynchronizingApplicationScopeStoresWhatWasSetInEachOfItsScopes) {
  for (const auto [user, host] : kApplicationScopes) {
    this->ours->setValue("key", PropertyList::boolean(true), this->kDomain, user, host);
  }
  EXPECT_TRUE(this->ours->synchronizeApplication(this->kDomain));
  for (const auto [user, host] : kApplicationScopes) {
    EXPECT_TRUE(this->other->copyValue("key", this->kDomain, user, host));
  }
}

TYPED_TEST(PreferencesContractTest, ADomainThatNamesNoFileHasNoValuesAndTakesNone) {
  using namespace std::string_literals;
  for (const std::string& domain : {""s, "."s, ".."s, "a/b"s, "/etc/passwd"s, "../escape"s, "a\0b"s}) {
    this->log.clear();
    EXPECT_FALSE(this->ours->copyValue("key", domain, this->kUser, this->kHost));
    EXPECT_FALSE(this->ours->copyApplicationValue("key", domain));
    EXPECT_FALSE(this->ours->synchronize(domain, this->kUser, this->kHost));
    EXPECT_FALSE(this->ours->synchronizeApplication(domain));
    this->ours->flushCachesForAnyUser(&domain);
    EXPECT_TRUE(this->log.entries().empty()) << "reading is no error";

    this->ours->setValue("key", PropertyList::boolean(true), domain, this->kUser, this->kHost);
    ASSERT_EQ(this->log.entries().size(), 1u);
    EXPECT_EQ(this->log.entries()[0].level, static_cast<int>(LogLevel::error));
    EXPECT_FALSE(this->ours->synchronize(domain, this->kUser, this->kHost));
    EXPECT_FALSE(this->ours->copyValue("key", domain, this->kUser, this->kHost));
  }
}

TYPED_TEST(PreferencesContractTest, WhatCannotBeStoredIsDroppedAndWhatWasStoredStands) {
  this->set(*this->ours, "key", "old");
  ASSERT_TRUE(this->sync(*this->ours));
  this->rig.setFull(true);
  this->set(*this->ours, "key", "new");
  this->set(*this->ours, "another", "new");
  EXPECT_FALSE(this->sync(*this->ours));
  ASSERT_EQ(this->log.entries().size(), 1u);
  EXPECT_EQ(this->log.entries()[0].level, static_cast<int>(LogLevel::error));
  EXPECT_EQ(this->get(*this->ours, "key"), "old");
  EXPECT_EQ(this->get(*this->ours, "another"), "(none)");
  EXPECT_EQ(this->get(*this->other, "key"), "old");
  EXPECT_TRUE(this->sync(*this->ours)) << "nothing is waiting any more";
  this->rig.setFull(false);
  EXPECT_TRUE(this->sync(*this->ours));
  EXPECT_EQ(this->get(*this->ours, "key"), "old") << "dropped means dropped";
  this->set(*this->ours, "key", "newer");
  EXPECT_TRUE(this->sync(*this->ours));
  EXPECT_TRUE(this->sync(*this->other));
  EXPECT_EQ(this->get(*this->other, "key"), "newer");
}

TYPED_TEST(PreferencesContractTest, AFlushedDomainKeepsWhatIsStoredAndWhatWasNotYetStored) {
  const std::string domain(this->kDomain);
  const std::string unrelated = "com.example.unrelated";
  this->set(*this->ours, "key", "value");
  ASSERT_TRUE(this->sync(*this->ours));
  this->set(*this->ours, "waiting", "ours");

  this->ours->flushCachesForAnyUser(nullptr);
  this->ours->flushCachesForAnyUser(&unrelated);
  this->ours->flushCachesForAnyUser(&domain);
  EXPECT_EQ(this->get(*this->ours, "key"), "value");
  EXPECT_EQ(this->get(*this->ours, "waiting"), "ours");
  EXPECT_TRUE(this->sync(*this->ours));
  EXPECT_EQ(this->get(*this->other, "waiting"), "ours");
}

}  // namespace
}  // namespace brenvik

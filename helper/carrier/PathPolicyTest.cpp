// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "helper/carrier/PathPolicy.h"

#include <gtest/gtest.h>
#include <sched.h>
#include <sys/stat.h>
#include <sys/sysmacros.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <functional>
#include <new>
#include <string>
#include <string_view>
#include <thread>
#include <vector>

#include "platform/files/fakes/TemporaryDirectory.h"
#include "platform/log/fakes/RecordingLog.h"

namespace brenvik {
namespace {

using Entry = RecordingLog::Entry;

constexpr const char* kFixedBundles = "/private/var/mobile/Library/Carrier Bundles";

MobileAccountSource accountAt(const char* home) {
  return [home] { return MobileAccount{home, 501, 501}; };
}

std::vector<Entry> refusalLines(const std::string& path, const std::string& homeBundles) {
  return {RecordingLog::unifiedLine(LogLevel::error, "NOT Allowing path " + path +
                                                         " as it isn't within the wild card directories:"),
          RecordingLog::unifiedLine(LogLevel::error, homeBundles),
          RecordingLog::unifiedLine(LogLevel::error, kFixedBundles)};
}

// The names as written down, each table once more and by hand.
const std::vector<std::string> kListedBelowLibrary{"Preferences/com.norvale.carrier.plist",
                                                   "Preferences/com.norvale.carrier_1.plist",
                                                   "Preferences/com.norvale.carrier_2.plist",
                                                   "Preferences/com.norvale.operator.plist",
                                                   "Preferences/com.norvale.operator_1.plist",
                                                   "Preferences/com.norvale.operator_2.plist",
                                                   "Preferences/com.norvale.carrier.default.plist",
                                                   "Preferences/com.norvale.carrier.bootstrap.plist",
                                                   "Carrier Bundle.bundle",
                                                   "Carrier1Bundle.bundle",
                                                   "Carrier2Bundle.bundle",
                                                   "Operator Bundle.bundle",
                                                   "Operator1Bundle.bundle",
                                                   "Operator2Bundle.bundle",
                                                   "CarrierDefault.bundle",
                                                   "CarrierBootstrap.bundle"};

// Runs `test` in a child whose root directory is `root`; what it returns is the child's exit status.
int inRoot(const std::string& root, const std::function<int()>& test) {
  const pid_t child = ::fork();
  if (child == 0) {
    if (::geteuid() != 0 && ::unshare(CLONE_NEWUSER) != 0) ::_exit(99);
    if (::chroot(root.c_str()) != 0 || ::chdir("/") != 0) ::_exit(98);
    ::_exit(test());
  }
  int status = -1;
  ::waitpid(child, &status, 0);
  return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
}

TEST(PathPolicyTest, EachOfTheThirtyTwoListedPathsPassesAndSaysWhichEntryItMatched) {
  for (const char* base : {"/no/such/home", "/private/var/mobile"}) {
    for (const std::string& name : kListedBelowLibrary) {
      PathPolicy policy(accountAt("/no/such/home"));
      RecordingLog log;
      const std::string path = std::string(base) + "/Library/" + name;
      EXPECT_TRUE(policy.isListedCarrierPath(path.c_str())) << path;
      EXPECT_EQ(
          log.entries(),
          (std::vector{RecordingLog::unifiedLine(LogLevel::info, path + " is within allowed path " + path)}));
    }
  }
}

TEST(PathPolicyTest, APathThatIsNotListedIsRefusedWithoutALine) {
  PathPolicy policy(accountAt("/no/such/home"));
  RecordingLog log;
  for (const char* path :
       {"", "/", "/private/var/mobile/Library/Carrier Bundle.bundleX",
        "/private/var/mobile/Library/Carrier Bundle",
        "/private/var/mobile/Library/Preferences/com.norvale.carrier_3.plist",
        "/private/var/mobile/library/Carrier1Bundle.bundle", "/no/such/home/Library/Carrier Bundles/a"}) {
    EXPECT_FALSE(policy.isListedCarrierPath(path)) << path;
  }
  EXPECT_TRUE(log.entries().empty());
}

TEST(PathPolicyTest, AListedEntryPlusATrailingSlashFailsAsTheMatchIsExact) {
  PathPolicy policy(accountAt("/no/such/home"));
  EXPECT_FALSE(policy.isListedCarrierPath("/private/var/mobile/Library/Carrier Bundle.bundle/"));
}

// Only root makes a device, and not in a user namespace.
bool makesDevices() {
  const TemporaryDirectory directory;
  return ::mknod((directory / "device").c_str(), S_IFCHR | 0600, makedev(1, 3)) == 0;
}

TEST(PathPolicyTest, Entry16PassesWhenItDoesNotExistAndWhenItIsAFileOrALinkButNotWhenItIsADirectory) {
  const char* const entry16 = "/private/var/mobile/Library/Preferences/com.norvale.carrier.plist";
  struct Case {
    const char* what;
    std::function<void(const std::string&)> make;
    int passes;
  };
  const std::vector<Case> cases{
      {"nothing", [](const std::string&) {}, 1},
      {"regular file", [](const std::string& p) { ::close(::creat(p.c_str(), 0600)); }, 1},
      {"link", [](const std::string& p) { ASSERT_EQ(::symlink("/nowhere", p.c_str()), 0); }, 1},
      {"link to a directory", [](const std::string& p) { ASSERT_EQ(::symlink("/", p.c_str()), 0); }, 1},
      {"socket", [](const std::string& p) { ASSERT_EQ(::mknod(p.c_str(), S_IFSOCK | 0600, 0), 0); }, 1},
      {"character device",
       [](const std::string& p) { ASSERT_EQ(::mknod(p.c_str(), S_IFCHR | 0600, makedev(1, 3)), 0); }, 1},
      {"block device",
       [](const std::string& p) { ASSERT_EQ(::mknod(p.c_str(), S_IFBLK | 0600, makedev(7, 0)), 0); }, 1},
      {"directory", [](const std::string& p) { ASSERT_EQ(::mkdir(p.c_str(), 0700), 0); }, 0},
      {"FIFO", [](const std::string& p) { ASSERT_EQ(::mkfifo(p.c_str(), 0600), 0); }, 0},
  };
  for (const Case& which : cases) {
    if (std::string_view(which.what).ends_with("device") && !makesDevices()) continue;
    TemporaryDirectory root;
    root.directory("private/var/mobile/Library/Preferences");
    which.make(root.path() + entry16);
    const int result = inRoot(root.path(), [&] {
      PathPolicy policy(accountAt("/private/var/mobile"));
      return policy.isListedCarrierPath(entry16) ? 1 : 0;
    });
    EXPECT_EQ(result, which.passes) << which.what;
  }
}

TEST(PathPolicyTest, ADirectoryAtAHomeEntryIsRefused) {
  TemporaryDirectory home;
  home.directory("Library/Carrier Bundle.bundle");
  home.link("Library/Carrier1Bundle.bundle", "anywhere");
  PathPolicy policy(accountAt(home.path().c_str()));
  EXPECT_FALSE(policy.isListedCarrierPath((home / "Library/Carrier Bundle.bundle").c_str()));
  EXPECT_TRUE(policy.isListedCarrierPath((home / "Library/Carrier1Bundle.bundle").c_str()));
}

TEST(PathPolicyTest, WhatBeginsWithTheFixedBundlesDirectoryIsAllowedEvenASiblingOfAnotherName) {
  PathPolicy policy(accountAt("/no/such/home"));
  for (const char* path :
       {"/private/var/mobile/Library/Carrier Bundles/x/y", "/private/var/mobile/Library/Carrier BundlesFoo",
        "/private/var/mobile/Library/Carrier BundlesX/a", "/private/var/mobile/Library/Carrier Bundles",
        "/private/var/mobile/Library/Carrier Bundles/../../../../etc/passwd"}) {
    RecordingLog log;
    EXPECT_TRUE(policy.isAllowedCarrierPath(path)) << path;
    EXPECT_EQ(log.entries(),
              (std::vector{RecordingLog::unifiedLine(
                  LogLevel::info, "Allowing path " + std::string(path) + " within " + kFixedBundles)}));
  }
}

TEST(PathPolicyTest, AShorterNameThanTheFixedBundlesDirectoryIsRefusedWithThreeLines) {
  PathPolicy policy(accountAt("/no/such/home"));
  RecordingLog log;
  const std::string path = "/private/var/mobile/Library/Carrier Bundle";
  EXPECT_FALSE(policy.isAllowedCarrierPath(path.c_str()));
  EXPECT_EQ(log.entries(), refusalLines(path, "/no/such/home/Library/Carrier Bundles/"));
}

TEST(PathPolicyTest, TheHomeBundlesDirectoryNeedsItsFinalSlash) {
  PathPolicy policy(accountAt("/no/such/home"));
  RecordingLog log;
  EXPECT_TRUE(policy.isAllowedCarrierPath("/no/such/home/Library/Carrier Bundles/a"));
  EXPECT_EQ(
      log.entries(),
      (std::vector{RecordingLog::unifiedLine(LogLevel::info,
                                             "Allowing path /no/such/home/Library/Carrier Bundles/a within "
                                             "/no/such/home/Library/Carrier Bundles/")}));
  EXPECT_FALSE(policy.isAllowedCarrierPath("/no/such/home/Library/Carrier Bundles"));
}

TEST(PathPolicyTest, WithTheFixedTreeAsHomeTheDirectoryWithoutSlashPassesByTheFixedPrefix) {
  PathPolicy policy(accountAt("/private/var/mobile"));
  RecordingLog log;
  EXPECT_TRUE(policy.isAllowedCarrierPath(kFixedBundles));
  EXPECT_TRUE(policy.isAllowedCarrierPath("/private/var/mobile/Library/Carrier Bundles/a"));
  EXPECT_EQ(
      log.entries(),
      (std::vector{
          RecordingLog::unifiedLine(
              LogLevel::info, "Allowing path " + std::string(kFixedBundles) + " within " + kFixedBundles),
          RecordingLog::unifiedLine(LogLevel::info,
                                    "Allowing path /private/var/mobile/Library/Carrier Bundles/a within "
                                    "/private/var/mobile/Library/Carrier Bundles/")}));
}

TEST(PathPolicyTest, AListedPathIsAllowedWithItsOwnLineOnly) {
  PathPolicy policy(accountAt("/no/such/home"));
  RecordingLog log;
  const std::string path = "/no/such/home/Library/Operator2Bundle.bundle";
  EXPECT_TRUE(policy.isAllowedCarrierPath(path.c_str()));
  EXPECT_EQ(
      log.entries(),
      (std::vector{RecordingLog::unifiedLine(LogLevel::info, path + " is within allowed path " + path)}));
}

TEST(PathPolicyTest, PackagesBelowTmpPassAndWhatOnlyLooksLikeOneFails) {
  PathPolicy policy(accountAt("/no/such/home"));
  for (const char* path :
       {"/tmp/update.tcpk", "/tmpx/a.tcpk", "/tmp.tcpk", "/tmp/../etc/x.tcpk", "/tmp/.tcpk"}) {
    EXPECT_TRUE(policy.isAllowedCarrierPath(path)) << path;
  }
  for (const char* path :
       {"/tmp/update.tcpk.bak", "/tmp/a.tcpk/b.tcpk", "/var/tmp/a.tcpk", "/tmp/update.TCPK", "/tmp/", "/tmp",
        "tmp/a.tcpk", " /tmp/a.tcpk", "/tmp/a.tcp", "/tmp/a.tcpkk"}) {
    EXPECT_FALSE(policy.isAllowedCarrierPath(path)) << path;
  }
}

TEST(PathPolicyTest, APathThatPassesOnlyAsAPackageStillLeavesTheThreeRefusalLines) {
  PathPolicy policy(accountAt("/no/such/home"));
  RecordingLog log;
  EXPECT_TRUE(policy.isAllowedCarrierPath("/tmp/update.tcpk"));
  EXPECT_EQ(log.entries(), refusalLines("/tmp/update.tcpk", "/no/such/home/Library/Carrier Bundles/"));
}

TEST(PathPolicyTest, TheRootDirectoryIsAHomeToo) {
  PathPolicy policy(accountAt("/"));
  EXPECT_TRUE(policy.isListedCarrierPath("//Library/Carrier Bundle.bundle"));
}

// As long as a request's path field can be.
TEST(PathPolicyTest, TheFirst1024BytesOfAPathAreCompared) {
  const std::string home = '/' + std::string(1000, 'h');
  PathPolicy policy(accountAt(home.c_str()));
  const std::string entry = home + "/Library/Preferences/com.norvale.carrier.plist";
  ASSERT_GT(entry.size(), 1024U);
  EXPECT_TRUE(policy.isListedCarrierPath((entry.substr(0, 1024) + "other").c_str()));
  EXPECT_FALSE(policy.isListedCarrierPath((entry.substr(0, 1023) + "Other").c_str()));
}

TEST(PathPolicyTest, WithoutAHomeTheHomeEntriesMatchNothingAndAnEmptyTextStandsInTheLine) {
  for (const char* home : {static_cast<const char*>(nullptr), ""}) {
    PathPolicy policy(accountAt(home));
    RecordingLog log;
    EXPECT_FALSE(policy.isListedCarrierPath("/Library/Carrier Bundle.bundle"));
    EXPECT_FALSE(policy.isListedCarrierPath(""));
    EXPECT_FALSE(policy.isAllowedCarrierPath("/Library/Carrier Bundles/a"));
    EXPECT_EQ(log.entries(), refusalLines("/Library/Carrier Bundles/a", ""));
    EXPECT_TRUE(policy.isListedCarrierPath("/private/var/mobile/Library/Carrier Bundle.bundle"));
  }
}

TEST(PathPolicyTest, TheHomeIsTakenOnceAndAChangeIsNotSeen) {
  int asked = 0;
  const char* home = "/first";
  PathPolicy policy([&] {
    ++asked;
    return MobileAccount{home, 0, 0};
  });
  EXPECT_EQ(asked, 0);
  EXPECT_TRUE(policy.isAllowedCarrierPath("/first/Library/Carrier Bundles/a"));
  home = "/second";
  EXPECT_FALSE(policy.isAllowedCarrierPath("/second/Library/Carrier Bundles/a"));
  EXPECT_TRUE(policy.isListedCarrierPath("/first/Library/CarrierDefault.bundle"));
  EXPECT_EQ(asked, 1);
}

TEST(PathPolicyTest, WithoutMemoryForTheTablesAPathIsRefusedAndTheNextQuestionBuildsThem) {
  bool exhausted = true;
  PathPolicy policy([&exhausted] {
    if (exhausted) throw std::bad_alloc();
    return MobileAccount{"/home", 0, 0};
  });
  RecordingLog log;
  EXPECT_FALSE(policy.isListedCarrierPath("/home/Library/CarrierDefault.bundle"));
  EXPECT_FALSE(policy.isAllowedCarrierPath("/home/Library/Carrier Bundles/a"));
  EXPECT_FALSE(policy.isAllowedCarrierPath("/private/var/mobile/Library/Carrier Bundles/a"));
  EXPECT_TRUE(log.entries().empty());
  exhausted = false;
  EXPECT_TRUE(policy.isListedCarrierPath("/home/Library/CarrierDefault.bundle"));
  EXPECT_TRUE(policy.isAllowedCarrierPath("/home/Library/Carrier Bundles/a"));
}

TEST(PathPolicyTest, ConcurrentFirstQuestionsBuildTheTablesOnce) {
  std::atomic<int> asked{0};
  PathPolicy policy([&] {
    ++asked;
    return MobileAccount{"/home", 0, 0};
  });
  std::vector<std::thread> threads;
  std::atomic<int> allowed{0};
  for (int i = 0; i < 4; ++i) {
    threads.emplace_back([&] {
      allowed += policy.isAllowedCarrierPath("/home/Library/Carrier Bundles/a");
      allowed += policy.isListedCarrierPath("/home/Library/CarrierBootstrap.bundle");
    });
  }
  for (std::thread& thread : threads) thread.join();
  EXPECT_EQ(asked, 1);
  EXPECT_EQ(allowed, 8);
}

}  // namespace
}  // namespace brenvik

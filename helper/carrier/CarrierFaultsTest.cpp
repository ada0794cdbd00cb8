// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
//
// What the requests leave on the disk when it is full, closed to them, cut in two, or when the helper is
// killed: what was there or what was asked for, never half of it. Everything below the requests is real.
#include <gtest/gtest.h>
#include <sched.h>
#include <sys/mount.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <filesystem>
#include <set>
#include <string>
#include <vector>

#include "helper/carrier/CarrierOperations.h"
#include "helper/carrier/CarrierTestSupport.h"
#include "helper/carrier/FileSystemManager.h"
#include "platform/files/fakes/ChildProcesses.h"
#include "platform/files/fakes/TemporaryDirectory.h"
#include "platform/files/fakes/ZipBuilder.h"
#include "platform/files/linux/LinuxFileManager.h"
#include "platform/files/linux/ZipArchiveCopier.h"
#include "platform/log/fakes/RecordingLog.h"

namespace brenvik {
namespace {

constexpr std::uint8_t kUnwritten = 7;

// The seven requests of an account at `home`, as plain functions.
class Requests {
 public:
  explicit Requests(std::string home, uid_t uid = ::getuid(), gid_t gid = ::getgid())
      : home_(std::move(home)), uid_(uid), gid_(gid) {}

  KernelReturn createLink(const std::string& target, const std::string& link) {
    return operations_.createSymlink(kPort, Long(target).data(), Long(link).data());
  }
  KernelReturn replaceLink(const std::string& target, const std::string& link) {
    return operations_.replaceCarrierSymlink(kPort, Long(target).data(), Long(link).data(),
                                             Long("com.norvale.carrier").data());
  }
  KernelReturn remove(const std::string& path) {
    return operations_.removeCarrierFile(kPort, Long(path).data(), Long("").data());
  }
  std::uint8_t copyFile(const std::string& from, const std::string& to, const std::string& name) {
    std::uint8_t success = kUnwritten;
    (void)operations_.copyCarrierFile(kPort, Short(from).data(), Short(to).data(), Short(name).data(),
                                      &success);
    return success;
  }
  std::uint8_t copyLogs(const std::string& from) {
    std::uint8_t success = kUnwritten;
    (void)operations_.copyCrashLogs(kPort, Short(from).data(), &success);
    return success;
  }
  std::uint8_t moveBundle(const std::string& from, const std::string& to, const std::string& name) {
    std::uint8_t success = kUnwritten;
    (void)operations_.moveIntoCarrierBundles(kPort, Short(from).data(), Short(to).data(), Short(name).data(),
                                             &success);
    return success;
  }
  std::uint8_t unpack(const std::string& archive, const std::string& to) {
    std::uint8_t success = kUnwritten;
    (void)operations_.unpackArchive(kPort, Short(archive).data(), Short(to).data(), &success);
    return success;
  }
  std::size_t flushes() const { return preferences_.flushed.size(); }

 private:
  const std::string home_;
  const uid_t uid_;
  const gid_t gid_;
  LinuxFileManager files_;
  FlushRecorder preferences_;
  const MobileAccountSource account_ = [this] { return MobileAccount{home_.c_str(), uid_, gid_}; };
  PathPolicy policy_{account_};
  CarrierOperations operations_{FileSystemManager::factory(files_),
                                [] { return std::make_unique<ZipArchiveCopier>(BRENVIK_TEST_READER); },
                                policy_, preferences_, account_};
};

// Everything below a directory: type, and content or target.
std::set<std::string> everythingIn(const std::string& top) {
  std::set<std::string> found;
  for (const auto& entry : std::filesystem::recursive_directory_iterator(top)) {
    const std::string name = entry.path().string().substr(top.size() + 1);
    if (entry.is_symlink()) {
      found.insert(name + " -> " + std::filesystem::read_symlink(entry.path()).string());
    } else if (entry.is_directory()) {
      found.insert(name + "/");
    } else {
      found.insert(name + ": " + contentOf(entry.path().string()));
    }
  }
  return found;
}

bool isEmptyExceptFor(const std::string& directory, const std::set<std::string>& names) {
  return std::ranges::all_of(std::filesystem::directory_iterator(directory), [&](const auto& entry) {
    return names.contains(entry.path().filename().string());
  });
}

// Runs `body` as root of a user namespace of its own, where an ordinary user stands behind root and no other
// account exists.
void inUserNamespace(const std::function<void()>& body) {
  const pid_t child = ::fork();
  ASSERT_GE(child, 0);
  if (child == 0) {
    if (::geteuid() == 0 && (::setresgid(4712, 4712, 4712) != 0 || ::setresuid(4711, 4711, 4711) != 0)) {
      ::_exit(9);
    }
    if (::access(BRENVIK_TEST_READER, X_OK) != 0) ::_exit(77);
    const std::string uid = std::to_string(::getuid());
    const std::string gid = std::to_string(::getgid());
    if (::unshare(CLONE_NEWUSER) != 0) ::_exit(77);
    std::ofstream("/proc/self/setgroups") << "deny";
    std::ofstream("/proc/self/uid_map") << "0 " + uid + " 1";
    std::ofstream("/proc/self/gid_map") << "0 " + gid + " 1";
    body();
    std::fflush(nullptr);
    ::_exit(testing::Test::HasFailure() ? 1 : 0);
  }
  int status = -1;
  ASSERT_EQ(::waitpid(child, &status, 0), child);
  if (WIFEXITED(status) && WEXITSTATUS(status) == 77) {
    GTEST_SKIP() << "no user namespace to be had, or the reader is out of reach of an ordinary user";
  }
  EXPECT_EQ(status, 0) << "see above";
}

class CarrierFaultsTest : public testing::Test {
 protected:
  // The account's home with something old in every place that the tests write to.
  void makeHome(const std::string& name) const {
    dir.link(name + "/Library/Carrier Bundle.bundle", "old target");
    dir.file(name + "/Library/Carrier Bundles/carrier.plist", "old");
    dir.file(name + "/Library/Carrier Bundles/Old.bundle/Info.plist", "old");
    dir.file(name + "/Library/Logs/CrashReporter/logs/crash", "old");
    dir.file(name + "/Library/link", "old");
  }
  void makeSources() const {
    dir.file("work/carrier.plist", large);
    dir.file("work/New.bundle/Info.plist", large);
    dir.file("work/New.bundle/de.lproj/strings", large);
    dir.file("work/logs/crash", large);
    dir.file("work/logs/fresh", large);
    ZipBuilder zip;
    zip.file("New.bundle/Info.plist", large).file("New.bundle/de.lproj/strings", large);
    dir.file("work/archive.zip", zip.build());
  }

  TemporaryDirectory dir;
  RecordingLog log;
  const std::string large = std::string(30'000, 'n');
  const std::string work = dir / "work";
};

TEST_F(CarrierFaultsTest, OnAFullDiskEveryRoutineLeavesWhatWasThere) {
  makeSources();
  dir.directory("home");
  inPrivateMounts([&] {
    // Neither bytes nor inodes are left.
    ASSERT_EQ(::mount("tmpfs", (dir / "home").c_str(), "tmpfs", 0, "size=256k,nr_inodes=40"), 0);
    makeHome("home");
    dir.file("home/filler", std::string(256 << 10, 'f'));
    for (int i = 0; i < 40; ++i) dir.file("home/inode" + std::to_string(i));
    const std::set<std::string> before = everythingIn(dir / "home");
    Requests requests(dir / "home");
    const std::string library = dir / "home/Library";

    EXPECT_EQ(requests.createLink("new", library + "/link"), 5);
    EXPECT_EQ(requests.createLink("new", library + "/fresh"), 5);
    EXPECT_EQ(requests.replaceLink("new", library + "/Carrier Bundle.bundle"), 5);
    EXPECT_EQ(requests.flushes(), 0U);
    EXPECT_EQ(requests.copyFile(work + "/New.bundle", library + "/Carrier Bundles", "Info.plist"), 0);
    EXPECT_EQ(requests.copyFile(work, library + "/Carrier Bundles", "carrier.plist"), 0);
    EXPECT_EQ(requests.copyFile(work, library + "/Carrier Bundles/made", "carrier.plist"), 0);
    (void)requests.copyLogs(work + "/logs");  // a merge reports nothing
    EXPECT_EQ(requests.moveBundle(work + "/New.bundle", library + "/Carrier Bundles", "New.bundle"), 0);
    EXPECT_EQ(log.entries().back(),
              RecordingLog::bsdLine(SyslogPriority::error, "Failed to move the directory " + work +
                                                               "/New.bundle to " + library +
                                                               "/Carrier Bundles. Error: 28\n"));
    EXPECT_EQ(requests.unpack(work + "/archive.zip", library + "/Carrier Bundles"), kUnwritten);
    EXPECT_EQ(log.entries().back(),
              RecordingLog::bsdLine(SyslogPriority::error, "ArkCopier signaled fatal file error"));
    EXPECT_EQ(requests.unpack(work + "/archive.zip", library + "/fresh/and/deep"), kUnwritten);
    EXPECT_EQ(everythingIn(dir / "home"), before);
    EXPECT_EQ(contentOf(work + "/New.bundle/de.lproj/strings"), large);

    // Removing needs no room, and gives some.
    EXPECT_EQ(requests.remove(library + "/Carrier Bundles/carrier.plist"), 0);
    EXPECT_EQ(requests.replaceLink("new", library + "/Carrier Bundle.bundle"), 0);
    EXPECT_EQ(std::filesystem::read_symlink(library + "/Carrier Bundle.bundle"), "new");
  });
}

TEST_F(CarrierFaultsTest, WhereTheDiskEndsInTheMiddleNothingHalfStays) {
  makeSources();
  dir.directory("home");
  inPrivateMounts([&] {
    // From room for next to nothing to room for nearly all: it ends in another place each time.
    for (int kibibytes = 32; kibibytes <= 96; kibibytes += 4) {
      mountSmallDisk(dir / "home", kibibytes);
      makeHome("home");
      Requests requests(dir / "home");
      const std::string library = dir / "home/Library";
      (void)requests.unpack(work + "/archive.zip", library + "/unpacked");
      (void)requests.copyFile(work, library + "/Carrier Bundles", "carrier.plist");
      (void)requests.copyLogs(work + "/logs");
      const bool moved = requests.moveBundle(work + "/New.bundle", library + "/Carrier Bundles", "New") == 1;
      for (const auto& entry : std::filesystem::recursive_directory_iterator(dir / "home")) {
        if (!entry.is_regular_file()) continue;
        const std::string content = contentOf(entry.path().string());
        EXPECT_TRUE(content == "old" || content == large) << entry.path() << " at " << kibibytes;
      }
      EXPECT_EQ(isThere(library + "/unpacked"), isThere(library + "/unpacked/New.bundle/de.lproj/strings"));
      EXPECT_EQ(isThere(library + "/Carrier Bundles/New/de.lproj/strings"), moved);
      EXPECT_EQ(isThere(work + "/New.bundle/Info.plist"), !moved);
      EXPECT_EQ(isThere(work + "/New.bundle/de.lproj/strings"), !moved);
      EXPECT_TRUE(isEmptyExceptFor(library,
                                   {"Carrier Bundle.bundle", "Carrier Bundles", "Logs", "link", "unpacked"}));
      if (moved) makeSources();
    }
  });
}

TEST_F(CarrierFaultsTest, WhereWritingIsForbiddenEveryRoutineFailsAndChangesNothing) {
  if (::geteuid() != 0) GTEST_SKIP() << "becomes another user";
  const mode_t mask = ::umask(022);  // who may look at everything
  makeSources();
  makeHome("home");
  ::umask(mask);
  ASSERT_EQ(::chmod(dir.path().c_str(), 0755), 0);
  const std::set<std::string> before = everythingIn(dir.path());
  const pid_t child = ::fork();
  if (child == 0) {
    if (::setresgid(4712, 4712, 4712) != 0 || ::setresuid(4711, 4711, 4711) != 0) ::_exit(9);
    Requests requests(dir / "home");
    const std::string library = dir / "home/Library";
    EXPECT_EQ(requests.createLink("new", library + "/link"), 5);
    EXPECT_EQ(requests.replaceLink("new", library + "/Carrier Bundle.bundle"), 5);
    EXPECT_EQ(requests.remove(library + "/Carrier Bundles/carrier.plist"), 5);
    EXPECT_EQ(requests.copyFile(work, library + "/Carrier Bundles", "carrier.plist"), 0);
    EXPECT_EQ(requests.copyFile(work, library + "/Carrier Bundles/made", "carrier.plist"), 0);
    (void)requests.copyLogs(work + "/logs");  // a merge reports nothing
    EXPECT_EQ(requests.moveBundle(work + "/New.bundle", library + "/Carrier Bundles", "New.bundle"), 0);
    EXPECT_EQ(log.entries().back(),
              RecordingLog::bsdLine(SyslogPriority::error, "Failed to move the directory " + work +
                                                               "/New.bundle to " + library +
                                                               "/Carrier Bundles. Error: 13\n"));
    EXPECT_EQ(requests.moveBundle(work + "/New.bundle", library + "/Carrier Bundles/made", "x"), 0);
    EXPECT_EQ(
        log.entries().back(),
        RecordingLog::bsdLine(SyslogPriority::notice, "Failed to create CarrierBundles Dir  to " + library +
                                                          "/Carrier Bundles/made. Error: 13\n"));
    EXPECT_EQ(requests.unpack(work + "/archive.zip", library + "/Carrier Bundles"), kUnwritten);
    EXPECT_EQ(requests.unpack(work + "/archive.zip", library + "/fresh"), kUnwritten);
    std::fflush(nullptr);
    ::_exit(testing::Test::HasFailure() ? 1 : 0);
  }
  int status = -1;
  ::waitpid(child, &status, 0);
  EXPECT_EQ(status, 0);
  EXPECT_EQ(everythingIn(dir.path()), before);
}

TEST_F(CarrierFaultsTest, BetweenTwoMountsEveryRoutineDoesWhatItDoesOnOne) {
  makeSources();
  dir.directory("home");
  inPrivateMounts([&] {
    mountSmallDisk(dir / "home", 1024);
    makeHome("home");
    Requests requests(dir / "home");
    const std::string library = dir / "home/Library";
    EXPECT_EQ(requests.createLink(work, library + "/link"), 0);
    EXPECT_EQ(requests.replaceLink(work, library + "/Carrier Bundle.bundle"), 0);
    EXPECT_EQ(contentOf(library + "/Carrier Bundle.bundle/carrier.plist"), large);
    EXPECT_EQ(requests.copyFile(work, library + "/Carrier Bundles", "carrier.plist"), 1);
    EXPECT_EQ(contentOf(library + "/Carrier Bundles/carrier.plist"), large);
    EXPECT_EQ(requests.copyLogs(work + "/logs"), 1);
    EXPECT_EQ(contentOf(library + "/Logs/CrashReporter/logs/crash"), large);
    EXPECT_EQ(contentOf(library + "/Logs/CrashReporter/logs/fresh"), large);
    EXPECT_EQ(requests.moveBundle(work + "/New.bundle", library + "/Carrier Bundles", "New.bundle"), 1);
    EXPECT_EQ(contentOf(library + "/Carrier Bundles/New.bundle/de.lproj/strings"), large);
    EXPECT_FALSE(isThere(work + "/New.bundle"));
    EXPECT_EQ(requests.unpack(work + "/archive.zip", library + "/Carrier Bundles"), 1);
    EXPECT_EQ(requests.unpack(work + "/archive.zip", library + "/a/b/c"), 1);
    EXPECT_EQ(contentOf(library + "/a/b/c/New.bundle/Info.plist"), large);
    EXPECT_EQ(requests.remove(library + "/Carrier Bundles/carrier.plist"), 0);
  });
}

TEST_F(CarrierFaultsTest, InAUserNamespaceTheRoutinesWorkAndOnlyTheGivingAwayFails) {
  makeSources();
  makeHome("home");
  if (::geteuid() == 0) {
    for (const auto& entry : std::filesystem::recursive_directory_iterator(dir.path())) {
      ASSERT_EQ(::lchown(entry.path().c_str(), 4711, 4712), 0);
    }
    ASSERT_EQ(::chown(dir.path().c_str(), 4711, 4712), 0);
  }
  inUserNamespace([&] {
    Requests requests(dir / "home", 501, 501);  // an account that does not exist there
    const std::string library = dir / "home/Library";
    EXPECT_EQ(requests.createLink("new", library + "/link"), 0);
    EXPECT_EQ(requests.replaceLink("new", library + "/Carrier Bundle.bundle"), 0);
    EXPECT_EQ(requests.copyFile(work, library + "/Carrier Bundles", "carrier.plist"), 0);
    EXPECT_EQ(contentOf(library + "/Carrier Bundles/carrier.plist"), large);
    EXPECT_EQ(requests.copyLogs(work + "/logs"), 1);
    EXPECT_EQ(requests.unpack(work + "/archive.zip", library + "/unpacked"), 1);
    EXPECT_EQ(contentOf(library + "/unpacked/New.bundle/Info.plist"), large);
    EXPECT_EQ(requests.moveBundle(work + "/New.bundle", library + "/Carrier Bundles", "New.bundle"), 1);
    EXPECT_EQ(requests.remove(library + "/Carrier Bundles/carrier.plist"), 0);
  });
}

TEST_F(CarrierFaultsTest, KilledAtAnyMomentEveryPlaceHasTheOldOrTheNew) {
  // In memory where the system has such a place: hundreds of rounds.
  const bool hasMemory = ::access("/dev/shm", W_OK) == 0;
  TemporaryDirectory disk(hasMemory ? std::filesystem::path("/dev/shm")
                                    : std::filesystem::temp_directory_path());
  makeSources();
  const std::string library = disk.directory("home/Library");
  const std::string bundles = disk.directory("home/Library/Carrier Bundles");
  disk.directory("home/Library/Logs/CrashReporter");
  const std::string link = disk.link("home/Library/Carrier Bundle.bundle", "0");
  const std::string file = disk.file("home/Library/Carrier Bundles/carrier.plist", "old");
  const std::string source = disk / "New.bundle";
  for (int round = 0; round < 250; ++round) {
    const pid_t child = ::fork();
    if (child == 0) {
      Requests requests(disk / "home");
      killThisProcessAfter(std::chrono::microseconds(100 + round * 37));
      for (int i = 1;; ++i) {
        (void)requests.replaceLink(std::to_string(i), link);
        (void)requests.createLink(std::to_string(i), library + "/link");
        (void)requests.copyFile(work, bundles, "carrier.plist");
        // The source of the move is itself made in one step.
        (void)requests.unpack(work + "/archive.zip", disk / "unpacked");
        (void)::rename((disk / "unpacked/New.bundle").c_str(), source.c_str());
        (void)requests.moveBundle(source, bundles, std::to_string(i));
        (void)requests.copyLogs(work + "/logs");
        std::filesystem::remove_all(disk / "unpacked");
      }
    }
    ::waitpid(child, nullptr, 0);
    ASSERT_TRUE(S_ISLNK(statOf(link).st_mode)) << round;
    const std::string content = contentOf(file);
    ASSERT_TRUE(content == "old" || content == large) << round << ": " << content.size();
    const auto isWhole = [&](const std::string& bundle) {
      return contentOf(bundle + "/Info.plist") == large && contentOf(bundle + "/de.lproj/strings") == large;
    };
    for (const auto& entry : std::filesystem::directory_iterator(bundles)) {
      const std::string name = entry.path().filename().string();
      if (name == "carrier.plist" || name.starts_with(".brenvik-")) continue;
      ASSERT_TRUE(isWhole(entry.path().string())) << entry.path() << " in round " << round;
    }
    if (isThere(source)) {
      ASSERT_TRUE(isWhole(source)) << round;
    }
    for (const char* name : {"crash", "fresh"}) {
      const std::string copied = library + "/Logs/CrashReporter/logs/" + name;
      if (isThere(copied)) {
        ASSERT_EQ(contentOf(copied), large) << copied << " in round " << round;
      }
    }
    for (const char* made : {"unpacked", "New.bundle"}) std::filesystem::remove_all(disk / made);
    if (round % 2 == 0) {  // the same places as new ones, in every other round
      std::filesystem::remove_all(library + "/Logs/CrashReporter/logs");
      disk.file("home/Library/Carrier Bundles/carrier.plist", "old");
    }
  }
  // Whatever the killed ones left hidden is no obstacle.
  Requests requests(disk / "home");
  EXPECT_EQ(requests.replaceLink("last", link), 0);
  EXPECT_EQ(requests.copyFile(work, bundles, "carrier.plist"), 1);
  EXPECT_EQ(requests.unpack(work + "/archive.zip", disk / "unpacked"), 1);
  EXPECT_EQ(requests.moveBundle(disk / "unpacked/New.bundle", bundles, "Last"), 1);
}

}  // namespace
}  // namespace brenvik

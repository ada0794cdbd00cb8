// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "helper/carrier/CarrierOperations.h"

#include <gtest/gtest.h>
#include <sched.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <sys/sysmacros.h>
#include <sys/wait.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <cstring>
#include <optional>
#include <string>
#include <vector>

#include "helper/carrier/CarrierTestSupport.h"
#include "helper/carrier/FileSystemManager.h"
#include "platform/files/fakes/FaultyFileManager.h"
#include "platform/files/fakes/ScriptedArchiveCopier.h"
#include "platform/files/fakes/TemporaryDirectory.h"
#include "platform/files/linux/LinuxFileManager.h"
#include "platform/log/fakes/RecordingLog.h"

namespace brenvik {
namespace {

using Log = RecordingLog;

class CarrierOperationsTest : public testing::Test {
 protected:
  CarrierOperationsTest() { home.directory("Library"); }

  std::string bundles(const std::string& name) const { return home / ("Library/Carrier Bundles" + name); }

  TemporaryDirectory home;
  TemporaryDirectory elsewhere;
  LinuxFileManager real;
  FaultyFileManager files{real};
  ArchiveScript archive;
  FlushRecorder preferences;
  MobileAccount account{home.path().c_str(), ::getuid(), ::getgid()};
  PathPolicy policy{[this] { return account; }};
  CarrierOperations operations{FileSystemManager::factory(files), archive.factory(), policy, preferences,
                               [this] { return account; }};
  RecordingLog log;
  std::uint8_t success = 7;
};

// ---- createSymlink

TEST_F(CarrierOperationsTest, CreateSymlinkMakesTheLinkAndReplacesAFile) {
  const std::string link = elsewhere.file("link", "old");
  EXPECT_EQ(operations.createSymlink(kPort, Long("/new/target").data(), Long(link).data()), 0);
  EXPECT_EQ(std::filesystem::read_symlink(link), "/new/target");
  EXPECT_EQ(operations.createSymlink(kPort, Long("other").data(), Long(elsewhere / "fresh").data()), 0);
  EXPECT_EQ(std::filesystem::read_symlink(elsewhere / "fresh"), "other");
  EXPECT_TRUE(log.entries().empty());
}

TEST_F(CarrierOperationsTest, CreateSymlinkReplacesALinkAndNotWhatItPointsTo) {
  const std::string target = elsewhere.file("target", "kept");
  const std::string link = elsewhere.link("link", target);
  EXPECT_EQ(operations.createSymlink(kPort, Long("new").data(), Long(link).data()), 0);
  EXPECT_EQ(std::filesystem::read_symlink(link), "new");
  EXPECT_EQ(contentOf(target), "kept");
}

TEST_F(CarrierOperationsTest, CreateSymlinkReplacesAnEmptyDirectoryButNotAFullOne) {
  const std::string empty = elsewhere.directory("empty");
  elsewhere.file("full/file", "kept");
  EXPECT_EQ(operations.createSymlink(kPort, Long("t").data(), Long(empty).data()), 0);
  EXPECT_EQ(std::filesystem::read_symlink(empty), "t");
  EXPECT_EQ(operations.createSymlink(kPort, Long("t").data(), Long(elsewhere / "full").data()), 5);
  EXPECT_EQ(contentOf(elsewhere / "full/file"), "kept");
}

TEST_F(CarrierOperationsTest, CreateSymlinkWithoutAParentDirectoryReturns5) {
  EXPECT_EQ(operations.createSymlink(kPort, Long("t").data(), Long(elsewhere / "no/such/link").data()), 5);
}

TEST_F(CarrierOperationsTest, CreateSymlinkIsNotBoundByThePathPolicy) {
  ASSERT_FALSE(policy.isAllowedCarrierPath((elsewhere / "anywhere").c_str()));
  EXPECT_EQ(operations.createSymlink(kPort, Long("t").data(), Long(elsewhere / "anywhere").data()), 0);
}

TEST_F(CarrierOperationsTest, ALinkThatCannotBeMadeLeavesWhatWasThere) {
  const std::string file = elsewhere.file("file", "kept");
  EXPECT_EQ(operations.createSymlink(kPort, Long("").data(), Long(file).data()), 5);
  EXPECT_EQ(contentOf(file), "kept");
}

TEST_F(CarrierOperationsTest, ItemsOfStrangersUnderHiddenNamesAreNoObstacleAndStay) {
  const std::string file = elsewhere.file("file", "old");
  for (int number = 0; number < 8; ++number) {
    elsewhere.file(".brenvik-link-" + std::to_string(number), "kept");
  }
  elsewhere.file(".brenvik-0123456789abcdef/planted", "kept");
  EXPECT_EQ(operations.createSymlink(kPort, Long("new").data(), Long(file).data()), 0);
  EXPECT_EQ(std::filesystem::read_symlink(file), "new");
  for (int number = 0; number < 8; ++number) {
    EXPECT_EQ(contentOf(elsewhere / (".brenvik-link-" + std::to_string(number))), "kept");
  }
  EXPECT_EQ(contentOf(elsewhere / ".brenvik-0123456789abcdef/planted"), "kept");
  EXPECT_EQ(std::distance(std::filesystem::directory_iterator(elsewhere.path()), {}), 10);
}

TEST_F(CarrierOperationsTest, ALinkThatCannotBeMadeLeavesAnEmptyDirectoryToo) {
  const std::string empty = elsewhere.directory("empty");
  EXPECT_EQ(operations.createSymlink(kPort, Long("").data(), Long(empty).data()), 5);
  EXPECT_EQ(operations.createSymlink(kPort, Long("t").data(), Long(empty + "/").data()), 5);
  EXPECT_TRUE(std::filesystem::is_directory(empty));
}

TEST_F(CarrierOperationsTest, UnterminatedFieldsAreCutAtTheirLastByte) {
  Long target(std::string(1024, 'a'));
  Long link(elsewhere / "link");
  EXPECT_EQ(operations.createSymlink(kPort, target.data(), link.data()), 0);
  EXPECT_EQ(std::filesystem::read_symlink(elsewhere / "link"), std::string(1023, 'a'));
  EXPECT_EQ(target.back(), '\0');
}

TEST_F(CarrierOperationsTest, EveryRoutineTerminatesEachOfItsFields) {
  // Of a field of 1024 or 256 letters nothing may be read behind it: the sanitizers would say so.
  const std::string letters(1024, 'x');
  Long a(letters), b(letters), c(letters);
  (void)operations.replaceCarrierSymlink(kPort, a.data(), b.data(), c.data());
  EXPECT_TRUE(a.back() == '\0' && b.back() == '\0' && c.back() == '\0');
  Long d(letters), e(letters);
  (void)operations.removeCarrierFile(kPort, d.data(), e.data());
  EXPECT_TRUE(d.back() == '\0' && e.back() == '\0');
  Short f(letters), g(letters), h(letters);
  (void)operations.copyCarrierFile(kPort, f.data(), g.data(), h.data(), &success);
  EXPECT_TRUE(f.back() == '\0' && g.back() == '\0' && h.back() == '\0');
  Short i(letters);
  (void)operations.copyCrashLogs(kPort, i.data(), &success);
  EXPECT_EQ(i.back(), '\0');
  files.fail("createDirectory", FileOutcome::failure(EACCES));
  Short j(letters), k(letters), l(letters);
  (void)operations.moveIntoCarrierBundles(kPort, j.data(), k.data(), l.data(), &success);
  EXPECT_TRUE(j.back() == '\0' && k.back() == '\0' && l.back() == '\0');
  Short m(letters), n(letters);
  (void)operations.unpackArchive(kPort, m.data(), n.data(), &success);
  EXPECT_TRUE(m.back() == '\0' && n.back() == '\0');
}

// ---- replaceCarrierSymlink

TEST_F(CarrierOperationsTest, ReplaceCarrierSymlinkReplacesTheLinkAndFlushesTheDomain) {
  const std::string link = home.link("Library/Carrier Bundle.bundle", "old");
  EXPECT_EQ(operations.replaceCarrierSymlink(kPort, Long("new").data(), Long(link).data(),
                                             Long("com.norvale.carrier").data()),
            0);
  EXPECT_EQ(std::filesystem::read_symlink(link), "new");
  EXPECT_EQ(preferences.flushed, (std::vector<std::optional<std::string>>{"com.norvale.carrier"}));
  EXPECT_EQ(
      log.entries(),
      (std::vector{Log::unifiedLine(LogLevel::info, link + " is within allowed path " + link),
                   Log::unifiedLine(LogLevel::info, "linkpath: " + link + ", domain: com.norvale.carrier")}));
}

TEST_F(CarrierOperationsTest, ReplaceCarrierSymlinkOnADirectoryReturns8AndSaysSo) {
  const std::string link = home.directory("Library/Carrier Bundle.bundle");
  EXPECT_EQ(operations.replaceCarrierSymlink(kPort, Long("new").data(), Long(link).data(), Long("d").data()),
            8);
  EXPECT_TRUE(std::filesystem::is_directory(link));
  EXPECT_TRUE(preferences.flushed.empty());
  EXPECT_EQ(log.entries(),
            (std::vector{Log::unifiedLine(LogLevel::error, "Cannot remove symlink: " + link)}));
}

TEST_F(CarrierOperationsTest, ReplaceCarrierSymlinkOutsideTheListReturns8AndChangesNothing) {
  const std::string link = home.link("Library/Carrier Bundles/link", "old");
  EXPECT_EQ(operations.replaceCarrierSymlink(kPort, Long("new").data(), Long(link).data(), Long("d").data()),
            8);
  EXPECT_EQ(std::filesystem::read_symlink(link), "old");
  EXPECT_TRUE(preferences.flushed.empty());
}

TEST_F(CarrierOperationsTest, ReplaceCarrierSymlinkWithAnEmptyDomainReplacesTheLinkAndFlushesNothing) {
  const std::string link = home.file("Library/Preferences/com.norvale.carrier.plist", "old");
  EXPECT_EQ(operations.replaceCarrierSymlink(kPort, Long("new").data(), Long(link).data(), Long("").data()),
            0);
  EXPECT_EQ(std::filesystem::read_symlink(link), "new");
  EXPECT_TRUE(preferences.flushed.empty());
  EXPECT_EQ(log.entries().back(), Log::unifiedLine(LogLevel::info, "linkpath: " + link + ", domain: "));
}

TEST_F(CarrierOperationsTest, ReplaceCarrierSymlinkWithAnInvalidDomainFlushesNoDomain) {
  const std::string link = home / "Library/Carrier Bundle.bundle";
  EXPECT_EQ(
      operations.replaceCarrierSymlink(kPort, Long("new").data(), Long(link).data(), Long("\xff").data()), 0);
  EXPECT_EQ(preferences.flushed, (std::vector<std::optional<std::string>>{std::nullopt}));
}

TEST_F(CarrierOperationsTest, ReplaceCarrierSymlinkThatFailsReturns5AndFlushesNothing) {
  const std::string link = home / "Library/Carrier Bundle.bundle";
  EXPECT_EQ(operations.replaceCarrierSymlink(kPort, Long("").data(), Long(link).data(), Long("d").data()), 5);
  EXPECT_TRUE(preferences.flushed.empty());
  EXPECT_EQ(log.entries(),
            (std::vector{Log::unifiedLine(LogLevel::info, link + " is within allowed path " + link)}));
}

// ---- removeCarrierFile

TEST_F(CarrierOperationsTest, RemoveCarrierFileOutsideReturns8YetFlushesTheDomainFirst) {
  const std::string file = elsewhere.file("file", "kept");
  EXPECT_EQ(operations.removeCarrierFile(kPort, Long(file).data(), Long("com.norvale.carrier").data()), 8);
  EXPECT_EQ(contentOf(file), "kept");
  EXPECT_EQ(preferences.flushed, (std::vector<std::optional<std::string>>{"com.norvale.carrier"}));
  EXPECT_EQ(
      log.entries(),
      (std::vector{Log::bsdLine(SyslogPriority::notice, "Removing domain: com.norvale.carrier\n"),
                   Log::unifiedLine(LogLevel::error, "NOT Allowing path " + file +
                                                         " as it isn't within the wild card directories:"),
                   Log::unifiedLine(LogLevel::error, bundles("/")),
                   Log::unifiedLine(LogLevel::error, "/private/var/mobile/Library/Carrier Bundles")}));
}

TEST_F(CarrierOperationsTest, RemoveCarrierFileRemovesAFileWithoutADomain) {
  const std::string file = home.file("Library/Carrier Bundles/file", "x");
  EXPECT_EQ(operations.removeCarrierFile(kPort, Long(file).data(), Long("").data()), 0);
  EXPECT_FALSE(isThere(file));
  EXPECT_TRUE(preferences.flushed.empty());
  EXPECT_EQ(
      log.entries(),
      (std::vector{Log::unifiedLine(LogLevel::info, "Allowing path " + file + " within " + bundles("/"))}));
}

TEST_F(CarrierOperationsTest, RemoveCarrierFileWithAnInvalidDomainFlushesNoDomain) {
  const std::string file = home.file("Library/Carrier Bundles/file", "x");
  EXPECT_EQ(operations.removeCarrierFile(kPort, Long(file).data(), Long("a\xc3").data()), 0);
  EXPECT_EQ(preferences.flushed, (std::vector<std::optional<std::string>>{std::nullopt}));
  EXPECT_EQ(log.entries().front(), Log::bsdLine(SyslogPriority::notice, "Removing domain: a\xc3\n"));
}

TEST_F(CarrierOperationsTest, RemoveCarrierFileFlushesADomainOfOneLetter) {
  const std::string file = home.file("Library/Carrier Bundles/file", "x");
  EXPECT_EQ(operations.removeCarrierFile(kPort, Long(file).data(), Long("a").data()), 0);
  EXPECT_EQ(preferences.flushed, (std::vector<std::optional<std::string>>{"a"}));
}

TEST_F(CarrierOperationsTest, RemoveCarrierFileReturns5ForWhatIsMissingOrAFullDirectory) {
  home.file("Library/Carrier Bundles/full/file", "kept");
  const std::string empty = home.directory("Library/Carrier Bundles/empty");
  EXPECT_EQ(operations.removeCarrierFile(kPort, Long(bundles("/missing")).data(), Long("").data()), 5);
  EXPECT_EQ(operations.removeCarrierFile(kPort, Long(bundles("/full")).data(), Long("").data()), 5);
  EXPECT_EQ(contentOf(bundles("/full/file")), "kept");
  EXPECT_EQ(operations.removeCarrierFile(kPort, Long(empty).data(), Long("").data()), 0);
  EXPECT_FALSE(isThere(empty));
}

// ---- copyCarrierFile

TEST_F(CarrierOperationsTest, CopyCarrierFileCopiesAndGivesTheFileToTheAccount) {
  elsewhere.file("carrier.plist", "content");
  if (::geteuid() == 0) account.uid = account.gid = 4711;
  EXPECT_EQ(
      operations.copyCarrierFile(kPort, Short(elsewhere.path()).data(), Short(bundles("/new/deep")).data(),
                                 Short("carrier.plist").data(), &success),
      0);
  EXPECT_EQ(success, 1);
  EXPECT_EQ(contentOf(bundles("/new/deep/carrier.plist")), "content");
  EXPECT_EQ(statOf(bundles("/new/deep/carrier.plist")).st_uid, account.uid);
  EXPECT_EQ(statOf(bundles("/new/deep/carrier.plist")).st_gid, account.gid);
  EXPECT_EQ(statOf(bundles("/new/deep")).st_mode & 07777, 0755u);
  const std::string destination = bundles("/new/deep");
  EXPECT_EQ(log.entries(),
            (std::vector{Log::bsdLine(SyslogPriority::notice,
                                      "'" + elsewhere.path() + "', '" + destination + "', 'carrier.plist'\n"),
                         Log::unifiedLine(LogLevel::info, "Allowing path " + destination +
                                                              "/carrier.plist within " + bundles("/"))}));
}

TEST_F(CarrierOperationsTest, CopyCarrierFileOutsideTheBundlesDirectoriesIsRefusedAndSaysSo) {
  elsewhere.file("file", "content");
  const std::string destination = elsewhere.directory("there");
  EXPECT_EQ(operations.copyCarrierFile(kPort, Short(elsewhere.path()).data(), Short(destination).data(),
                                       Short("file").data(), &success),
            0);
  EXPECT_EQ(success, 0);
  EXPECT_FALSE(isThere(destination + "/file"));
  const auto lines = log.entries();
  ASSERT_EQ(lines.size(), 5u);
  EXPECT_EQ(lines.front(), Log::bsdLine(SyslogPriority::notice,
                                        "'" + elsewhere.path() + "', '" + destination + "', 'file'\n"));
  EXPECT_EQ(lines.back(),
            Log::bsdLine(SyslogPriority::error, "Destination directory " + destination +
                                                    "/file is not within the allowed directories\n"));
}

TEST_F(CarrierOperationsTest, CopyCarrierFileThatFailsNamesTheDirectoriesAndNotTheFiles) {
  EXPECT_EQ(operations.copyCarrierFile(kPort, Short(elsewhere.path()).data(), Short(bundles("")).data(),
                                       Short("missing").data(), &success),
            0);
  EXPECT_EQ(success, 0);
  EXPECT_EQ(log.entries().back(),
            Log::bsdLine(SyslogPriority::error,
                         "Failed to copy the file " + elsewhere.path() + " to " + bundles("") + "\n"));
}

TEST_F(CarrierOperationsTest, CopyCarrierFileSucceedsOnlyIfTheOwnerCanBeSet) {
#ifdef __SANITIZE_THREAD__
  GTEST_SKIP() << "the sanitizer's own thread: a process with threads gets no user namespace";
#endif
  elsewhere.file("file", "content");
  home.directory("Library/Carrier Bundles");
  account.uid = 4711;
  // In a user namespace without any mapping, no file can be given to account 4711.
  const pid_t child = ::fork();
  if (child == 0) {
    if (::unshare(CLONE_NEWUSER) != 0) ::_exit(77);
    std::uint8_t flag = 7;
    (void)operations.copyCarrierFile(kPort, Short(elsewhere.path()).data(), Short(bundles("")).data(),
                                     Short("file").data(), &flag);
    ::_exit(flag);
  }
  int status = -1;
  ::waitpid(child, &status, 0);
  ASSERT_TRUE(WIFEXITED(status));
  if (WEXITSTATUS(status) == 77) GTEST_SKIP() << "no user namespace to be had";
  EXPECT_EQ(WEXITSTATUS(status), 0);
  EXPECT_EQ(contentOf(bundles("/file")), "content");
}

TEST_F(CarrierOperationsTest, CopyCarrierFileThatKeepsTheOldFileIsNoSuccessAndWritesNoLine) {
  elsewhere.file("file", "new");
  const std::string old = home.file("Library/Carrier Bundles/file", "old");
  if (::geteuid() == 0) account.uid = account.gid = 4711;
  files.fail("copyItem", FileOutcome::failure(EIO));
  EXPECT_EQ(operations.copyCarrierFile(kPort, Short(elsewhere.path()).data(), Short(bundles("")).data(),
                                       Short("file").data(), &success),
            0);
  EXPECT_EQ(success, 0);
  EXPECT_EQ(contentOf(old), "old");
  EXPECT_EQ(statOf(old).st_uid, ::getuid());  // nor is the old file given away
  EXPECT_EQ(
      log.entries(),
      (std::vector{
          Log::bsdLine(SyslogPriority::notice, "'" + elsewhere.path() + "', '" + bundles("") + "', 'file'\n"),
          Log::unifiedLine(LogLevel::info, "Allowing path " + old + " within " + bundles("/"))}));
}

TEST_F(CarrierOperationsTest, CopyCarrierFileOfWhatIsNoFileOverAFileIsNoSuccess) {
  if (::geteuid() != 0) GTEST_SKIP() << "needs root to make a device node";
  if (::mknod((elsewhere / "device").c_str(), S_IFCHR | 0666, makedev(1, 3)) != 0)
    GTEST_SKIP() << "no nodes here";
  const std::string old = home.file("Library/Carrier Bundles/device", "old");
  EXPECT_EQ(operations.copyCarrierFile(kPort, Short(elsewhere.path()).data(), Short(bundles("")).data(),
                                       Short("device").data(), &success),
            0);
  EXPECT_EQ(success, 0);
  EXPECT_EQ(contentOf(old), "old");
}

TEST_F(CarrierOperationsTest, CopyCarrierFileOntoADirectoryTellsOfTheFileInsideAndGivesTheDirectory) {
  elsewhere.file("name", "new");
  const std::string inside = home.file("Library/Carrier Bundles/name/name", "old");
  if (::geteuid() == 0) account.uid = account.gid = 4711;
  const auto copy = [&] {
    (void)operations.copyCarrierFile(kPort, Short(elsewhere.path()).data(), Short(bundles("")).data(),
                                     Short("name").data(), &success);
    return success;
  };
  files.fail("copyItem", FileOutcome::failure(EIO));
  EXPECT_EQ(copy(), 0);
  EXPECT_EQ(contentOf(inside), "old");
  files.recover("copyItem");
  EXPECT_EQ(copy(), 1);
  EXPECT_EQ(contentOf(inside), "new");
  EXPECT_EQ(copy(), 1);  // over a file with the same content
  EXPECT_EQ(statOf(bundles("/name")).st_uid, account.uid);
  EXPECT_EQ(statOf(inside).st_uid, ::getuid());
}

TEST_F(CarrierOperationsTest, CopyCarrierFileSucceedsOnlyWhenTheDirectoryThatIsGivenIsOnTheDisk) {
  elsewhere.file("file", "content");
  home.directory("Library/Carrier Bundles/file");
  files.fail("syncItem", FileOutcome::failure(EIO));
  EXPECT_EQ(operations.copyCarrierFile(kPort, Short(elsewhere.path()).data(), Short(bundles("")).data(),
                                       Short("file").data(), &success),
            0);
  EXPECT_EQ(success, 0);
  EXPECT_EQ(contentOf(bundles("/file/file")), "content");
}

// Puts another file in the place of the copy the moment it is made, as whoever owns the folder can.
class SwappingFileManager final : public FaultyFileManager {
 public:
  using FaultyFileManager::FaultyFileManager;
  std::string precious;
  FileOutcome copyItem(const std::string& source, const std::string& destination, IfPresent ifPresent,
                       Durability durability, Gift* gift) noexcept override {
    const FileOutcome outcome = FaultyFileManager::copyItem(source, destination, ifPresent, durability, gift);
    const std::string place = replaces.empty() ? destination : replaces;
    EXPECT_EQ(::rename(place.c_str(), (place + ".away").c_str()), 0);
    EXPECT_EQ(::rename(precious.c_str(), place.c_str()), 0);
    return outcome;
  }
  std::string replaces;  // empty: the destination
};

TEST_F(CarrierOperationsTest, CopyCarrierFileGivesTheCopyAwayAndNeverWhatTakesItsPlace) {
  if (::geteuid() != 0) GTEST_SKIP() << "needs root to give files away";
  account.uid = account.gid = 4711;
  for (const bool isDirectory : {false, true}) {
    SwappingFileManager swapping(real);
    CarrierOperations withSwaps{FileSystemManager::factory(swapping), archive.factory(), policy, preferences,
                                [this] { return account; }};
    const std::string name = isDirectory ? "folder" : "file";
    elsewhere.file(name, "copied");
    if (isDirectory) home.directory("Library/Carrier Bundles/folder");
    swapping.precious = home.file("Library/Carrier Bundles/precious", "root's");
    if (isDirectory) swapping.replaces = bundles("/folder");
    (void)withSwaps.copyCarrierFile(kPort, Short(elsewhere.path()).data(), Short(bundles("")).data(),
                                    Short(name).data(), &success);
    EXPECT_EQ(success, isDirectory ? 0 : 1);  // of a directory's place it can be seen
    EXPECT_EQ(contentOf(bundles("/" + name)), "root's");
    EXPECT_EQ(statOf(bundles("/" + name)).st_uid, 0u);
    EXPECT_EQ(statOf(bundles("/" + name + ".away")).st_uid, isDirectory ? 0u : 4711u);
  }
}

TEST_F(CarrierOperationsTest, CopyCarrierFileWaitsForTheDiskBeforeTheFileIsShown) {
  elsewhere.file("file", "content");
  for (int i = 0; i < 2; ++i) {  // a new file, and one over another
    (void)operations.copyCarrierFile(kPort, Short(elsewhere.path()).data(), Short(bundles("")).data(),
                                     Short("file").data(), &success);
    EXPECT_EQ(success, 1);
  }
  EXPECT_EQ(files.durabilities, std::vector(2, Durability::onReturn));
}

TEST_F(CarrierOperationsTest, CopyCarrierFileOfADirectoryOntoOneIsAMergeAndSucceeds) {
  elsewhere.file("name/new", "new");
  home.file("Library/Carrier Bundles/name/name/old", "old");
  EXPECT_EQ(operations.copyCarrierFile(kPort, Short(elsewhere.path()).data(), Short(bundles("")).data(),
                                       Short("name").data(), &success),
            0);
  EXPECT_EQ(success, 1);
  EXPECT_EQ(contentOf(bundles("/name/name/new")), "new");
  EXPECT_EQ(contentOf(bundles("/name/name/old")), "old");
}

TEST_F(CarrierOperationsTest, CopyCarrierFileOntoItselfSucceeds) {
  const std::string file = home.file("Library/Carrier Bundles/file", "kept");
  EXPECT_EQ(operations.copyCarrierFile(kPort, Short(bundles("")).data(), Short(bundles("")).data(),
                                       Short("file").data(), &success),
            0);
  EXPECT_EQ(success, 1);
  EXPECT_EQ(contentOf(file), "kept");
}

TEST_F(CarrierOperationsTest, CopyCarrierFileGivesALinkAwayAndNotWhatItPointsTo) {
  const std::string precious = elsewhere.file("precious", "x");
  elsewhere.link("link", precious);
  const uid_t before = statOf(precious).st_uid;
  if (::geteuid() == 0) account.uid = account.gid = 4711;
  EXPECT_EQ(operations.copyCarrierFile(kPort, Short(elsewhere.path()).data(), Short(bundles("")).data(),
                                       Short("link").data(), &success),
            0);
  EXPECT_EQ(success, 1);
  EXPECT_TRUE(S_ISLNK(statOf(bundles("/link")).st_mode));
  EXPECT_EQ(statOf(bundles("/link")).st_uid, account.uid);
  EXPECT_EQ(statOf(precious).st_uid, before);
}

TEST_F(CarrierOperationsTest, CopyCarrierFileIntoADirectoryThatCannotBeMadeFails) {
  elsewhere.file("file", "x");
  files.fail("createDirectory", FileOutcome::failure(EACCES));
  EXPECT_EQ(operations.copyCarrierFile(kPort, Short(elsewhere.path()).data(), Short(bundles("")).data(),
                                       Short("file").data(), &success),
            0);
  EXPECT_EQ(success, 0);
}

// ---- copyCrashLogs

TEST_F(CarrierOperationsTest, CopyCrashLogsCopiesIntoTheAccountsCrashLogs) {
  elsewhere.file("logs/a/crash.txt", "boom");
  const std::string destination = home / "Library/Logs/CrashReporter/";
  home.directory("Library/Logs/CrashReporter");
  EXPECT_EQ(operations.copyCrashLogs(kPort, Short(elsewhere / "logs").data(), &success), 0);
  EXPECT_EQ(success, 1);
  EXPECT_EQ(contentOf(destination + "logs/a/crash.txt"), "boom");
  EXPECT_EQ(log.entries(),
            (std::vector{Log::bsdLine(SyslogPriority::notice,
                                      "'" + (elsewhere / "logs") + "', '" + destination + "'\n")}));
}

TEST_F(CarrierOperationsTest, CopyCrashLogsTakesAHomeThatEndsInASlash) {
  const std::string slashed = home.path() + "/";
  account.home = slashed.c_str();
  const std::string source = elsewhere.directory("logs");
  home.directory("Library/Logs/CrashReporter");
  EXPECT_EQ(operations.copyCrashLogs(kPort, Short(source).data(), &success), 0);
  EXPECT_EQ(success, 1);
  EXPECT_EQ(log.entries(),
            (std::vector{Log::bsdLine(SyslogPriority::notice, "'" + source + "', '" + home.path() +
                                                                  "/Library/Logs/CrashReporter/'\n")}));
}

TEST_F(CarrierOperationsTest, CopyCrashLogsTakesAHomeOfOneLetter) {
  account.home = "/";
  const std::string source = elsewhere / "missing";
  EXPECT_EQ(operations.copyCrashLogs(kPort, Short(source).data(), &success), 0);
  EXPECT_EQ(log.entries().front(),
            Log::bsdLine(SyslogPriority::notice, "'" + source + "', '/Library/Logs/CrashReporter/'\n"));
}

TEST_F(CarrierOperationsTest, CopyCrashLogsThatFailsSaysWhyAtNoticeLevel) {
  const std::string source = elsewhere / "missing";
  const std::string destination = home / "Library/Logs/CrashReporter/";
  EXPECT_EQ(operations.copyCrashLogs(kPort, Short(source).data(), &success), 0);
  EXPECT_EQ(success, 0);
  EXPECT_EQ(log.entries(),
            (std::vector{Log::bsdLine(SyslogPriority::notice, "'" + source + "', '" + destination + "'\n"),
                         Log::bsdLine(SyslogPriority::notice, "Failed to copy the directory " + source +
                                                                  " to " + destination + ". Error: -1\n")}));
}

TEST_F(CarrierOperationsTest, CopyCrashLogsWorksWithoutASuccessByte) {
  const std::string source = elsewhere.directory("logs");
  home.directory("Library/Logs/CrashReporter");
  EXPECT_EQ(operations.copyCrashLogs(kPort, Short(source).data(), nullptr), 0);
  EXPECT_TRUE(isThere(home / "Library/Logs/CrashReporter/logs"));
}

TEST_F(CarrierOperationsTest, CopyCrashLogsWithoutAHomeFailsAndWritesNowhere) {
  const std::string source = elsewhere.directory("logs");
  account.home = nullptr;
  EXPECT_EQ(operations.copyCrashLogs(kPort, Short(source).data(), &success), 0);
  EXPECT_EQ(success, 0);
  EXPECT_EQ(log.entries(),
            (std::vector{Log::bsdLine(SyslogPriority::notice, "'" + source + "', ''\n"),
                         Log::bsdLine(SyslogPriority::notice,
                                      "Failed to copy the directory " + source + " to . Error: 2\n")}));
}

// ---- moveIntoCarrierBundles

TEST_F(CarrierOperationsTest, MoveIntoCarrierBundlesMovesTheTree) {
  elsewhere.file("bundle/Info.plist", "info");
  EXPECT_EQ(operations.moveIntoCarrierBundles(kPort, Short(elsewhere / "bundle").data(),
                                              Short(bundles("")).data(), Short("A.bundle").data(), &success),
            0);
  EXPECT_EQ(success, 1);
  EXPECT_EQ(contentOf(bundles("/A.bundle/Info.plist")), "info");
  EXPECT_FALSE(isThere(elsewhere / "bundle"));
  EXPECT_EQ(statOf(bundles("")).st_mode & 07777, 0755u);
  const std::string source = elsewhere / "bundle";
  EXPECT_EQ(log.entries(),
            (std::vector{
                Log::bsdLine(SyslogPriority::notice, "'" + source + "', '" + bundles("") + "'\n"),
                Log::bsdLine(SyslogPriority::notice, "'" + source + "', '" + bundles("") + "', 'A.bundle'\n"),
                Log::unifiedLine(LogLevel::info,
                                 "Allowing path " + bundles("/A.bundle") + " within " + bundles("/"))}));
}

TEST_F(CarrierOperationsTest, MoveIntoCarrierBundlesWithARefusedDestinationStillLeavesTheDirectoryCreated) {
  elsewhere.file("bundle/Info.plist", "info");
  const std::string destination = elsewhere / "made/on/the/way";
  EXPECT_EQ(operations.moveIntoCarrierBundles(kPort, Short(elsewhere / "bundle").data(),
                                              Short(destination).data(), Short("A.bundle").data(), &success),
            0);
  EXPECT_EQ(success, 0);
  EXPECT_TRUE(std::filesystem::is_directory(destination));
  EXPECT_EQ(statOf(destination).st_mode & 07777, 0755u);
  EXPECT_TRUE(isThere(elsewhere / "bundle/Info.plist"));
  EXPECT_EQ(log.entries().back(),
            Log::bsdLine(SyslogPriority::error, "Destination directory " + destination +
                                                    "/A.bundle is not within the allowed directories\n"));
}

TEST_F(CarrierOperationsTest, MoveIntoCarrierBundlesThatCannotMakeTheDirectorySaysSoWithTwoBlanks) {
  elsewhere.directory("bundle");
  files.fail("createDirectory", FileOutcome::failure(EACCES));
  EXPECT_EQ(operations.moveIntoCarrierBundles(kPort, Short(elsewhere / "bundle").data(),
                                              Short(bundles("")).data(), Short("A").data(), &success),
            0);
  EXPECT_EQ(success, 0);
  EXPECT_EQ(log.entries(),
            (std::vector{Log::bsdLine(SyslogPriority::notice,
                                      "'" + (elsewhere / "bundle") + "', '" + bundles("") + "'\n"),
                         Log::bsdLine(SyslogPriority::notice, "Failed to create CarrierBundles Dir  to " +
                                                                  bundles("") + ". Error: 13\n")}));
}

TEST_F(CarrierOperationsTest, ADirectoryFailureWithoutACodeCountsAsMadeAndTheMoveFails) {
  elsewhere.directory("bundle");
  files.fail("createDirectory", FileOutcome::failureWithoutCode());
  EXPECT_EQ(operations.moveIntoCarrierBundles(kPort, Short(elsewhere / "bundle").data(),
                                              Short(bundles("")).data(), Short("A").data(), &success),
            0);
  EXPECT_EQ(success, 0);
  EXPECT_EQ(log.entries().back(),
            Log::bsdLine(SyslogPriority::error, "Failed to move the directory " + (elsewhere / "bundle") +
                                                    " to " + bundles("") + ". Error: 2\n"));
}

TEST_F(CarrierOperationsTest, MoveIntoCarrierBundlesOntoSomethingReports17AndAMissingSourceMinus1) {
  elsewhere.directory("bundle");
  home.file("Library/Carrier Bundles/A/kept", "x");
  EXPECT_EQ(operations.moveIntoCarrierBundles(kPort, Short(elsewhere / "bundle").data(),
                                              Short(bundles("")).data(), Short("A").data(), &success),
            0);
  EXPECT_EQ(success, 0);
  EXPECT_EQ(log.entries().back(),
            Log::bsdLine(SyslogPriority::error, "Failed to move the directory " + (elsewhere / "bundle") +
                                                    " to " + bundles("") + ". Error: 17\n"));
  EXPECT_TRUE(isThere(bundles("/A/kept")));
  success = 7;
  (void)operations.moveIntoCarrierBundles(kPort, Short(elsewhere / "no").data(), Short(bundles("")).data(),
                                          Short("B").data(), &success);
  EXPECT_EQ(success, 0);
  EXPECT_EQ(log.entries().back(),
            Log::bsdLine(SyslogPriority::error, "Failed to move the directory " + (elsewhere / "no") +
                                                    " to " + bundles("") + ". Error: -1\n"));
}

TEST_F(CarrierOperationsTest, MoveIntoCarrierBundlesWorksWithoutASuccessByte) {
  elsewhere.directory("bundle");
  EXPECT_EQ(operations.moveIntoCarrierBundles(kPort, Short(elsewhere / "bundle").data(),
                                              Short(bundles("")).data(), Short("A").data(), nullptr),
            0);
  EXPECT_TRUE(isThere(bundles("/A")));
}

// ---- unpackArchive

TEST_F(CarrierOperationsTest, UnpackArchiveHandsThePathsAndExactlyThreeTrueOptionsOn) {
  EXPECT_EQ(operations.unpackArchive(kPort, Short("/a.zip").data(), Short("/there").data(), &success), 0);
  EXPECT_EQ(success, 1);
  EXPECT_EQ(archive.archive, "/a.zip");
  EXPECT_EQ(archive.destination, "/there");
  EXPECT_EQ(archive.options,
            PropertyList::dictionary({{"extractPKZip", PropertyList::boolean(true)},
                                      {"copyExtendedAttributes", PropertyList::boolean(true)},
                                      {"copyResources", PropertyList::boolean(true)}}));
  EXPECT_EQ(archive.living, 0);
  EXPECT_TRUE(log.entries().empty());
}

TEST_F(CarrierOperationsTest, UnpackArchiveThatFailsDoesNotWriteSuccess) {
  archive.result = EIO;
  EXPECT_EQ(operations.unpackArchive(kPort, Short("/a.zip").data(), Short("/there").data(), &success), 0);
  EXPECT_EQ(success, 7);
}

TEST_F(CarrierOperationsTest, UnpackArchiveAnswersAFileErrorWith2) {
  archive.fileError = ArchiveFileError{"../x", EPERM};
  archive.result = EPERM;
  EXPECT_EQ(operations.unpackArchive(kPort, Short("/a.zip").data(), Short("/there").data(), &success), 0);
  EXPECT_EQ(archive.answer, 2);
  EXPECT_TRUE(log.entries().empty());
}

TEST_F(CarrierOperationsTest, UnpackArchiveLogsAFatalErrorOnTheBsdLog) {
  archive.fatalError = EIO;
  archive.result = EIO;
  EXPECT_EQ(operations.unpackArchive(kPort, Short("/a.zip").data(), Short("/there").data(), &success), 0);
  EXPECT_EQ(success, 7);
  EXPECT_EQ(log.entries(),
            (std::vector{Log::bsdLine(SyslogPriority::error, "ArkCopier signaled fatal file error")}));
}

TEST_F(CarrierOperationsTest, UnpackArchiveWithoutACopierReturns0AndDoesNotWriteSuccess) {
  CarrierOperations without{FileSystemManager::factory(files),
                            [] { return std::unique_ptr<ArchiveCopier>(); }, policy, preferences,
                            [this] { return account; }};
  EXPECT_EQ(without.unpackArchive(kPort, Short("/a.zip").data(), Short("/there").data(), &success), 0);
  EXPECT_EQ(success, 7);
}

// ---- the file system is the request's own

TEST_F(CarrierOperationsTest, EachRequestOpensAndClosesItsReleaseScope) {
  (void)operations.copyCrashLogs(kPort, Short("/no").data(), &success);
  (void)operations.moveIntoCarrierBundles(kPort, Short("/no").data(), Short(elsewhere.path()).data(),
                                          Short("x").data(), &success);
  EXPECT_EQ(files.scopesOpened, 2);
  EXPECT_EQ(files.openScopes, 0);
}

TEST_F(CarrierOperationsTest, ARequestThatGetsNoFileSystemFailsInItsOwnWay) {
  CarrierOperations without{[] { return std::unique_ptr<FileSystemInterface>(); }, archive.factory(), policy,
                            preferences, [this] { return account; }};
  EXPECT_EQ(without.copyCarrierFile(kPort, Short("/a").data(), Short(bundles("")).data(), Short("b").data(),
                                    &success),
            0);
  EXPECT_EQ(success, 0);
  success = 7;
  EXPECT_EQ(without.copyCrashLogs(kPort, Short("/a").data(), &success), 0);
  EXPECT_EQ(success, 0);
  success = 7;
  EXPECT_EQ(without.moveIntoCarrierBundles(kPort, Short("/a").data(), Short(bundles("")).data(),
                                           Short("b").data(), &success),
            0);
  EXPECT_EQ(success, 0);
}

}  // namespace
}  // namespace brenvik

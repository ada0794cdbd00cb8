// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "helper/lasd/DatabaseInstaller.h"

#include <gtest/gtest.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <cerrno>

#include "helper/lasd/DatabaseTypes.h"
#include "helper/lasd/LasdTestSupport.h"
#include "platform/preferences/fakes/InMemoryPreferences.h"

namespace brenvik {
namespace {

// Records what is synced while it stands: "path", of a file "path size", as it is at that moment.
struct SyncRecord {
  explicit SyncRecord(int errorOfFiles = 0) : error(errorOfFiles) { present = this; }
  ~SyncRecord() { present = nullptr; }
  SyncRecord(const SyncRecord&) = delete;
  SyncRecord& operator=(const SyncRecord&) = delete;

  // 0, or why a file is not synced.
  int take(int file) {
    struct stat status {};
    const bool isFile = ::fstat(file, &status) == 0 && S_ISREG(status.st_mode);
    synced.push_back(std::filesystem::read_symlink("/proc/self/fd/" + std::to_string(file)).string() +
                     (isFile ? " " + std::to_string(status.st_size) : ""));
    if (look) look();
    return isFile ? error : 0;
  }

  static inline SyncRecord* present = nullptr;
  const int error;
  std::vector<std::string> synced;
  std::function<void()> look;
};

}  // namespace
}  // namespace brenvik

// In place of the C library's in this program.
extern "C" int fsync(int file) {
  if (brenvik::SyncRecord::present != nullptr) {
    errno = brenvik::SyncRecord::present->take(file);
    if (errno != 0) return -1;
  }
  return static_cast<int>(::syscall(SYS_fsync, file));
}

namespace brenvik {
namespace {

const std::string kUrl = "https://server.example/content/gsm.db.gz";

class DatabaseInstallerTest : public LasdTest {
 protected:
  void SetUp() override {
    LasdTest::SetUp();
    directory = folder / "LASD";
  }
  bool install(const std::string& url = kUrl, std::int32_t type = gsm) {
    DatabaseInstaller installer({fetcherParts(), preferences, directory});
    return installer.downloadAndInstall(url, type, record);
  }
  PropertyList recorded(const char* key) {
    return preferences.copyValue(key, "com.norvale.lasd", UserScope::currentUser, HostScope::anyHost);
  }
  // The lines of a fetch that brought `size` bytes.
  static Lines fetchLines(const std::string& url, std::size_t size) {
    return {info("Fetching URL " + url),
            info("URL retrieved " + url + ", size: " + std::to_string(size) + " ")};
  }
  void expectLines(Lines first, const Lines& rest) {
    first.insert(first.end(), rest.begin(), rest.end());
    EXPECT_EQ(log.entries(), first);
  }
  std::string at(const std::string& name) const { return directory / name; }
  std::size_t files() const {
    return static_cast<std::size_t>(std::distance(std::filesystem::directory_iterator(directory), {}));
  }

  std::filesystem::path directory;
  InMemoryPreferences preferences;
  PropertyList record = PropertyList::dictionary(
      {{"Version", PropertyList::string("2.1")}, {"ContentURL", PropertyList::string(kUrl)}});
};

TEST_F(DatabaseInstallerTest, AMissingDirectoryIsMadeWithMode0755AndTheDatabasePutInPlace) {
  serveGzip(kUrl, "database");
  const mode_t before = ::umask(0077);
  EXPECT_TRUE(install());
  ::umask(before);
  struct stat status {};
  ASSERT_EQ(::stat(directory.c_str(), &status), 0);
  EXPECT_EQ(status.st_mode, S_IFDIR | 0755U);
  EXPECT_EQ(contentOf(at("gsm.db")), "database");
  EXPECT_EQ(files(), 1U);
  EXPECT_EQ(recorded("gsm"), record);
  expectLines(fetchLines(kUrl, gzipOf("database").size()),
              {info("uncompressing to " + at("gsm.db.tmp")),
               info("Moving " + at("gsm.db.tmp") + " to " + at("gsm.db")),
               info("Downloaded gsm database version 2.1 successfully")});
}

TEST_F(DatabaseInstallerTest, WithoutAPreviousFileNothingIsRemovedAndTheRenameStillHappens) {
  std::filesystem::create_directory(directory);
  serveGzip(kUrl, "database");
  EXPECT_TRUE(install());
  EXPECT_EQ(contentOf(at("gsm.db")), "database");
  for (const auto& line : log.entries()) EXPECT_FALSE(line.line.starts_with("Removed old database"));
}

TEST_F(DatabaseInstallerTest, AnOlderDatabaseIsRemovedBeforeTheNewOneIsMovedIn) {
  std::filesystem::create_directory(directory);
  std::ofstream(at("gsm.db")) << "older";
  serveGzip(kUrl, "newer");
  EXPECT_TRUE(install());
  EXPECT_EQ(contentOf(at("gsm.db")), "newer");
  expectLines(fetchLines(kUrl, gzipOf("newer").size()),
              {info("uncompressing to " + at("gsm.db.tmp")), info("Removed old database " + at("gsm.db")),
               info("Moving " + at("gsm.db.tmp") + " to " + at("gsm.db")),
               info("Downloaded gsm database version 2.1 successfully")});
}

TEST_F(DatabaseInstallerTest, ARegularFileInPlaceOfTheDirectoryStopsTheInstall) {
  std::ofstream(directory) << "in the way";
  serveGzip(kUrl, "database");
  EXPECT_FALSE(install());
  EXPECT_EQ(log.entries(), Lines{error("Cannot create " + directory.string() + " errno set to File exists")});
  EXPECT_TRUE(web.seen().empty());
}

TEST_F(DatabaseInstallerTest, ADirectoryWithoutParentCannotBeMade) {
  directory = folder / "missing" / "LASD";
  EXPECT_FALSE(install());
  EXPECT_EQ(log.entries(),
            Lines{error("Cannot create " + directory.string() + " errno set to No such file or directory")});
}

TEST_F(DatabaseInstallerTest, ADirectoryThatCannotBeLookedAtIsNoReasonToStop) {
  std::ofstream(folder / "file") << "x";
  directory = folder / "file" / "LASD";  // ENOTDIR
  serveGzip(kUrl, "database");
  EXPECT_FALSE(install());
  const Lines lines = log.entries();
  EXPECT_EQ(lines.front(), info("Fetching URL " + kUrl)) << "it went on";
  EXPECT_EQ(lines.back(), error("Failed to commit the data to file for " + at("gsm.db.tmp")));
}

TEST_F(DatabaseInstallerTest, AFailedFetchBlamesWifiAndTouchesNothing) {
  std::filesystem::create_directory(directory);
  std::ofstream(at("gsm.db")) << "older";
  web.fail(kUrl, WebErrorKind::cannotConnect);
  EXPECT_FALSE(install());
  EXPECT_EQ(log.entries().back(),
            error("Cannot download file " + kUrl + ". Either Wifi is turned OFF or not Wifi attached"));
  EXPECT_EQ(contentOf(at("gsm.db")), "older");
  EXPECT_FALSE(recorded("gsm"));
  EXPECT_FALSE(web.seen().at(0).cellularAllowed);
}

TEST_F(DatabaseInstallerTest, AUrlEndingInDbGzAndAQueryGivesTheNameDb) {
  const std::string url = "https://server.example/db.gz?x=1";
  serveGzip(url, "database");
  EXPECT_TRUE(install(url));
  EXPECT_EQ(contentOf(at("db")), "database");
}

TEST_F(DatabaseInstallerTest, NamesAreWhatFollowsTheLastSlashUpToTheFirstGz) {
  EXPECT_EQ(databaseFileName("https://h/foo.db.gz"), "foo.db");
  EXPECT_EQ(databaseFileName("https://h/foo.db"), "foo.db");
  EXPECT_EQ(databaseFileName("https://h/a.gz.b.gz"), "a");
  EXPECT_EQ(databaseFileName("https://h/a.gzip"), "a");
  EXPECT_EQ(databaseFileName("https://h/a.GZ"), "a.GZ");
  EXPECT_EQ(databaseFileName("https://h/x.gz?next=/y.gz"), "y");
  EXPECT_EQ(databaseFileName("https://h/.hidden"), ".hidden");
  EXPECT_EQ(databaseFileName("https://h/..."), "...");
}

TEST_F(DatabaseInstallerTest, AUrlThatGivesNoFileNameFailsAndTouchesNothing) {
  std::filesystem::create_directory(directory);
  for (const char* url : {"no slash", "https://h/", "https://h/.gz", "https://h/.", "https://h/..",
                          "https://h/...gz", "https://h/..gz"}) {
    EXPECT_EQ(databaseFileName(url), "") << url;
    serveGzip(url, "database");
    EXPECT_FALSE(install(url));
    EXPECT_EQ(log.entries().back(), error(std::string("No file name in URL ") + url));
  }
  EXPECT_EQ(files(), 0U);
  EXPECT_FALSE(recorded("gsm"));
}

TEST_F(DatabaseInstallerTest, AFailedUncompressLeavesTheOlderDatabaseAndNoTemporaryFile) {
  std::filesystem::create_directory(directory);
  std::ofstream(at("gsm.db")) << "older";
  web.answer(kUrl, 200, "not gzip", {{"Content-Type", "application/gzip"}});
  EXPECT_FALSE(install());
  expectLines(fetchLines(kUrl, 8), {info("uncompressing to " + at("gsm.db.tmp")),
                                    error("Could not uncompress HTTP response to " + at("gsm.db.tmp") + "!"),
                                    error("Failed to commit the data to file for " + at("gsm.db.tmp"))});
  EXPECT_EQ(contentOf(at("gsm.db")), "older");
  EXPECT_EQ(files(), 1U);
  EXPECT_FALSE(recorded("gsm"));
}

TEST_F(DatabaseInstallerTest, AnOlderDatabaseThatCannotBeRemovedStopsTheInstallAndKeepsTheTemporaryFile) {
  std::filesystem::create_directories(at("gsm.db") + "/full");
  serveGzip(kUrl, "newer");
  EXPECT_FALSE(install());
  expectLines(fetchLines(kUrl, gzipOf("newer").size()),
              {info("uncompressing to " + at("gsm.db.tmp")),
               error("Failed to remove the previous download at location " + at("gsm.db"))});
  EXPECT_EQ(contentOf(at("gsm.db.tmp")), "newer");
  EXPECT_FALSE(recorded("gsm"));

  log.clear();
  std::filesystem::remove_all(at("gsm.db"));
  serveGzip(kUrl, "even newer");
  EXPECT_TRUE(install()) << "the next attempt writes over it";
  EXPECT_EQ(contentOf(at("gsm.db")), "even newer");
  EXPECT_EQ(files(), 1U);
}

TEST_F(DatabaseInstallerTest, AFailedRenameSaysWhyAndKeepsTheTemporaryFile) {
  // The temporary file is taken away while it is written.
  class Thief final : public Gunzip {
   public:
    explicit Thief(std::string path) : path_(std::move(path)) {}
    GunzipOutcome gunzipInto(const GunzipInput&, int file, std::uint64_t, std::uint64_t) noexcept override {
      EXPECT_EQ(::write(file, "newer", 5), 5);
      std::filesystem::remove(path_);
      return {GunzipResult::whole, 5, 0};
    }

   private:
    const std::string path_;
  } thief(at("gsm.db.tmp"));
  serveGzip(kUrl, "newer");
  DatabaseInstaller installer({{queues, web, thief, roomyDisk}, preferences, directory});
  EXPECT_FALSE(installer.downloadAndInstall(kUrl, gsm, record));
  EXPECT_EQ(log.entries().back(), error("Could not rename " + at("gsm.db.tmp") + " to " + at("gsm.db") +
                                        ": No such file or directory"));
  EXPECT_FALSE(recorded("gsm"));
}

TEST_F(DatabaseInstallerTest, AFolderThatIsMadeIsOnTheDiskBeforeTheDatabaseAndItsRecord) {
  serveGzip(kUrl, "database");
  SyncRecord syncs;
  EXPECT_TRUE(install());
  ASSERT_FALSE(syncs.synced.empty());
  EXPECT_EQ(syncs.synced.front(), directory.parent_path().string());
}

TEST_F(DatabaseInstallerTest, TheWholeFileIsOnTheDiskBeforeItIsMovedInAndTheFolderBeforeTheRecordIsWritten) {
  serveGzip(kUrl, "database");
  std::filesystem::create_directory(directory);
  SyncRecord syncs;
  std::vector<std::string> there;
  syncs.look = [&] {
    const bool isMovedIn = std::filesystem::exists(at("gsm.db"));
    there.push_back(std::string(isMovedIn ? "moved in" : "not yet") + (recorded("gsm") ? ", recorded" : ""));
  };
  EXPECT_TRUE(install());
  EXPECT_EQ(syncs.synced, (std::vector<std::string>{at("gsm.db.tmp") + " 8", directory.string()}));
  EXPECT_EQ(there, (std::vector<std::string>{"not yet", "moved in"}));
  EXPECT_TRUE(recorded("gsm"));
}

TEST_F(DatabaseInstallerTest, AFileThatDoesNotReachTheDiskIsAFailureWithItsReason) {
  serveGzip(kUrl, "database");
  {
    const SyncRecord failing(EIO);
    EXPECT_FALSE(install());
  }
  expectLines(fetchLines(kUrl, gzipOf("database").size()),
              {info("uncompressing to " + at("gsm.db.tmp")),
               error("Cannot write output file " + at("gsm.db.tmp") + ": Input/output error"),
               error("Could not uncompress HTTP response to " + at("gsm.db.tmp") + "!"),
               error("Failed to commit the data to file for " + at("gsm.db.tmp"))});
  EXPECT_EQ(files(), 0U);
  EXPECT_FALSE(recorded("gsm"));
}

TEST_F(DatabaseInstallerTest, ATypeOutsideTheFiveInstallsTheFileButFailsAndRecordsNothing) {
  serveGzip(kUrl, "database");
  EXPECT_FALSE(install(kUrl, 3));
  EXPECT_EQ(contentOf(at("gsm.db")), "database");
  EXPECT_EQ(log.entries().back(), info("Moving " + at("gsm.db.tmp") + " to " + at("gsm.db")));
  for (const char* key : {"gsm", "umts", "cdma", "lte", "scdma", "unknown"})
    EXPECT_FALSE(recorded(key)) << key;
}

TEST_F(DatabaseInstallerTest, ARecordThatCannotBeStoredFailsTheInstall) {
  serveGzip(kUrl, "database");
  preferences.disk().setFull(true);
  EXPECT_FALSE(install());
  EXPECT_EQ(contentOf(at("gsm.db")), "database");
  for (const auto& line : log.entries()) EXPECT_EQ(line.line.find("successfully"), std::string::npos);
  EXPECT_FALSE(recorded("gsm"));
}

TEST_F(DatabaseInstallerTest, ARecordThatThereIsNoMemoryForFailsTheInstall) {
  serveGzip(kUrl, "database");
  for (const int operations : {0, 1}) {  // the setting, the storing
    preferences.operationsWithMemory = operations;
    EXPECT_FALSE(install());
    preferences.operationsWithMemory = -1;
    EXPECT_FALSE(recorded("gsm"));
  }
  EXPECT_EQ(contentOf(at("gsm.db")), "database");
}

TEST_F(DatabaseInstallerTest, EachTypeIsRecordedUnderItsName) {
  const std::pair<std::int32_t, const char*> types[] = {
      {1, "umts"}, {2, "cdma"}, {4, "lte"}, {8, "gsm"}, {16, "scdma"}};
  serveGzip(kUrl, "database");
  for (const auto& [type, name] : types) {
    EXPECT_TRUE(install(kUrl, type));
    EXPECT_EQ(recorded(name), record) << name;
    EXPECT_EQ(log.entries().back(),
              info(std::string("Downloaded ") + name + " database version 2.1 successfully"));
  }
}

TEST_F(DatabaseInstallerTest, ARecordWithoutVersionIsStoredAllTheSame) {
  record = PropertyList::dictionary({{"ContentURL", PropertyList::string(kUrl)}});
  serveGzip(kUrl, "database");
  EXPECT_TRUE(install());
  EXPECT_EQ(log.entries().back(), info("Downloaded gsm database version (null) successfully"));
}

}  // namespace
}  // namespace brenvik

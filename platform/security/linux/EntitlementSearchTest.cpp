// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/security/linux/EntitlementSearch.h"

#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <cerrno>
#include <filesystem>
#include <functional>
#include <string>
#include <vector>

#include "platform/base/UniqueFd.h"
#include "platform/base/fakes/FailingCalls.h"
#include "platform/security/linux/EntitlementTestSupport.h"
#include "platform/security/linux/Sha256.h"

namespace brenvik {
namespace {

// While it lives, fstat(2) on this thread gives what `change` makes of the facts of a descriptor's file.
class ChangedFacts {
 public:
  using Change = std::function<void(int fd, struct stat* facts)>;
  explicit ChangedFacts(Change change) : change_(std::move(change)) { current_ = this; }
  ~ChangedFacts() { current_ = nullptr; }
  ChangedFacts(const ChangedFacts&) = delete;
  ChangedFacts& operator=(const ChangedFacts&) = delete;

  static void apply(int fd, struct stat* facts) {
    if (current_ != nullptr) current_->change_(fd, facts);
  }

 private:
  static inline constinit thread_local ChangedFacts* current_ = nullptr;
  const Change change_;
};

}  // namespace
}  // namespace brenvik

extern "C" {
int changedFstat(int fd, struct stat* facts) noexcept __asm__("fstat");

int changedFstat(int fd, struct stat* facts) noexcept {
  const auto result = static_cast<int>(::syscall(SYS_newfstatat, fd, "", facts, AT_EMPTY_PATH));
  if (result == 0) brenvik::ChangedFacts::apply(fd, facts);
  return result;
}
}

namespace brenvik {
namespace {

namespace fs = std::filesystem;
using testing::ElementsAre;
using testing::IsEmpty;
using Kind = EntitlementFinding::Kind;

class Candidate final : public EntitlementCandidate {
 public:
  uid_t uid() const noexcept override { return account; }
  const std::optional<FileIdentity>& executable() override { return file; }
  const std::string& unit() override {
    if (whenAskedForUnit) whenAskedForUnit();
    return itsUnit;
  }

  uid_t account = 0;
  std::optional<FileIdentity> file;
  std::string itsUnit = "caller.service";
  std::function<void()> whenAskedForUnit;  // runs before the answer is given
};

std::string nameOf(Kind kind) {
  switch (kind) {
    case Kind::holds:
      return "holds";
    case Kind::differs:
      return "differs";
    case Kind::wrong:
      return "wrong";
    case Kind::unknown:
      return "unknown";
    case Kind::note:
      return "note";
  }
  return "";
}

class EntitlementSearchTest : public EntitlementFolderTest {
 protected:
  void SetUp() override {
    EntitlementFolderTest::SetUp();
    if (IsSkipped()) return;
    candidate.file = identityAt(AT_FDCWD, program.c_str());
    ASSERT_TRUE(candidate.file);
  }

  // What is found, one line each: "etc/a.plist: holds User is root".
  std::vector<std::string> findings(const std::vector<std::string>& directories) {
    EntitlementSearch search(accounts, directories);
    std::vector<EntitlementFinding> found;
    result = search.find(kName, candidate, &found);
    EXPECT_THAT(log.entries(), IsEmpty()) << "who wants the findings gets no log";
    std::vector<std::string> lines;
    for (const EntitlementFinding& each : found) {
      const std::string key = each.key.empty() ? "" : each.key + ' ';
      lines.push_back(fs::path(each.path).lexically_relative(root).string() + ": " + nameOf(each.kind) + ' ' +
                      key + each.text);
    }
    return lines;
  }
  // Those of the folder etc but for the first, that it is read.
  std::vector<std::string> findingsInEtc() {
    auto lines = findings({(root / "etc").string()});
    EXPECT_EQ(lines.at(0), "etc: note is read");
    lines.erase(lines.begin());
    return lines;
  }
  std::string digestOfProgram() {
    const UniqueFd fd(::open(program.c_str(), O_RDONLY | O_CLOEXEC));
    std::string hex;
    const Sha256Digest digest = sha256OfFile(fd.get()).value();
    for (const std::uint8_t byte : digest) hex += hexOf(byte);
    return hex;
  }

  Candidate candidate;
  EntitlementSearch::Result result;
};

// ----- What is found -----

TEST_F(EntitlementSearchTest, AFileThatGivesTheEntitlementIsShownWithEachOfItsKeys) {
  grant("etc/a.plist", "<true/>",
        quoted("User", "root") + quoted("Unit", "caller.service") + quoted("SHA256", digestOfProgram()));
  grant("etc/b.plist", "<false/>");
  EXPECT_THAT(findingsInEtc(), ElementsAre("etc/a.plist: holds User is root",  //
                                           "etc/a.plist: holds Executable is " + program,
                                           "etc/a.plist: holds Entitlements has com.example.allow",
                                           "etc/a.plist: holds Unit is caller.service",
                                           "etc/a.plist: holds SHA256 is the digest of the executable"));
  EXPECT_EQ(result.value, PropertyList::boolean(true));
  EXPECT_EQ(result.file, (root / "etc/a.plist").string());
  EXPECT_FALSE(result.error);
}

TEST_F(EntitlementSearchTest, AKeyThatTheseFilesDoNotHaveIsNotedAndTheOnesTheyHaveAreNot) {
  grant("etc/a.plist", "<true/>",
        quoted("User", "root") + quoted("Unit", "caller.service") + quoted("SHA256", digestOfProgram()) +
            quoted("unit", "x.service") + quoted("Users", "root"));
  const auto lines = findingsInEtc();
  ASSERT_EQ(lines.size(), 7U);
  EXPECT_THAT((std::vector(lines.begin(), lines.begin() + 2)),
              testing::UnorderedElementsAre(
                  "etc/a.plist: note unit is not a key of these files, and is not looked at",
                  "etc/a.plist: note Users is not a key of these files, and is not looked "
                  "at"));
  EXPECT_TRUE(result.value);
}

TEST_F(EntitlementSearchTest, AValueThatIsNotTrueIsShownAsWhatItIs) {
  const auto shown = [&](const char* value) {
    grant("etc/a.plist", value);
    return findingsInEtc().back();
  };
  EXPECT_EQ(shown("<true/>"), "etc/a.plist: holds Entitlements has com.example.allow");
  const std::string as = "etc/a.plist: holds Entitlements has com.example.allow as ";
  EXPECT_EQ(shown("<false/>"), as + "false");
  EXPECT_EQ(shown("<integer>1</integer>"), as + "an integer, not a boolean");
  EXPECT_EQ(shown("<real>1</real>"), as + "a real, not a boolean");
  EXPECT_EQ(shown("<string>true</string>"), as + "a string, not a boolean");
  EXPECT_EQ(shown("<data></data>"), as + "data, not a boolean");
  EXPECT_EQ(shown("<date>2001-01-01T00:00:00Z</date>"), as + "a date, not a boolean");
  EXPECT_EQ(shown("<array/>"), as + "an array, not a boolean");
  EXPECT_EQ(shown("<dict/>"), as + "a dictionary, not a boolean");
}

TEST_F(EntitlementSearchTest, EachKeyOfAFileThatDoesNotMatchIsComparedAllTheSame) {
  accounts.accounts["keeper"] = {AccountIds{501, 20}, std::nullopt};
  write("etc/a.plist", document(quoted("Executable", "/bin/sh") + quoted("User", "keeper") +
                                quoted("Unit", "other.service") + quoted("SHA256", std::string(64, '0')) +
                                "<key>Entitlements</key><dict/>"));
  EXPECT_THAT(findingsInEtc(),
              ElementsAre("etc/a.plist: differs User is keeper (501), and the caller is 0",
                          "etc/a.plist: differs Executable is /bin/sh, and the caller runs another file",
                          "etc/a.plist: differs Entitlements does not have com.example.allow",
                          "etc/a.plist: differs Unit is other.service, and the caller runs in caller.service",
                          "etc/a.plist: note SHA256 was not compared"));
  EXPECT_FALSE(result.value);
  EXPECT_FALSE(result.error);
}

TEST_F(EntitlementSearchTest, AnyOneKeyThatDiffersKeepsTheValueBack) {
  accounts.accounts["keeper"] = {AccountIds{501, 20}, std::nullopt};
  const auto value = [&](const char* executable, const std::string& more) {
    write("etc/a.plist", document(quoted("Executable", executable) + more + held()));
    (void)findingsInEtc();
    EXPECT_FALSE(result.error);
    return result.value;
  };
  EXPECT_TRUE(value(program.c_str(), ""));
  EXPECT_FALSE(value("/bin/sh", ""));
  EXPECT_FALSE(value("/no/such/program", ""));
  EXPECT_FALSE(value(program.c_str(), quoted("User", "keeper")));
  EXPECT_FALSE(value(program.c_str(), quoted("User", "nobody-knows-it")));
  EXPECT_FALSE(value(program.c_str(), quoted("Unit", "other.service")));
  EXPECT_FALSE(value(program.c_str(), quoted("SHA256", std::string(64, '0'))));
  EXPECT_FALSE(value(program.c_str(), quoted("User", "keeper") + quoted("SHA256", digestOfProgram())));
  EXPECT_FALSE(value(program.c_str(), quoted("Unit", "other.service") + quoted("SHA256", digestOfProgram())));
}

TEST_F(EntitlementSearchTest, ADirectoryIsShownWithWhatBecameOfIt) {
  fs::create_directory(root / "open");
  ASSERT_EQ(::chmod((root / "open").c_str(), 0777), 0);
  fs::create_directory(root / "open/below");
  ASSERT_EQ(::chmod((root / "open/below").c_str(), 0755), 0);
  EXPECT_THAT(findings({(root / "etc").string(), (root / "gone").string(), program, program + "/x",
                        (root / "open").string(), (root / "open/below").string(), (root / "lib").string()}),
              ElementsAre("etc: note has no files",     //
                          "gone: note does not exist",  //
                          "program: wrong not a directory", "program/x: wrong not a directory",
                          "open: wrong not owned by root, or others may write to it",
                          "open/below: wrong " + (root / "open").string() +
                              " is not owned by root, or others may write to it",
                          "lib: note has no files"));
  EXPECT_FALSE(result.error);
}

TEST_F(EntitlementSearchTest, AFileThatIsPassedOverIsShownWithWhatIsWrong) {
  fs::create_symlink(program, root / "etc/a.plist");
  ASSERT_EQ(::chmod(grant("etc/b.plist").c_str(), 0666), 0);
  write("etc/c.plist", std::string((std::size_t{1} << 20) + 1, '\n'));
  write("etc/d.plist", "");
  grant("etc/e.plist", "<true/>", "<key>Unit</key><true/><key>SHA256</key><true/>");
  EXPECT_THAT(findingsInEtc(), ElementsAre("etc/a.plist: wrong not a regular file",
                                           "etc/b.plist: wrong not owned by root, or others may write to it",
                                           "etc/c.plist: wrong too large",
                                           "etc/d.plist: wrong not a property list of the right form",
                                           "etc/e.plist: wrong Unit is a boolean, not a string",
                                           "etc/e.plist: wrong SHA256 is a boolean, not a string"));
  EXPECT_FALSE(result.value);
}

TEST_F(EntitlementSearchTest, AnAccountAnExecutableAndAUnitThatCannotMatchAreShownWithTheReason) {
  candidate.itsUnit.clear();
  write("etc/a.plist", document(quoted("Executable", (root / "gone").string()) +
                                quoted("User", "no-such-account") + quoted("Unit", "x.service") + held()));
  const fs::path changeable = write("changeable", "");
  ASSERT_EQ(::chmod(changeable.c_str(), 0666), 0);
  write("etc/b.plist", document(quoted("Executable", changeable.string()) + held()));
  EXPECT_THAT(findingsInEtc(),
              ElementsAre("etc/a.plist: wrong User is \"no-such-account\", and there is no such account",
                          "etc/a.plist: differs Executable is " + (root / "gone").string() +
                              ": No such file or directory",
                          "etc/a.plist: holds Entitlements has com.example.allow",
                          "etc/a.plist: differs Unit is x.service, and the caller runs in no unit of the "
                          "system's service manager",
                          "etc/b.plist: holds User is root",
                          "etc/b.plist: wrong Executable cannot be relied on: " + changeable.string() +
                              " is not owned by root, or others may write to it",
                          "etc/b.plist: holds Entitlements has com.example.allow"));
}

TEST_F(EntitlementSearchTest, AnExecutableThatCannotBeExaminedNowEndsTheSearch) {
  grant("etc/a.plist");
  grant("etc/b.plist");
  const auto looks = [](const fs::path& path) {
    return static_cast<int>(std::distance(path.begin(), path.end()));
  };
  const FailingCall failing("lstat", EIO, looks(root / "etc"));
  EXPECT_THAT(findingsInEtc(),
              ElementsAre("etc/a.plist: holds User is root",
                          "etc/a.plist: unknown Executable is " + program + ": Input/output error",
                          "etc/a.plist: holds Entitlements has com.example.allow",
                          "etc/a.plist: unknown cannot be examined"));
  EXPECT_TRUE(result.error);
  EXPECT_FALSE(result.value);
}

TEST_F(EntitlementSearchTest, ADigestThatCannotBeComparedNowEndsTheSearchAndTheReasonIsShown) {
  grant("etc/a.plist", "<true/>", quoted("SHA256", digestOfProgram()));
  grant("etc/b.plist");
  const auto lastTwo = [&] {
    const auto lines = findingsInEtc();
    EXPECT_TRUE(result.error);
    EXPECT_FALSE(result.value);
    return std::vector(lines.end() - 2, lines.end());
  };
  {
    const FailingCall failing("openat", EMFILE, 1);  // the first opens the file a.plist
    EXPECT_THAT(lastTwo(),
                ElementsAre("etc/a.plist: unknown SHA256 cannot be compared: the file cannot be read",
                            "etc/a.plist: unknown cannot be examined"));
  }
  {
    const FailingCall failing("read", EIO, 1);
    EXPECT_THAT(
        lastTwo(),
        ElementsAre("etc/a.plist: unknown SHA256 cannot be compared: the file or libcrypto cannot be read",
                    "etc/a.plist: unknown cannot be examined"));
  }
}

TEST_F(EntitlementSearchTest, AnExecutableThatIsExchangedOrRemovedBeforeItIsDigestedIsNoMatch) {
  grant("etc/a.plist", "<true/>", quoted("Unit", "caller.service") + quoted("SHA256", digestOfProgram()));
  candidate.whenAskedForUnit = [&] {
    fs::copy_file(program, root / "new");
    fs::rename(root / "new", program);
  };
  const char* const changed =
      "etc/a.plist: differs SHA256 cannot be compared: the caller has become another program, or has ended";
  EXPECT_EQ(findingsInEtc().back(), changed) << "the same bytes in another file";
  EXPECT_FALSE(result.value);
  EXPECT_FALSE(result.error);
  candidate.file = identityAt(AT_FDCWD, program.c_str());
  candidate.whenAskedForUnit = [&] { fs::remove(program); };
  EXPECT_EQ(findingsInEtc().back(), changed);
  EXPECT_FALSE(result.value);
  EXPECT_FALSE(result.error);
}

TEST_F(EntitlementSearchTest, ACandidateWithoutAnExecutableMatchesNoFile) {
  grant("etc/a.plist");
  candidate.file.reset();
  EXPECT_EQ(findingsInEtc().at(1),
            "etc/a.plist: differs Executable is " + program + ", and the caller runs another file");
  EXPECT_FALSE(result.value);
}

TEST_F(EntitlementSearchTest, AFileThatWasNoRegularOneWhenItWasOpenedIsPassedOverWhateverStandsThereSince) {
  grant("etc/a.plist", "<false/>");
  grant("etc/b.plist");
  EntitlementSearch search(accounts, {(root / "etc").string()});
  for (const int error : {ELOOP, ENXIO, ENODEV}) {  // a link, a socket, a device without a driver
    const FailingCall failing("openat", error);
    const auto found = search.find(kName, candidate);
    EXPECT_EQ(found.value, PropertyList::boolean(true)) << error;
    EXPECT_EQ(found.file, (root / "etc/b.plist").string());
    EXPECT_FALSE(found.error) << error;
  }
  expectOneError(passedOver("etc/a.plist", "not a regular file"));
}

TEST_F(EntitlementSearchTest, ADirectoryThatMayNotBeLookedAtEndsTheSearch) {
  grant("lib/a.plist");
  EntitlementSearch search(accounts, {(root / "etc").string(), (root / "lib").string()});
  const FailingCall failing("lstat", EACCES);
  const auto found = search.find(kName, candidate);
  EXPECT_TRUE(found.error);
  EXPECT_FALSE(found.value);
  expectOneError(line("entitlements cannot be told: ", root / "etc", " cannot be examined"));
}

TEST_F(EntitlementSearchTest, AFileThatGetsShorterWhileItIsReadEndsTheSearch) {
  const auto file = grant("etc/a.plist");
  grant("etc/b.plist");
  EntitlementSearch search(accounts, {(root / "etc").string()});
  const ChangedFacts changed([](int, struct stat* facts) { ++facts->st_size; });
  const auto found = search.find(kName, candidate);
  EXPECT_TRUE(found.error);
  EXPECT_FALSE(found.value);
  expectOneError(line("entitlements cannot be told: ", file, " cannot be examined"));
}

TEST_F(EntitlementSearchTest, TheFileThatWasLookedAtIsDigestedWhereverALinkToItLeadsSince) {
  const fs::path link = root / "link";
  fs::create_symlink(program, link);
  write("etc/a.plist", document(quoted("Executable", link.string()) + quoted("Unit", "caller.service") +
                                quoted("SHA256", digestOfProgram()) + held()));
  candidate.whenAskedForUnit = [&] {
    fs::remove(link);
    fs::create_symlink("/bin/sh", link);
  };
  EXPECT_EQ(findingsInEtc().back(), "etc/a.plist: holds SHA256 is the digest of the executable");
  EXPECT_TRUE(result.value);
}

TEST_F(EntitlementSearchTest, AnExecutableThatCannotBeReliedOnIsNamedWithoutLinks) {
  fs::create_symlink(program, root / "link");
  ASSERT_EQ(::chmod(program.c_str(), 0777), 0);
  write("etc/a.plist", document(quoted("Executable", (root / "link").string()) + held()));
  EXPECT_EQ(findingsInEtc().at(1), "etc/a.plist: wrong Executable cannot be relied on: " + program +
                                       " is not owned by root, or others may write to it");
}

TEST_F(EntitlementSearchTest, NoProgramThatIsStartedMeanwhileGetsADescriptor) {
  grant("etc/a.plist", "<true/>", quoted("Unit", "caller.service") + quoted("SHA256", digestOfProgram()));
  const auto inherited = [] {
    int count = 0;
    for (int fd = 0; fd < 1024; ++fd) {
      const int flags = ::fcntl(fd, F_GETFD);
      if (flags >= 0 && (flags & FD_CLOEXEC) == 0) ++count;
    }
    return count;
  };
  const int before = inherited();
  int looks = 0;
  candidate.whenAskedForUnit = [&] {  // the directory is open
    ++looks;
    EXPECT_EQ(inherited(), before);
  };
  const ChangedFacts atEachFile([&](int fd, struct stat*) {
    ++looks;
    EXPECT_EQ(::fcntl(fd, F_GETFD), FD_CLOEXEC);
  });
  (void)findingsInEtc();
  EXPECT_TRUE(result.value);
  EXPECT_EQ(looks, 3) << "the file, the directory, the executable";
}

// ----- What is told once -----

TEST_F(EntitlementSearchTest, AFaultIsToldAgainWhenAnyOfTheFilesFactsHasChanged) {
  const std::string text = passedOver("etc/a.plist", "not owned by root, or others may write to it");
  ASSERT_EQ(::chmod(grant("etc/a.plist").c_str(), 0666), 0);
  EntitlementSearch search(accounts, {(root / "etc").string()});
  const auto ask = [&] { EXPECT_FALSE(search.find(kName, candidate).value); };
  ask();
  expectOneError(text);
  ask();
  EXPECT_THAT(log.entries(), IsEmpty());
  const std::vector<ChangedFacts::Change> changes{
      [](int, struct stat* facts) { ++facts->st_dev; },
      [](int, struct stat* facts) { ++facts->st_ino; },
      [](int, struct stat* facts) { ++facts->st_size; },
      [](int, struct stat* facts) { ++facts->st_mtim.tv_sec; },
      [](int, struct stat* facts) { ++facts->st_mtim.tv_nsec; },
      [](int, struct stat* facts) { ++facts->st_ctim.tv_sec; },
      [](int, struct stat* facts) { ++facts->st_ctim.tv_nsec; },
  };
  for (const auto& change : changes) {
    {
      const ChangedFacts changed(change);
      ask();
      expectOneError(text);
      ask();
      EXPECT_THAT(log.entries(), IsEmpty());
    }
    ask();
    expectOneError(text);
  }
}

TEST_F(EntitlementSearchTest, AFaultOfALinkOrDirectoryIsToldAgainForAnotherOneInItsPlace) {
  const fs::path etc = root / "etc";
  EntitlementSearch search(accounts, {etc.string()});
  const auto lines = [&] {
    EXPECT_FALSE(search.find(kName, candidate).value);
    const std::size_t count = log.entries().size();
    log.clear();
    return count;
  };
  fs::create_symlink(program, etc / "a.plist");
  EXPECT_EQ(lines(), 1U);
  EXPECT_EQ(lines(), 0U);
  fs::create_symlink(program, etc / "another");
  fs::rename(etc / "another", etc / "a.plist");
  EXPECT_EQ(lines(), 1U);
  fs::remove(etc / "a.plist");

  ASSERT_EQ(::chmod(etc.c_str(), 0777), 0);
  EXPECT_EQ(lines(), 1U);
  EXPECT_EQ(lines(), 0U);
  fs::rename(etc, root / "before");
  fs::create_directory(etc);
  ASSERT_EQ(::chmod(etc.c_str(), 0777), 0);
  EXPECT_EQ(lines(), 1U) << "another directory";
  ASSERT_EQ(::chmod(etc.c_str(), 0755), 0);
  EXPECT_EQ(lines(), 0U);
  ASSERT_EQ(::chmod(etc.c_str(), 0777), 0);
  EXPECT_EQ(lines(), 1U) << "it was in order meanwhile";
}

TEST_F(EntitlementSearchTest, AnotherFaultOfTheSameFileIsTold) {
  const auto file = grant("etc/a.plist", "<true/>", quoted("User", "keeper"));
  EntitlementSearch search(accounts, {(root / "etc").string()});
  EXPECT_FALSE(search.find(kName, candidate).value);
  expectOneError(passedOver("etc/a.plist", "User is \"keeper\", and there is no such account"));
  accounts.accounts["keeper"] = {AccountIds{0, 0}, std::nullopt};
  ASSERT_EQ(::chmod(program.c_str(), 0777), 0);
  EXPECT_FALSE(search.find(kName, candidate).value);
  expectOneError(passedOver("etc/a.plist", "Executable cannot be relied on: " + program +
                                               " is not owned by root, or others may write to it"));
}

TEST_F(EntitlementSearchTest, OfManyFaultsAThousandAndTwentyFourAreRememberedAsTold) {
  std::vector<std::string> directories;
  for (int i = 0; i < 1024; ++i) directories.push_back(program + '/' + std::to_string(i));
  // The lines of the second of two searches.
  const auto toldAgain = [&] {
    EntitlementSearch search(accounts, directories);
    EXPECT_FALSE(search.find(kName, candidate).value);
    EXPECT_EQ(log.entries().size(), directories.size());
    log.clear();
    EXPECT_FALSE(search.find(kName, candidate).value);
    const std::size_t lines = log.entries().size();
    log.clear();
    return lines;
  };
  EXPECT_EQ(toldAgain(), 0U);
  directories.push_back(program + "/1024");
  EXPECT_EQ(toldAgain(), directories.size()) << "what is kept does not grow any further";
}

TEST_F(EntitlementSearchTest, ANewFaultOfAFileThatHadOneLeavesTheOthersToldWhereNoMoreAreRemembered) {
  std::vector<std::string> directories;
  for (int i = 0; i < 1023; ++i) directories.push_back(program + '/' + std::to_string(i));
  directories.push_back((root / "etc").string());
  ASSERT_EQ(::chmod(grant("etc/a.plist").c_str(), 0666), 0);
  EntitlementSearch search(accounts, directories);
  const auto lines = [&] {
    EXPECT_FALSE(search.find(kName, candidate).value);
    const std::size_t count = log.entries().size();
    log.clear();
    return count;
  };
  EXPECT_EQ(lines(), 1024U);
  ASSERT_EQ(::chmod(grant("etc/a.plist", "<false/>").c_str(), 0666), 0);  // of another size
  EXPECT_EQ(lines(), 1U);
  EXPECT_EQ(lines(), 0U);
}

TEST_F(EntitlementSearchTest, AFaultThatIsShownToSomebodyIsToldInTheLogAllTheSame) {
  ASSERT_EQ(::chmod(grant("etc/a.plist").c_str(), 0666), 0);
  EntitlementSearch search(accounts, {(root / "etc").string()});
  std::vector<EntitlementFinding> found;
  (void)search.find(kName, candidate, &found);
  EXPECT_THAT(log.entries(), IsEmpty());
  (void)search.find(kName, candidate);
  expectOneError(passedOver("etc/a.plist", "not owned by root, or others may write to it"));
}

// ----- Which directories -----

TEST(EntitlementDirectoriesTest, ASearchNamesItsDirectoriesInOrder) {
  FakeAccountDirectory accounts;
  const EntitlementSearch search(accounts, {"/b", "/a"});
  EXPECT_THAT(search.directories(), ElementsAre("/b", "/a"));
}

TEST(EntitlementDirectoriesTest, TheOnesNamedAtBuildTimeAreAbsolutePathsEachByItself) {
  const auto directories = entitlementDirectories();
  EXPECT_THAT(directories, testing::Not(IsEmpty()));
  EXPECT_THAT(directories,
              testing::Each(testing::AllOf(testing::StartsWith("/"), testing::Not(testing::HasSubstr(":")))));
}

// ----- Why a search gave nothing -----

class WhyNotEntitledTest : public testing::Test {
 protected:
  void add(const char* path, const char* key, Kind kind, const char* text) {
    findings.push_back({path, key, kind, text});
  }
  std::string why() const { return whyNotEntitled(result, findings); }

  EntitlementSearch::Result result;
  std::vector<EntitlementFinding> findings;
};

TEST_F(WhyNotEntitledTest, WhatCannotBeExaminedIsTheReasonWhateverElseWasFound) {
  result.error = true;
  add("/etc", "", Kind::note, "is read");
  EXPECT_EQ(why(), "a file cannot be examined now");
  add("/etc/a.plist", "Unit", Kind::differs, "is x.service");
  add("/etc/b.plist", "SHA256", Kind::unknown, "cannot be compared");
  add("/etc/b.plist", "", Kind::unknown, "cannot be examined");
  EXPECT_EQ(why(), "/etc/b.plist cannot be examined now");
}

TEST_F(WhyNotEntitledTest, AValueThatWasGivenIsTheReason) {
  result.file = "/etc/a.plist";
  add("/etc/0.plist", "Unit", Kind::differs, "is x.service");
  result.value = PropertyList::boolean(true);
  EXPECT_EQ(why(), "/etc/a.plist gives it by now");
  result.value = PropertyList::boolean(false);
  EXPECT_EQ(why(), "/etc/a.plist gives it as false");
  result.value = PropertyList::integer(1);
  EXPECT_EQ(why(), "/etc/a.plist gives it as an integer, not a boolean");
}

TEST_F(WhyNotEntitledTest, WhereNothingIsAtFaultNoFileNamesIt) {
  EXPECT_EQ(why(), "no file names it");
  add("/etc", "", Kind::note, "is read");
  add("/etc/a.plist", "unit", Kind::note, "is not a key of these files");
  add("/etc/a.plist", "Executable", Kind::holds, "is /bin/a");
  EXPECT_EQ(why(), "no file names it");
}

TEST_F(WhyNotEntitledTest, AFileWithoutTheEntitlementIsNotNearWhateverElseItSays) {
  add("/etc/a.plist", "Executable", Kind::holds, "is /bin/a");
  add("/etc/a.plist", "Entitlements", Kind::differs, "does not have it");
  EXPECT_EQ(why(), "no file names it");
  add("/etc/b.plist", "User", Kind::differs, "is b");
  add("/etc/b.plist", "Executable", Kind::differs, "is /bin/b");
  EXPECT_EQ(why(), "/etc/b.plist came nearest, but its User is b");
}

TEST_F(WhyNotEntitledTest, AFileWhoseEntitlementsAreWrongMayHaveMeantIt) {
  add("/etc/a.plist", "Entitlements", Kind::wrong, "is missing");
  EXPECT_EQ(why(), "/etc/a.plist came nearest, but its Entitlements is missing");
}

TEST_F(WhyNotEntitledTest, TheFileWithTheFewestFaultsIsTheNearest) {
  add("/etc/a.plist", "User", Kind::differs, "is a");
  add("/etc/a.plist", "Executable", Kind::holds, "is /bin/a");
  add("/etc/a.plist", "Unit", Kind::differs, "is a.service");
  add("/etc/b.plist", "User", Kind::holds, "is b");
  add("/etc/b.plist", "Executable", Kind::wrong, "cannot be relied on");
  add("/etc/c.plist", "User", Kind::holds, "is c");
  add("/etc/c.plist", "Executable", Kind::holds, "is /bin/c");
  add("/etc/c.plist", "Unit", Kind::differs, "is c.service");
  add("/etc/c.plist", "SHA256", Kind::differs, "is another");
  EXPECT_EQ(why(), "/etc/b.plist came nearest, but its Executable cannot be relied on");
}

TEST_F(WhyNotEntitledTest, OfFilesWithAsManyFaultsTheOneOfTheCallersExecutableIsTheNearest) {
  add("/etc/a.plist", "User", Kind::holds, "is a");
  add("/etc/a.plist", "Executable", Kind::differs, "is /bin/a");
  add("/etc/b.plist", "User", Kind::differs, "is b");
  add("/etc/b.plist", "Executable", Kind::holds, "is /bin/b");
  add("/etc/c.plist", "User", Kind::holds, "is c");
  add("/etc/c.plist", "Executable", Kind::differs, "is /bin/c");
  EXPECT_EQ(why(), "/etc/b.plist came nearest, but its User is b");
}

TEST_F(WhyNotEntitledTest, AmongThoseTheOneThatFailsAtTheLatestKeyIsTheNearestAndTheFirstOfEquals) {
  add("/etc/a.plist", "User", Kind::differs, "is a");
  add("/etc/a.plist", "Executable", Kind::holds, "is /bin/a");
  add("/etc/a.plist", "Entitlements", Kind::holds, "has it");
  for (const char* const path : {"/etc/b.plist", "/etc/c.plist"}) {
    add(path, "User", Kind::holds, "is root");
    add(path, "Executable", Kind::holds, "is /bin/a");
    add(path, "Unit", Kind::differs, "is x.service");
  }
  add("/etc/d.plist", "User", Kind::differs, "is d");
  add("/etc/d.plist", "Executable", Kind::holds, "is /bin/a");
  EXPECT_EQ(why(), "/etc/b.plist came nearest, but its Unit is x.service");
}

TEST_F(WhyNotEntitledTest, ADirectoryOrFileThatIsWrongAsAWholeIsNamedAsPassedOver) {
  add("/etc", "", Kind::wrong, "not a directory");
  EXPECT_EQ(why(), "/etc is passed over: not a directory");
  add("/lib/a.plist", "User", Kind::holds, "is root");
  add("/lib/a.plist", "Executable", Kind::differs, "is /bin/a");
  EXPECT_EQ(why(), "/lib/a.plist came nearest, but its Executable is /bin/a");
}

}  // namespace
}  // namespace brenvik

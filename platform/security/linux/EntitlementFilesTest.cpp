// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/security/linux/EntitlementFiles.h"

#include <dlfcn.h>
#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <csignal>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <functional>
#include <thread>

#include "platform/base/ProcessFacts.h"
#include "platform/base/UniqueFd.h"
#include "platform/base/fakes/FailingAllocations.h"
#include "platform/base/fakes/FailingCalls.h"
#include "platform/log/Log.h"
#include "platform/log/fakes/RecordingLog.h"
#include "platform/plist/PropertyListCodec.h"
#include "platform/security/linux/CallerTestSupport.h"
#include "platform/security/linux/EntitlementTestSupport.h"
#include "platform/security/linux/Sha256.h"

// Calls of this program that a test may let fail. None of the opens here makes a file. Only the symbols have
// the names of the C library: where its headers check sizes (_FORTIFY_SOURCE), they define functions of these
// names, and call others, which clang's programs then do.
static std::function<void(const char*)> beforeOpening;  // is told of each path that is opened

extern "C" {
ssize_t failingRead(int fd, void* bytes, std::size_t size) __asm__("read");
ssize_t failingCheckedRead(int fd, void* bytes, std::size_t size, std::size_t room) __asm__("__read_chk");
ssize_t failingGetdents64(int fd, void* bytes, std::size_t size) noexcept __asm__("getdents64");
int failingLstat(const char* path, struct stat* facts) noexcept __asm__("lstat");
int failingOpenat(int directory, const char* path, int flags, ...) __asm__("openat");
int failingCheckedOpenat(int directory, const char* path, int flags) __asm__("__openat_2");

ssize_t failingRead(int fd, void* bytes, std::size_t size) {
  return brenvik::FailingCall::failsNow("read") ? -1 : ::syscall(SYS_read, fd, bytes, size);
}
ssize_t failingCheckedRead(int fd, void* bytes, std::size_t size, std::size_t /*room*/) {
  return failingRead(fd, bytes, size);
}
ssize_t failingGetdents64(int fd, void* bytes, std::size_t size) noexcept {
  return brenvik::FailingCall::failsNow("getdents64") ? -1 : ::syscall(SYS_getdents64, fd, bytes, size);
}
int failingLstat(const char* path, struct stat* facts) noexcept {
  if (brenvik::FailingCall::failsNow("lstat")) return -1;
  return static_cast<int>(::syscall(SYS_newfstatat, AT_FDCWD, path, facts, AT_SYMLINK_NOFOLLOW));
}
int failingOpenat(int directory, const char* path, int flags, ...) {
  if (beforeOpening) beforeOpening(path);
  if (brenvik::FailingCall::failsNow("openat")) return -1;
  return static_cast<int>(::syscall(SYS_openat, directory, path, flags, 0));
}
int failingCheckedOpenat(int directory, const char* path, int flags) {
  return failingOpenat(directory, path, flags);
}
}

namespace brenvik {
namespace {

namespace fs = std::filesystem;
using testing::ElementsAre;
using testing::IsEmpty;

constexpr uid_t kStranger = 65534;

// A process that runs `program` as root until this object goes, or kill() is called.
class Child {
 public:
  explicit Child(const std::string& program) {
    int input[2];
    int started[2];
    if (::pipe2(input, O_CLOEXEC) != 0 || ::pipe2(started, O_CLOEXEC) != 0) std::abort();
    keepsItWaiting_.reset(input[1]);
    const UniqueFd itsInput(input[0]);
    const UniqueFd hasStarted(started[0]);
    UniqueFd untilExec(started[1]);
    pid_ = ::fork();
    if (pid_ == 0) {
      ::dup2(itsInput.get(), 0);
      ::execl(program.c_str(), "caller", nullptr);
      ::_exit(127);
    }
    untilExec.reset();
    char byte;
    (void)!::read(hasStarted.get(), &byte, 1);  // end of file once exec has closed the other end
    startTime_ = processStartTime(pid_).value_or(0);
  }
  Child(const Child&) = delete;
  Child& operator=(const Child&) = delete;
  ~Child() { kill(); }

  void kill() {
    if (pid_ <= 0) return;
    ::kill(pid_, SIGKILL);
    ::waitpid(pid_, nullptr, 0);
    pid_ = -1;
  }
  AuditToken token(uid_t uid = 0) const {
    AuditToken token;
    token.words = {~0U, uid, uid, uid, uid, static_cast<std::uint32_t>(pid_), 1, startTime_};
    return token;
  }

 private:
  UniqueFd keepsItWaiting_;
  pid_t pid_ = -1;
  std::uint32_t startTime_ = 0;
};

class EntitlementFilesTest : public EntitlementFolderTest {
 protected:
  EntitlementFiles makeFiles(const std::string& proc = "/proc") {
    return EntitlementFiles(accounts, {(root / "etc").string(), (root / "lib").string()}, proc);
  }
  SecurityTask::Answer ask(const AuditToken& caller, const char* name = kName) {
    auto files = makeFiles();
    const auto task = files.makeTask(caller);
    if (task == nullptr) {
      ADD_FAILURE() << "no task";
      return {};
    }
    return task->copyEntitlement(name);
  }
  // The caller holds nothing, and nobody is to blame.
  void expectNothing(const AuditToken& caller, const char* why = "") {
    const auto answer = ask(caller);
    EXPECT_FALSE(answer.value) << why;
    EXPECT_FALSE(answer.error) << why;
  }
  void expectGranted(const AuditToken& caller, const char* why = "") {
    const auto answer = ask(caller);
    EXPECT_EQ(answer.value, PropertyList::boolean(true)) << why;
    EXPECT_FALSE(answer.error) << why;
  }
};

TEST_F(EntitlementFilesTest, ACallerThatOnlyTheReaderMayReadCostsTwoQuestions) {
  if (!readsCallersByItself()) GTEST_SKIP() << "a process with fewer rights than this one cannot be made";
  grant("etc/a.plist");
  const Child caller(program);
  const UniqueFd folder(
      ::open(("/proc/" + std::to_string(caller.token().pid())).c_str(), O_PATH | O_CLOEXEC));
  ASSERT_EQ(::chmod(root.c_str(), 0755), 0);  // the child has no power over modes
  AnsweringReader reader;
  reader.answer = callerFactsOf(folder.get());
  const auto outcome = [&](int questions, bool isEntitled) {
    return withoutCapabilities([&] {
      EntitlementFiles files(accounts, {(root / "etc").string()}, "/proc", &reader);
      const auto task = files.makeTask(caller.token());
      if (task == nullptr) return 1;
      if (task->describeCaller().executable != program) return 2;
      const auto answer = task->copyEntitlement(kName);
      if (answer.error || (answer.value.asBoolean() == true) != isEntitled) return 3;
      if (!isEntitled && task->explainRefusal(kName).empty()) return 4;
      return reader.asked == questions ? 0 : 10 + reader.asked;
    });
  };
  EXPECT_EQ(outcome(2, true), 0) << "what it is, and whether it still is when all has been read";
  fs::remove(root / "etc/a.plist");
  EXPECT_EQ(outcome(2, false), 0);
}

TEST_F(EntitlementFilesTest, AFileOfTheCallersProgramGivesTheValue) {
  grant("etc/a.plist");
  const Child caller(program);
  expectGranted(caller.token());
  EXPECT_THAT(log.entries(), IsEmpty());
  EXPECT_EQ(accounts.idLookUps, 0) << "the superuser needs no look-up";
}

TEST_F(EntitlementFilesTest, ValuesOfAnyTypeAreGivenAsTheyAre) {
  grant("etc/a.plist", "<string>true</string>");
  const Child caller(program);
  EXPECT_EQ(ask(caller.token()).value, PropertyList::string("true"));
  grant("etc/a.plist", "<false/>");
  EXPECT_EQ(ask(caller.token()).value, PropertyList::boolean(false));
  grant("etc/a.plist", "<array><integer>7</integer></array>");
  EXPECT_EQ(ask(caller.token()).value, PropertyList::array({PropertyList::integer(7)}));
}

TEST_F(EntitlementFilesTest, AnEntitlementThatNoFileNamesHasNoValue) {
  grant("etc/a.plist");
  const Child caller(program);
  const auto answer = ask(caller.token(), "com.example.other");
  EXPECT_FALSE(answer.value);
  EXPECT_FALSE(answer.error);
}

TEST_F(EntitlementFilesTest, WithoutDirectoriesNobodyHoldsAnythingAndNothingIsSaid) {
  fs::remove(root / "etc");
  fs::remove(root / "lib");
  const Child caller(program);
  expectNothing(caller.token());
  EXPECT_THAT(log.entries(), IsEmpty());
}

TEST_F(EntitlementFilesTest, AnotherProgramIsNotMatched) {
  grant("etc/a.plist");
  fs::copy_file(program, root / "copy");
  const Child caller((root / "copy").string());
  expectNothing(caller.token(), "the same bytes in another file");
}

TEST_F(EntitlementFilesTest, TheExecutableIsFollowedThroughLinks) {
  fs::create_symlink(program, root / "link");
  write("etc/a.plist", document(quoted("Executable", (root / "link").string()) + held()));
  const Child caller(program);
  expectGranted(caller.token());
}

TEST_F(EntitlementFilesTest, AProgramReplacedUnderTheRunningCallerIsAnotherProgram) {
  grant("etc/a.plist");
  const Child caller(program);
  fs::copy_file(program, root / "new");
  fs::rename(root / "new", program);
  expectNothing(caller.token());
}

TEST_F(EntitlementFilesTest, AnExecutableThatIsNoAbsolutePathOrDoesNotExistMatchesNothing) {
  const Child caller(program);
  write("etc/a.plist", document(quoted("Executable", (root / "gone").string()) + held()));
  expectNothing(caller.token(), "missing");
  write("etc/a.plist", document(quoted("Executable", program + "/x") + held()));
  expectNothing(caller.token(), "below a file");
  write("etc/a.plist", document(quoted("Executable", program + "/") + held()));
  expectNothing(caller.token(), "as a folder");
  EXPECT_THAT(log.entries(), IsEmpty()) << "a program may be installed later";
  write("etc/a.plist", document(quoted("Executable", "program") + held()));
  expectNothing(caller.token(), "relative");
  expectOneError(passedOver("etc/a.plist", "Executable is not an absolute path"));
  write("etc/a.plist", document(held()));
  expectNothing(caller.token(), "not named");
  expectOneError(passedOver("etc/a.plist", "Executable is missing"));
}

TEST_F(EntitlementFilesTest, TheAccountOfTheMessageDecidesAndRootIsTheDefault) {
  grant("etc/a.plist");
  const Child caller(program);
  expectNothing(caller.token(kStranger), "a program of root's that sent the message as somebody else");
  expectGranted(caller.token());
}

TEST_F(EntitlementFilesTest, ANamedAccountIsLookedUpAndCompared) {
  accounts.accounts["keeper"] = {AccountIds{kStranger, 1}, std::nullopt};
  grant("etc/a.plist", "<true/>", quoted("User", "keeper"));
  const Child caller(program);
  expectGranted(caller.token(kStranger));
  expectNothing(caller.token(0), "root is not keeper");
  EXPECT_THAT(log.entries(), IsEmpty());
  accounts.accounts.clear();
  expectNothing(caller.token(kStranger), "no such account");
  expectOneError(passedOver("etc/a.plist", "User is \"keeper\", and there is no such account"));
  expectNothing(caller.token(0), "nor root");
  expectOneError(passedOver("etc/a.plist", "User is \"keeper\", and there is no such account"));
}

TEST_F(EntitlementFilesTest, TheAccountComesFirstSoThatNothingOfAStrangerIsLookedAt) {
  grant("etc/a.plist");
  ASSERT_EQ(::chmod(program.c_str(), 0777), 0);
  const Child caller(program);
  expectNothing(caller.token(kStranger));
  EXPECT_THAT(log.entries(), IsEmpty()) << "its executable would have been complained about";
}

TEST_F(EntitlementFilesTest, FilesAreReadInBytewiseOrderOfTheirNames) {
  grant("etc/a.plist", "<string>a</string>");
  grant("etc/Z.plist", "<string>Z</string>");
  grant("etc/10.plist", "<string>10</string>");
  grant("etc/9.plist", "<string>9</string>");
  grant("etc/\xC3\xA9.plist", "<string>e-acute</string>");
  const Child caller(program);
  for (const char* const first : {"10", "9", "Z", "a"}) {
    EXPECT_EQ(ask(caller.token()).value, PropertyList::string(first));
    fs::remove(root / "etc" / (std::string(first) + ".plist"));
  }
  EXPECT_EQ(ask(caller.token()).value, PropertyList::string("e-acute"));
}

TEST_F(EntitlementFilesTest, TheFirstDirectoryGoesBeforeTheSecondWhateverTheNames) {
  grant("etc/z.plist", "<false/>");
  grant("lib/a.plist", "<true/>");
  const Child caller(program);
  EXPECT_EQ(ask(caller.token()).value, PropertyList::boolean(false)) << "the administrator's word stands";
  fs::remove(root / "etc/z.plist");
  expectGranted(caller.token());
}

TEST_F(EntitlementFilesTest, AFileThatMatchesWithoutTheKeyLeavesTheQuestionToTheNext) {
  write("etc/a.plist", document(quoted("Executable", program) + "<key>Entitlements</key><dict/>"));
  grant("etc/b.plist");
  const Child caller(program);
  expectGranted(caller.token());
}

TEST_F(EntitlementFilesTest, OnlyNamesThatEndInPlistAndAreNotHiddenAreRead) {
  grant("etc/a.plist.bak");
  grant("etc/a.PLIST");
  grant("etc/aplist");
  grant("etc/.a.plist");
  grant("etc/.plist");
  const Child caller(program);
  expectNothing(caller.token());
  EXPECT_THAT(log.entries(), IsEmpty());
}

TEST_F(EntitlementFilesTest, BinaryFilesAreReadToo) {
  const auto content = PropertyList::dictionary(
      {{"Executable", PropertyList::string(program)},
       {"Entitlements", PropertyList::dictionary({{kName, PropertyList::boolean(true)}})}});
  const auto bytes = serializePropertyList(content, PropertyListFormat::binary);
  ASSERT_TRUE(bytes);
  write("etc/a.plist", *bytes);
  const Child caller(program);
  expectGranted(caller.token());
}

TEST_F(EntitlementFilesTest, ATextWithANulInItNamesNoFileAndNoAccount) {
  const std::string nul(1, '\0');
  const auto writeWith = [&](const std::string& executable, const std::string& user) {
    const auto bytes = serializePropertyList(
        PropertyList::dictionary(
            {{"Executable", PropertyList::string(executable)},
             {"User", PropertyList::string(user)},
             {"Entitlements", PropertyList::dictionary({{kName, PropertyList::boolean(true)}})}}),
        PropertyListFormat::binary);
    ASSERT_TRUE(bytes);
    write("etc/a.plist", *bytes);
  };
  accounts.accounts["keeper"] = {AccountIds{0, 0}, std::nullopt};
  const Child caller(program);
  writeWith(program, "keeper");
  expectGranted(caller.token());
  writeWith(program + nul + "x", "keeper");
  expectNothing(caller.token());
  expectOneError(passedOver("etc/a.plist", "Executable is not an absolute path"));
  writeWith(program, "keeper" + nul + "x");
  expectNothing(caller.token());
  EXPECT_EQ(log.entries().size(), 1U);
}

struct WrongKey {
  const char* name;
  const char* keys;  // after Executable and Entitlements
  const char* told;
};
class WrongKeyTest : public EntitlementFilesTest, public testing::WithParamInterface<WrongKey> {};

TEST_P(WrongKeyTest, AWrongKeyMakesTheFileNoMatchAndIsToldWhoeverAsks) {
  write("etc/a.plist", document(quoted("Executable", program) + held() + GetParam().keys));
  const Child caller(program);
  for (const uid_t account : {uid_t{0}, kStranger}) {
    expectNothing(caller.token(account));
    expectOneError(passedOver("etc/a.plist", GetParam().told));
  }
  grant("etc/b.plist");
  expectGranted(caller.token(), "the next file is asked");
}
INSTANTIATE_TEST_SUITE_P(
    EveryKey, WrongKeyTest,
    testing::Values(
        WrongKey{"Executable", "<key>Executable</key><integer>1</integer>",
                 "Executable is an integer, not a string"},
        WrongKey{"User", "<key>User</key><true/>", "User is a boolean, not a string"},
        WrongKey{"Unit", "<key>Unit</key><array/>", "Unit is an array, not a string"},
        WrongKey{"EmptyUnit", "<key>Unit</key><string></string>", "Unit is not the name of a unit"},
        WrongKey{"PathAsUnit", "<key>Unit</key><string>/system.slice/x.service</string>",
                 "Unit is not the name of a unit"},
        WrongKey{"SlashInUnit", "<key>Unit</key><string>system.slice/x.service</string>",
                 "Unit is not the name of a unit"},
        WrongKey{"SHA256", "<key>SHA256</key><data></data>", "SHA256 is data, not a string"},
        WrongKey{"ShortSHA256", "<key>SHA256</key><string>00</string>",
                 "SHA256 is not 64 hexadecimal digits"},
        WrongKey{"Entitlements", "<key>Entitlements</key><real>1</real>",
                 "Entitlements is a real, not a dictionary"},
        WrongKey{"Two", "<key>Unit</key><date>2001-01-01T00:00:00Z</date><key>Executable</key><dict/>",
                 "Executable is a dictionary, not a string; Unit is a date, not a string"}),
    [](const auto& test) { return std::string(test.param.name); });

TEST_F(EntitlementFilesTest, WhatIsWrongIsToldOnceForEachStateOfTheFile) {
  const Child caller(program);
  auto files = makeFiles();
  const auto ask = [&] { EXPECT_FALSE(files.makeTask(caller.token())->copyEntitlement(kName).value); };
  const std::string type = passedOver("etc/a.plist", "User is an integer, not a string");
  grant("etc/a.plist", "<true/>", "<key>User</key><integer>0</integer>");
  ask();
  expectOneError(type);
  ask();
  EXPECT_THAT(log.entries(), IsEmpty()) << "the same file once more";
  grant("etc/a.plist", "<true/>", "<key>User</key><integer>00</integer>");
  ask();
  expectOneError(type);
  grant("etc/a.plist", "<false/>");
  EXPECT_EQ(files.makeTask(caller.token())->copyEntitlement(kName).value, PropertyList::boolean(false));
  EXPECT_THAT(log.entries(), IsEmpty());

  // The executable has changed, and the file has not.
  const std::string executable =
      passedOver("etc/a.plist", "Executable cannot be relied on: " + program +
                                    " is not owned by root, or others may write to it");
  for (int i = 0; i < 2; ++i) {
    ASSERT_EQ(::chmod(program.c_str(), 0775), 0);
    ask();
    expectOneError(executable);
    ask();
    EXPECT_THAT(log.entries(), IsEmpty());
    ASSERT_EQ(::chmod(program.c_str(), 0755), 0);
    (void)files.makeTask(caller.token())->copyEntitlement(kName);
    EXPECT_THAT(log.entries(), IsEmpty());
  }

  // A directory is told once, however often its content changes.
  ASSERT_EQ(::chmod((root / "etc").c_str(), 0775), 0);
  ask();
  EXPECT_EQ(log.entries().size(), 1U);
  log.clear();
  write("etc/another", "");
  ask();
  EXPECT_THAT(log.entries(), IsEmpty());
}

TEST_F(EntitlementFilesTest, TheDigestMustMatchWhenItIsGiven) {
  const UniqueFd fd(::open(program.c_str(), O_RDONLY | O_CLOEXEC));
  const auto digest = sha256OfFile(fd.get());
  ASSERT_TRUE(digest);
  std::string hex;
  for (const std::uint8_t byte : *digest) hex += hexOf(byte);
  const Child caller(program);
  grant("etc/a.plist", "<true/>", quoted("SHA256", hex));
  expectGranted(caller.token());
  for (char& c : hex) c = static_cast<char>(std::toupper(c));
  grant("etc/a.plist", "<true/>", quoted("SHA256", hex));
  expectGranted(caller.token(), "upper case");
  hex.back() = hex.back() == '0' ? '1' : '0';
  grant("etc/a.plist", "<true/>", quoted("SHA256", hex));
  expectNothing(caller.token(), "another digest");
  hex.pop_back();
  grant("etc/a.plist", "<true/>", quoted("SHA256", hex));
  EXPECT_THAT(log.entries(), IsEmpty());
  expectNothing(caller.token(), "no digest at all");
  grant("etc/a.plist", "<true/>", quoted("SHA256", ""));
  expectNothing(caller.token(), "empty");
}

using EntitlementFilesDeathTest = EntitlementFilesTest;

TEST_F(EntitlementFilesDeathTest, TheDigestLibraryIsLoadedByTheFirstFileThatNeedsItAndNotBefore) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");  // a process of its own, in which no other test has run
  EXPECT_EXIT(
      {
        const auto isLoaded = [] { return ::dlopen("libcrypto.so.3", RTLD_NOW | RTLD_NOLOAD) != nullptr; };
        const Child caller(program);
        const bool atStart = isLoaded();
        grant("etc/a.plist");
        const bool granted = ask(caller.token()).value.hasValue();
        const bool withoutDigest = isLoaded();
        grant("etc/a.plist", "<true/>", quoted("SHA256", std::string(64, '0')));
        (void)ask(caller.token(kStranger));
        const bool forAStranger = isLoaded();
        (void)ask(caller.token());
        const bool withDigest = isLoaded();
        fs::remove_all(root);
        ::_exit(!atStart && granted && !withoutDigest && !forAStranger && withDigest ? 7 : 1);
      },
      testing::ExitedWithCode(7), "");
}

// ----- What cannot be trusted -----

TEST_F(EntitlementFilesTest, AFileNotOwnedByRootIsPassedOverAndReported) {
  const auto file = grant("etc/a.plist");
  ASSERT_EQ(::chown(file.c_str(), kStranger, 0), 0);
  const Child caller(program);
  expectNothing(caller.token());
  expectOneError(
      line("entitlement file ", file, " passed over: not owned by root, or others may write to it"));
  grant("lib/a.plist");
  expectGranted(caller.token(), "the next file is asked");
}

TEST_F(EntitlementFilesTest, AFileThatGroupOrOthersMayWriteIsPassedOverAndReported) {
  const auto file = grant("etc/a.plist");
  const Child caller(program);
  for (const mode_t mode : {0664U, 0646U, 0666U}) {
    ASSERT_EQ(::chmod(file.c_str(), mode), 0);
    expectNothing(caller.token());
    expectOneError(
        line("entitlement file ", file, " passed over: not owned by root, or others may write to it"));
  }
}

TEST_F(EntitlementFilesTest, ADirectoryThatCannotBeTrustedIsPassedOverAndReported) {
  grant("etc/a.plist");
  const Child caller(program);
  const fs::path etc = root / "etc";
  const std::string text =
      line("entitlement directory ", etc, " passed over: not owned by root, or others may write to it");
  for (const mode_t mode : {0775U, 0757U, 01777U}) {
    ASSERT_EQ(::chmod(etc.c_str(), mode), 0);
    expectNothing(caller.token());
    expectOneError(text);
  }
  ASSERT_EQ(::chmod(etc.c_str(), 0755), 0);
  ASSERT_EQ(::chown(etc.c_str(), kStranger, 0), 0);
  expectNothing(caller.token());
  expectOneError(text);
  ASSERT_EQ(::chown(etc.c_str(), 0, 0), 0);
  expectGranted(caller.token());
}

TEST_F(EntitlementFilesTest, ADirectoryThatIsNoneIsPassedOverAndReported) {
  fs::remove(root / "etc");
  write("etc", "");
  grant("lib/a.plist");
  const Child caller(program);
  expectGranted(caller.token());
  expectOneError(line("entitlement directory ", root / "etc", " passed over: not a directory"));
}

TEST_F(EntitlementFilesTest, AnExecutableThatCannotBeTrustedMakesItsFilePassedOverAndReported) {
  grant("etc/a.plist");
  const std::string text = passedOver("etc/a.plist", "Executable cannot be relied on: " + program +
                                                         " is not owned by root, or others may write to it");
  const Child caller(program);
  for (const mode_t mode : {0775U, 0757U}) {
    ASSERT_EQ(::chmod(program.c_str(), mode), 0);
    expectNothing(caller.token());
    expectOneError(text);
  }
  ASSERT_EQ(::chmod(program.c_str(), 0755), 0);
  ASSERT_EQ(::chown(program.c_str(), kStranger, 0), 0);
  expectNothing(caller.token());
  expectOneError(text);
}

// What a path of folders and links is worth as Executable, when the program itself is root's.
class FoldersAboveTest : public EntitlementFilesTest {
 protected:
  void SetUp() override {
    EntitlementFilesTest::SetUp();
    if (IsSkipped()) return;
    fs::create_directories(root / "a/b");
    for (const char* const folder : {"a", "a/b"}) ASSERT_EQ(::chmod((root / folder).c_str(), 0755), 0);
    fs::rename(program, root / "a/b/program");
    program = (root / "a/b/program").string();
  }
  void grantFor(const fs::path& executable) {
    write("etc/a.plist", document(quoted("Executable", executable.string()) + held()));
  }
  void expectDistrust(const AuditToken& caller, const fs::path& place, const char* why = "") {
    expectNothing(caller, why);
    expectOneError(passedOver("etc/a.plist", "Executable cannot be relied on: " + place.string() +
                                                 " is not owned by root, or others may write to it"));
  }
};

TEST_F(FoldersAboveTest, EachFolderAboveTheExecutableMustBeRootsAlone) {
  grantFor(program);
  const Child caller(program);
  expectGranted(caller.token());
  for (const char* const folder : {"a", "a/b"}) {
    const fs::path place = root / folder;
    for (const mode_t mode : {0775U, 0757U}) {
      ASSERT_EQ(::chmod(place.c_str(), mode), 0);
      expectDistrust(caller.token(), place);
    }
    ASSERT_EQ(::chmod(place.c_str(), 0755), 0);
    ASSERT_EQ(::chown(place.c_str(), kStranger, 0), 0);
    expectDistrust(caller.token(), place, "its owner can rename what is in it");
    ASSERT_EQ(::chmod(place.c_str(), 01777), 0);
    expectDistrust(caller.token(), place, "with the sticky bit, too");
    ASSERT_EQ(::chown(place.c_str(), 0, 0), 0);
    expectGranted(caller.token(), "in a folder of root's with the sticky bit root's entries stay");
    ASSERT_EQ(::chmod(place.c_str(), 0755), 0);
  }
}

TEST_F(FoldersAboveTest, ALinkOnTheWayMustBeRootsAndStandWhereOnlyRootCanReplaceIt) {
  const Child caller(program);
  fs::create_directory(root / "links");
  ASSERT_EQ(::chmod((root / "links").c_str(), 01777), 0);
  for (const char* const target : {"../a", "../links/../a/.", "../a/b/.."}) {
    fs::create_symlink(target, root / "links/a");
    grantFor(root / "links/a/b/program");
    expectGranted(caller.token(), target);
    ASSERT_EQ(::lchown((root / "links/a").c_str(), kStranger, 0), 0);
    expectDistrust(caller.token(), root / "links/a", "its owner could replace it");
    fs::remove(root / "links/a");
  }
  fs::create_symlink(root / "a/b/program", root / "links/absolute");
  grantFor(root / "links/absolute");
  expectGranted(caller.token());
  ASSERT_EQ(::chmod((root / "links").c_str(), 0777), 0);
  expectDistrust(caller.token(), root / "links", "anybody could replace the link");
  fs::create_symlink("round", root / "a/round");
  grantFor(root / "a/round/program");
  expectNothing(caller.token(), "a circle leads nowhere");
  EXPECT_THAT(log.entries(), IsEmpty());
}

TEST_F(FoldersAboveTest, AFolderSwappedByItsOwnerGivesTheEntitlementToNobody) {
  // The owner of a/b moves root's program away and leads the path to another program of root's.
  grantFor(program);
  const fs::path other = root / "other";
  fs::copy_file(program, other);
  ASSERT_EQ(::chmod(other.c_str(), 0755), 0);
  ASSERT_EQ(::chown((root / "a").c_str(), kStranger, 0), 0);
  fs::rename(root / "a/b", root / "a/c");
  fs::create_directory(root / "a/b");
  fs::create_hard_link(other, root / "a/b/program");
  const Child caller(other.string());
  expectDistrust(caller.token(), root / "a");
}

TEST_F(EntitlementFilesTest, EachFolderAboveTheFilesMustBeRootsAlone) {
  fs::create_directories(root / "above/etc");
  for (const char* const folder : {"above", "above/etc"})
    ASSERT_EQ(::chmod((root / folder).c_str(), 0755), 0);
  grant("above/etc/a.plist");
  const Child caller(program);
  EntitlementFiles files(accounts, {(root / "above/etc").string()});
  const auto isGranted = [&] {
    return files.makeTask(caller.token())->copyEntitlement(kName).value.hasValue();
  };
  EXPECT_TRUE(isGranted());
  ASSERT_EQ(::chown((root / "above").c_str(), kStranger, 0), 0);
  EXPECT_FALSE(isGranted());
  EXPECT_FALSE(isGranted());
  expectOneError("entitlement directory " + (root / "above/etc").string() + " passed over: " +
                 (root / "above").string() + " is not owned by root, or others may write to it");
}

TEST_F(EntitlementFilesTest, ALinkIsPassedOverAndReported) {
  const auto target = grant("good");
  fs::create_symlink(target, root / "etc/a.plist");
  const Child caller(program);
  expectNothing(caller.token());
  expectOneError(line("entitlement file ", root / "etc/a.plist", " passed over: not a regular file"));
}

TEST_F(EntitlementFilesTest, APipeASocketADeviceAndAFolderArePassedOverReportedAndHoldNobodyUp) {
  const Child caller(program);
  const fs::path file = root / "etc/a.plist";
  const std::string text = line("entitlement file ", file, " passed over: not a regular file");

  ASSERT_EQ(::mkfifo(file.c_str(), 0644), 0);
  expectNothing(caller.token(), "pipe");
  expectOneError(text);
  fs::remove(file);

  const UniqueFd socket(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  ASSERT_LT(file.string().size(), sizeof address.sun_path);
  file.string().copy(address.sun_path, file.string().size());
  ASSERT_EQ(::bind(socket.get(), reinterpret_cast<sockaddr*>(&address), sizeof address), 0);
  expectNothing(caller.token(), "socket");
  expectOneError(text);
  fs::remove(file);

  fs::create_directory(file);
  expectNothing(caller.token(), "folder");
  expectOneError(text);
}

TEST_F(EntitlementFilesTest, AFileOfOneMebibyteIsReadAndALargerOneIsPassedOverAndReported) {
  const std::string good = document(quoted("Executable", program) + held());
  const auto file = write("etc/a.plist", good + std::string((std::size_t{1} << 20) - good.size(), '\n'));
  ASSERT_EQ(fs::file_size(file), std::size_t{1} << 20);
  const Child caller(program);
  expectGranted(caller.token());
  write("etc/a.plist", good + std::string((std::size_t{1} << 20) - good.size() + 1, '\n'));
  expectNothing(caller.token());
  expectOneError(line("entitlement file ", file, " passed over: too large"));
}

TEST_F(EntitlementFilesTest, AFileThatIsNoPropertyListDictionaryIsPassedOverAndReported) {
  const Child caller(program);
  const std::string text =
      line("entitlement file ", root / "etc/a.plist", " passed over: not a property list of the right form");
  for (const char* const content :
       {"", "hello", "<plist version=\"1.0\"><dict>", "<plist version=\"1.0\"><array/></plist>"}) {
    write("etc/a.plist", content);
    expectNothing(caller.token(), content);
    expectOneError(text);
  }
}

// ----- Who is asking -----

TEST_F(EntitlementFilesTest, ACallerThatIsGoneOrAwaitsItsParentOrIsAnotherOneIsNoTask) {
  grant("etc/a.plist");
  auto files = makeFiles();
  Child caller(program);
  AuditToken token = caller.token();
  EXPECT_NE(files.makeTask(token), nullptr);

  token.words[7] += 1;
  EXPECT_EQ(files.makeTask(token), nullptr) << "the id now belongs to a process that started at another time";

  token = caller.token();
  caller.kill();
  EXPECT_EQ(files.makeTask(token), nullptr) << "gone";
  EXPECT_EQ(files.explainNoTask(token), "the caller has ended");

  token.words[5] = 0;
  EXPECT_EQ(files.makeTask(token), nullptr) << "a token that names no process";
}

TEST_F(EntitlementFilesTest, ACallerThatGoesAfterTheTaskWasMadeHoldsNothing) {
  grant("etc/a.plist");
  auto files = makeFiles();
  Child caller(program);
  const auto task = files.makeTask(caller.token());
  ASSERT_NE(task, nullptr);
  caller.kill();
  const auto answer = task->copyEntitlement(kName);
  EXPECT_FALSE(answer.value);
  EXPECT_FALSE(answer.error);
}

TEST_F(EntitlementFilesTest, ACallerThatGoesWhileTheFilesAreReadHoldsNothing) {
  // The first file makes the caller's program known; the second asks for an account, and while that is looked
  // up the caller goes. By then everything fits: only the look at the end can tell.
  write("etc/a.plist", document(quoted("Executable", program) + "<key>Entitlements</key><dict/>"));
  grant("etc/b.plist", "<true/>", quoted("User", "keeper"));
  accounts.accounts["keeper"] = {AccountIds{0, 0}, std::nullopt};
  auto files = makeFiles();
  Child caller(program);
  {
    const auto task = files.makeTask(caller.token());
    ASSERT_NE(task, nullptr);
    ASSERT_TRUE(task->copyEntitlement(kName).value) << "it would be granted";
  }
  const auto task = files.makeTask(caller.token());
  ASSERT_NE(task, nullptr);
  accounts.whenAskedForIds = [&](const std::string&) { caller.kill(); };
  const auto answer = task->copyEntitlement(kName);
  EXPECT_FALSE(answer.value);
  EXPECT_FALSE(answer.error);
  EXPECT_EQ(accounts.idLookUps, 2);
}

// A made-up /proc with one process, for what a real one cannot be brought to do.
class MadeUpProcessTest : public EntitlementFilesTest {
 protected:
  void SetUp() override {
    EntitlementFilesTest::SetUp();
    if (IsSkipped()) return;
    fs::create_directories(root / "proc/7");
    write("proc/7/stat", statText('S', 100));
    write("proc/7/cgroup", "0::/system.slice/caller.service\n");
    fs::create_symlink(program, root / "proc/7/exe");
    for (const char* const process : {"7", "self"}) {
      fs::create_directories(root / "proc" / process / "ns");
      write((std::string("proc/") + process + "/ns/user").c_str(), "");
    }
    fs::remove(root / "proc/7/ns/user");
    fs::create_symlink("../../self/ns/user", root / "proc/7/ns/user");
    token.words = {~0U, 0, 0, 0, 0, 7, 1, 100};
  }
  static std::string statText(char state, int startTime) {
    return std::string("7 (a b) c) ") + state + " 1 7 7 0 -1 0 0 0 0 0 0 0 0 0 20 0 1 0 " +
           std::to_string(startTime) + " 0\n";
  }
  SecurityTask::Answer askHere() {
    auto files = makeFiles((root / "proc").string());
    const auto task = files.makeTask(token);
    if (task == nullptr) {
      ADD_FAILURE() << "no task";
      return {};
    }
    return task->copyEntitlement(kName);
  }
  AuditToken token;
};

TEST_F(MadeUpProcessTest, ACallerThatBecomesAnotherProgramWhileTheFilesAreReadHoldsNothing) {
  write("etc/a.plist", document(quoted("Executable", program) + "<key>Entitlements</key><dict/>"));
  grant("etc/b.plist", "<true/>", quoted("User", "keeper"));
  accounts.accounts["keeper"] = {AccountIds{0, 0}, std::nullopt};
  EXPECT_TRUE(askHere().value) << "it would be granted";
  accounts.whenAskedForIds = [&](const std::string&) {
    fs::remove(root / "proc/7/exe");
    fs::create_symlink("/bin/sh", root / "proc/7/exe");
  };
  const auto answer = askHere();
  EXPECT_FALSE(answer.value);
  EXPECT_FALSE(answer.error);
}

TEST_F(MadeUpProcessTest, TheUnitMustBeTheOneTheCallerRunsIn) {
  grant("etc/a.plist", "<true/>", quoted("Unit", "caller.service"));
  EXPECT_TRUE(askHere().value);
  for (const char* const other :
       {"other.service", "caller", "system.slice", "/system.slice/caller.service", ""}) {
    grant("etc/a.plist", "<true/>", quoted("Unit", other));
    EXPECT_FALSE(askHere().value) << other;
  }
}

TEST_F(MadeUpProcessTest, AUnitIsFoundInTheHierarchyNamedSystemdWhereThereIsNoUnifiedOne) {
  write("proc/7/cgroup", "4:cpu:/\n1:name=systemd:/system.slice/caller.service\n");
  grant("etc/a.plist", "<true/>", quoted("Unit", "caller.service"));
  EXPECT_TRUE(askHere().value);
}

TEST_F(MadeUpProcessTest, AUnitsNameThatAnotherThanTheSystemsManagerGaveIsNoUnit) {
  grant("etc/a.plist", "<true/>", quoted("Unit", "caller.service"));
  for (const char* const forged :
       {"/user.slice/user-501.slice/user@501.service/app.slice/caller.service",
        "/user.slice/user-501.slice/caller.service", "/user.slice/caller.service",
        "/system.slice/container.service/caller.service",
        "/machine.slice/x.scope/system.slice/caller.service", "/x/caller.service", "/.slice/caller.service",
        "/../caller.service", "/system.slice//caller.service", "/system.slice/caller.service/",
        "/system.slice/caller.service (deleted)"}) {
    write("proc/7/cgroup", std::string("0::") + forged + "\n");
    EXPECT_FALSE(askHere().value) << forged;
    write("proc/7/cgroup", std::string("1:name=systemd:") + forged + "\n");
    EXPECT_FALSE(askHere().value) << forged;
  }
  for (const char* const real : {"/caller.service", "/system.slice/caller.service",
                                 "/system.slice/system-caller.slice/caller.service"}) {
    write("proc/7/cgroup", std::string("0::") + real + "\n");
    EXPECT_TRUE(askHere().value) << real;
  }
}

TEST_F(MadeUpProcessTest, ACallerInAnotherUserNamespaceOrInOneThatCannotBeToldIsNoTask) {
  grant("etc/a.plist");
  EXPECT_TRUE(askHere().value);
  auto files = makeFiles((root / "proc").string());
  fs::remove(root / "proc/7/ns/user");
  EXPECT_EQ(files.makeTask(token), nullptr);
  EXPECT_EQ(files.explainNoTask(token), "the caller's user namespace cannot be told");
  write("proc/7/ns/user", "");
  EXPECT_EQ(files.makeTask(token), nullptr);
  EXPECT_EQ(files.explainNoTask(token), "the caller is in a user namespace of its own");
  fs::remove(root / "proc/self/ns/user");
  fs::remove(root / "proc/7/ns/user");
  EXPECT_EQ(files.makeTask(token), nullptr) << "two that cannot be told are not the same";
}

TEST_F(MadeUpProcessTest, AnEmptyUnitIsNotTheUnitOfACallerThatIsInNone) {
  write("proc/7/cgroup", "0::/\n");
  grant("etc/a.plist", "<true/>", quoted("Unit", ""));
  EXPECT_FALSE(askHere().value);
  fs::remove(root / "proc/7/cgroup");
  EXPECT_FALSE(askHere().value);
}

TEST_F(MadeUpProcessTest, AProgramThatBecomesAnotherOneBeforeItIsDigestedIsNoMatch) {
  // The first file makes the caller's program known; while the account of the second is looked up the caller
  // becomes another program, and that one's digest is what the file asks for.
  write("other", "another program");
  const UniqueFd other(::open((root / "other").c_str(), O_RDONLY | O_CLOEXEC));
  std::string hex;
  const Sha256Digest digest = sha256OfFile(other.get()).value();
  for (const std::uint8_t byte : digest) hex += hexOf(byte);
  write("etc/a.plist", document(quoted("Executable", program) + "<key>Entitlements</key><dict/>"));
  grant("etc/b.plist", "<true/>", quoted("User", "keeper") + quoted("SHA256", hex));
  accounts.accounts["keeper"] = {AccountIds{0, 0}, std::nullopt};
  accounts.whenAskedForIds = [&](const std::string&) {
    fs::remove(root / "proc/7/exe");
    fs::create_symlink(root / "other", root / "proc/7/exe");
  };
  const auto answer = askHere();
  EXPECT_EQ(accounts.idLookUps, 1);
  EXPECT_FALSE(answer.value);
  EXPECT_FALSE(answer.error);
}

TEST_F(MadeUpProcessTest, AProgramThatIsReplacedBeforeItIsDigestedDoesNotSpeakForItsOldForm) {
  const fs::path replacement = root / "replacement";
  write("replacement", "the program's next version");
  const UniqueFd next(::open(replacement.c_str(), O_RDONLY | O_CLOEXEC));
  std::string hex;
  const Sha256Digest digest = sha256OfFile(next.get()).value();
  for (const std::uint8_t byte : digest) hex += hexOf(byte);
  grant("etc/a.plist", "<true/>", quoted("SHA256", hex));
  // The caller goes on with the old one.
  fs::remove(root / "proc/7/exe");
  fs::create_hard_link(program, root / "proc/7/exe");
  bool isReplaced = false;
  beforeOpening = [&](const char* path) {
    if (isReplaced || program != path) return;
    isReplaced = true;
    fs::rename(replacement, program);
  };
  const auto answer = askHere();
  beforeOpening = nullptr;
  EXPECT_TRUE(isReplaced);
  EXPECT_FALSE(answer.value);
  EXPECT_FALSE(answer.error);
}

// ----- When the system fails us -----

TEST_F(EntitlementFilesTest, OutOfDescriptorsTheQuestionCannotBeAnsweredAndALaterFileDoesNotAnswerInstead) {
  grant("etc/a.plist", "<false/>");
  grant("lib/a.plist", "<true/>");
  auto files = makeFiles();
  const Child caller(program);
  const auto task = files.makeTask(caller.token());
  ASSERT_NE(task, nullptr);
  rlimit before{};
  ASSERT_EQ(::getrlimit(RLIMIT_NOFILE, &before), 0);
  const auto limitTo = [&](int descriptors) {
    const rlimit limit{static_cast<rlim_t>(descriptors), before.rlim_max};
    ASSERT_EQ(::setrlimit(RLIMIT_NOFILE, &limit), 0);
  };
  int next = ::dup(0);
  ASSERT_GE(next, 0);
  ::close(next);

  limitTo(next);  // not even the directory
  auto answer = task->copyEntitlement(kName);
  limitTo(next + 1);  // the directory, but not the file
  const auto second = task->copyEntitlement(kName);
  limitTo(next);
  const auto noTask = files.makeTask(caller.token());
  ASSERT_EQ(::setrlimit(RLIMIT_NOFILE, &before), 0);

  EXPECT_TRUE(answer.error);
  EXPECT_FALSE(answer.value);
  EXPECT_TRUE(second.error);
  EXPECT_FALSE(second.value);
  EXPECT_EQ(noTask, nullptr);
  EXPECT_THAT(
      log.entries(),
      ElementsAre(
          RecordingLog::unifiedLine(
              LogLevel::error, line("entitlements cannot be told: ", root / "etc", " cannot be examined")),
          RecordingLog::unifiedLine(LogLevel::error, line("entitlements cannot be told: ",
                                                          root / "etc/a.plist", " cannot be examined"))));
  answer = task->copyEntitlement(kName);
  EXPECT_EQ(answer.value, PropertyList::boolean(false));
  EXPECT_FALSE(answer.error);
}

TEST_F(EntitlementFilesTest, WhatTheSystemCannotSayNowIsNoNoAndNoLaterFileAnswersInstead) {
  struct Case {
    const char* call;
    int error;
    int skipped;
    const char* blamed;
  };
  grant("etc/a.plist", "<false/>", quoted("SHA256", std::string(64, '0')));
  grant("lib/a.plist", "<true/>");
  auto files = makeFiles();
  const Child caller(program);
  const auto task = files.makeTask(caller.token());
  ASSERT_NE(task, nullptr);
  // Of the walk to a path, the top included.
  const auto looks = [](const fs::path& path) {
    return static_cast<int>(std::distance(path.begin(), path.end()));
  };
  const int directory = looks(root / "etc");
  const int executable = directory + looks(program);
  for (const Case& which : {Case{"lstat", EMFILE, 0, "etc"}, Case{"lstat", ENOMEM, directory - 1, "etc"},
                            Case{"getdents64", EIO, 0, "etc"}, Case{"openat", EMFILE, 0, "etc/a.plist"},
                            Case{"read", EIO, 0, "etc/a.plist"}, Case{"lstat", EIO, directory, "etc/a.plist"},
                            Case{"lstat", ENOMEM, executable - 1, "etc/a.plist"},
                            Case{"openat", EMFILE, 1, "etc/a.plist"}, Case{"read", EIO, 1, "etc/a.plist"}}) {
    const FailingCall failing(which.call, which.error, which.skipped);
    const auto answer = task->copyEntitlement(kName);
    EXPECT_TRUE(answer.error) << which.call << which.skipped;
    EXPECT_FALSE(answer.value) << which.call << which.skipped;
    EXPECT_EQ(failing.failures(), 1) << which.call << which.skipped;
    expectOneError(line("entitlements cannot be told: ", root / which.blamed, " cannot be examined"));
  }
  EXPECT_TRUE(task->copyEntitlement(kName).value) << "the digest is another one, so the second file counts";
}

TEST_F(EntitlementFilesTest, AFileThatGoesAfterItWasListedIsPassedOverInSilence) {
  grant("etc/a.plist", "<true/>", quoted("User", "keeper"));
  grant("etc/b.plist", "<false/>");
  grant("lib/c.plist", "<true/>");
  accounts.accounts["keeper"] = {AccountIds{kStranger, 1}, std::nullopt};
  accounts.whenAskedForIds = [&](const std::string&) { fs::remove(root / "etc/b.plist"); };
  const Child caller(program);
  expectGranted(caller.token());
  EXPECT_THAT(log.entries(), IsEmpty());
}

TEST_F(EntitlementFilesTest, ACallerThatGoesBeforeItIsDigestedHoldsNothing) {
  write("etc/a.plist", document(quoted("Executable", program) + "<key>Entitlements</key><dict/>"));
  grant("etc/b.plist", "<true/>", quoted("User", "keeper") + quoted("SHA256", std::string(64, '0')));
  accounts.accounts["keeper"] = {AccountIds{0, 0}, std::nullopt};
  auto files = makeFiles();
  Child caller(program);
  const auto task = files.makeTask(caller.token());
  ASSERT_NE(task, nullptr);
  accounts.whenAskedForIds = [&](const std::string&) { caller.kill(); };
  const auto answer = task->copyEntitlement(kName);
  EXPECT_EQ(accounts.idLookUps, 1);
  EXPECT_FALSE(answer.value);
  EXPECT_FALSE(answer.error);
  EXPECT_THAT(log.entries(), IsEmpty());
}

TEST_F(MadeUpProcessTest, AProgramThatIsNoLongerThereWhenItIsToBeDigestedIsNoMatch) {
  write("etc/a.plist", document(quoted("Executable", program) + "<key>Entitlements</key><dict/>"));
  grant("etc/b.plist", "<true/>", quoted("User", "keeper") + quoted("SHA256", std::string(64, '0')));
  accounts.accounts["keeper"] = {AccountIds{0, 0}, std::nullopt};
  accounts.whenAskedForIds = [&](const std::string&) { fs::remove(root / "proc/7/exe"); };
  const auto answer = askHere();
  EXPECT_EQ(accounts.idLookUps, 1);
  EXPECT_FALSE(answer.value);
  EXPECT_FALSE(answer.error);
}

TEST_F(EntitlementFilesTest, WithoutMemoryTheQuestionCannotBeAnsweredAndALaterFileDoesNotAnswerInstead) {
  if (!FailingAllocations::kWork) GTEST_SKIP() << "operator new belongs to the sanitizer";
  setLogSink(nullptr);  // it needs memory of its own
  grant("etc/a.plist", "<false/>");
  grant("lib/a.plist", "<true/>");
  auto files = makeFiles();
  const Child caller(program);
  // One that fails alone leaves enough for the later file.
  for (const auto howMany : {FailingAllocations::HowMany::all, FailingAllocations::HowMany::one}) {
    int withoutTask = 0;
    int withoutAnswer = 0;
    for (long first = 0;; ++first) {
      SecurityTask::Answer answer;
      bool hasTask = false;
      long failures = 0;
      {
        const FailingAllocations noMemory(first, howMany);
        const auto task = files.makeTask(caller.token());
        hasTask = task != nullptr;
        if (hasTask) answer = task->copyEntitlement(kName);
        failures = FailingAllocations::failures();
      }
      if (!hasTask) {
        ++withoutTask;
        continue;
      }
      if (answer.value) {
        EXPECT_EQ(answer.value, PropertyList::boolean(false)) << "allocation " << first;
        EXPECT_FALSE(answer.error);
        if (failures == 0) break;
        continue;
      }
      EXPECT_TRUE(answer.error) << "allocation " << first;
      ++withoutAnswer;
    }
    EXPECT_GE(withoutTask, 1);
    EXPECT_GT(withoutAnswer, 5);
  }
}

// ----- What is told of a refusal -----

class ExplanationTest : public EntitlementFilesTest {
 protected:
  std::string explain(const AuditToken& caller) {
    auto files = makeFiles();
    const auto task = files.makeTask(caller);
    return task == nullptr ? "no task" : task->explainRefusal(kName);
  }
};

TEST_F(ExplanationTest, TheFileThatCameNearestIsNamedWithTheKeyThatDiffers) {
  accounts.accounts["keeper"] = {AccountIds{kStranger, 1}, std::nullopt};
  const Child caller(program);
  EXPECT_EQ(explain(caller.token()), "no file names it");
  write("etc/0.plist", document(quoted("Executable", program) + "<key>Entitlements</key><dict/>"));
  EXPECT_EQ(explain(caller.token()), "no file names it");
  write("etc/a.plist", document(quoted("Executable", "/bin/sh") + quoted("User", "keeper") + held()));
  EXPECT_EQ(
      explain(caller.token()),
      (root / "etc/a.plist").string() + " came nearest, but its User is keeper (65534), and the caller is 0");
  write("etc/b.plist", document(quoted("Executable", "/bin/sh") + held()));
  EXPECT_EQ(explain(caller.token()), (root / "etc/b.plist").string() +
                                         " came nearest, but its Executable is /bin/sh, and the caller runs "
                                         "another file");
  grant("etc/bb.plist", "<true/>", quoted("User", "keeper"));
  EXPECT_EQ(explain(caller.token()),
            (root / "etc/bb.plist").string() +
                " came nearest, but its User is keeper (65534), and the caller is 0");
  grant("etc/c.plist", "<true/>", quoted("Unit", "x.service"));
  EXPECT_THAT(explain(caller.token()),
              testing::StartsWith((root / "etc/c.plist").string() +
                                  " came nearest, but its Unit is x.service, and the "
                                  "caller runs in "));
  fs::remove(root / "etc/c.plist");
  grant("etc/d.plist", "<true/>", quoted("SHA256", std::string(64, '0')));
  EXPECT_EQ(explain(caller.token()), (root / "etc/d.plist").string() +
                                         " came nearest, but its SHA256 is not the digest of the executable");
  grant("etc/e.plist", "<false/>");
  EXPECT_EQ(explain(caller.token()), (root / "etc/e.plist").string() + " gives it as false");
  grant("etc/e.plist", "<string>true</string>");
  EXPECT_EQ(explain(caller.token()),
            (root / "etc/e.plist").string() + " gives it as a string, not a boolean");
  EXPECT_THAT(log.entries(), IsEmpty());
}

TEST_F(ExplanationTest, AFileThatIsPassedOverIsNamedWithWhatIsWrong) {
  const Child caller(program);
  const auto file = grant("etc/a.plist", "<true/>", "<key>User</key><integer>0</integer>");
  EXPECT_EQ(explain(caller.token()),
            file.string() + " came nearest, but its User is an integer, not a string");
  grant("etc/a.plist");
  ASSERT_EQ(::chmod(file.c_str(), 0666), 0);
  EXPECT_EQ(explain(caller.token()),
            file.string() + " is passed over: not owned by root, or others may write to it");
  EXPECT_THAT(log.entries(), IsEmpty()) << "a search that explains logs nothing";
}

TEST_F(MadeUpProcessTest, ACallerThatBecomesAnotherProgramWhileItIsExplainedIsToldAsSuch) {
  for (const char* const name : {"etc/a.plist", "etc/b.plist"}) {
    grant(name, "<true/>", quoted("User", "keeper") + quoted("Unit", "other.service"));
  }
  accounts.accounts["keeper"] = {AccountIds{0, 0}, std::nullopt};
  auto files = makeFiles((root / "proc").string());
  const auto task = files.makeTask(token);
  ASSERT_NE(task, nullptr);
  EXPECT_EQ(task->explainRefusal(kName),
            (root / "etc/a.plist").string() +
                " came nearest, but its Unit is other.service, and the caller runs in "
                "caller.service");
  accounts.whenAskedForIds = [&](const std::string&) {
    fs::remove(root / "proc/7/exe");
    fs::create_symlink("/bin/sh", root / "proc/7/exe");
  };
  EXPECT_EQ(task->explainRefusal(kName), "the caller has ended, or has become another program");
  EXPECT_EQ(files.explainNoTask(token), "the caller cannot be examined now") << "there is nothing in its way";
}

TEST_F(MadeUpProcessTest, ACallerWhoseExecutableCannotBeToldIsExplainedAsOneThatHasEndedAndHoldsNothing) {
  grant("etc/a.plist");
  fs::remove(root / "proc/7/exe");
  auto files = makeFiles((root / "proc").string());
  const auto task = files.makeTask(token);
  ASSERT_NE(task, nullptr);
  EXPECT_FALSE(task->copyEntitlement(kName).value);
  EXPECT_FALSE(task->copyEntitlement(kName).error);
  EXPECT_EQ(task->explainRefusal(kName), "the caller has ended, or has become another program");
}

TEST_F(ExplanationTest, WhatCannotBeReadNowIsTheReason) {
  const auto file = grant("etc/a.plist");
  const Child caller(program);
  auto files = makeFiles();
  const auto task = files.makeTask(caller.token());
  ASSERT_NE(task, nullptr);
  {
    const FailingCall failing("read", EIO, 0);
    EXPECT_EQ(task->explainRefusal(kName), file.string() + " cannot be examined now");
  }
  EXPECT_EQ(task->explainRefusal(kName), file.string() + " gives it by now");
  EXPECT_THAT(log.entries(), IsEmpty());
}

TEST_F(ExplanationTest, ACallerThatHasEndedIsToldAsSuch) {
  grant("etc/a.plist");
  auto files = makeFiles();
  Child caller(program);
  const auto task = files.makeTask(caller.token());
  ASSERT_NE(task, nullptr);
  EXPECT_EQ(task->describeCaller().executable, program);
  caller.kill();
  EXPECT_EQ(task->explainRefusal(kName), "the caller has ended, or has become another program");
}

TEST_F(EntitlementFilesTest, NoDescriptorIsLeftBehind) {
  grant("etc/a.plist", "<true/>", quoted("SHA256", std::string(64, '0')));
  grant("etc/b.plist", "<true/>", quoted("Unit", "x.service"));
  ASSERT_EQ(::chmod(grant("etc/c.plist").c_str(), 0666), 0);
  grant("lib/a.plist");
  const Child caller(program);
  const auto count = [] {
    return std::distance(fs::directory_iterator("/proc/self/fd"), fs::directory_iterator());
  };
  expectGranted(caller.token());
  const auto before = count();
  for (int i = 0; i < 10; ++i) expectGranted(caller.token());
  EXPECT_EQ(count(), before);
}

TEST_F(EntitlementFilesTest, SeveralThreadsMayAskAtTheSameTime) {
  grant("etc/a.plist");
  auto files = makeFiles();
  const Child caller(program);
  std::array<int, 4> granted{};
  std::vector<std::thread> threads;
  for (int& count : granted) {
    threads.emplace_back([&files, &caller, &count] {
      for (int i = 0; i < 50; ++i) {
        const auto task = files.makeTask(caller.token());
        if (task != nullptr && task->copyEntitlement(kName).value.asBoolean() == true) ++count;
      }
    });
  }
  for (auto& thread : threads) thread.join();
  EXPECT_THAT(granted, ElementsAre(50, 50, 50, 50));
}

TEST_F(EntitlementFilesTest, TheDirectoriesNamedAtBuildTimeAreUsedWhenNoneAreGiven) {
  // Nothing grants this name anywhere; that the question is answered is all that can be said of this machine.
  EntitlementFiles files(accounts);
  const Child caller(program);
  const auto task = files.makeTask(caller.token());
  ASSERT_NE(task, nullptr);
  EXPECT_FALSE(task->copyEntitlement("com.example.nobody-holds-this").value);
}

}  // namespace
}  // namespace brenvik

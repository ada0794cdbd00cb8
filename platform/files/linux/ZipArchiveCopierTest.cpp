// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/files/linux/ZipArchiveCopier.h"

#include <gtest/gtest.h>
#include <linux/filter.h>
#include <linux/seccomp.h>
#include <sys/prctl.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <cerrno>
#include <cstddef>
#include <cstring>
#include <optional>
#include <set>
#include <string>
#include <vector>

#include "platform/base/fakes/FailingCalls.h"
#include "platform/files/archive/ArchiveFrames.h"
#include "platform/files/fakes/ChildProcesses.h"
#include "platform/files/fakes/TemporaryDirectory.h"
#include "platform/files/fakes/ZipBuilder.h"

namespace brenvik {
namespace {

PropertyList options(bool zip = true, bool attributes = true, bool resources = true) {
  return PropertyList::dictionary({{"extractPKZip", PropertyList::boolean(zip)},
                                   {"copyExtendedAttributes", PropertyList::boolean(attributes)},
                                   {"copyResources", PropertyList::boolean(resources)}});
}

class ZipArchiveCopierTest : public testing::Test {
 protected:
  // Unpacks into "out"; what the handlers saw stands in the members below.
  int unpack(const std::string& bytes, const PropertyList& how = options()) {
    return copy(dir.file("archive.zip", bytes), dir / "out", how);
  }
  int copy(const std::string& archive, const std::string& destination, const PropertyList& how = options(),
           const std::string& reader = BRENVIK_TEST_READER,
           std::chrono::milliseconds longest = std::chrono::seconds(60)) {
    fileErrors.clear();
    fatal.reset();
    ZipArchiveCopier copier(reader, longest);
    copier.setFileErrorHandler([this](const ArchiveFileError& error) {
      fileErrors.push_back(error.path);
      return answer;
    });
    copier.setFatalErrorHandler([this](int code) { fatal = code; });
    return copier.copy(archive, destination, how);
  }
  // A reader that says what the test wrote down.
  int copyFrames(const std::string& frames) {
    return copy(dir.file("frames", frames), dir / "out", options(), "/bin/cat");
  }
  std::set<std::string> everything() const {
    std::set<std::string> found;
    for (const auto& entry : std::filesystem::recursive_directory_iterator(dir.path())) {
      found.insert(entry.path().string().substr(dir.path().size() + 1));
    }
    return found;
  }

  TemporaryDirectory dir;
  int answer = archive_answer::stopCopy;
  std::vector<std::string> fileErrors;
  std::optional<int> fatal;
};

std::string frame(archive_frame::Type type, const std::string& bytes) {
  const archive_frame::Head head{type, static_cast<std::uint32_t>(bytes.size())};
  return std::string(reinterpret_cast<const char*>(&head), sizeof head) + bytes;
}

std::string entryFrame(const std::string& path, std::uint64_t size = archive_frame::kUnknownSize,
                       archive_frame::Kind kind = archive_frame::Kind::file, const std::string& target = "",
                       std::uint16_t mode = 0644) {
  archive_frame::EntryHead head{};
  head.size = size;
  head.modified = 1'000'000'000;
  head.mode = mode;
  head.kind = kind;
  head.pathLength = static_cast<std::uint16_t>(path.size());
  head.targetLength = static_cast<std::uint16_t>(target.size());
  return frame(archive_frame::Type::entry,
               std::string(reinterpret_cast<const char*>(&head), sizeof head) + path + target);
}

const std::string kEndOfEntry = frame(archive_frame::Type::endOfEntry, "");
const std::string kEnd = frame(archive_frame::Type::end, "");

// A companion as packers write it, with one attribute.
std::string companionWith(const std::string& attribute, const std::string& value) {
  const auto be = [](std::uint32_t number, int bytes) {
    std::string out;
    for (int i = bytes - 1; i >= 0; --i) out += static_cast<char>(number >> (8 * i) & 0xFF);
    return out;
  };
  const std::string name = attribute + std::string(1, '\0');
  const auto valueAt = static_cast<std::uint32_t>((50 + 34 + 36 + 11 + name.size() + 3) & ~std::size_t{3});
  std::string out = be(0x00051607, 4) + be(0x00020000, 4) + std::string(16, ' ') + be(2, 2);
  out += be(9, 4) + be(50, 4) + be(200, 4) + be(2, 4) + be(0, 4) + be(0, 4);
  out += std::string(34, '\0') + be(0x41545452, 4) + std::string(28, '\0') + be(0, 2) + be(1, 2);
  out += be(valueAt, 4) + be(static_cast<std::uint32_t>(value.size()), 4) + be(0, 2) +
         be(static_cast<std::uint32_t>(name.size()), 1) + name;
  out.resize(valueAt, '\0');
  return out + value;
}

// ---- what is unpacked

TEST_F(ZipArchiveCopierTest, FilesFoldersLinksModesAndTimesComeOut) {
  ZipBuilder zip;
  zip.file("a.txt", "content")
      .file("bin/run", "#!", 0100755)
      .directory("empty/folder")
      .link("bin/again", "../a.txt");
  const mode_t before = ::umask(0077);
  EXPECT_EQ(unpack(zip.build()), 0);
  ::umask(before);
  EXPECT_EQ(contentOf(dir / "out/a.txt"), "content");
  EXPECT_EQ(statOf(dir / "out/a.txt").st_mode, S_IFREG | 0644u);
  EXPECT_EQ(statOf(dir / "out/bin/run").st_mode, S_IFREG | 0755u);
  EXPECT_EQ(statOf(dir / "out/empty/folder").st_mode, S_IFDIR | 0755u);
  EXPECT_EQ(statOf(dir / "out").st_mode, S_IFDIR | 0755u);
  EXPECT_EQ(std::filesystem::read_symlink(dir / "out/bin/again"), "../a.txt");
  EXPECT_LT(statOf(dir / "out/a.txt").st_mtime, 1'800'000'000);
  EXPECT_TRUE(fileErrors.empty());
  EXPECT_EQ(fatal, std::nullopt);
}

TEST_F(ZipArchiveCopierTest, PermissionBitsStayAndWhatIsPrivateStaysPrivate) {
  ZipBuilder zip;
  zip.file("secret", "s", 0100600).file("shared", "s", 0100664).file("locked", "l", 0100400);
  zip.file("run", "#!", 0100711);
  zip.add({.name = "hidden/", .content = "", .mode = 040700}).file("hidden/below", "x", 0100640);
  zip.add({.name = "drop/", .content = "", .mode = 041777});
  zip.add({.name = "closed/", .content = "", .mode = 040555});
  zip.add({.name = "closed/deeper/", .content = "", .mode = 040500}).file("closed/deeper/file", "x");
  zip.file("without/entry", "x");
  zip.file("__MACOSX/._secret", companionWith("note", "value"));
  const auto check = [&] {
    const std::pair<const char*, mode_t> expected[] = {{"secret", S_IFREG | 0600},
                                                       {"._secret", S_IFREG | 0600},
                                                       {"shared", S_IFREG | 0664},
                                                       {"locked", S_IFREG | 0400},
                                                       {"run", S_IFREG | 0711},
                                                       {"hidden", S_IFDIR | 0700},
                                                       {"hidden/below", S_IFREG | 0640},
                                                       {"drop", S_IFDIR | 0777},
                                                       {"closed", S_IFDIR | 0555},
                                                       {"closed/deeper", S_IFDIR | 0500},
                                                       {"closed/deeper/file", S_IFREG | 0644},
                                                       {"without", S_IFDIR | 0755}};
    for (const auto& [name, mode] : expected) {
      EXPECT_EQ(statOf(dir / ("out/" + std::string(name))).st_mode, mode) << name;
    }
  };
  for (const mode_t mask : {0022u, 0077u, 0000u}) {
    const mode_t before = ::umask(mask);
    EXPECT_EQ(unpack(zip.build()), 0);
    ::umask(before);
    check();
    std::filesystem::permissions(dir / "out/closed", std::filesystem::perms::owner_all);
    std::filesystem::permissions(dir / "out/closed/deeper", std::filesystem::perms::owner_all);
    std::filesystem::remove_all(dir / "out");
  }
  if (::geteuid() != 0) return;  // moving a directory that is closed to its owner
  dir.file("out/kept", "kept");
  EXPECT_EQ(unpack(zip.build()), 0);
  check();
}

TEST_F(ZipArchiveCopierTest, NamesThatAreNotAsciiComeOutWithAndWithoutTheUtf8Flag) {
  ZipBuilder zip;
  zip.file("Größe/日本.txt", "1");
  zip.add({.name = "naïve.txt", .content = "2", .flags = 0});
  EXPECT_EQ(unpack(zip.build()), 0);
  EXPECT_EQ(contentOf(dir / "out/Größe/日本.txt"), "1");
  EXPECT_EQ(contentOf(dir / "out/naïve.txt"), "2");
}

TEST_F(ZipArchiveCopierTest, Zip64EntriesAndDataDescriptorsAreRead) {
  ZipBuilder zip;
  zip.add({.name = "wide", .content = "sixty-four", .isZip64 = true});
  zip.add({.name = "late", .content = "described later", .hasDescriptor = true});
  EXPECT_EQ(unpack(zip.build()), 0);
  EXPECT_EQ(contentOf(dir / "out/wide"), "sixty-four");
  EXPECT_EQ(contentOf(dir / "out/late"), "described later");
}

TEST_F(ZipArchiveCopierTest, BackslashesSeparateNamesAndWhatCameFromAPipeIsAFile) {
  // Both are how widespread packers write what they mean.
  ZipBuilder zip;
  zip.file("folder\\file", "content").add({.name = "piped", .content = "p", .mode = 010666});
  EXPECT_EQ(unpack(zip.build()), 0);
  EXPECT_EQ(contentOf(dir / "out/folder/file"), "content");
  EXPECT_EQ(statOf(dir / "out/piped").st_mode, S_IFREG | 0666u);
}

// As a service unit's filter does, for this process and the readers that it starts.
void refuseInThisProcess(int call, unsigned error) {
  sock_filter program[] = {
      BPF_STMT(BPF_LD | BPF_W | BPF_ABS, offsetof(seccomp_data, nr)),
      BPF_JUMP(BPF_JMP | BPF_JEQ | BPF_K, static_cast<unsigned>(call), 0, 1),
      BPF_STMT(BPF_RET | BPF_K, SECCOMP_RET_ERRNO | error),
      BPF_STMT(BPF_RET | BPF_K, SECCOMP_RET_ALLOW),
  };
  const sock_fprog filter{std::size(program), program};
  ASSERT_EQ(::prctl(PR_SET_NO_NEW_PRIVS, 1, 0, 0, 0), 0);
  ASSERT_EQ(::prctl(PR_SET_SECCOMP, SECCOMP_MODE_FILTER, &filter), 0);
}

// Longer than all the pages that the reader lends the pipe, twice over.
std::string largeContent() {
  std::string large(5'000'001, '\0');
  for (std::size_t i = 0; i < large.size(); ++i) large[i] = static_cast<char>(i * 2654435761u >> 11);
  return large;
}

TEST_F(ZipArchiveCopierTest, LargeFilesComeOutByteForByte) {
  const std::string large = largeContent();
  ZipBuilder zip;
  zip.file("small", "s").file("large", large).file("after", "a").file("again", large.substr(1, 200'000));
  EXPECT_EQ(unpack(zip.build()), 0);
  EXPECT_TRUE(contentOf(dir / "out/large") == large);
  EXPECT_TRUE(contentOf(dir / "out/again") == large.substr(1, 200'000));
  EXPECT_EQ(contentOf(dir / "out/after"), "a");
}

TEST_F(ZipArchiveCopierTest, WherePagesCannotBeLentLargeFilesComeOutAllTheSame) {
  const std::string large = largeContent();
  const std::string archive = ZipBuilder().file("large", large).file("after", "a").build();
  for (const int call : {SYS_splice, SYS_vmsplice}) {
    inPrivateMounts([&] {
      refuseInThisProcess(call, EPERM);
      EXPECT_EQ(unpack(archive), 0) << call;
      EXPECT_TRUE(contentOf(dir / "out/large") == large) << call;
      EXPECT_EQ(contentOf(dir / "out/after"), "a") << call;
      std::filesystem::remove_all(dir / "out");
      std::filesystem::remove(dir / "archive.zip");
    });
  }
}

TEST_F(ZipArchiveCopierTest, AnEmptyArchiveMakesAnEmptyDestinationAndMissingFoldersAboveIt) {
  const std::string archive = dir.file("empty.zip", ZipBuilder().build());
  const mode_t before = ::umask(0077);
  EXPECT_EQ(copy(archive, dir / "not/./yet//there/"), 0);
  ::umask(before);
  EXPECT_TRUE(std::filesystem::is_empty(dir / "not/yet/there"));
  for (const char* made : {"not", "not/yet", "not/yet/there"}) {
    EXPECT_EQ(statOf(dir / made).st_mode, S_IFDIR | 0755u) << made;
  }
}

TEST_F(ZipArchiveCopierTest, AnArchiveThatFailsLeavesNoFoldersAboveItsDestination) {
  const std::string archive = dir.file("archive.zip", ZipBuilder().file("../outside", "x").build());
  EXPECT_NE(copy(archive, dir / "not/yet/there"), 0);
  EXPECT_EQ(everything(), (std::set<std::string>{"archive.zip"}));
  const std::string good = dir.file("archive.zip", ZipBuilder().file("a", "x").build());
  EXPECT_NE(copy(good, dir / "not/../there"), 0);
  dir.link("dangling", "nowhere");
  EXPECT_EQ(copy(good, dir / "dangling/there"), EEXIST);
  EXPECT_EQ(copy(good, dir / "dangling"), EEXIST);
  EXPECT_EQ(copy(good, dir / "archive.zip/there"), ENOTDIR);
  EXPECT_EQ(copy(good, ""), ENOENT);
  EXPECT_EQ(everything(), (std::set<std::string>{"archive.zip", "dangling"}));
}

TEST_F(ZipArchiveCopierTest, IntoADirectoryThatIsThereFilesAreReplacedAndOthersKept) {
  dir.file("out/kept", "kept");
  dir.file("out/sub/old", "old");
  dir.file("precious", "precious");
  dir.link("out/link", "../precious");
  ZipBuilder zip;
  zip.file("sub/old", "new").file("sub/fresh", "fresh").file("link", "no link").file("new/file", "n");
  EXPECT_EQ(unpack(zip.build()), 0);
  EXPECT_EQ(contentOf(dir / "out/kept"), "kept");
  EXPECT_EQ(contentOf(dir / "out/sub/old"), "new");
  EXPECT_EQ(contentOf(dir / "out/sub/fresh"), "fresh");
  EXPECT_EQ(contentOf(dir / "out/link"), "no link");
  EXPECT_EQ(contentOf(dir / "precious"), "precious");
  EXPECT_EQ(contentOf(dir / "out/new/file"), "n");
  EXPECT_EQ(everything().size(), 10u);
}

TEST_F(ZipArchiveCopierTest, AnAnswerWaitsForTheContentsAndForTheNamesAndSaysWhenTheyAreLost) {
  dir.file("out/old", "old");
  const std::string archive = ZipBuilder().file("old", "new").build();
  {
    const FailingCall broken("syncfs", EIO);
    EXPECT_EQ(unpack(archive), EIO);
    EXPECT_EQ(broken.failures(), 1);
    EXPECT_EQ(contentOf(dir / "out/old"), "old");
  }
  const FailingCall broken("syncfs", EIO, 1);
  EXPECT_EQ(unpack(archive), EIO);
  EXPECT_EQ(broken.failures(), 1);
  EXPECT_EQ(contentOf(dir / "out/old"), "new");
}

TEST_F(ZipArchiveCopierTest, AConflictWithWhatIsThereChangesNothing) {
  dir.file("out/name/below", "kept");
  dir.directory("elsewhere");
  dir.link("out/way", "../elsewhere");
  ZipBuilder file;
  file.file("first", "1").file("name", "a file where a directory is");
  EXPECT_EQ(unpack(file.build()), EEXIST);
  EXPECT_EQ(fatal, EEXIST);
  ZipBuilder through;
  through.file("first", "1").file("way/out", "through a link");
  EXPECT_EQ(unpack(through.build()), EEXIST);
  EXPECT_FALSE(isThere(dir / "out/first"));
  EXPECT_FALSE(isThere(dir / "elsewhere/out"));
  EXPECT_EQ(contentOf(dir / "out/name/below"), "kept");
}

// ---- resource data

TEST_F(ZipArchiveCopierTest, ACompanionsResourceDataStandsBesideItsFileAndItsAttributesOnIt) {
  const std::string companion = companionWith("com.example.note", "value");
  ZipBuilder zip;
  zip.file("sub/name", "content").directory("__MACOSX").file("__MACOSX/sub/._name", companion);
  EXPECT_EQ(unpack(zip.build()), 0);
  EXPECT_EQ(contentOf(dir / "out/sub/name"), "content");
  EXPECT_EQ(contentOf(dir / "out/sub/._name"), companion);
  EXPECT_FALSE(isThere(dir / "out/__MACOSX"));
  char value[16];
  const ssize_t size =
      ::getxattr((dir / "out/sub/name").c_str(), "user.com.example.note", value, sizeof value);
  if (size >= 0 || errno != ENOTSUP) {
    EXPECT_EQ(std::string(value, static_cast<std::size_t>(std::max<ssize_t>(size, 0))), "value");
  }
}

TEST_F(ZipArchiveCopierTest, WithoutTheOptionsCompanionsAndAttributesAreLeftOut) {
  ZipBuilder zip;
  zip.file("name", "content").file("__MACOSX/._name", companionWith("note", "value"));
  EXPECT_EQ(unpack(zip.build(), options(true, false, false)), 0);
  EXPECT_FALSE(isThere(dir / "out/._name"));
  EXPECT_LT(::getxattr((dir / "out/name").c_str(), "user.note", nullptr, 0), 0);
  EXPECT_EQ(unpack(zip.build(), options(false)), ENOTSUP);
}

TEST_F(ZipArchiveCopierTest, ACompanionCannotBeRunAndALinkHasNone) {
  const std::string companion = frame(archive_frame::Type::companion, "resource");
  EXPECT_EQ(
      copyFrames(entryFrame("name", 0, archive_frame::Kind::file, "", 0755) + companion + kEndOfEntry +
                 entryFrame("link", 0, archive_frame::Kind::link, "name") + companion + kEndOfEntry + kEnd),
      0);
  EXPECT_EQ(everything(), (std::set<std::string>{"frames", "out", "out/name", "out/._name", "out/link"}));
  EXPECT_EQ(statOf(dir / "out/name").st_mode & 07777, 0755u);
  EXPECT_EQ(statOf(dir / "out/._name").st_mode & 07777, 0644u);
}

TEST_F(ZipArchiveCopierTest, AnAttributeThatComesTwiceHasItsLastValue) {
  const auto directoryWith = [](const char* value) {
    return entryFrame("d", 0, archive_frame::Kind::directory, "", 0755) +
           frame(archive_frame::Type::companion, companionWith("note", value)) + kEndOfEntry;
  };
  const std::string frames = directoryWith("first") + directoryWith("last") + kEnd;
  EXPECT_EQ(copy(dir.file("frames", frames), dir / "out", options(true, true, false), "/bin/cat"), 0);
  char value[16];
  const ssize_t size = ::getxattr((dir / "out/d").c_str(), "user.note", value, sizeof value);
  if (size < 0 && errno == ENOTSUP) GTEST_SKIP() << "no attributes here";
  EXPECT_EQ(std::string(value, static_cast<std::size_t>(std::max<ssize_t>(size, 0))), "last");
}

// ---- hostile archives

struct Hostile {
  const char* what;
  ZipBuilder zip;
};

std::vector<Hostile> hostileArchives() {
  std::vector<Hostile> all;
  const auto add = [&](const char* what) -> ZipBuilder& {
    all.push_back({what, {}});
    return all.back().zip.file("innocent", "first");
  };
  add("parent folder").file("../outside", "x");
  add("parent folder inside").file("a/../../outside", "x");
  add("absolute name").file("/tmp/brenvik-absolute", "x");
  add("two slashes").file("a//b", "x");
  add("here").file("./a", "x");
  add("parent folder with backslashes").file("..\\outside", "x");
  add("control character").file("a\nb", "x");
  add("invalid UTF-8").add({.name = "a\xff", .content = "x", .flags = 0});
  add("long name").file(std::string(256, 'n'), "x");
  add("long path").file(std::string(600, 'a') + "/" + std::string(600, 'b'), "x");
  add("deep path")
      .file(
          [] {
            std::string path;
            for (int i = 0; i < 120; ++i) path += "d/";
            return path + "f";
          }(),
          "x");
  add("link out").link("link", "../../outside");
  add("absolute link").link("link", "/etc/passwd");
  add("empty link").link("link", "");
  add("link to a parent by a way around")
      .directory("d1/d2")
      .link("d1/d2/x", "../..")
      .link("y", "d1/d2/x/../../out");
  add("link, then a file through it").link("link", "real").directory("real").file("link/file", "x");
  add("link, then a folder through it").directory("real").link("link", "real").directory("link/folder");
  add("two files of one name").file("same", "1").file("same", "2");
  add("file, then folder of one name").file("same", "1").file("same/below", "2");
  add("link over a file").file("same", "1").link("same", "innocent");
  add("set-user-id").file("run", "x", 0104755);
  add("set-group-id folder").add({.name = "d/", .content = "", .mode = 042755});
  add("device").add({.name = "device", .content = "", .mode = 020666});
  add("block device").add({.name = "device", .content = "", .mode = 060666});
  add("socket").add({.name = "socket", .content = "", .mode = 0140666});
  add("encrypted").add({.name = "secret", .content = "0123456789abcdef", .flags = 0x0801});
  add("wrong checksum").add({.name = "bad", .content = "x", .claimedChecksum = 1});
  add("claims more than it has").add({.name = "bad", .content = "x", .claimedSize = 1000});
  add("claims less than it has").add({.name = "bad", .content = "0123456789", .claimedSize = 2});
  add("hostile name before the data only")
      .add({.name = "harmless", .content = "x", .localName = "../outside"});
  add("companion over a file")
      .file("._name", "own")
      .file("name", "x")
      .file("__MACOSX/._name", companionWith("a", "b"));
  return all;
}

TEST_F(ZipArchiveCopierTest, HostileArchivesAreRefusedWholeAndLeaveNothingAnywhere) {
  dir.file("outside-guard/kept", "kept");
  for (const Hostile& hostile : hostileArchives()) {
    std::filesystem::remove_all(dir / "out");
    EXPECT_NE(unpack(hostile.zip.build()), 0) << hostile.what;
    EXPECT_TRUE(fileErrors.size() == 1 || fatal) << hostile.what;
    EXPECT_EQ(everything(), (std::set<std::string>{"archive.zip", "outside-guard", "outside-guard/kept"}))
        << hostile.what;
    // The same into a destination that is there.
    dir.file("out/kept", "kept");
    EXPECT_NE(unpack(hostile.zip.build()), 0) << hostile.what;
    EXPECT_EQ(everything(), (std::set<std::string>{"archive.zip", "out", "out/kept", "outside-guard",
                                                   "outside-guard/kept"}))
        << hostile.what;
  }
  EXPECT_FALSE(isThere("/tmp/brenvik-absolute"));
}

TEST_F(ZipArchiveCopierTest, WhereOpenat2IsRefusedArchivesComeOutAllTheSame) {
  ZipBuilder zip;
  zip.file("top", "1").file("a/b/c", "2").directory("a/empty").link("a/link", "../top");
  const std::string good = zip.build();
  // RestrictSUIDSGID= answers the first, filters that are older than the call the second.
  for (const int refusal : {ENOSYS, EPERM}) {
    inPrivateMounts([&] {
      refuseInThisProcess(SYS_openat2, static_cast<unsigned>(refusal));
      ASSERT_EQ(::syscall(SYS_openat2, -1, "", nullptr, 0), -1);
      ASSERT_EQ(errno, refusal);
      EXPECT_EQ(unpack(good), 0);
      EXPECT_EQ(contentOf(dir / "out/top"), "1");
      EXPECT_EQ(contentOf(dir / "out/a/b/c"), "2");
      EXPECT_EQ(contentOf(dir / "out/a/link"), "1");
      EXPECT_EQ(statOf(dir / "out/a/empty").st_mode, S_IFDIR | 0755u);
      std::filesystem::remove_all(dir / "out");
      std::filesystem::remove(dir / "archive.zip");
      for (const Hostile& hostile : hostileArchives()) {
        EXPECT_NE(unpack(hostile.zip.build()), 0) << hostile.what;
        EXPECT_EQ(everything(), std::set<std::string>{"archive.zip"}) << hostile.what;
      }
    });
  }
}

TEST_F(ZipArchiveCopierTest, ARefusedEntryIsAFileErrorThatAHandlerMayPassOver) {
  answer = archive_answer::skipFile;
  ZipBuilder zip;
  zip.file("../outside", "x").file("good", "g").file("run", "x", 0104755).link("l", "/etc");
  EXPECT_EQ(unpack(zip.build()), 0);
  EXPECT_EQ(fileErrors, (std::vector<std::string>{"../outside", "run", "l"}));
  EXPECT_EQ(fatal, std::nullopt);
  EXPECT_EQ(contentOf(dir / "out/good"), "g");
  EXPECT_EQ(everything(), (std::set<std::string>{"archive.zip", "out", "out/good"}));
}

TEST_F(ZipArchiveCopierTest, AFileThatIsPassedOverForItsCompanionDoesNotStayEmpty) {
  answer = archive_answer::skipFile;
  ZipBuilder zip;
  zip.file("._name", "own").file("name", "content").file("__MACOSX/._name", companionWith("a", "b"));
  EXPECT_EQ(unpack(zip.build()), 0);
  EXPECT_EQ(fileErrors, (std::vector<std::string>{"._name"}));
  EXPECT_EQ(everything(), (std::set<std::string>{"archive.zip", "out", "out/._name"}));
  EXPECT_EQ(contentOf(dir / "out/._name"), "own");
}

TEST_F(ZipArchiveCopierTest, AnAnswerToAFileErrorIsNotAFatalErrorOnTop) {
  ZipBuilder zip;
  zip.file("../outside", "x");
  EXPECT_NE(unpack(zip.build()), 0);
  EXPECT_EQ(fileErrors, (std::vector<std::string>{"../outside"}));
  EXPECT_EQ(fatal, std::nullopt);
}

TEST_F(ZipArchiveCopierTest, DamagedArchivesAndWhatIsNoneAreFatalErrors) {
  ZipBuilder zip;
  zip.file("a", std::string(5000, 'a')).file("b", std::string(5000, 'b'));
  const std::string good = zip.build();
  for (const std::string& bytes :
       {std::string(), std::string("no archive"), std::string(100'000, 'x'), good.substr(0, 6000),
        good.substr(0, good.size() - 30), good.substr(3000)}) {
    EXPECT_NE(unpack(bytes), 0) << bytes.size();
    EXPECT_NE(fatal, std::nullopt) << bytes.size();
    EXPECT_FALSE(isThere(dir / "out"));
  }
  EXPECT_NE(copy(dir / "missing", dir / "out"), 0);
  EXPECT_EQ(fatal, ENOENT);
  EXPECT_NE(copy(dir.path(), dir / "out"), 0);
  ASSERT_EQ(::mkfifo((dir / "fifo").c_str(), 0600), 0);
  EXPECT_EQ(copy(dir / "fifo", dir / "out"), EINVAL);
}

TEST_F(ZipArchiveCopierTest, EveryShorterArchiveIsRefused) {
  ZipBuilder zip;
  zip.file("file", "content of the file");
  const std::string good = zip.build();
  for (std::size_t length = 0; length < good.size(); length += 3) {
    EXPECT_NE(unpack(good.substr(0, length)), 0) << length;
    EXPECT_EQ(everything(), (std::set<std::string>{"archive.zip"})) << length;
  }
}

TEST_F(ZipArchiveCopierTest, ALinkThatSomebodyElseCanHaveMadeIsNoDestination) {
  dir.directory("elsewhere");
  const std::string archive = dir.file("archive.zip", ZipBuilder().file("a", "x").build());
  dir.link("folder/out", dir / "elsewhere");
  ASSERT_EQ(::chmod((dir / "folder").c_str(), 0777), 0);
  EXPECT_EQ(copy(archive, dir / "folder/out"), EEXIST);
  EXPECT_EQ(copy(archive, dir / "folder/out/below"), EEXIST);
  EXPECT_TRUE(std::filesystem::is_empty(dir / "elsewhere"));
  ASSERT_EQ(::chmod((dir / "folder").c_str(), 0755), 0);
  EXPECT_EQ(copy(archive, dir / "folder/out"), 0);
  EXPECT_EQ(contentOf(dir / "elsewhere/a"), "x");
}

TEST_F(ZipArchiveCopierTest, TheDestinationMustNotBeAFile) {
  dir.file("out", "kept");
  EXPECT_EQ(unpack(ZipBuilder().file("a", "x").build()), ENOTDIR);
  EXPECT_EQ(contentOf(dir / "out"), "kept");
}

// ---- limits

TEST_F(ZipArchiveCopierTest, MoreBytesThanTheCapAreRefusedBeforeTheFirst) {
  EXPECT_EQ(copyFrames(entryFrame("bomb", (std::uint64_t{1} << 30) + 1)), EFBIG);
  EXPECT_EQ(fatal, EFBIG);
  EXPECT_EQ(everything(), (std::set<std::string>{"frames"}));
}

TEST_F(ZipArchiveCopierTest, CompanionsCountAsWellEvenWhereTheyAreLeftOut) {
  dir.directory("disk");
  const auto framesWith = [&](std::size_t bytes) {
    return dir.file("frames", entryFrame("a") +
                                  frame(archive_frame::Type::companion, std::string(bytes, 'c')) +
                                  kEndOfEntry + kEnd);
  };
  inPrivateMounts([&] {
    mountSmallDisk(dir / "disk", 128);
    const PropertyList dataOnly = options(true, false, false);
    EXPECT_EQ(copy(framesWith(200'000), dir / "disk/out", dataOnly, "/bin/cat"), EFBIG);
    EXPECT_TRUE(std::filesystem::is_empty(dir / "disk"));
    EXPECT_EQ(copy(framesWith(20'000), dir / "disk/out", dataOnly, "/bin/cat"), 0);
  });
}

TEST_F(ZipArchiveCopierTest, MoreEntriesThanTheCapAreRefused) {
  std::string frames;
  const std::string one = frame(archive_frame::Type::refused, std::string("\1\0\0\0x", 5));
  for (int i = 0; i <= 100'000; ++i) frames += one;
  answer = archive_answer::skipFile;
  EXPECT_EQ(copyFrames(frames + kEnd), EFBIG);
  EXPECT_EQ(copyFrames(frames.substr(one.size()) + kEnd), 0);
}

TEST_F(ZipArchiveCopierTest, ManyNamesForTheDataOfOneEntryGiveOneFileInside) {
  // A bomb without compression: a thousand entries in the directory, and the bytes of one.
  ZipBuilder zip;
  zip.file("0", std::string(4000, 'b'));
  for (int i = 1; i < 1000; ++i) {
    const std::string name = i % 2 == 0 ? std::to_string(i) : "../outside" + std::to_string(i);
    zip.add({.name = name, .content = std::string(4000, 'b'), .sharesData = true});
  }
  EXPECT_EQ(unpack(zip.build()), 0);
  EXPECT_EQ(everything(), (std::set<std::string>{"archive.zip", "out", "out/0"}));
}

TEST_F(ZipArchiveCopierTest, OnASmallDiskABombEndsAtItsEdgeAndLeavesNothing) {
  dir.directory("disk");
  dir.file("archive.zip", ZipBuilder().file("a", "x").file("big", std::string(300'000, 'b')).build());
  inPrivateMounts([&] {
    mountSmallDisk(dir / "disk", 128);
    EXPECT_NE(copy(dir / "archive.zip", dir / "disk/out"), 0);
    EXPECT_NE(fatal, std::nullopt);
    EXPECT_TRUE(std::filesystem::is_empty(dir / "disk"));
    dir.file("disk/out/a", "old");
    EXPECT_NE(copy(dir / "archive.zip", dir / "disk/out"), 0);
    EXPECT_EQ(contentOf(dir / "disk/out/a"), "old");
    EXPECT_FALSE(isThere(dir / "disk/out/big"));
  });
}

// ---- readers that lie, hang and die

TEST_F(ZipArchiveCopierTest, FramesThatNoCorrectReaderSendsAreAFatalErrorAndLeaveNothing) {
  const std::string good =
      entryFrame("file", 3) + frame(archive_frame::Type::data, "abc") + kEndOfEntry + kEnd;
  ASSERT_EQ(copyFrames(good), 0);
  EXPECT_EQ(contentOf(dir / "out/file"), "abc");
  std::filesystem::remove_all(dir / "out");
  for (const std::string& frames :
       {good + "x", good.substr(0, good.size() - 8), frame(archive_frame::Type{99}, ""),
        entryFrame("file", 2) + frame(archive_frame::Type::data, "abc") + kEndOfEntry + kEnd,
        entryFrame("file", 4) + frame(archive_frame::Type::data, "abc") + kEndOfEntry + kEnd,
        frame(archive_frame::Type::data, "abc") + kEnd, entryFrame("a") + entryFrame("b") + kEnd,
        kEndOfEntry + kEnd,
        entryFrame("d", 0, archive_frame::Kind::directory) + frame(archive_frame::Type::data, "x"),
        entryFrame("file", 0, archive_frame::Kind{7}),
        entryFrame("file", 0, archive_frame::Kind::file, "", 04644) + kEndOfEntry + kEnd,
        entryFrame("a", 0, archive_frame::Kind::file, "target"),
        frame(archive_frame::Type::failed, std::string("\5\0\0\0", 4))}) {
    EXPECT_NE(copyFrames(frames), 0);
    EXPECT_NE(fatal, std::nullopt);
    EXPECT_FALSE(isThere(dir / "out"));
  }
}

TEST_F(ZipArchiveCopierTest, AReaderThatSendsMoreOrLessThanItSaidGetsNoLargeFile) {
  // Large enough that the bytes do not pass through this process.
  const std::string megabyte(1 << 20, 'x');
  const std::string data = frame(archive_frame::Type::data, megabyte);
  ASSERT_EQ(copyFrames(entryFrame("file", 2 << 20) + data + data + kEndOfEntry + kEnd), 0);
  EXPECT_EQ(std::filesystem::file_size(dir / "out/file"), std::uintmax_t{2} << 20);
  std::filesystem::remove_all(dir / "out");
  const std::string twice = entryFrame("file", 2 << 20) + data + data;
  for (const std::string& frames :
       {twice + data + kEndOfEntry + kEnd, twice + frame(archive_frame::Type::data, "x") + kEndOfEntry + kEnd,
        entryFrame("file", (2 << 20) - 1) + data + data + kEndOfEntry + kEnd,
        entryFrame("file", (2 << 20) + 1) + data + data + kEndOfEntry + kEnd, twice, twice + kEnd,
        entryFrame("file", std::uint64_t{1} << 40) + data + kEndOfEntry + kEnd}) {
    EXPECT_NE(copyFrames(frames), 0);
    EXPECT_FALSE(isThere(dir / "out"));
  }
}

TEST_F(ZipArchiveCopierTest, AReaderThatHangsIsKilledWhenTheTimeIsOver) {
  const std::string reader = dir.file("reader", "#!/bin/sh\nexec sleep 1000\n");
  ASSERT_EQ(::chmod(reader.c_str(), 0755), 0);
  const auto start = std::chrono::steady_clock::now();
  EXPECT_EQ(copy(dir.file("archive"), dir / "out", options(), reader, std::chrono::milliseconds(50)),
            ETIMEDOUT);
  EXPECT_LT(std::chrono::steady_clock::now() - start, std::chrono::seconds(20));
  EXPECT_EQ(fatal, ETIMEDOUT);
  EXPECT_EQ(::waitpid(-1, nullptr, WNOHANG), -1);  // reaped
}

TEST_F(ZipArchiveCopierTest, AReaderThatDiesOrIsMissingIsAFailedCopy) {
  const std::string reader = dir.file("reader", "#!/bin/sh\nkill -KILL $$\n");
  ASSERT_EQ(::chmod(reader.c_str(), 0755), 0);
  EXPECT_EQ(copy(dir.file("archive"), dir / "out", options(), reader), EPIPE);
  EXPECT_EQ(fatal, EPIPE);
  EXPECT_EQ(copy(dir / "archive", dir / "out", options(), dir / "no-reader"), ENOENT);
  EXPECT_FALSE(isThere(dir / "out"));
}

TEST_F(ZipArchiveCopierTest, TheReaderHasNoDescriptorsOfThisProcessAndNoEnvironment) {
  const std::string reader =
      dir.file("reader", "#!/bin/sh\n(for fd in $(ls /proc/$$/fd); do echo fd $fd; done; env) > " +
                             (dir / "seen") + "\n");
  ASSERT_EQ(::chmod(reader.c_str(), 0755), 0);
  const int inherited = ::dup2(STDIN_FILENO, 77);  // not close-on-exec
  ASSERT_EQ(inherited, 77);
  ASSERT_EQ(::setenv("BRENVIK_TEST_SECRET", "x", 1), 0);
  (void)copy(dir.file("archive"), dir / "out", options(), reader);
  ::unsetenv("BRENVIK_TEST_SECRET");
  ::close(inherited);
  const std::string seen = contentOf(dir / "seen");
  EXPECT_NE(seen.find("fd 1\n"), std::string::npos) << seen;
  EXPECT_EQ(seen.find("fd 77\n"), std::string::npos) << seen;
  EXPECT_EQ(seen.find("SECRET"), std::string::npos) << seen;
}

TEST_F(ZipArchiveCopierTest, KilledAtAnyMomentAFileIsTheOldOneOrTheNewOne) {
  const std::string oldContent(100'000, 'o');
  const std::string newContent(100'000, 'n');
  const std::string archive =
      dir.file("archive.zip", ZipBuilder().file("a", newContent).file("b", newContent).build());
  for (int round = 0; round < 12; ++round) {
    dir.file("out/a", oldContent);
    const pid_t child = ::fork();
    if (child == 0) {
      killThisProcessAfter(std::chrono::microseconds(2000 + round * 1511));
      for (;;) {
        (void)copy(archive, dir / "out");
        (void)copy(archive, dir / "fresh");
        std::filesystem::remove_all(dir / "fresh");
      }
    }
    ::waitpid(child, nullptr, 0);
    const std::string a = contentOf(dir / "out/a");
    ASSERT_TRUE(a == oldContent || a == newContent) << round;
    if (isThere(dir / "out/b")) {
      ASSERT_TRUE(contentOf(dir / "out/b") == newContent) << round;
    }
  }
  // What the killed ones left is cleared by the next.
  EXPECT_EQ(copy(archive, dir / "out"), 0);
  for (const auto& entry : std::filesystem::directory_iterator(dir / "out")) {
    EXPECT_FALSE(entry.path().filename().string().starts_with(".brenvik")) << entry.path();
  }
}

TEST_F(ZipArchiveCopierTest, IntoADirectoryThatMayNotBeEnteredNothingIsUnpacked) {
  const std::string frames =
      dir.file("frames", entryFrame("closed", 0, archive_frame::Kind::directory, "", 0755) + kEndOfEntry +
                             entryFrame("new") + kEndOfEntry + kEnd);
  dir.directory("out/closed");
  ASSERT_EQ(::chmod(dir.path().c_str(), 0777), 0);
  ASSERT_EQ(::chmod((dir / "out").c_str(), 0777), 0);
  ASSERT_EQ(::chmod((dir / "out/closed").c_str(), 0000), 0);
  const pid_t child = ::fork();
  if (child == 0) {
    if (::geteuid() == 0 && (::setresgid(4712, 4712, 4712) != 0 || ::setresuid(4711, 4711, 4711) != 0)) {
      ::_exit(9);
    }
    EXPECT_EQ(copy(frames, dir / "out", options(), "/bin/cat"), EACCES);
    EXPECT_EQ(fatal, EACCES);
    std::fflush(nullptr);
    ::_exit(HasFailure() ? 1 : 0);
  }
  int status = -1;
  ::waitpid(child, &status, 0);
  EXPECT_EQ(status, 0);
  EXPECT_FALSE(isThere(dir / "out/new"));
}

TEST_F(ZipArchiveCopierTest, AFolderThatCannotBeMadeEndsTheCopyAndItsFilesStandNowhereElse) {
  // The hidden folder and the stage in it come first.
  const FailingCall broken("mkdirat", EIO, 2);
  EXPECT_EQ(copyFrames(entryFrame("first") + kEndOfEntry + entryFrame("a/b/file") + kEndOfEntry + kEnd), EIO);
  EXPECT_EQ(broken.failures(), 1);
  EXPECT_EQ(fatal, EIO);
  EXPECT_EQ(everything(), (std::set<std::string>{"frames"}));
}

TEST_F(ZipArchiveCopierTest, AsAnOrdinaryUserItWorksAsWell) {
  if (::geteuid() != 0) GTEST_SKIP() << "every other test does that then";
  const std::string archive = dir.file("archive.zip", ZipBuilder().file("a", "x").build());
  ASSERT_EQ(::chmod(dir.path().c_str(), 0777), 0);
  const pid_t child = ::fork();
  if (child == 0) {
    if (::setresgid(4712, 4712, 4712) != 0 || ::setresuid(4711, 4711, 4711) != 0) ::_exit(9);
    // The build tree may be closed to that user: a reader where everybody may go.
    ::_exit(::access(BRENVIK_TEST_READER, X_OK) != 0 ? 77 : copy(archive, dir / "out") == 0 ? 0 : 1);
  }
  int status = -1;
  ::waitpid(child, &status, 0);
  if (WEXITSTATUS(status) == 77) GTEST_SKIP() << "the reader cannot be run by an ordinary user here";
  EXPECT_EQ(status, 0);
  EXPECT_EQ(statOf(dir / "out/a").st_uid, 4711u);
}

}  // namespace
}  // namespace brenvik

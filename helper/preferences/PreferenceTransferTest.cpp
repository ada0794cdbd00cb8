// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "helper/preferences/PreferenceTransfer.h"

#include <gtest/gtest.h>
#include <unistd.h>

#include <array>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <string>
#include <vector>

#include "helper/carrier/FileSystemManager.h"
#include "platform/files/linux/LinuxFileManager.h"
#include "platform/ipc/fakes/HeapRegions.h"
#include "platform/log/fakes/RecordingLog.h"
#include "platform/plist/PropertyListCodec.h"
#include "platform/preferences/fakes/InMemoryPreferences.h"

namespace brenvik {
namespace {

using namespace std::string_literals;

constexpr PortName kPort = 77;

// A request's text field: 256 bytes, what follows the text being of no meaning.
class Field {
 public:
  explicit Field(std::string_view text) {
    bytes_.fill('#');
    text.copy(bytes_.data(), bytes_.size());
    if (text.size() < bytes_.size()) bytes_[text.size()] = '\0';
  }
  operator char*() { return bytes_.data(); }

 private:
  std::array<char, 256> bytes_;
};

PropertyList parse(std::string_view bytes) { return parsePropertyList(std::as_bytes(std::span(bytes))); }

std::string nestedArrays(std::size_t levels) {
  std::string xml = "<plist version=\"1.0\">";
  for (std::size_t i = 0; i < levels; ++i) xml += "<array>";
  for (std::size_t i = 0; i < levels; ++i) xml += "</array>";
  return xml + "</plist>";
}

class PreferenceTransferTest : public testing::Test {
 protected:
  KernelReturn set(std::string_view domain, std::string_view key, std::string_view bytes) {
    return transfer.setPreferenceValue(kPort, Field(domain), Field(key), bytes.data(),
                                       static_cast<std::uint32_t>(bytes.size()));
  }
  KernelReturn copy(std::string_view domain, std::string_view key) {
    return transfer.copyPreferenceValue(kPort, Field(domain), Field(key), &payload);
  }
  KernelReturn copyApp(std::string_view domain, std::string_view key) {
    return transfer.copyAppPreferenceValue(kPort, Field(domain), Field(key), &payload);
  }
  // What another process finds.
  PropertyList stored(std::string_view key) {
    return InMemoryPreferences(disk).copyValue(key, "com.example", UserScope::currentUser,
                                               HostScope::anyHost);
  }
  std::string content() const { return {static_cast<const char*>(payload.address), payload.length}; }
  void expectNoPayload() const {
    EXPECT_EQ(payload.address, nullptr);
    EXPECT_EQ(payload.length, 0u);
    EXPECT_EQ(regions.live(), 0u);
  }
  RecordingLog::Entry allocated(const char* which) const {
    return RecordingLog::bsdLine(SyslogPriority::error,
                                 "VM_ALLOCATE " + std::to_string(payload.length) + "l (" + which + ")\n");
  }

  RecordingLog log;
  InMemoryDisk disk;
  InMemoryPreferences preferences{disk};
  HeapRegions regions;
  PropertyList file;  // what a dictionary file holds
  std::string fileRead;
  PreferenceTransfer transfer{preferences, regions, [this](const char* path) {
                                fileRead = path;
                                return file;
                              }};
  OutOfLinePayload payload{&disk, 99};  // rubbish, as a caller may leave it
};

const std::string kXmlString = "<plist version=\"1.0\"><string>hello</string></plist>";

// ---- set ------------------------------------------------------------------------------------------------

TEST_F(PreferenceTransferTest, ASetValueIsStoredForOtherProcessesWhenTheRoutineReturns) {
  EXPECT_EQ(set("com.example", "greeting", kXmlString), kern::success);
  EXPECT_EQ(stored("greeting").asString(), "hello");
  EXPECT_TRUE(log.entries().empty());
}

TEST_F(PreferenceTransferTest, ASetRequestWithAOneByteValueRemovesTheKeyWhateverTheByte) {
  for (const std::string& byte : {"\0"s, "x"s, "<"s}) {
    ASSERT_EQ(set("com.example", "greeting", kXmlString), kern::success);
    EXPECT_EQ(set("com.example", "greeting", byte), kern::success);
    EXPECT_FALSE(stored("greeting"));
  }
  EXPECT_EQ(set("com.example", "never there", "x"), kern::success);
}

TEST_F(PreferenceTransferTest, ATwoByteValueThatIsNoPropertyListFailsAndLeavesTheKeyUntouched) {
  ASSERT_EQ(set("com.example", "greeting", kXmlString), kern::success);
  EXPECT_EQ(set("com.example", "greeting", "xx"), kern::failure);
  EXPECT_EQ(stored("greeting").asString(), "hello");
}

TEST_F(PreferenceTransferTest, AnEmptyValueFailsAndLeavesTheKeyUntouched) {
  ASSERT_EQ(set("com.example", "greeting", kXmlString), kern::success);
  EXPECT_EQ(transfer.setPreferenceValue(kPort, Field("com.example"), Field("greeting"), nullptr, 0),
            kern::failure);
  EXPECT_EQ(set("com.example", "greeting", ""), kern::failure);
  EXPECT_EQ(stored("greeting").asString(), "hello");
}

TEST_F(PreferenceTransferTest, ABinaryValueIsAcceptedAndALaterCopyReturnsItAsXml) {
  const auto value = PropertyList::dictionary(
      {{"Version", PropertyList::string("7")}, {"Sizes", PropertyList::array({PropertyList::integer(-1)})}});
  const auto binary = serializePropertyList(value, PropertyListFormat::binary);
  ASSERT_TRUE(binary && binary->starts_with("bplist00"));
  ASSERT_EQ(set("com.example", "record", *binary), kern::success);

  ASSERT_EQ(copy("com.example", "record"), kern::success);
  EXPECT_TRUE(content().starts_with("<?xml version=\"1.0\""));
  EXPECT_EQ(content(), serializePropertyList(value, PropertyListFormat::xml)) << "no byte more";
  EXPECT_EQ(parse(content()), value);
}

TEST_F(PreferenceTransferTest, HostileValuesFailAtOnce) {
  EXPECT_EQ(set("com.example", "greeting", nestedArrays(100'000)), kern::failure);
  EXPECT_EQ(set("com.example", "greeting", "bplist00\xD1"), kern::failure);
  EXPECT_FALSE(stored("greeting"));
}

TEST_F(PreferenceTransferTest, ADomainOrKeyWithInvalidUtf8FailsInEveryRoutine) {
  for (const auto& [domain, key] : {std::pair{"\xFF", "key"},
                                    {"com.example", "\xC0\x80"},
                                    {"com.\xED\xA0\x80", "key"},
                                    {"d", "a\xE2\x82"}}) {
    EXPECT_EQ(set(domain, key, kXmlString), kern::failure);
    EXPECT_EQ(set(domain, key, "x"), kern::failure);
    EXPECT_EQ(copy(domain, key), kern::failure);
    expectNoPayload();
    payload = {&disk, 99};
    EXPECT_EQ(copyApp(domain, key), kern::failure);
    expectNoPayload();
  }
  EXPECT_TRUE(log.entries().empty());
}

TEST_F(PreferenceTransferTest, AFieldWithoutTerminatorEndsAtItsLastByte) {
  const std::string whole(256, 'k');
  ASSERT_EQ(set("com.example", whole, kXmlString), kern::success);
  EXPECT_TRUE(stored(std::string(255, 'k')));
  // The byte that goes may be the end of a character.
  EXPECT_EQ(set("com.example", std::string(254, 'k') + "\xC3\xA9", kXmlString), kern::failure);
}

TEST_F(PreferenceTransferTest, AValueThatCannotBeStoredStillAnswersSuccess) {
  disk.setFull(true);
  EXPECT_EQ(set("com.example", "greeting", kXmlString), kern::success);
  EXPECT_FALSE(stored("greeting"));
  log.clear();
  EXPECT_EQ(set("a/b", "greeting", kXmlString), kern::success);
  EXPECT_EQ(log.entries().size(), 1u) << "the store says what it did not do";
}

TEST_F(PreferenceTransferTest, AValueThatIsLostForWantOfMemoryIsNotSuccess) {
  ASSERT_EQ(set("com.example", "greeting", kXmlString), kern::success);
  for (const int operations : {0, 1}) {  // the setting, the storing
    preferences.operationsWithMemory = operations;
    EXPECT_EQ(set("com.example", "greeting", "x"), kern::failure);
  }
  preferences.operationsWithMemory = -1;
  EXPECT_TRUE(stored("greeting"));
}

// ---- copy -----------------------------------------------------------------------------------------------

TEST_F(PreferenceTransferTest, AValueThatCannotBeReadForWantOfMemoryIsNotAMissingOne) {
  ASSERT_EQ(set("com.example", "greeting", kXmlString), kern::success);
  for (const int operations : {0, 1}) {  // seeing what others wrote, reading
    preferences.operationsWithMemory = operations;
    EXPECT_EQ(copy("com.example", "greeting"), kern::failure);
    expectNoPayload();
    EXPECT_EQ(copyApp("com.example", "greeting"), kern::failure);
    expectNoPayload();
  }
  EXPECT_TRUE(log.entries().empty());
}

TEST_F(PreferenceTransferTest, CopyingAKeyThatDoesNotExistReturnsSuccessAndNoPayload) {
  EXPECT_EQ(copy("com.example", "nothing"), kern::success);
  expectNoPayload();
  payload = {&disk, 99};
  EXPECT_EQ(copyApp("com.example", "nothing"), kern::success);
  expectNoPayload();
  for (const char* domain : {"", ".", "..", "a/b"}) {
    EXPECT_EQ(copy(domain, "nothing"), kern::success);
    expectNoPayload();
  }
  EXPECT_EQ(regions.calls, 0);
  EXPECT_TRUE(log.entries().empty()) << "no region, no line";
}

TEST_F(PreferenceTransferTest, ACopySeesWhatAnotherProcessHasWrittenSince) {
  ASSERT_EQ(copy("com.example", "greeting"), kern::success);
  InMemoryPreferences other(disk);
  other.setValue("greeting", PropertyList::string("new"), "com.example", UserScope::currentUser,
                 HostScope::anyHost);
  other.synchronize("com.example", UserScope::currentUser, HostScope::anyHost);

  ASSERT_EQ(copy("com.example", "greeting"), kern::success);
  EXPECT_EQ(parse(content()).asString(), "new");
  ASSERT_EQ(copyApp("com.example", "greeting"), kern::success);
  EXPECT_EQ(parse(content()).asString(), "new");
}

TEST_F(PreferenceTransferTest, ACopyFirstSynchronizesTheScopesThatItReads) {
  const auto isStored = [this](const char* key, const PreferencesScope& scope) {
    return bool(InMemoryPreferences(disk).copyValue(key, "com.example", scope.user, scope.host));
  };
  for (const char* const key : {"a", "b"}) {
    for (const auto& scope : kApplicationScopes) {
      preferences.setValue(key, PropertyList::boolean(true), "com.example", scope.user, scope.host);
      EXPECT_FALSE(isStored(key, scope));
    }
    ASSERT_EQ(key == "a"s ? copy("com.example", key) : copyApp("com.example", key), kern::success);
    for (const auto& scope : kApplicationScopes) {
      const bool isUsers = scope.user == UserScope::currentUser && scope.host == HostScope::anyHost;
      EXPECT_EQ(isStored(key, scope), key == "b"s || isUsers);
    }
  }
}

TEST_F(PreferenceTransferTest, OnlyApplicationScopeSeesOtherHostsAndUsers) {
  InMemoryPreferences other(disk);
  other.setValue("wide", PropertyList::string("any user"), "com.example", UserScope::anyUser,
                 HostScope::anyHost);
  other.synchronize("com.example", UserScope::anyUser, HostScope::anyHost);
  other.setValue("wide", PropertyList::string("this host"), "com.example", UserScope::currentUser,
                 HostScope::currentHost);
  ASSERT_EQ(copyApp("com.example", "wide"), kern::success);
  EXPECT_EQ(parse(content()).asString(), "any user");
  other.synchronize("com.example", UserScope::currentUser, HostScope::currentHost);
  ASSERT_EQ(copyApp("com.example", "wide"), kern::success);
  EXPECT_EQ(parse(content()).asString(), "this host");

  EXPECT_EQ(copy("com.example", "wide"), kern::success);
  EXPECT_EQ(payload.address, nullptr);
  EXPECT_EQ(payload.length, 0u);
}

TEST_F(PreferenceTransferTest, EachCopyRoutineLogsItsAllocation) {
  ASSERT_EQ(set("com.example", "greeting", kXmlString), kern::success);
  ASSERT_EQ(copy("com.example", "greeting"), kern::success);
  EXPECT_EQ(log.entries(), std::vector{allocated("mhs1")});
  log.clear();
  ASSERT_EQ(copyApp("com.example", "greeting"), kern::success);
  EXPECT_EQ(log.entries(), std::vector{allocated("mhs2")});
}

TEST_F(PreferenceTransferTest, AFailedAllocationPassesItsCodeOnAndIsLoggedAllTheSame) {
  ASSERT_EQ(set("com.example", "greeting", kXmlString), kern::success);
  const auto length = serializePropertyList(PropertyList::string("hello"), PropertyListFormat::xml)->size();
  regions.refuseWith = kern::noSpace;
  EXPECT_EQ(copy("com.example", "greeting"), kern::noSpace);
  EXPECT_EQ(payload.address, nullptr);
  EXPECT_EQ(payload.length, length);
  EXPECT_EQ(log.entries(), std::vector{allocated("mhs1")});
  log.clear();
  regions.refuseWith = kern::resourceShortage;
  EXPECT_EQ(copyApp("com.example", "greeting"), kern::resourceShortage);
  EXPECT_EQ(payload.address, nullptr);
  EXPECT_EQ(payload.length, length);
  EXPECT_EQ(log.entries(), std::vector{allocated("mhs2")});
}

TEST_F(PreferenceTransferTest, AValueThatXmlCannotSayFailsTheCopy) {
  const auto binary = serializePropertyList(PropertyList::string("\x01"), PropertyListFormat::binary);
  ASSERT_TRUE(binary);
  ASSERT_EQ(set("com.example", "odd", *binary), kern::success);
  EXPECT_EQ(copy("com.example", "odd"), kern::failure);
  expectNoPayload();
  payload = {&disk, 99};
  EXPECT_EQ(copyApp("com.example", "odd"), kern::failure);
  expectNoPayload();
  EXPECT_TRUE(log.entries().empty());
}

// ---- property-list files ----------------------------------------------------------------------------------

TEST_F(PreferenceTransferTest, AFilesDictionaryComesBackAsXml) {
  file = PropertyList::dictionary({{"CarrierName", PropertyList::string("Norvale")}});
  ASSERT_EQ(transfer.loadPlistFile(kPort, Field("/etc/carrier.plist"), &payload), kern::success);
  EXPECT_EQ(fileRead, "/etc/carrier.plist");
  EXPECT_EQ(content(), serializePropertyList(file, PropertyListFormat::xml));
  EXPECT_EQ(log.entries(),
            std::vector{RecordingLog::unifiedLine(LogLevel::info, "Loading /etc/carrier.plist as plist")});
}

TEST_F(PreferenceTransferTest, AnEmptyDictionaryIsAPayloadToo) {
  file = PropertyList::dictionary({});
  ASSERT_EQ(transfer.loadPlistFile(kPort, Field("/f"), &payload), kern::success);
  EXPECT_EQ(parse(content()), file);
}

TEST_F(PreferenceTransferTest, AFileThatThereIsNoMemoryForIsAMemoryFailure) {
  PreferenceTransfer starved(preferences, regions,
                             [](const char*) -> PropertyList { throw std::bad_alloc(); });
  EXPECT_EQ(starved.loadPlistFile(kPort, Field("/f"), &payload), kern::memoryFailure);
  expectNoPayload();
}

TEST_F(PreferenceTransferTest, AFileThatGivesNothingIsAMemoryFailure) {
  const std::vector expected{
      RecordingLog::unifiedLine(LogLevel::info, "Loading /no/such/file as plist"),
      RecordingLog::unifiedLine(LogLevel::error, "Could not create data representation of dictionary")};
  EXPECT_EQ(transfer.loadPlistFile(kPort, Field("/no/such/file"), &payload), kern::memoryFailure);
  expectNoPayload();
  EXPECT_EQ(log.entries(), expected);

  log.clear();
  payload = {&disk, 99};
  file = PropertyList::dictionary({{"no XML", PropertyList::string("\x01")}});
  EXPECT_EQ(transfer.loadPlistFile(kPort, Field("/no/such/file"), &payload), kern::memoryFailure);
  expectNoPayload();
  EXPECT_EQ(log.entries(), expected);
}

TEST_F(PreferenceTransferTest, AFailedAllocationForAFilePassesItsCodeOn) {
  file = PropertyList::dictionary({});
  const auto length = serializePropertyList(file, PropertyListFormat::xml)->size();
  regions.refuseWith = kern::noSpace;
  EXPECT_EQ(transfer.loadPlistFile(kPort, Field("/f"), &payload), kern::noSpace);
  EXPECT_EQ(payload.address, nullptr);
  EXPECT_EQ(payload.length, length);
  EXPECT_EQ(
      log.entries(),
      (std::vector{RecordingLog::unifiedLine(LogLevel::info, "Loading /f as plist"),
                   RecordingLog::unifiedLine(LogLevel::error, "Could not allocate " + std::to_string(length) +
                                                                  " bytes for payload")}));
}

TEST_F(PreferenceTransferTest, APathWithoutTerminatorEndsAtItsLastByte) {
  file = PropertyList::dictionary({});
  ASSERT_EQ(transfer.loadPlistFile(kPort, Field(std::string(256, 'p')), &payload), kern::success);
  EXPECT_EQ(fileRead, std::string(255, 'p'));
}

// Put together as the daemon does it, with real files, outside every carrier directory.
class PlistFileTest : public PreferenceTransferTest {
 protected:
  PlistFileTest() {
    char name[] = "/tmp/brenvik-plist-file.XXXXXX";
    folder = ::mkdtemp(name);
  }
  ~PlistFileTest() override { std::filesystem::remove_all(folder); }

  std::string write(std::string_view bytes) {
    const std::string path = folder / "file.plist";
    std::ofstream(path, std::ios::binary) << bytes;
    return path;
  }
  KernelReturn load(std::string_view path) { return fromFiles.loadPlistFile(kPort, Field(path), &payload); }

  std::filesystem::path folder;
  LinuxFileManager files;
  PreferenceTransfer fromFiles{preferences, regions, [this](const char* path) {
                                 return FileSystemManager(files).readDictionary(path);
                               }};
};

TEST_F(PlistFileTest, AFileOutsideEveryCarrierDirectoryIsLoadedWhenItIsReadable) {
  const auto value = PropertyList::dictionary({{"a", PropertyList::boolean(true)}});
  for (const auto format : {PropertyListFormat::xml, PropertyListFormat::binary}) {
    ASSERT_EQ(load(write(*serializePropertyList(value, format))), kern::success);
    EXPECT_EQ(parse(content()), value);
  }
}

TEST_F(PlistFileTest, AMissingFileAnArrayAndANonPlistGiveAMemoryFailureAndALine) {
  const std::string array = *serializePropertyList(PropertyList::array({}), PropertyListFormat::xml);
  const std::string path = folder / "file.plist";
  for (const char* const what : {"missing", "array", "no plist"}) {
    SCOPED_TRACE(what);
    if (what == "array"s) write(array);
    if (what == "no plist"s) write("no property list");
    log.clear();
    EXPECT_EQ(load(path), kern::memoryFailure);
    EXPECT_EQ(log.entries(),
              (std::vector{RecordingLog::unifiedLine(LogLevel::info, "Loading " + path + " as plist"),
                           RecordingLog::unifiedLine(LogLevel::error,
                                                     "Could not create data representation of dictionary")}));
  }
}

}  // namespace
}  // namespace brenvik

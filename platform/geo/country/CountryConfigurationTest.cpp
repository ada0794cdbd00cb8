// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/geo/country/CountryConfiguration.h"

#include <gtest/gtest.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdlib>
#include <filesystem>
#include <fstream>

#include "platform/log/fakes/RecordingLog.h"
#include "platform/plist/PropertyListCodec.h"

namespace brenvik {
namespace {

namespace fs = std::filesystem;

class CountryConfigurationTest : public testing::Test {
 protected:
  CountryConfigurationTest() {
    std::string name = (fs::temp_directory_path() / "brenvik-country-XXXXXX").string();
    if (::mkdtemp(name.data()) == nullptr) std::abort();
    folder = name;
    fs::create_directories(folder / "zoneinfo/Europe");
    fs::create_directories(folder / "zoneinfo/US");
    write("zoneinfo/zone.tab",
          "# comment\tx\tEurope/Nowhere\n"
          "NO\t+5955+01045\tEurope/Oslo\n"
          "US\t+404251-0740023\tAmerica/New_York\tEastern (most areas)\n"
          "broken line\n"
          "DE\t+5230+01322\tEurope/Berlin\tmost of Germany");
  }
  ~CountryConfigurationTest() override { fs::remove_all(folder); }

  void write(const fs::path& name, std::string_view content) { std::ofstream(folder / name) << content; }
  void configure(const PropertyList& value, PropertyListFormat format = PropertyListFormat::xml) {
    write("country.plist", *serializePropertyList(value, format));
  }
  static PropertyList code(std::string_view text) {
    return PropertyList::dictionary({{"CountryCode", PropertyList::string(text)}});
  }
  void zoneIs(const fs::path& target) {
    fs::remove(folder / "localtime");
    fs::create_symlink(target, folder / "localtime");
  }
  CountryConfiguration::Files files() const {
    return {folder / "country.plist", folder / "localtime", folder / "timezone",
            folder / "zoneinfo/zone.tab"};
  }

  fs::path folder;
  RecordingLog log;
};

TEST_F(CountryConfigurationTest, WithNothingToGoByThereIsNoCountry) {
  CountryConfiguration country(files());
  EXPECT_EQ(country.countryCode(), std::nullopt);
  EXPECT_TRUE(log.entries().empty());
}

TEST_F(CountryConfigurationTest, TheFileComesBeforeTheLastAddressAndThatBeforeTheTimeZone) {
  zoneIs(folder / "zoneinfo/Europe/Berlin");
  CountryConfiguration country(files());
  EXPECT_EQ(country.countryCode(), "DE");
  country.setLastGeocoded("FR");
  EXPECT_EQ(country.countryCode(), "FR");
  configure(code("NO"));
  EXPECT_EQ(country.countryCode(), "NO");
  fs::remove(folder / "country.plist");
  EXPECT_EQ(country.countryCode(), "FR");
}

TEST_F(CountryConfigurationTest, TheFileMayBeOfEitherFormat) {
  configure(code("NO"), PropertyListFormat::binary);
  CountryConfiguration country(files());
  EXPECT_EQ(country.countryCode(), "NO");
}

TEST_F(CountryConfigurationTest, AFileReplacedIsReadAgain) {
  configure(code("NO"));
  CountryConfiguration country(files());
  EXPECT_EQ(country.countryCode(), "NO");
  write("new.plist", *serializePropertyList(code("SE"), PropertyListFormat::xml));
  fs::rename(folder / "new.plist", folder / "country.plist");
  EXPECT_EQ(country.countryCode(), "SE");
}

TEST_F(CountryConfigurationTest, AFileThatCouldNotBeReadForWantOfDescriptorsIsReadWhenThereAreSomeAgain) {
  configure(code("NO"));
  CountryConfiguration country(files());
  country.setLastGeocoded("FR");
  rlimit before{};
  ASSERT_EQ(::getrlimit(RLIMIT_NOFILE, &before), 0);
  const rlimit none{0, before.rlim_max};
  ASSERT_EQ(::setrlimit(RLIMIT_NOFILE, &none), 0);
  const auto without = country.countryCode();
  ASSERT_EQ(::setrlimit(RLIMIT_NOFILE, &before), 0);
  EXPECT_EQ(without, "FR");
  EXPECT_EQ(country.countryCode(), "NO");
  EXPECT_EQ(log.entries(), std::vector<RecordingLog::Entry>{});
}

TEST_F(CountryConfigurationTest, ALongCodeIsGivenAsItStands) {
  configure(code(std::string(100, 'x')));
  CountryConfiguration country(files());
  EXPECT_EQ(country.countryCode(), std::string(100, 'x'));
}

TEST_F(CountryConfigurationTest, AFileThatNamesNoCodeIsPassedOverAndSaidOnce) {
  const auto expectPassedOver = [&](const char* why) {
    log.clear();
    CountryConfiguration country(files());
    country.setLastGeocoded("FR");
    EXPECT_EQ(country.countryCode(), "FR") << why;
    EXPECT_EQ(country.countryCode(), "FR") << why;
    EXPECT_EQ(log.entries().size(), 1U) << why;
  };
  write("country.plist", "no property list");
  expectPassedOver("garbage");
  write("country.plist", "");
  expectPassedOver("empty");
  configure(code(""));
  expectPassedOver("empty code");
  configure(PropertyList::dictionary({{"CountryCode", PropertyList::integer(47)}}));
  expectPassedOver("not a text");
  configure(PropertyList::string("NO"));
  expectPassedOver("not a dictionary");
  configure(code(std::string(70'000, 'x')));
  expectPassedOver("too large");
  fs::remove(folder / "country.plist");
  ASSERT_EQ(::mkfifo((folder / "country.plist").c_str(), 0600), 0);
  expectPassedOver("a pipe");
  fs::remove(folder / "country.plist");
  fs::create_directory(folder / "country.plist");
  expectPassedOver("a folder");
}

TEST_F(CountryConfigurationTest, TheTimeZoneMayBeARelativeLink) {
  zoneIs("zoneinfo/Europe/Oslo");
  // As in /etc: relative to the link's own folder, and by way of the database's folder.
  EXPECT_EQ(CountryConfiguration(files()).countryCode(), "NO");
}

TEST_F(CountryConfigurationTest, AnAliasOfAZoneIsFollowed) {
  fs::create_symlink("../America/New_York", folder / "zoneinfo/US/Eastern");
  zoneIs(folder / "zoneinfo/US/Eastern");
  EXPECT_EQ(CountryConfiguration(files()).countryCode(), "US");
}

TEST_F(CountryConfigurationTest, AZoneThatIsALinkToAnotherCountrysKeepsItsOwn) {
  fs::create_symlink("Berlin", folder / "zoneinfo/Europe/Oslo");
  zoneIs(folder / "zoneinfo/Europe/Oslo");
  EXPECT_EQ(CountryConfiguration(files()).countryCode(), "NO");
}

TEST_F(CountryConfigurationTest, ZonesOfNoCountryGiveNone) {
  for (const char* zone : {"Etc/UTC", "UTC", "GMT", "Europe/Nowhere", ""}) {
    zoneIs(folder / "zoneinfo" / zone);
    EXPECT_EQ(CountryConfiguration(files()).countryCode(), std::nullopt) << zone;
  }
}

TEST_F(CountryConfigurationTest, LinksThatGoRoundInCirclesGiveNone) {
  fs::create_symlink("B", folder / "zoneinfo/A");
  fs::create_symlink("A", folder / "zoneinfo/B");
  zoneIs(folder / "zoneinfo/A");
  EXPECT_EQ(CountryConfiguration(files()).countryCode(), std::nullopt);
}

TEST_F(CountryConfigurationTest, ACopyInsteadOfALinkIsNamedByTheFileBesideIt) {
  write("localtime", "TZif2");
  write("timezone", "Europe/Oslo\n");
  EXPECT_EQ(CountryConfiguration(files()).countryCode(), "NO");
}

TEST_F(CountryConfigurationTest, AChangedZoneIsNoticed) {
  zoneIs(folder / "zoneinfo/Europe/Oslo");
  CountryConfiguration country(files());
  EXPECT_EQ(country.countryCode(), "NO");
  zoneIs(folder / "zoneinfo/Europe/Berlin");
  EXPECT_EQ(country.countryCode(), "DE");
}

TEST_F(CountryConfigurationTest, WithoutTheTableAZoneHasNoCountry) {
  fs::remove(folder / "zoneinfo/zone.tab");
  zoneIs(folder / "zoneinfo/Europe/Oslo");
  EXPECT_EQ(CountryConfiguration(files()).countryCode(), std::nullopt);
}

}  // namespace
}  // namespace brenvik

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/geo/linux/Gazetteer.h"

#include <gtest/gtest.h>
#include <unistd.h>

#include <cstdlib>
#include <filesystem>
#include <fstream>

namespace brenvik {
namespace {

constexpr const char* kNone = nullptr;

struct Case {
  const char* name;
  double latitude;
  double longitude;
  const char* country;  // null: nothing is known of the place
  const char* area;
  const char* city;
};
void PrintTo(const Case& place, std::ostream* out) { *out << place.name; }

std::optional<std::string> text(const char* bytes) {
  return bytes == nullptr ? std::nullopt : std::optional<std::string>(bytes);
}

class GazetteerPlaceTest : public testing::TestWithParam<Case> {};

TEST_P(GazetteerPlaceTest, HasTheCountryOfItsBorderAndTheAreaAndCityOfItsNearestPlace) {
  static Gazetteer gazetteer(GAZETTEER_DATABASE);
  const Case& place = GetParam();
  const auto answer = gazetteer.lookUp({place.latitude, place.longitude});
  ASSERT_FALSE(answer.error) << answer.error->description;
  if (place.country == kNone) {
    EXPECT_FALSE(answer.address);
    return;
  }
  ASSERT_TRUE(answer.address);
  EXPECT_EQ(answer.address->countryCode, place.country);
  EXPECT_EQ(answer.address->administrativeArea, text(place.area));
  EXPECT_EQ(answer.address->locality, text(place.city));
  EXPECT_EQ(answer.address->postCode, std::nullopt);
}

INSTANTIATE_TEST_SUITE_P(
    Borders, GazetteerPlaceTest,
    testing::Values(
        // An exclave of Germany in Switzerland; the nearest large towns are Swiss.
        Case{"BuesingenIsGerman", 47.6968, 8.6876, "DE", "Baden-Wurttemberg", "Büsingen"},
        // Belgian parcels in a Dutch town, and the Dutch town around them.
        Case{"BaarleHertogIsBelgian", 51.4413, 4.9296, "BE", "Flanders", "Baarle-Hertog"},
        Case{"BaarleNassauIsDutch", 51.4475, 4.9292, "NL", "North Brabant", "Baarle-Nassau"},
        Case{"LliviaIsSpanish", 42.4646, 1.9807, "ES", "Catalonia", "Llívia"},
        Case{"CampioneIsItalian", 45.9690, 8.9710, "IT", "Lombardy", "Campione"},
        Case{"TheVaticanIsNotItaly", 41.9022, 12.4533, "VA", kNone, "Vatican City"},
        Case{"MonacoIsNotFrance", 43.7384, 7.4246, "MC", "Municipality of Monaco", "Monaco"},
        Case{"GenevaAirportIsSwiss", 46.2330, 6.1090, "CH", "Geneva", "Le Grand-Saconnex"},
        Case{"FerneyIsFrench", 46.2558, 6.1081, "FR", "Auvergne-Rhône-Alpes", "Ferney-Voltaire"},
        Case{"BaselIsSwiss", 47.5584, 7.5733, "CH", "Basel-City", "Basel"},
        Case{"SaintLouisIsFrench", 47.5903, 7.5650, "FR", "Grand Est", "Saint-Louis"},
        Case{"CeutaIsSpanish", 35.8892, -5.3204, "ES", "Ceuta", "Ceuta"},
        Case{"NiagaraFallsIsCanadianWestOfTheRiver", 43.0896, -79.0849, "CA", "Ontario", "Niagara Falls"},
        Case{"NiagaraFallsIsAmericanEastOfTheRiver", 43.0945, -79.0367, "US", "New York", "Niagara Falls"},
        Case{"PointRobertsIsAmerican", 48.9854, -123.0780, "US", "Washington", "Point Roberts"},
        Case{"TijuanaIsMexican", 32.5027, -117.0037, "MX", "Baja California", "Tijuana"},
        Case{"SanYsidroIsAmerican", 32.5520, -117.0431, "US", "California", "Imperial Beach"},
        Case{"SingaporeIsNotJohor", 1.4360, 103.7860, "SG", kNone, "Woodlands"},
        Case{"JohorBahruIsMalaysian", 1.4655, 103.7578, "MY", "Johor", "Johor Bahru"},
        Case{"KaliningradIsRussian", 54.7065, 20.5110, "RU", "Kaliningrad Oblast", "Kaliningrad"},
        Case{"HaparandaIsSwedish", 65.8355, 24.1368, "SE", "Norrbotten", "Haparanda"}),
    [](const auto& each) { return std::string(each.param.name); });

INSTANTIATE_TEST_SUITE_P(
    Coasts, GazetteerPlaceTest,
    testing::Values(Case{"ABeachBelongsToItsCity", -22.9711, -43.1823, "BR", "Rio de Janeiro",
                         "Rio de Janeiro"},
                    Case{"AnIslandFortBelongsToItsCity", 42.3190, -70.9280, "US", "Massachusetts", "Hull"},
                    Case{"NorthCape", 71.1710, 25.7840, "NO", "Finnmark", "Honningsvåg"},
                    Case{"TheMiddleOfTheAtlanticIsNowhere", 30.0, -40.0, kNone, kNone, kNone},
                    Case{"TheMiddleOfThePacificIsNowhere", 0.0, -140.0, kNone, kNone, kNone}),
    [](const auto& each) { return std::string(each.param.name); });

INSTANTIATE_TEST_SUITE_P(
    EdgesOfTheMap, GazetteerPlaceTest,
    testing::Values(Case{"TheSouthPole", -90.0, 0.0, "AQ", kNone, kNone},
                    Case{"TheSouthPoleOnTheAntimeridian", -90.0, 180.0, "AQ", kNone, kNone},
                    Case{"TheNorthPoleIsNowhere", 90.0, 0.0, kNone, kNone, kNone},
                    Case{"TaveuniWestOfTheAntimeridian", -16.80, 179.99, "FJ", "Northern", kNone},
                    Case{"TaveuniEastOfTheAntimeridian", -16.80, -179.99, "FJ", "Northern", kNone},
                    Case{"TaveuniOnTheAntimeridian", -16.80, 180.0, "FJ", "Northern", kNone},
                    Case{"TaveuniOnTheAntimeridianFromTheWest", -16.80, -180.0, "FJ", "Northern", kNone},
                    Case{"ChukotkaEastOfTheAntimeridian", 66.15, -169.80, "RU", "Chukotka", "Uelen"},
                    Case{"WrangelIslandOnTheAntimeridian", 71.20, 180.0, "RU", kNone, kNone},
                    Case{"AttuIsAmericanWestOfTheAntimeridian", 52.90, 172.90, "US", kNone, kNone},
                    Case{"BigDiomedeIsRussian", 65.78, -169.06, "RU", "Chukotka", kNone},
                    Case{"LittleDiomedeIsAmerican", 65.755, -168.92, "US", "Alaska", "Diomede"}),
    [](const auto& each) { return std::string(each.param.name); });

class GazetteerFileTest : public testing::Test {
 protected:
  GazetteerFileTest() {
    std::string name = (std::filesystem::temp_directory_path() / "brenvik-gazetteer-XXXXXX").string();
    if (::mkdtemp(name.data()) == nullptr) std::abort();
    folder = name;
  }
  ~GazetteerFileTest() override { std::filesystem::remove_all(folder); }
  static std::string problemOf(const std::filesystem::path& path) {
    Gazetteer gazetteer(path);
    const auto answer = gazetteer.lookUp({59.9, 10.7});
    EXPECT_FALSE(answer.address);
    return answer.error ? answer.error->description : "none";
  }
  static void makeDatabase(const std::filesystem::path& path, const char* sql) {
    sqlite3* handle = nullptr;
    const int code =
        sqlite()->open_v2(path.c_str(), &handle, SQLITE_OPEN_READWRITE | SQLITE_OPEN_CREATE, nullptr);
    const SqliteDatabase database(handle);
    ASSERT_EQ(code, SQLITE_OK);
    ASSERT_EQ(sqlite()->exec(handle, sql, nullptr, nullptr, nullptr), SQLITE_OK);
  }
  std::filesystem::path folder;
};

TEST_F(GazetteerFileTest, WithoutTheDatabaseALookUpIsAnError) {
  EXPECT_EQ(problemOf(folder / "none.db"),
            "the offline gazetteer cannot be read: unable to open database file");
}

TEST_F(GazetteerFileTest, TheDatabaseIsOpenedByTheFirstLookUpAndNotBefore) {
  Gazetteer gazetteer(folder / "later.db");
  EXPECT_TRUE(gazetteer.lookUp({59.9, 10.7}).error);
  std::filesystem::create_symlink(GAZETTEER_DATABASE, folder / "later.db");
  const auto answer = gazetteer.lookUp({59.9, 10.7});
  ASSERT_TRUE(answer.address);
  EXPECT_EQ(answer.address->countryCode, "NO");
}

TEST_F(GazetteerFileTest, APathMayHoldWhatAUriWouldMisread) {
  const auto path = folder / "a?b#c%20d e.db";
  std::filesystem::create_symlink(GAZETTEER_DATABASE, path);
  Gazetteer gazetteer(path);
  EXPECT_TRUE(gazetteer.lookUp({59.9, 10.7}).address);
}

TEST_F(GazetteerFileTest, AnotherDatabaseIsAnError) {
  const auto path = folder / "other.db";
  makeDatabase(path, "create table t(a)");
  EXPECT_EQ(problemOf(path), "the offline gazetteer cannot be read: not a gazetteer of this version");
}

TEST_F(GazetteerFileTest, AFileThatIsNoDatabaseIsAnError) {
  std::ofstream(folder / "text.db") << std::string(10000, 'x');
  EXPECT_EQ(problemOf(folder / "text.db"),
            "the offline gazetteer cannot be read: not a gazetteer of this version");
}

TEST_F(GazetteerFileTest, ADatabaseThatLostItsTablesIsAnError) {
  const auto path = folder / "empty.db";
  makeDatabase(path, "pragma application_id = 1115047777; pragma user_version = 2; create table t(a)");
  EXPECT_EQ(problemOf(path), "the offline gazetteer cannot be read: no such table: place");
}

TEST_F(GazetteerFileTest, AnOlderOrNewerDatabaseIsAnError) {
  for (const char* version : {"1", "3"}) {
    const auto path = folder / (std::string("version-") + version);
    makeDatabase(
        path, (std::string("pragma application_id = 1115047777; pragma user_version = ") + version).c_str());
    EXPECT_EQ(problemOf(path), "the offline gazetteer cannot be read: not a gazetteer of this version");
  }
}

TEST_F(GazetteerFileTest, ADatabaseCutShortIsAnErrorOrAnAnswer) {
  const auto path = folder / "short.db";
  const auto size = std::filesystem::file_size(GAZETTEER_DATABASE);
  for (const auto left :
       {std::uintmax_t{0}, std::uintmax_t{50}, std::uintmax_t{4096}, size / 2, size - 4096}) {
    std::filesystem::remove(path);
    std::filesystem::copy_file(GAZETTEER_DATABASE, path);
    std::filesystem::resize_file(path, left);
    Gazetteer gazetteer(path);
    for (const Coordinate place : {Coordinate{59.9, 10.7}, Coordinate{-33.9, 151.2}, Coordinate{89.9, 0}}) {
      const auto answer = gazetteer.lookUp(place);
      EXPECT_FALSE(answer.error && answer.address);
      EXPECT_TRUE(answer.error || left > 4096) << left;
    }
  }
}

TEST_F(GazetteerFileTest, ADatabaseThatIsOverwrittenWhileItIsOpenIsAnErrorAndThenReadAgain) {
  const auto path = folder / "changing.db";
  std::filesystem::copy_file(GAZETTEER_DATABASE, path);
  Gazetteer gazetteer(path);
  EXPECT_TRUE(gazetteer.lookUp({59.9, 10.7}).address);
  std::filesystem::resize_file(path, 4096);
  EXPECT_TRUE(gazetteer.lookUp({-33.9, 151.2}).error);
  std::filesystem::remove(path);
  std::filesystem::copy_file(GAZETTEER_DATABASE, path);
  const auto answer = gazetteer.lookUp({-33.9, 151.2});
  ASSERT_TRUE(answer.address);
  EXPECT_EQ(answer.address->countryCode, "AU");
}

TEST_F(GazetteerFileTest, ADamagedDatabaseIsAnErrorOrAnAnswerAndNeverACrash) {
  const auto path = folder / "damaged.db";
  std::filesystem::copy_file(GAZETTEER_DATABASE, path);
  // Every page but the first is noise.
  std::fstream file(path, std::ios::in | std::ios::out | std::ios::binary);
  const auto size = std::filesystem::file_size(path);
  for (std::uintmax_t at = 4096; at < size; at += 512) {
    file.seekp(static_cast<std::streamoff>(at));
    file << "noise noise noise";
  }
  file.close();
  Gazetteer gazetteer(path);
  const auto answer = gazetteer.lookUp({59.9, 10.7});
  ASSERT_TRUE(answer.error);
  EXPECT_EQ(answer.error->description.rfind("the offline gazetteer ", 0), 0U);
}

// A gazetteer as small as can be: its one leaf of borders, and its one place, in Oslo's square.
constexpr const char* kSmall =
    "pragma application_id = 1115047777; pragma user_version = 2;"
    "create table country(id integer primary key, code, sovereign); insert into country values(1, 'NO', '');"
    "create table layer(id integer primary key, country); insert into layer values(1, 1);"
    "create table rule(id integer primary key, country, needs);"
    "create table land(cell integer primary key, data);"
    "create table near(cell integer primary key, data); insert into near values(863322, "
    "x'102710270501000001000000');";

TEST_F(GazetteerFileTest, AnErrorOfTheLastStatementIsOneOfTheLookUpToo) {
  const auto path = folder / "failing.db";
  makeDatabase(path,
               (std::string(kSmall) +
                "create table area(id integer primary key, name); insert into land values(0, x'1A0001');"
                "create view place as select 1 as id, abs(-9223372036854775807 - 1) as name, 1 as area, "
                "null as town;")
                   .c_str());
  EXPECT_EQ(problemOf(path), "the offline gazetteer is damaged: integer overflow");
}

TEST_F(GazetteerFileTest, AViewInTheDatabaseRunsNoFunctionThatIsMoreThanACalculation) {
  const auto path = folder / "view.db";
  makeDatabase(path,
               (std::string(kSmall) +
                "create table area(id integer primary key, name); insert into land values(0, x'1A0001');"
                "create view place as select 1 as id, rtreecheck('land') as name, 1 as area, null as town;")
                   .c_str());
  EXPECT_EQ(problemOf(path), "the offline gazetteer cannot be read: unsafe use of rtreecheck()");
}

TEST_F(GazetteerFileTest, BordersAndPlacesThatMakeNoSenseAreErrors) {
  const auto problemWith = [this](const std::string& sql) {
    const auto path = folder / "odd.db";
    std::filesystem::remove(path);
    makeDatabase(path, (std::string(kSmall) +
                        "create table area(id integer primary key, name);"
                        "create table place(id integer primary key, name, area, town); insert into place "
                        "values(1, 'Oslo', null, null);" +
                        sql)
                           .c_str());
    return problemOf(path);
  };
  const std::string borders = "the offline gazetteer is damaged: its borders cannot be read";
  EXPECT_EQ(problemWith("insert into land values(0, x'1A0002');"), borders) << "a layer that is not there";
  EXPECT_EQ(problemWith("insert into land values(0, x'');"), borders) << "nothing";
  EXPECT_EQ(problemWith("insert into land values(0, x'1A0101FFFFFFFF0F0202');"), borders)
      << "more corners than bytes";
  EXPECT_EQ(problemWith("insert into land values(0, x'1AFFFFFFFF0F01');"), borders)
      << "more rings than bytes";
  EXPECT_EQ(problemWith("insert into land values(0, x'1AFFFFFFFFFFFFFF');"), borders)
      << "a number without end";
  const std::string places = "the offline gazetteer is damaged: its places cannot be read";
  EXPECT_EQ(problemWith("insert into land values(0, x'1A0001'); update near set data = x'00';"), places);
  EXPECT_EQ(problemWith("update near set data = x'102710270509000001000000';"), places)
      << "a country unknown";
  const std::string tables = "the offline gazetteer cannot be read: its tables are incomplete";
  EXPECT_EQ(problemWith("delete from country;"), tables);
  EXPECT_EQ(problemWith("update country set id = 7;"), tables);
  EXPECT_EQ(problemWith("update layer set country = 9;"), tables);
}

// Runs make-gazetteer on a small world with a table of its own, and tells what the look-up then says of a
// place.
TEST_F(GazetteerFileTest, AProductMayAnswerOtherwiseOnDisputedLand) {
  // Two squares of ten degrees, of which the second lies on the first's eastern half and beyond.
  std::ofstream(folder / "world.txt") << "brenvik-gazetteer\t2\narea\tAA.1\tDivision\n"
                                         "arc\t0,0 1000000,0 0,1000000 -1000000,0 0,-1000000\n"
                                         "arc\t500000,0 1000000,0 0,1000000 -1000000,0 0,-1000000\n"
                                         "layer\tAA\t1\nlayer\tBB\t2\n"
                                         "place\tTown\tAA\tAA.1\t100000\t100000\tP\t1000\t\n";
  const auto make = [this](const std::string& table) {
    std::ofstream(folder / "table.tsv") << table;
    return std::system((std::string(PYTHON) + " " + MAKE_GAZETTEER + " " + (folder / "world.txt").string() +
                        " " + (folder / "table.tsv").string() + " " + (folder / "own.db").string() + " 2> " +
                        (folder / "problem").string())
                           .c_str());
  };
  const auto countryAt = [this](double latitude, double longitude) {
    return Gazetteer(folder / "own.db")
        .lookUp({latitude, longitude})
        .address.value_or(StructuredAddress{})
        .countryCode.value_or("");
  };
  ASSERT_EQ(make(""), 0);
  EXPECT_EQ(countryAt(5, 7), "AA") << "the first border, for want of a rule";
  ASSERT_EQ(make("# a comment\n\nOverlap\tAA&BB\tBB\twhy\nCorner\tAA 1,1 1,3 3,3 3,1\tCC\twhy\n"), 0);
  EXPECT_EQ(countryAt(5, 7), "BB") << "in both";
  EXPECT_EQ(countryAt(5, 2), "AA") << "in the first alone";
  EXPECT_EQ(countryAt(5, 12), "BB") << "in the second alone";
  EXPECT_EQ(countryAt(2, 2), "CC") << "inside the outline";
  EXPECT_EQ(countryAt(2, 3.5), "AA") << "outside the outline";
  for (const char* table :
       {"one field\n", "a\tb\tAA\twhy\n", "a\tAA\tnorway\twhy\n", "a\tAA 1,2 3,4\tAA\twhy\n",
        "a\tAA 1,2 3,4 x,y\tAA\twhy\n", "a\tAA 1,2 3,4 91,0\tAA\twhy\n", "a\tQQ\tAA\twhy\n"}) {
    EXPECT_NE(make(table), 0) << table;
    EXPECT_GT(std::filesystem::file_size(folder / "problem"), 0U) << table;
  }
  EXPECT_EQ(countryAt(5, 7), "BB") << "the database is as it was";
}

TEST_F(GazetteerFileTest, TheDatabaseHas16MegabytesAtMost) {
  EXPECT_LE(std::filesystem::file_size(GAZETTEER_DATABASE), 16'000'000U);
}

TEST(GazetteerOwnCodeTest, ATerritoryAndDisputedLandHaveTheirOwnCodeWhateverTheSourceSays) {
  Gazetteer gazetteer(GAZETTEER_DATABASE);
  EXPECT_EQ(gazetteer.ownCode({22.30, 114.17}, "CN"), "HK");
  EXPECT_EQ(gazetteer.ownCode({18.45, -66.07}, "US"), "PR");
  EXPECT_EQ(gazetteer.ownCode({-20.88, 55.45}, "FR"), "RE");
  EXPECT_EQ(gazetteer.ownCode({44.95, 34.10}, "RU"), "UA");
  EXPECT_EQ(gazetteer.ownCode({22.30, 114.17}, "JP"), "JP") << "not a matter of territories";
  EXPECT_EQ(gazetteer.ownCode({52.52, 13.40}, "FR"), "FR") << "the server knows its borders";
  EXPECT_EQ(gazetteer.ownCode({30, -40}, "XX"), "XX") << "the sea";
  EXPECT_EQ(Gazetteer("/nonexistent/gazetteer.db").ownCode({22.30, 114.17}, "CN"), "CN");
}

}  // namespace
}  // namespace brenvik

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/geo/linux/GeocoderAnswer.h"

#include <gtest/gtest.h>

namespace brenvik {
namespace {

StructuredAddress addressIn(std::string_view body) {
  const auto answer = readGeocoderAnswer(body);
  EXPECT_FALSE(answer.error) << answer.error->description;
  EXPECT_TRUE(answer.address);
  return answer.address.value_or(StructuredAddress{});
}
std::string problemIn(std::string_view body) {
  const auto answer = readGeocoderAnswer(body);
  EXPECT_FALSE(answer.address);
  return answer.error ? answer.error->description : "none";
}

TEST(GeocoderAnswerTest, ReadsTheFourParts) {
  const auto address = addressIn(
      R"({"place_id":88715228,"licence":"Data © OpenStreetMap contributors","osm_id":5013364,"lat":"48.8582599",)"
      R"("category":"man_made","importance":0.62,"address":{"man_made":"Tour Eiffel","house_number":"5",)"
      R"("city_district":"Paris 7e Arrondissement","city":"Paris","ISO3166-2-lvl6":"FR-75C","state":"Île-de-France",)"
      R"("postcode":"75007","country":"France","country_code":"fr"},"boundingbox":["48.8574","48.8590"]})");
  EXPECT_EQ(address.countryCode, "FR");
  EXPECT_EQ(address.administrativeArea, "Île-de-France");
  EXPECT_EQ(address.locality, "Paris");
  EXPECT_EQ(address.postCode, "75007");
}

TEST(GeocoderAnswerTest, TheCityIsTheFirstOfCityTownVillageAndMunicipality) {
  EXPECT_EQ(addressIn(R"({"address":{"municipality":"M","village":"V","town":"T","city":"C"}})").locality,
            "C");
  EXPECT_EQ(addressIn(R"({"address":{"municipality":"M","village":"V","town":"T"}})").locality, "T");
  EXPECT_EQ(addressIn(R"({"address":{"municipality":"M","village":"V"}})").locality, "V");
  EXPECT_EQ(addressIn(R"({"address":{"municipality":"M"}})").locality, "M");
  EXPECT_EQ(addressIn(R"({"address":{"road":"R"}})").locality, std::nullopt);
}

TEST(GeocoderAnswerTest, AQuarterNamesTheCityWhereNothingLargerDoes) {
  EXPECT_EQ(addressIn(R"({"address":{"suburb":"Mitte","city":"Berlin"}})").locality, "Berlin");
  EXPECT_EQ(
      addressIn(R"({"address":{"neighbourhood":"N","hamlet":"H","suburb":"S","borough":"B"}})").locality,
      "B");
  EXPECT_EQ(addressIn(R"({"address":{"neighbourhood":"N","hamlet":"H","suburb":"S"}})").locality, "S");
  EXPECT_EQ(addressIn(R"({"address":{"neighbourhood":"N","hamlet":"H"}})").locality, "H");
  EXPECT_EQ(addressIn(R"({"address":{"neighbourhood":"N"}})").locality, "N");
}

TEST(GeocoderAnswerTest, PartsOutsideTheAddressDoNotCount) {
  const auto address = addressIn(
      R"({"city":"A","extra":{"city":"B"},"address":{"sub":{"city":"C"},"list":["city",{"city":"D"}]},"state":"E"})");
  EXPECT_EQ(address.locality, std::nullopt);
  EXPECT_EQ(address.administrativeArea, std::nullopt);
}

TEST(GeocoderAnswerTest, AnAddressNestedDeeperIsNone) {
  EXPECT_EQ(problemIn(R"({"features":[{"address":{"city":"C"}}]})"), "the geocoder's answer has no address");
}

TEST(GeocoderAnswerTest, AnAddressMayHaveNoKnownPart) {
  const auto address = addressIn(R"({"address":{}})");
  EXPECT_EQ(address.countryCode, std::nullopt);
  EXPECT_EQ(address.locality, std::nullopt);
}

TEST(GeocoderAnswerTest, UnableToGeocodeIsNoAddressAndNoError) {
  for (const char* body : {R"({"error":"Unable to geocode"})", R"({"error":{"code":1,"message":"m"}})",
                           R"({"address":{"city":"C"},"error":null})"}) {
    const auto answer = readGeocoderAnswer(body);
    EXPECT_FALSE(answer.error) << body;
    EXPECT_FALSE(answer.address) << body;
  }
}

TEST(GeocoderAnswerTest, AnErrorKeyDeeperInsideIsNotTheServersError) {
  EXPECT_EQ(addressIn(R"({"address":{"error":"x","city":"C"}})").locality, "C");
}

TEST(GeocoderAnswerTest, ACountryCodeIsTwoLettersOrAbsent) {
  EXPECT_EQ(addressIn(R"({"address":{"country_code":"No"}})").countryCode, "NO");
  for (const char* body : {R"({"address":{"country_code":""}})", R"({"address":{"country_code":"nor"}})",
                           R"({"address":{"country_code":"n1"}})", R"({"address":{"country_code":"ø"}})",
                           R"({"address":{"country_code":47}})", R"({"address":{"country_code":null}})"}) {
    EXPECT_EQ(addressIn(body).countryCode, std::nullopt) << body;
  }
}

TEST(GeocoderAnswerTest, PartsThatAreNoUsableTextAreAbsent) {
  EXPECT_EQ(addressIn(R"({"address":{"city":["Paris"]}})").locality, std::nullopt);
  EXPECT_EQ(addressIn(R"({"address":{"city":"a\u0000b"}})").locality, std::nullopt);
  EXPECT_EQ(addressIn(R"({"address":{"postcode":75007}})").postCode, std::nullopt);
}

TEST(GeocoderAnswerTest, APartOfAnyLengthIsTakenWhole) {
  const std::string name(100'000, 'x');
  EXPECT_EQ(addressIn(R"({"address":{"city":")" + name + R"("}})").locality, name);
  EXPECT_EQ(addressIn(R"({"address":{"state":")" + name + R"("}})").administrativeArea, name);
  EXPECT_EQ(addressIn(R"({"address":{"postcode":")" + name + R"("}})").postCode, name);
}

TEST(GeocoderAnswerTest, OfAKeyGivenTwiceTheLastCounts) {
  EXPECT_EQ(addressIn(R"({"address":{"city":"A","city":"B"}})").locality, "B");
  EXPECT_EQ(addressIn(R"({"address":{"city":"A","city":null}})").locality, std::nullopt);
  EXPECT_EQ(addressIn(R"({"address":{"city":"A"},"address":{"state":"S"}})").locality, std::nullopt);
  EXPECT_EQ(problemIn(R"({"address":{"city":"A"},"address":"S"})"), "the geocoder's answer has no address");
}

TEST(GeocoderAnswerTest, WhatIsNotAJsonObjectIsAnError) {
  for (const char* body :
       {"", " ", "null", "1", "\"text\"", "[]", R"([{"address":{}}])", "<!DOCTYPE html><html></html>",
        R"({"address":{"city":"Par)", R"({"address":{"city":"Paris"})", R"({"address":{}} trailing)",
        "{\"a\":\x80}", "{\"address\":{\"city\":\"\xff\"}}", R"({"address":{"city":"\ud800"}})",
        "{'address':{}}", "\x1f\x8b\x08"}) {
    EXPECT_EQ(problemIn(body), "the geocoder's answer is not a JSON object") << body;
  }
}

TEST(GeocoderAnswerTest, DeepNestingIsReadInBoundedSpace) {
  std::string body = R"({"address":{"city":"C"},"x":)";
  body += std::string(100'000, '[') + std::string(100'000, ']') + "}";
  EXPECT_EQ(addressIn(body).locality, "C");
  EXPECT_EQ(problemIn(std::string(200'000, '[')), "the geocoder's answer is not a JSON object");
  EXPECT_EQ(problemIn(R"({"a":)" + std::string(200'000, '[')), "the geocoder's answer is not a JSON object");
}

TEST(GeocoderAnswerTest, AnAnswerBeyondTheLimitIsAnError) {
  EXPECT_EQ(problemIn(R"({"address":{}})" + std::string(kLargestGeocoderAnswer, ' ')),
            "the geocoder's answer is too long");
}

}  // namespace
}  // namespace brenvik

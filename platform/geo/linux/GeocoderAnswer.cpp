// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/geo/linux/GeocoderAnswer.h"

#include <algorithm>
#include <array>
#include <nlohmann/json.hpp>

namespace brenvik {
namespace {

// What names the town, the first that is there: a town before the quarters that some places are all mapped
// as. The offline answers follow the same rule.
constexpr std::array<std::string_view, 10> kTowns{"city",          "town",         "village", "municipality",
                                                  "city_district", "borough",      "suburb",  "hamlet",
                                                  "quarter",       "neighbourhood"};
// The parts an address is read from.
constexpr auto kParts = [] {
  std::array<std::string_view, 3 + kTowns.size()> parts{"country_code", "state", "postcode"};
  std::copy(kTowns.begin(), kTowns.end(), parts.begin() + 3);
  return parts;
}();

// Takes from the stream of values the two facts wanted, and keeps nothing else: no tree is built of what a
// server sends. Nesting costs a bit a level.
class Reader final : public nlohmann::json_sax<nlohmann::json> {
 public:
  bool isError() const { return error_; }
  bool hasAddress() const { return address_; }
  std::optional<std::string> part(std::string_view name) const {
    const auto index =
        static_cast<std::size_t>(std::find(kParts.begin(), kParts.end(), name) - kParts.begin());
    return parts_[index];
  }

  bool key(string_t& name) override {
    if (depth_ == 1) {
      inAddress_ = name == "address";
      if (inAddress_) {
        parts_ = {};
        address_ = false;
      }
      if (name == "error") error_ = true;
    }
    part_ = nullptr;
    if (depth_ == 2 && inAddress_) {
      const auto* const found = std::find(kParts.begin(), kParts.end(), name);
      if (found != kParts.end()) {
        part_ = &parts_[static_cast<std::size_t>(found - kParts.begin())];
        part_->reset();
      }
    }
    return true;
  }
  bool string(string_t& value) override {
    if (part_ != nullptr && depth_ == 2) {
      const bool usable = !value.empty() && value.find('\0') == string_t::npos;
      *part_ = usable ? std::optional<std::string>(value) : std::nullopt;
    }
    return depth_ > 0;
  }
  bool start_object(std::size_t) override {
    if (depth_ == 1 && inAddress_) address_ = true;
    ++depth_;
    part_ = nullptr;
    return true;
  }
  bool end_object() override {
    --depth_;
    return true;
  }
  bool start_array(std::size_t) override {
    if (depth_ == 0) return false;
    ++depth_;
    part_ = nullptr;
    return true;
  }
  bool end_array() override {
    --depth_;
    return true;
  }
  bool null() override { return depth_ > 0; }
  bool boolean(bool) override { return depth_ > 0; }
  bool number_integer(number_integer_t) override { return depth_ > 0; }
  bool number_unsigned(number_unsigned_t) override { return depth_ > 0; }
  bool number_float(number_float_t, const string_t&) override { return depth_ > 0; }
  bool binary(binary_t&) override { return false; }
  bool parse_error(std::size_t, const std::string&, const nlohmann::json::exception&) override {
    return false;
  }

 private:
  std::array<std::optional<std::string>, kParts.size()> parts_;
  std::optional<std::string>* part_ = nullptr;  // what the next value belongs to
  std::size_t depth_ = 0;
  bool inAddress_ = false;  // the member of the outermost object that is being read is the address
  bool error_ = false;
  bool address_ = false;
};

std::optional<std::string> countryCode(std::optional<std::string> text) {
  if (!text || text->size() != 2) return std::nullopt;
  for (char& c : *text) {
    if (c >= 'a' && c <= 'z') c = static_cast<char>(c - 'a' + 'A');
    if (c < 'A' || c > 'Z') return std::nullopt;
  }
  return text;
}

}  // namespace

GeocoderAnswer readGeocoderAnswer(std::string_view body) {
  Reader reader;
  if (body.size() > kLargestGeocoderAnswer) return {{}, GeoError{"the geocoder's answer is too long"}};
  if (!nlohmann::json::sax_parse(body.begin(), body.end(), &reader)) {
    return {{}, GeoError{"the geocoder's answer is not a JSON object"}};
  }
  if (reader.isError()) return {};
  if (!reader.hasAddress()) return {{}, GeoError{"the geocoder's answer has no address"}};
  StructuredAddress address;
  address.countryCode = countryCode(reader.part("country_code"));
  address.administrativeArea = reader.part("state");
  address.postCode = reader.part("postcode");
  for (const std::string_view kind : kTowns) {
    if (!address.locality) address.locality = reader.part(kind);
  }
  return {std::move(address), {}};
}

}  // namespace brenvik

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/network/GeoMessages.h"

#include <arpa/inet.h>
#include <netinet/in.h>

#include <algorithm>
#include <string_view>

#include "platform/base/Utf8.h"
#include "platform/worker/WorkerFields.h"

namespace brenvik {
namespace {

// The helper looks at the first, and no source here has more.
constexpr std::uint32_t kMaxItems = 16;

bool isText(std::string_view text) noexcept {
  return !text.empty() && text.find('\0') == std::string_view::npos && isValidUtf8(text);
}

bool isCountryCode(std::string_view code) noexcept {
  return code.size() == 2 &&
         std::all_of(code.begin(), code.end(), [](char c) { return c >= 'A' && c <= 'Z'; });
}

bool isIpAddress(const std::string& text) noexcept {
  in6_addr space{};
  return text.find('\0') == std::string::npos && (::inet_pton(AF_INET, text.c_str(), &space) == 1 ||
                                                  ::inet_pton(AF_INET6, text.c_str(), &space) == 1);
}

// Not within a character.
std::string_view cut(std::string_view text, std::size_t most) noexcept {
  if (text.size() <= most) return text;
  while (most > 0 && (static_cast<unsigned char>(text[most]) & 0xC0U) == 0x80) --most;
  return text.substr(0, most);
}

void write(FieldWriter& to, const std::optional<GeoError>& error) {
  to.optional(error, [](FieldWriter& writer, const GeoError& it) {
    const auto line = cut(it.description, kLongestGeoError);
    writer.text(isText(line) ? line : "no description");
  });
}

std::optional<GeoError> readError(FieldReader& from) {
  const auto text = from.optionalText();
  if (!text) return std::nullopt;
  if (text->size() > kLongestGeoError || !isText(*text)) from.fail();
  return GeoError{std::string(*text)};
}

std::optional<std::string> readPart(FieldReader& from, bool (*isGood)(std::string_view) noexcept) {
  const auto text = from.optionalText();
  if (!text) return std::nullopt;
  if (!isGood(*text)) from.fail();
  return std::string(*text);
}

void write(FieldWriter& to, const StructuredAddress& address) {
  to.optionalText(address.countryCode).optionalText(address.administrativeArea);
  to.optionalText(address.locality).optionalText(address.postCode);
}

StructuredAddress readAddress(FieldReader& from) {
  StructuredAddress address;
  address.countryCode = readPart(from, isCountryCode);
  address.administrativeArea = readPart(from, isText);
  address.locality = readPart(from, isText);
  address.postCode = readPart(from, isText);
  return address;
}

// A place without an address, an address without parts that are told apart, or all.
enum class Holds : std::uint8_t { nothing = 0, place = 1, address = 2, parts = 3 };

void write(FieldWriter& to, const std::optional<MapItem>& item) {
  const auto holds = !item                               ? Holds::nothing
                     : !item->address                    ? Holds::place
                     : !item->address->structuredAddress ? Holds::address
                                                         : Holds::parts;
  to.u8(static_cast<std::uint8_t>(holds)).boolean(item && item->valid);
  if (holds == Holds::parts) write(to, *item->address->structuredAddress);
}

std::optional<MapItem> readItem(FieldReader& from) {
  const auto holds = from.u8();
  const bool valid = from.boolean();
  if (holds > static_cast<std::uint8_t>(Holds::parts)) from.fail();
  if (holds == static_cast<std::uint8_t>(Holds::nothing)) return std::nullopt;
  MapItem item{valid, std::nullopt};
  if (holds >= static_cast<std::uint8_t>(Holds::address)) item.address.emplace();
  if (holds == static_cast<std::uint8_t>(Holds::parts)) item.address->structuredAddress = readAddress(from);
  return item;
}

}  // namespace

std::vector<std::byte> encode(const Coordinate& coordinate) {
  return FieldWriter().real(coordinate.latitude).real(coordinate.longitude).take();
}

std::optional<Coordinate> decodeCoordinate(std::span<const std::byte> payload) {
  FieldReader from(payload);
  Coordinate coordinate;
  coordinate.latitude = from.real();
  coordinate.longitude = from.real();
  if (!from.whole()) return std::nullopt;
  return coordinate;
}

std::vector<std::byte> encode(const GeoOutcome<MapItems>& outcome) {
  FieldWriter to;
  write(to, outcome.error);
  if (!outcome.error) {
    const auto count = outcome.answer ? std::min<std::size_t>(outcome.answer->size(), kMaxItems) : 0;
    to.u32(static_cast<std::uint32_t>(count));
    for (std::size_t i = 0; i < count; ++i) write(to, (*outcome.answer)[i]);
  }
  return to.take();
}

std::optional<GeoOutcome<MapItems>> decodeMapItems(std::span<const std::byte> payload) {
  FieldReader from(payload);
  GeoOutcome<MapItems> outcome;
  outcome.error = readError(from);
  if (!outcome.error && !from.hasFailed()) {
    const auto count = from.u32();
    if (count > kMaxItems || payload.size() > kLongestAddress) from.fail();
    outcome.answer.emplace();
    for (std::uint32_t i = 0; i < count && !from.hasFailed(); ++i) outcome.answer->push_back(readItem(from));
  }
  if (!from.whole()) return std::nullopt;
  return outcome;
}

std::vector<std::byte> encode(const GeoOutcome<GeoIpResult>& outcome) {
  FieldWriter to;
  write(to, outcome.error);
  if (!outcome.error) to.text(outcome.answer ? outcome.answer->ipAddress : std::string());
  return to.take();
}

std::optional<GeoOutcome<GeoIpResult>> decodeGeoIpResult(std::span<const std::byte> payload) {
  FieldReader from(payload);
  GeoOutcome<GeoIpResult> outcome;
  outcome.error = readError(from);
  if (!outcome.error && !from.hasFailed()) {
    outcome.answer = GeoIpResult{std::string(from.text())};
    if (!isIpAddress(outcome.answer->ipAddress)) from.fail();
  }
  if (!from.whole()) return std::nullopt;
  return outcome;
}

}  // namespace brenvik

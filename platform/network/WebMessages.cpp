// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/network/WebMessages.h"

#include <algorithm>
#include <limits>
#include <string_view>

#include "platform/worker/WorkerFields.h"

namespace brenvik {
namespace {

// HTTP has three digits.
constexpr std::uint32_t kLargestStatus = 999;

bool isKnown(std::uint32_t kind) noexcept {
  return kind <= static_cast<std::uint32_t>(WebErrorKind::unusableUrl);
}

bool hasLineBreakOrNul(std::string_view text) noexcept {
  return text.find_first_of(std::string_view("\r\n\0", 3)) != std::string_view::npos;
}

void write(FieldWriter& to, const HeaderMap& headers) {
  to.u32(static_cast<std::uint32_t>(headers.size()));
  for (const auto& [name, value] : headers) to.text(name).text(value);
}

// Each field takes bytes of the payload, so their number needs no limit of its own.
HeaderMap readHeaders(FieldReader& from) {
  HeaderMap headers;
  for (auto left = from.u32(); left > 0 && !from.hasFailed(); --left) {
    const auto name = from.text();
    const auto value = from.text();
    if (from.hasFailed()) break;
    if (name.empty() || hasLineBreakOrNul(name) || !headers.try_emplace(std::string(name), value).second) {
      from.fail();
    }
  }
  return headers;
}

}  // namespace

std::vector<std::byte> encode(const WebQuestion& question) {
  FieldWriter to;
  to.u32(static_cast<std::uint32_t>(question.type)).text(question.url).boolean(question.cellularAllowed);
  to.i64(question.timeLimit.count()).u64(question.largestBody);
  write(to, question.headers);
  return to.take();
}

std::optional<WebQuestion> decodeWebQuestion(std::span<const std::byte> payload) {
  FieldReader from(payload);
  WebQuestion question;
  if (from.u32() != static_cast<std::uint32_t>(WebRequestType::get)) return std::nullopt;
  question.url = from.text();
  question.cellularAllowed = from.boolean();
  const auto limit = from.i64();
  question.largestBody = from.u64();
  question.headers = readHeaders(from);
  // Longer than a day is no limit that anybody means, and would overflow on its way to a deadline.
  constexpr std::int64_t kMaxTimeLimit = std::chrono::milliseconds(std::chrono::hours(24)).count();
  if (!from.whole() || limit < 0 || limit > kMaxTimeLimit || question.largestBody > kLargestWebBody)
    return std::nullopt;
  question.timeLimit = std::chrono::milliseconds(limit);
  return question;
}

std::vector<std::byte> encode(const WebAnswer& answer) {
  FieldWriter to;
  to.u32(static_cast<std::uint32_t>(answer.errorKind)).u32(static_cast<std::uint32_t>(answer.statusCode));
  to.u64(answer.bodySize);
  write(to, answer.headers);
  return to.take();
}

std::optional<WebAnswer> decodeWebAnswer(std::span<const std::byte> payload, std::uint64_t largestBody) {
  FieldReader from(payload);
  WebAnswer answer;
  const auto kind = from.u32();
  const auto status = from.u32();
  answer.bodySize = from.u64();
  answer.headers = readHeaders(from);
  if (!from.whole() || !isKnown(kind) || status > kLargestStatus) return std::nullopt;
  answer.errorKind = static_cast<WebErrorKind>(kind);
  answer.statusCode = static_cast<int>(status);
  if (answer.bodySize > (answer.errorKind == WebErrorKind::none ? largestBody : 0)) return std::nullopt;
  return answer;
}

}  // namespace brenvik

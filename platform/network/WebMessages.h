// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <chrono>
#include <cstddef>
#include <cstdint>
#include <optional>
#include <span>
#include <string>
#include <vector>

#include "platform/web/WebClient.h"

namespace brenvik {

// One HTTP request to the worker.
struct WebQuestion {
  WebRequestType type = WebRequestType::get;
  std::string url;
  HeaderMap headers;
  bool cellularAllowed = true;
  std::chrono::milliseconds timeLimit{0};
  std::uint64_t largestBody = kLargestWebBody;
};

// The worker's answer. The body travels in sealed memory of exactly `bodySize` bytes.
struct WebAnswer {
  WebErrorKind errorKind = WebErrorKind::unknown;
  int statusCode = 0;
  HeaderMap headers;
  std::uint64_t bodySize = 0;
};

// The decoders return nothing for a malformed message, and for one that no correct program sends: with a body
// larger than `largestBody`, with a body and a failure, or with NUL bytes or line breaks in texts. All throw
// std::bad_alloc.
std::vector<std::byte> encode(const WebQuestion& question);
std::optional<WebQuestion> decodeWebQuestion(std::span<const std::byte> payload);
std::vector<std::byte> encode(const WebAnswer& answer);
std::optional<WebAnswer> decodeWebAnswer(std::span<const std::byte> payload, std::uint64_t largestBody);

}  // namespace brenvik

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <cstdint>
#include <map>
#include <string>
#include <string_view>

#include "platform/web/WebBody.h"

// The vocabulary of the HTTP client. RFC 9110.
namespace brenvik {

// Orders header names without regard to the case of ASCII letters.
struct HeaderNameLess {
  using is_transparent = void;
  bool operator()(std::string_view left, std::string_view right) const noexcept;
};

// Header fields by name. The values of a repeated field are joined by ", ".
using HeaderMap = std::map<std::string, std::string, HeaderNameLess>;

enum class WebRequestType : std::int32_t { get = 0 };

// How a transfer ended. `none`, the value 1, means that a whole response came, with any status.
enum class WebErrorKind : std::int32_t {
  unknown = 0,
  none = 1,
  clientUnavailable =
      2,              // the HTTP client could not be loaded or started, or has no descriptors to work with
  cancelled = 3,      // the client was destroyed first
  hostNotFound = 4,   // the name was looked up and has no address, or no name server answered
  cannotConnect = 5,  // refused, unreachable
  cellularNotAllowed = 6,  // the only route is cellular, and the session does not allow it
  timedOut = 7,            // connecting, stalling or the request's own limit
  connectionLost = 8,      // ended or reset before the response was whole
  certificateRefused = 9,  // not trusted, or made out to another name
  certificateClock = 10,   // not valid yet or any more: the system clock may be wrong
  secureConnection = 11,   // any other failure of TLS
  redirectRefused = 12,    // to something other than https
  tooManyRedirects = 13,
  bodyTooLarge = 14,
  malformedResponse = 15,  // not HTTP, or content that does not decode
  outOfMemory = 16,
  unusableUrl = 17,  // the client, whose check is stricter than that of makeRequest(), refuses it
};

// A response, or the facts known about a transfer that failed.
struct WebResponse {
  WebErrorKind errorKind = WebErrorKind::unknown;
  int statusCode = 0;  // 0: none arrived
  WebBody body;
  HeaderMap headers;
};

// Names for people, in a log line. Never null; valid for ever.
const char* textOfErrorKind(WebErrorKind kind) noexcept;
const char* textOfStatusCode(int statusCode) noexcept;

}  // namespace brenvik

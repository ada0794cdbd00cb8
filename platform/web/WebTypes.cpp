// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/web/WebTypes.h"

#include <algorithm>

namespace brenvik {
namespace {

constexpr unsigned char lowered(char c) noexcept {
  return static_cast<unsigned char>(c >= 'A' && c <= 'Z' ? c - 'A' + 'a' : c);
}

}  // namespace

bool HeaderNameLess::operator()(std::string_view left, std::string_view right) const noexcept {
  return std::lexicographical_compare(left.begin(), left.end(), right.begin(), right.end(),
                                      [](char a, char b) { return lowered(a) < lowered(b); });
}

const char* textOfErrorKind(WebErrorKind kind) noexcept {
  switch (kind) {
    case WebErrorKind::unknown:
      return "unknown error";
    case WebErrorKind::none:
      return "no error";
    case WebErrorKind::clientUnavailable:
      return "HTTP client not available";
    case WebErrorKind::cancelled:
      return "cancelled";
    case WebErrorKind::hostNotFound:
      return "host not found";
    case WebErrorKind::cannotConnect:
      return "cannot connect";
    case WebErrorKind::cellularNotAllowed:
      return "cellular access not allowed";
    case WebErrorKind::timedOut:
      return "timed out";
    case WebErrorKind::connectionLost:
      return "connection lost";
    case WebErrorKind::certificateRefused:
      return "server certificate not trusted";
    case WebErrorKind::certificateClock:
      return "server certificate not valid at this time, check the system clock";
    case WebErrorKind::secureConnection:
      return "secure connection failed";
    case WebErrorKind::redirectRefused:
      return "redirect to something other than https refused";
    case WebErrorKind::tooManyRedirects:
      return "too many redirects";
    case WebErrorKind::bodyTooLarge:
      return "response too large";
    case WebErrorKind::malformedResponse:
      return "malformed response";
    case WebErrorKind::outOfMemory:
      return "out of memory";
    case WebErrorKind::unusableUrl:
      return "URL cannot be used";
  }
  return "unknown error";
}

const char* textOfStatusCode(int statusCode) noexcept {
  switch (statusCode) {
    case 0:
      return "no status";
    case 200:
      return "OK";
    case 201:
      return "Created";
    case 202:
      return "Accepted";
    case 204:
      return "No Content";
    case 206:
      return "Partial Content";
    case 301:
      return "Moved Permanently";
    case 302:
      return "Found";
    case 303:
      return "See Other";
    case 304:
      return "Not Modified";
    case 307:
      return "Temporary Redirect";
    case 308:
      return "Permanent Redirect";
    case 400:
      return "Bad Request";
    case 401:
      return "Unauthorized";
    case 403:
      return "Forbidden";
    case 404:
      return "Not Found";
    case 405:
      return "Method Not Allowed";
    case 406:
      return "Not Acceptable";
    case 408:
      return "Request Timeout";
    case 410:
      return "Gone";
    case 416:
      return "Range Not Satisfiable";
    case 429:
      return "Too Many Requests";
    case 451:
      return "Unavailable For Legal Reasons";
    case 500:
      return "Internal Server Error";
    case 501:
      return "Not Implemented";
    case 502:
      return "Bad Gateway";
    case 503:
      return "Service Unavailable";
    case 504:
      return "Gateway Timeout";
    default:
      break;
  }
  if (statusCode >= 100 && statusCode < 200) return "Informational";
  if (statusCode >= 200 && statusCode < 300) return "Successful";
  if (statusCode >= 300 && statusCode < 400) return "Redirection";
  if (statusCode >= 400 && statusCode < 500) return "Client Error";
  if (statusCode >= 500 && statusCode < 600) return "Server Error";
  return "unknown status";
}

}  // namespace brenvik

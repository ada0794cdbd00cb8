// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/web/linux/curl/ResponseHead.h"

#include <arpa/inet.h>
#include <curl/curl.h>
#include <netinet/in.h>
#include <strings.h>

#include <memory>

namespace brenvik {
namespace {

struct UrlCleanup {
  void operator()(CURLU* url) const noexcept { curl_url_cleanup(url); }
};
struct TextCleanup {
  void operator()(char* text) const noexcept { curl_free(text); }
};
using Url = std::unique_ptr<CURLU, UrlCleanup>;
using Text = std::unique_ptr<char, TextCleanup>;

std::string partOf(CURLU* url, CURLUPart part) {
  char* value = nullptr;
  if (curl_url_get(url, part, &value, 0) != CURLUE_OK) return {};
  const Text owned(value);
  return value;
}

std::string_view trimmed(std::string_view text) noexcept {
  constexpr std::string_view kBlanks = " \t\r\n";
  const auto first = text.find_first_not_of(kBlanks);
  if (first == std::string_view::npos) return {};
  return text.substr(first, text.find_last_not_of(kBlanks) - first + 1);
}

}  // namespace

bool ResponseHead::takeLine(std::string_view line) {
  taken_ += line.size();
  if (taken_ > kMaxSize) return false;
  if (bodyHasBegun_) return true;
  if (line.starts_with("HTTP/")) fields.clear();  // of an interim response before this one
  if (line.starts_with(' ') || line.starts_with('\t')) {
    const auto more = trimmed(line);
    const auto field = fields.find(lastName_);
    if (more.empty() || lastName_.empty() || field == fields.end()) return true;
    if (!field->second.empty()) field->second += ' ';
    field->second += more;
    return true;
  }
  lastName_.clear();
  const auto colon = line.find(':');
  if (colon == std::string_view::npos || colon == 0) return true;
  const auto value = trimmed(line.substr(colon + 1));
  lastName_ = trimmed(line.substr(0, colon));
  const auto [at, isNew] = fields.try_emplace(lastName_, value);
  if (!isNew) at->second.append(", ").append(value);
  return true;
}

std::optional<ParsedUrl> parseUrl(const std::string& text) {
  if (text.find('\0') != std::string::npos) return std::nullopt;
  const Url url(curl_url());
  if (url == nullptr || curl_url_set(url.get(), CURLUPART_URL, text.c_str(), 0) != CURLUE_OK)
    return std::nullopt;
  ParsedUrl parsed{partOf(url.get(), CURLUPART_SCHEME), partOf(url.get(), CURLUPART_HOST)};
  if (parsed.host.starts_with('[') && parsed.host.ends_with(']')) {
    parsed.host = parsed.host.substr(1, parsed.host.size() - 2);
  }
  if (parsed.host.empty()) return std::nullopt;
  return parsed;
}

bool needsLookUp(const std::string& host) {
  in6_addr space{};
  if (::inet_pton(AF_INET, host.c_str(), &space) == 1 || ::inet_pton(AF_INET6, host.c_str(), &space) == 1)
    return false;
  constexpr std::string_view kLocal = "localhost";
  if (host.size() < kLocal.size()) return true;
  const std::size_t before = host.size() - kLocal.size();
  return ::strcasecmp(host.c_str() + before, kLocal.data()) != 0 || (before > 0 && host[before - 1] != '.');
}

}  // namespace brenvik

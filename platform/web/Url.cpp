// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/web/Url.h"

#include <algorithm>

namespace brenvik {
namespace {

constexpr unsigned kLargestPort = 65535;

bool isPort(std::string_view text) noexcept {
  unsigned port = 0;
  for (const char c : text) {
    if (c < '0' || c > '9') return false;
    port = port * 10 + static_cast<unsigned>(c - '0');
    if (port > kLargestPort) return false;
  }
  return true;
}

// An IPv6 address with or without a zone; which one it is, the client finds out.
bool isBracketed(std::string_view host) noexcept {
  const auto address = host.substr(0, host.find('%'));
  return !address.empty() &&
         address.find_first_not_of("0123456789abcdefABCDEF:.") == std::string_view::npos &&
         address.find(':') != std::string_view::npos;
}

}  // namespace

bool isUsableUrl(std::string_view url) noexcept {
  const auto isForbidden = [](char c) { return static_cast<unsigned char>(c) <= ' ' || c == 0x7F; };
  if (std::any_of(url.begin(), url.end(), isForbidden)) return false;
  constexpr std::string_view kScheme = "https:";
  if (url.size() <= kScheme.size()) return false;
  for (std::size_t i = 0; i < kScheme.size(); ++i) {
    if ((url[i] | ('a' <= kScheme[i] && kScheme[i] <= 'z' ? 0x20 : 0)) != kScheme[i]) return false;
  }
  url.remove_prefix(kScheme.size());
  // One to three, as clients take them.
  const auto slashes = std::min(url.find_first_not_of('/'), url.size());
  if (slashes < 1 || slashes > 3) return false;
  url.remove_prefix(slashes);
  auto host = url.substr(0, url.find_first_of("/?#"));
  if (const auto user = host.rfind('@'); user != std::string_view::npos) host.remove_prefix(user + 1);
  std::string_view port;
  if (host.starts_with('[')) {
    const auto end = host.find(']');
    if (end == std::string_view::npos || !isBracketed(host.substr(1, end - 1))) return false;
    port = host.substr(end + 1);
    if (!port.empty() && !port.starts_with(':')) return false;
  } else {
    const auto end = std::min(host.find(':'), host.size());
    port = host.substr(end);
    host = host.substr(0, end);
    if (host.empty() || host.find_first_of("!{}[]\\$'\"^`*<>=;,+&()|") != std::string_view::npos)
      return false;
  }
  return port.empty() || isPort(port.substr(1));
}

}  // namespace brenvik

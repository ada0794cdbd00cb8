// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include <algorithm>
#include <cstdint>
#include <cstdlib>
#include <string>

#include "platform/web/linux/curl/ResponseHead.h"

using namespace brenvik;

// The header lines of a server, and where it redirects to.
extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  const std::string_view all(reinterpret_cast<const char*>(data), size);
  ResponseHead head;
  bool whole = true;
  for (std::size_t at = 0; at < size && whole;) {
    const std::size_t end = std::min(size, all.find('\n', at) == all.npos ? size : all.find('\n', at) + 1);
    const auto line = all.substr(at, end - at);
    if (line == "\r\n") head.bodyBegins();
    whole = head.takeLine(line);
    at = end;
  }
  if (whole != (size <= ResponseHead::kMaxSize)) std::abort();
  for (const auto& [name, value] : head.fields) {
    // No line of ours can be broken by what a server sent.
    if ((name + value).find('\n') != std::string::npos) std::abort();
    if (!head.fields.contains(name)) std::abort();
  }
  const auto location = head.fields.find("Location");
  const std::string target = location != head.fields.end() ? location->second : std::string(all);
  if (const auto url = parseUrl(target)) {
    if (url->host.empty() || url->scheme.empty()) std::abort();
    for (const char c : url->host) {
      if (static_cast<unsigned char>(c) <= ' ' || c == '/' || c == '@') std::abort();
    }
    (void)needsLookUp(url->host);
  }
  return 0;
}

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <memory>

#include "platform/gzip/Gunzip.h"
#include "platform/runloop/WorkQueue.h"
#include "platform/web/WebClient.h"

// What the daemon and the module that holds the HTTP client agree on. Both come from one build: objects of
// C++ cross the border.
namespace brenvik {

inline constexpr const char kWebModuleFile[] = "brenvik-web.so";
// The one symbol of the module.
inline constexpr const char kWebModuleSymbol[] = "brenvikWebModule";

struct WebModuleFunctions {
  const char* version;  // of the build; another one's module is not used
  // Null when it cannot be made. Nothing throws.
  std::unique_ptr<WebClient> (*makeWebClient)(WorkQueues& queues) noexcept;
  std::unique_ptr<Gunzip> (*makeGunzip)() noexcept;
};
using WebModuleEntry = const WebModuleFunctions* (*)() noexcept;

}  // namespace brenvik

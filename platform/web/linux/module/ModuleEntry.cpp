// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/gzip/linux/ZlibGunzip.h"
#include "platform/web/linux/WebModule.h"
#include "platform/web/linux/curl/CurlWebClient.h"

namespace brenvik {
namespace {

std::unique_ptr<WebClient> makeWebClient(WorkQueues& queues) noexcept try {
  return CurlWebClient::make(queues);
} catch (...) {
  return nullptr;  // out of memory
}

std::unique_ptr<Gunzip> makeGunzip() noexcept try { return std::make_unique<ZlibGunzip>(); } catch (...) {
  return nullptr;
}

constexpr WebModuleFunctions kFunctions{BRENVIK_VERSION, makeWebClient, makeGunzip};

}  // namespace
}  // namespace brenvik

extern "C" __attribute__((visibility("default"))) const brenvik::WebModuleFunctions*
brenvikWebModule() noexcept {
  return &brenvik::kFunctions;
}

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <chrono>
#include <cstdint>
#include <memory>
#include <string>

#include "platform/net/linux/CellularRule.h"
#include "platform/runloop/WorkQueue.h"
#include "platform/web/WebClient.h"

namespace brenvik {

struct CurlSettings {
  std::string certificateAuthorities;  // a file of trusted certificates; empty: the system's
  std::chrono::milliseconds connectLimit = std::chrono::seconds(30);  // name, connection and TLS together
  std::chrono::seconds stallLimit = std::chrono::seconds(30);  // two at least: rates are taken over a second
  // The limit of a whole request: this long, plus the time that its largest body takes at the slowest rate. A
  // real body is far smaller than the largest, so a slow link has enough time, but a server that trickles has
  // not.
  std::chrono::milliseconds wholeLimit = std::chrono::minutes(1);
  std::uint64_t slowestBytesPerSecond = std::uint64_t{64} << 10;
  CellularRuleFiles cellularFiles;
  bool bodiesForAnotherProcess = false;  // see WebBody
};

// The HTTP client on libcurl's multi interface, driven by its own queue. Requests under way when it is
// destroyed complete as cancelled. Do not destroy it on a queue that it made or calls back on.
class CurlWebClient final : public WebClient {
 public:
  // Returns null if libcurl does not start.
  static std::unique_ptr<CurlWebClient> make(WorkQueues& queues, CurlSettings settings = {});
  ~CurlWebClient() override;

  std::shared_ptr<WebSession> makeSession() override;
  std::shared_ptr<WebRequest> makeRequest(WebRequestType type, const std::string& url,
                                          const HeaderMap& headers,
                                          std::shared_ptr<WebSession> session) override;

 private:
  class Driver;
  class Session;
  class Request;
  struct Transfer;

  explicit CurlWebClient(std::shared_ptr<Driver> driver);
  const std::shared_ptr<Driver> driver_;
};

}  // namespace brenvik

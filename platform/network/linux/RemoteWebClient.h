// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <chrono>

#include "platform/network/linux/NetworkAnswers.h"
#include "platform/web/WebClient.h"

namespace brenvik {

// The HTTP client, in the network worker. A request that the worker does not answer completes as
// clientUnavailable, at the latest after the longest silence. A request under way when the answers are shut
// down completes as cancelled.
class RemoteWebClient final : public WebClient {
 public:
  // The longest URL, in bytes; with it, a request still fits one datagram.
  static constexpr std::size_t kLongestUrl = std::size_t{32} << 10;

  // The answers must outlive it.
  explicit RemoteWebClient(NetworkAnswers& answers) noexcept : answers_(answers) {}

  std::shared_ptr<WebSession> makeSession() override;
  std::shared_ptr<WebRequest> makeRequest(WebRequestType type, const std::string& url,
                                          const HeaderMap& headers,
                                          std::shared_ptr<WebSession> session) override;

 private:
  class Session;
  class Request;
  NetworkAnswers& answers_;
};

}  // namespace brenvik

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <chrono>
#include <cstddef>
#include <cstdint>
#include <functional>
#include <memory>
#include <string>
#include <vector>

#include "platform/runloop/WorkQueue.h"
#include "platform/web/WebTypes.h"

namespace brenvik {

// The largest body of a response in bytes, both as it travels and decoded, unless its request sets a lower
// limit.
inline constexpr std::uint64_t kLargestWebBody = std::uint64_t{512} << 20;
// The same for a redirect, whose body is not used.
inline constexpr std::uint64_t kLargestRedirectBody = std::uint64_t{64} << 10;

// The settings that several requests share. Set it up before the requests are sent.
class WebSession {
 public:
  virtual ~WebSession() = default;
  // False: no packet of a request, name look-ups included, may be sent over a cellular interface. The default
  // is true.
  virtual void setCellularAllowed(bool allowed) noexcept = 0;
};

// One request. Set it up, then send() it once; the caller need not keep it alive. One thread at a time.
class WebRequest {
 public:
  // The handler owns the response, which is null if nothing at all is known.
  using Completion = std::function<void(std::shared_ptr<WebResponse>)>;

  virtual ~WebRequest() = default;

  // Sets the queue on which the completion runs. The request holds the queue until then; for a queue without
  // shared ownership, such as WorkQueues::main(), pass a shared_ptr that owns nothing.
  virtual void setCallbackQueue(std::shared_ptr<WorkQueue> queue) = 0;
  // Sets the completion, which runs exactly once for each request that is sent, on the callback queue and
  // never within send().
  virtual void setCompletion(Completion completion) = 0;
  // Limits the time from send() to the end of the body, redirects included. Zero, the default, means only the
  // client's own limits on connecting (30 s), on stalling (under 200 bytes a second for 30 s) and on the
  // whole request (a minute, and a second for each 64 KiB of the largest body). The shortest limit counts.
  virtual void setTimeLimit(std::chrono::milliseconds limit) noexcept = 0;
  // Limits the body, in bytes, both as it travels and decoded; kLargestWebBody is the default and the
  // maximum.
  virtual void setLargestBody(std::uint64_t bytes) noexcept = 0;
  // Starts the request and returns at once. A GET carries no body, so `body` is not sent.
  virtual void send(std::vector<std::byte> body) = 0;
  // A request under way completes as cancelled, some time later; a request that was not sent yet will never
  // be sent. In every case the completion of a sent request runs once.
  virtual void cancel() noexcept = 0;
};

// The platform's HTTP client: https only, certificates checked against the system's trust store, redirects
// only to https, no proxy, no cookies, no connection used twice. If the headers include "Accept-Encoding", a
// Content-Encoding of the response is decoded; Content-Type never matters. Any thread.
class WebClient {
 public:
  virtual ~WebClient() = default;

  virtual std::shared_ptr<WebSession> makeSession() = 0;

  // Returns null if the URL cannot be used: not https, no host, blanks or control characters. Header names
  // and values are sent as given ("User-Agent" too; there is no default); a header with a line break is left
  // out.
  virtual std::shared_ptr<WebRequest> makeRequest(WebRequestType type, const std::string& url,
                                                  const HeaderMap& headers,
                                                  std::shared_ptr<WebSession> session) = 0;
};

}  // namespace brenvik

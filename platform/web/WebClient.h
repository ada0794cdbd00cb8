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

// The largest body a response may have, as it travels and decoded, unless its request asks for less.
inline constexpr std::uint64_t kLargestWebBody = std::uint64_t{512} << 20;
// The same for a redirect, whose body is not used.
inline constexpr std::uint64_t kLargestRedirectBody = std::uint64_t{64} << 10;

// What several requests have in common. Set it up before the requests are sent.
class WebSession {
 public:
  virtual ~WebSession() = default;
  // False: no packet of a request, look-up of the name included, may leave by a cellular interface.
  // Allowed to begin with.
  virtual void setCellularAllowed(bool allowed) noexcept = 0;
};

// One request. Set it up, then send() it once; the caller need not keep it alive. One thread at a time.
class WebRequest {
 public:
  // The response is the handler's own. It may be null: nothing at all is known.
  using Completion = std::function<void(std::shared_ptr<WebResponse>)>;

  virtual ~WebRequest() = default;

  // Where the completion runs. The request holds the queue until then; for a queue that has no owner to share
  // with, such as WorkQueues::main(), give a shared_ptr that owns nothing.
  virtual void setCallbackQueue(std::shared_ptr<WorkQueue> queue) = 0;
  // Runs exactly once for each request that is sent, always, on the callback queue and never within send().
  virtual void setCompletion(Completion completion) = 0;
  // From send() to the end of the body, redirects included. Zero, as at first: no limit other than the
  // client's own on connecting (30 s), on stalling (under 200 bytes a second for 30 s) and on the whole
  // request (a minute, and a second for each 64 KiB of the largest body). The shortest limit counts.
  virtual void setTimeLimit(std::chrono::milliseconds limit) noexcept = 0;
  // Bytes of the body, as it travels and decoded; kLargestWebBody at first, and at most.
  virtual void setLargestBody(std::uint64_t bytes) noexcept = 0;
  // Starts the request and returns at once. A get carries no body, so what is given is not sent.
  virtual void send(std::vector<std::byte> body) = 0;
  // A request under way completes as cancelled, a while later; one that has not been sent never is. Whatever
  // the outcome, the completion runs once.
  virtual void cancel() noexcept = 0;
};

// The platform's HTTP client: https only, certificates checked against the system's trust store, redirects
// followed to https only, no proxy, no cookies, no connection used twice. With an "Accept-Encoding" among
// the headers, a Content-Encoding of the response is decoded; Content-Type never matters. Any thread.
class WebClient {
 public:
  virtual ~WebClient() = default;

  virtual std::shared_ptr<WebSession> makeSession() = 0;

  // Null when the URL cannot be used: not https, no host, blanks or control characters in it. Header names
  // and values go out as given ("User-Agent" too; without one none is sent); one holding a line break is left
  // out.
  virtual std::shared_ptr<WebRequest> makeRequest(WebRequestType type, const std::string& url,
                                                  const HeaderMap& headers,
                                                  std::shared_ptr<WebSession> session) = 0;
};

}  // namespace brenvik

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <atomic>
#include <chrono>
#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <new>
#include <span>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "platform/web/WebClient.h"

namespace brenvik {

// A client that answers each URL as told, always through the callback queue and after send() has returned.
// A URL nobody told it about gets an answer of 404. Tell it before it is used; requests may then come from
// any thread.
class ScriptedWebClient final : public WebClient {
 public:
  struct Seen {
    WebRequestType type;
    std::string url;
    HeaderMap headers;
    bool cellularAllowed;
    std::string queueLabel;
    std::size_t bodySize;
    std::chrono::milliseconds timeLimit;
    std::uint64_t largestBody;
  };

  void answer(const std::string& url, WebResponse response) { answers_[url] = std::move(response); }
  void answer(const std::string& url, int statusCode, std::string_view body, HeaderMap headers = {}) {
    WebResponse response;
    response.errorKind = WebErrorKind::none;
    response.statusCode = statusCode;
    response.body.append(std::as_bytes(std::span(body)));
    response.headers = std::move(headers);
    answers_[url] = std::move(response);
  }
  void fail(const std::string& url, WebErrorKind kind) {
    WebResponse response;
    response.errorKind = kind;
    answers_[url] = std::move(response);
  }
  // The completion of this URL gets null.
  void answerNothing(const std::string& url) { nothing_[url] = true; }
  // No request can be made of this URL.
  void refuse(const std::string& url) { refused_[url] = true; }
  // Keeps every answer back, its request sent, until releaseAnswers().
  void holdAnswers() {
    const std::lock_guard lock(mutex_);
    holding_ = true;
  }
  void releaseAnswers() {
    std::vector<std::function<void()>> held;
    {
      const std::lock_guard lock(mutex_);
      holding_ = false;
      held.swap(held_);
    }
    for (auto& deliver : held) deliver();
  }

  std::vector<Seen> seen() const {
    const std::lock_guard lock(mutex_);
    return seen_;
  }

  // There is no memory for another session.
  bool exhausted = false;
  // Requests that somebody has cancelled; they are answered all the same.
  std::atomic<int> cancelled{0};

  std::shared_ptr<WebSession> makeSession() override {
    if (exhausted) throw std::bad_alloc();
    return std::make_shared<Session>();
  }
  std::shared_ptr<WebRequest> makeRequest(WebRequestType type, const std::string& url,
                                          const HeaderMap& headers,
                                          std::shared_ptr<WebSession> session) override {
    if (refused_.contains(url)) return nullptr;
    return std::make_shared<Request>(*this, type, url, headers, std::static_pointer_cast<Session>(session));
  }

 private:
  struct Session final : WebSession {
    void setCellularAllowed(bool value) noexcept override { allowed = value; }
    bool allowed = true;
  };

  class Request final : public WebRequest {
   public:
    Request(ScriptedWebClient& client, WebRequestType type, std::string url, HeaderMap headers,
            std::shared_ptr<Session> session)
        : client_(client),
          type_(type),
          url_(std::move(url)),
          headers_(std::move(headers)),
          session_(std::move(session)) {}
    void setCallbackQueue(std::shared_ptr<WorkQueue> queue) override { queue_ = std::move(queue); }
    void setCompletion(Completion completion) override { completion_ = std::move(completion); }
    void setTimeLimit(std::chrono::milliseconds limit) noexcept override { timeLimit_ = limit; }
    void setLargestBody(std::uint64_t bytes) noexcept override { largestBody_ = bytes; }
    void cancel() noexcept override { ++client_.cancelled; }
    void send(std::vector<std::byte> body) override {
      if (std::exchange(sent_, true)) return;
      std::shared_ptr<WebResponse> response;
      if (!client_.nothing_.contains(url_)) {
        response = std::make_shared<WebResponse>();
        const auto found = client_.answers_.find(url_);
        if (found != client_.answers_.end()) {
          *response = found->second;
        } else {
          response->errorKind = WebErrorKind::none;
          response->statusCode = 404;
        }
      }
      auto deliver = [queue = queue_, completion = completion_, response = std::move(response)] {
        queue->post([completion, response] { completion(response); });
      };
      {
        const std::lock_guard lock(client_.mutex_);
        client_.seen_.push_back({type_, url_, headers_, session_->allowed, queue_->label(), body.size(),
                                 timeLimit_, largestBody_});
        if (client_.holding_) {
          client_.held_.emplace_back(std::move(deliver));
          return;
        }
      }
      deliver();
    }

   private:
    ScriptedWebClient& client_;
    const WebRequestType type_;
    const std::string url_;
    const HeaderMap headers_;
    const std::shared_ptr<Session> session_;
    std::shared_ptr<WorkQueue> queue_;
    Completion completion_;
    std::chrono::milliseconds timeLimit_{0};
    std::uint64_t largestBody_ = kLargestWebBody;
    bool sent_ = false;
  };

  std::map<std::string, WebResponse> answers_;
  std::map<std::string, bool> nothing_;
  std::map<std::string, bool> refused_;
  mutable std::mutex mutex_;
  std::vector<Seen> seen_;
  bool holding_ = false;
  std::vector<std::function<void()>> held_;
};

}  // namespace brenvik

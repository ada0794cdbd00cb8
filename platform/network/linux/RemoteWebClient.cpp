// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/network/linux/RemoteWebClient.h"

#include <algorithm>
#include <new>
#include <optional>
#include <utility>

#include "platform/network/WebMessages.h"
#include "platform/network/linux/LargeMessage.h"
#include "platform/web/Url.h"

namespace brenvik {
namespace {

using std::chrono::milliseconds;

// What the worker may take beyond the limit that it has itself.
constexpr milliseconds kAllowance = std::chrono::minutes(1);

// The client's own limit, as the seam has it: a minute, and a second for each 64 KiB of the largest body.
milliseconds longestOf(std::uint64_t largestBody) noexcept {
  return std::chrono::minutes(1) + std::chrono::seconds(largestBody >> 16);
}

WebErrorKind kindOf(NetworkAnswers::Ended ended) noexcept {
  switch (ended) {
    case NetworkAnswers::Ended::answered:
      return WebErrorKind::none;
    case NetworkAnswers::Ended::refused:
    case NetworkAnswers::Ended::unavailable:
      return WebErrorKind::clientUnavailable;
    case NetworkAnswers::Ended::cancelled:
      return WebErrorKind::cancelled;
  }
  return WebErrorKind::unknown;
}

// False when it is nonsense.
bool takeAnswer(WorkerMessage message, std::uint64_t largestBody, WebResponse& response) {
  auto opened = LargePayload::open(std::move(message));
  if (!opened) return false;
  auto answer = decodeWebAnswer(opened->bytes(), largestBody);
  auto& descriptors = opened->descriptors();
  if (!answer || descriptors.size() != (answer->bodySize > 0 ? 1U : 0U)) return false;
  if (answer->bodySize > 0) {
    auto body = WebBody::ofSealedMemory(std::move(descriptors[0]), answer->bodySize);
    if (!body) return false;
    response.body = *std::move(body);
  }
  response.errorKind = answer->errorKind;
  response.statusCode = answer->statusCode;
  response.headers = std::move(answer->headers);
  return true;
}

}  // namespace

class RemoteWebClient::Session final : public WebSession {
 public:
  void setCellularAllowed(bool allowed) noexcept override { cellularAllowed = allowed; }
  bool cellularAllowed = true;
};

class RemoteWebClient::Request final : public WebRequest {
 public:
  Request(NetworkAnswers& answers, std::shared_ptr<Session> session, WebQuestion question)
      : answers_(answers), session_(std::move(session)), question_(std::move(question)) {}

  void setCallbackQueue(std::shared_ptr<WorkQueue> queue) override { queue_ = std::move(queue); }
  void setCompletion(Completion completion) override {
    completion_ = std::make_shared<Completion>(std::move(completion));
  }
  void setTimeLimit(milliseconds limit) noexcept override {
    question_.timeLimit = std::max(limit, milliseconds(0));
  }
  void setLargestBody(std::uint64_t bytes) noexcept override {
    question_.largestBody = std::min(bytes, kLargestWebBody);
  }

  void send(std::vector<std::byte>) override {
    if (queue_ == nullptr || completion_ == nullptr) return;
    question_.cellularAllowed = session_ == nullptr || session_->cellularAllowed;
    auto message = packLarge(static_cast<std::uint32_t>(NetworkMessage::ask), encode(question_));
    auto ticket = std::make_shared<Ticket>();
    ticket->largestBody = question_.largestBody;
    ticket->queue = std::exchange(queue_, nullptr);
    ticket->completion = std::exchange(completion_, nullptr);
    auto limit = longestOf(question_.largestBody);
    if (question_.timeLimit > milliseconds(0)) limit = std::min(limit, question_.timeLimit);
    token_ = answers_.ask(
        NetworkWork::web, std::move(message), limit + kAllowance,
        [ticket](NetworkAnswers::Ended ended, WorkerMessage* answer) { return ticket->end(ended, answer); });
  }

  void cancel() noexcept override { answers_.cancel(token_); }

 private:
  // What telling the outcome takes, made beforehand: it takes no memory then.
  struct Ticket {
    std::uint64_t largestBody = 0;
    std::shared_ptr<WorkQueue> queue;
    std::shared_ptr<Completion> completion;
    std::shared_ptr<WebResponse> response = std::make_shared<WebResponse>();

    bool end(NetworkAnswers::Ended ended, WorkerMessage* answer) noexcept {
      bool makesSense = true;
      response->errorKind = kindOf(ended);
      try {
        if (answer != nullptr) makesSense = takeAnswer(std::move(*answer), largestBody, *response);
        if (!makesSense) *response = {WebErrorKind::clientUnavailable, 0, {}, {}};
      } catch (const std::bad_alloc&) {
        *response = {WebErrorKind::outOfMemory, 0, {}, {}};
      }
      if (*completion == nullptr) return makesSense;
      try {
        queue->post([done = completion, told = response] { (*done)(told); });
      } catch (...) {
        // Its thread cannot be started, or memory is short; better told on the wrong queue than never.
        try {
          (*completion)(response);
        } catch (const std::bad_alloc&) {
          // Whoever is told copes with that, or has a time-out.
        }
      }
      return makesSense;
    }
  };

  NetworkAnswers& answers_;
  const std::shared_ptr<Session> session_;
  WebQuestion question_;
  std::shared_ptr<WorkQueue> queue_;
  std::shared_ptr<Completion> completion_;
  NetworkAnswers::Token token_;
};

std::shared_ptr<WebSession> RemoteWebClient::makeSession() { return std::make_shared<Session>(); }

std::shared_ptr<WebRequest> RemoteWebClient::makeRequest(WebRequestType type, const std::string& url,
                                                         const HeaderMap& headers,
                                                         std::shared_ptr<WebSession> session) {
  if (type != WebRequestType::get || url.size() > kLongestUrl || !isUsableUrl(url)) return nullptr;
  WebQuestion question;
  question.url = url;
  for (const auto& [name, value] : headers) {
    // Nobody should see a field of his break out of its line, in a message either.
    if (name.empty() || (name + value).find_first_of(std::string_view("\r\n\0", 3)) != std::string::npos)
      continue;
    question.headers.emplace(name, value);
  }
  return std::make_shared<Request>(answers_, std::static_pointer_cast<Session>(session), std::move(question));
}

}  // namespace brenvik

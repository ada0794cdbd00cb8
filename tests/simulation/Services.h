// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <functional>
#include <map>
#include <memory>
#include <new>
#include <optional>
#include <set>
#include <span>
#include <string>
#include <utility>
#include <vector>

#include "World.h"
#include "platform/gzip/Gunzip.h"
#include "platform/ipc/fakes/FakePorts.h"
#include "platform/labeler/SubscriptionLabeler.h"
#include "platform/net/EchoNetwork.h"
#include "platform/plist/PropertyList.h"
#include "platform/radio/RadioManager.h"
#include "platform/web/WebClient.h"

// The services of the machine that the fakes beside the platform's roles are too kind for: those that take
// time, and those that depend on the network.
namespace brenvik::simulation {

enum class Route { none, wifi, cellular };

// An answer of the update server, and how long it takes.
struct WebAnswer {
  WebErrorKind kind = WebErrorKind::none;
  int status = 200;
  bool isNothing = false;  // the client reports no response at all
  std::string body;
  std::optional<std::string> contentType;
  Time delay{0};
};

// The HTTP client. Answers come after their time; the route at the beginning and at the end counts.
class SimulatedWeb final : public WebClient {
 public:
  explicit SimulatedWeb(World& world) : world_(world) {}

  Route route = Route::wifi;
  std::function<WebAnswer(const std::string& url)> answer;
  // Told when the request is sent, and when the answer, as it is after the route was looked at, comes.
  std::function<void(const std::string& url)> onSend;
  std::function<void(const std::string& url, const WebAnswer& answer)> onAnswer;
  std::function<void(const std::string& text)> onBreach;
  int workersDied = 0;  // so far; a request under way has no answer then

  std::shared_ptr<WebSession> makeSession() override { return std::make_shared<Session>(); }
  std::shared_ptr<WebRequest> makeRequest(WebRequestType, const std::string& url, const HeaderMap&,
                                          std::shared_ptr<WebSession> session) override;

 private:
  struct Session final : WebSession {
    void setCellularAllowed(bool value) noexcept override { allowed = value; }
    bool allowed = true;
  };
  class Request;
  WebAnswer throughTheAir(const Session& session, WebAnswer sent) const;
  World& world_;
};

class SimulatedWeb::Request final : public WebRequest {
 public:
  Request(SimulatedWeb& web, std::string url, std::shared_ptr<Session> session)
      : web_(web), url_(std::move(url)), session_(std::move(session)) {}
  void setCallbackQueue(std::shared_ptr<WorkQueue> queue) override { queue_ = std::move(queue); }
  void setCompletion(Completion completion) override { completion_ = std::move(completion); }
  void setTimeLimit(std::chrono::milliseconds) noexcept override {}
  void setLargestBody(std::uint64_t) noexcept override {}
  void cancel() noexcept override {}
  // Gives the answer before it returns, because the caller will wait with its thread; others go on meanwhile.
  void send(std::vector<std::byte>) override {
    if (web_.world_.isKilled()) return completion_(nullptr);
    web_.onSend(url_);
    WebAnswer sent = web_.throughTheAir(*session_, web_.answer(url_));
    const int diedBefore = web_.workersDied;
    web_.world_.waitFor(sent.delay);
    sent = web_.throughTheAir(*session_, std::move(sent));
    if (web_.workersDied != diedBefore) {
      sent = WebAnswer();
      sent.kind = WebErrorKind::clientUnavailable;
      sent.status = 0;
    }
    if (web_.world_.isKilled()) return completion_(nullptr);
    web_.onAnswer(url_, sent);
    const auto isDone = std::make_shared<bool>(false);
    queue_->post([isDone, completion = completion_, response = responseOf(sent)] {
      completion(response);
      *isDone = true;
    });
    while (!*isDone && !web_.world_.isKilled()) web_.world_.waitFor(Time(0));
    if (!*isDone) completion_(nullptr);
  }

 private:
  static std::shared_ptr<WebResponse> responseOf(const WebAnswer& answer) {
    if (answer.isNothing) return nullptr;
    auto response = std::make_shared<WebResponse>();
    response->errorKind = answer.kind;
    response->statusCode = answer.status;
    if (answer.kind == WebErrorKind::none) {
      response->body.append(std::as_bytes(std::span(answer.body)));
      if (answer.contentType) response->headers["Content-Type"] = *answer.contentType;
    }
    return response;
  }
  SimulatedWeb& web_;
  const std::string url_;
  const std::shared_ptr<Session> session_;
  std::shared_ptr<WorkQueue> queue_;
  Completion completion_;
};

inline std::shared_ptr<WebRequest> SimulatedWeb::makeRequest(WebRequestType, const std::string& url,
                                                             const HeaderMap&,
                                                             std::shared_ptr<WebSession> session) {
  if (!url.starts_with("https://")) return nullptr;
  return std::make_shared<Request>(*this, url, std::static_pointer_cast<Session>(session));
}

inline WebAnswer SimulatedWeb::throughTheAir(const Session& session, WebAnswer sent) const {
  if (session.allowed) onBreach("a request that may use the cellular network");
  if (route == Route::wifi || sent.kind != WebErrorKind::none) return sent;
  sent.kind = route == Route::none ? WebErrorKind::cannotConnect : WebErrorKind::cellularNotAllowed;
  sent.status = 0;
  sent.isNothing = false;
  return sent;
}

// A gzip file is "gz:" and its content here; "gz!" is one that is damaged in the middle. At "gz?" the worker
// dies in the middle of it, at "gz." when it has written everything.
class SimulatedGunzip final : public Gunzip {
 public:
  GunzipOutcome gunzipInto(const GunzipInput& input, int file, std::uint64_t room,
                           std::uint64_t) noexcept override {
    const std::string_view bytes(reinterpret_cast<const char*>(input.bytes.data()), input.bytes.size());
    if (bytes.empty()) return {GunzipResult::truncated, 0, 0};
    const bool isWhole = bytes.starts_with("gz:") || bytes.starts_with("gz.");
    const std::string_view content = bytes.substr(std::min<std::size_t>(3, bytes.size()));
    if (content.size() > room) return {GunzipResult::whole, content.size(), 0};
    const std::string_view written = isWhole ? content : content.substr(0, content.size() / 2);
    if (::write(file, written.data(), written.size()) != static_cast<ssize_t>(written.size())) {
      return {GunzipResult::refused, 0, errno};
    }
    if (bytes.starts_with("gz?") || bytes.starts_with("gz.")) return {GunzipResult::unavailable, 0, 0};
    return {isWhole ? GunzipResult::whole : GunzipResult::damaged, written.size(), 0};
  }
};

// Echoes: answered at once, after a while, or never.
class SimulatedEcho final : public EchoNetwork {
 public:
  explicit SimulatedEcho(World& world) : world_(world) {}

  enum class Far { answers, isSilent, isUnreachable };
  Far far = Far::answers;
  bool hasCellular = true;
  std::function<void(unsigned interface, std::span<const std::byte> message)> onSend;
  // Asked at each step of a probe: whether the worker dies at it.
  std::function<bool()> dies;
  int workersDied = 0;  // so far; the sockets that were open then are of no use any more
  int openSockets = 0;

  std::optional<in_addr> addressOfHost(const char*) override { return std::nullopt; }
  std::optional<int> protocolByName(const char*) override { return dies() ? std::nullopt : std::optional(1); }
  std::unique_ptr<EchoSocket> openEchoSocket(int, std::uint16_t) override {
    return dies() ? nullptr : std::make_unique<Socket>(*this);
  }
  unsigned indexOfInterface(const char* name) override {
    return !dies() && hasCellular && std::strcmp(name, "pdp_ip0") == 0 ? 7 : 0;
  }
  int timeOfDay(timeval* now) noexcept override {
    const auto time = std::chrono::duration_cast<std::chrono::microseconds>(world_.now()).count();
    now->tv_sec = static_cast<time_t>(time / 1'000'000);
    now->tv_usec = static_cast<suseconds_t>(time % 1'000'000);
    return 0;
  }
  std::chrono::microseconds steadyTime() noexcept override {
    return std::chrono::duration_cast<std::chrono::microseconds>(world_.now());
  }

 private:
  class Socket final : public EchoSocket {
   public:
    explicit Socket(SimulatedEcho& echo) : echo_(echo) { ++echo_.openSockets; }
    Socket(const Socket&) = delete;
    Socket& operator=(const Socket&) = delete;
    ~Socket() override { --echo_.openSockets; }
    void setReceiveBufferSize(int) override {}
    void bindToInterface(unsigned index) override { interface_ = index; }
    int setReceiveTimeOut(std::chrono::microseconds timeOut) override {
      timeOut_ = timeOut;
      return isDead() ? EPIPE : 0;
    }
    EchoTransfer sendTo(in_addr, std::span<const std::byte> message) override {
      if (isDead()) return {-1, EPIPE};
      if (echo_.onSend) echo_.onSend(interface_, message);
      if (echo_.far == Far::isUnreachable) return {-1, ENETUNREACH};
      sent_.assign(message.begin(), message.end());
      return {static_cast<std::ptrdiff_t>(message.size()), 0};
    }
    EchoTransfer receive(std::span<std::byte> buffer) override {
      if (echo_.world_.isKilled()) return {-1, EIO};
      if (isDead()) return {-1, EPIPE};
      if (echo_.far != Far::answers || sent_.size() > buffer.size()) {
        echo_.world_.waitFor(timeOut_);
        return {-1, echo_.workersDied != diedBefore_ ? EPIPE : EAGAIN};
      }
      std::copy(sent_.begin(), sent_.end(), buffer.begin());
      buffer[0] = std::byte{0};  // the reply to an echo request
      return {static_cast<std::ptrdiff_t>(sent_.size()), 0};
    }
    bool deliversIpHeader() const noexcept override { return false; }

   private:
    bool isDead() { return echo_.dies() || echo_.workersDied != diedBefore_; }
    SimulatedEcho& echo_;
    const int diedBefore_ = echo_.workersDied;
    unsigned interface_ = 0;
    std::chrono::microseconds timeOut_{0};
    std::vector<std::byte> sent_;
  };
  World& world_;
};

// The radio manager's switch.
class SimulatedRadio final : public RadioManager {
 public:
  void setLogToFile(bool enable) noexcept override { isOn = enable; }
  std::optional<bool> isOn;
};

// A labeler without languages: a label is its own text.
class SimulatedLabeler final : public SubscriptionLabeler {
 public:
  PropertyList localizedBadgeLabels(const PropertyList& labels, const PropertyList&) override {
    return textsOf(labels);
  }
  PropertyList localizedLabels(const PropertyList& labels, const PropertyList&) override {
    return textsOf(labels);
  }

 private:
  static PropertyList textsOf(const PropertyList& labels) {
    std::vector<PropertyList> texts;
    for (std::size_t i = 0; i < labels.size(); ++i) {
      if (labels.at(i).asString().has_value()) texts.push_back(labels.at(i));
    }
    return PropertyList::array(std::move(texts));
  }
};

// Sources of the machine's ports. A port that has died is told of from the main loop, whenever it is watched.
class SimulatedPortSources final : public PortSources {
 public:
  SimulatedPortSources(World& world, FakePortSpace& ports) : world_(world), ports_(ports) {}
  bool refuses = false;  // the machine is out of descriptors

  std::shared_ptr<RoutineSource> makeRoutineSource(PortName port, const RoutineTable& table,
                                                   WantTrailer trailer) noexcept override try {
    if (refuses || !ports_.receiveRights.contains(port)) return nullptr;
    auto source = std::make_shared<FakeRoutineSource>(port, table, trailer);
    routines_[port] = source;
    return source;
  } catch (const std::bad_alloc&) {
    return nullptr;
  }
  std::shared_ptr<DeathWatch> makeDeathWatch(PortName port, RunLoop&) noexcept override try {
    if (refuses || !ports_.sendRights.contains(port)) return nullptr;
    auto watch = std::make_shared<FakeDeathWatch>(port);
    watches_[port] = watch;
    if (dead_.contains(port)) {
      tell(watch);
      watch->died = true;
    }
    return watch;
  } catch (const std::bad_alloc&) {
    return nullptr;
  }

  // The source that serves the port now, or null.
  std::shared_ptr<FakeRoutineSource> sourceOf(PortName port) const {
    const auto found = routines_.find(port);
    const auto source = found != routines_.end() ? found->second.lock() : nullptr;
    return source != nullptr && source->added && source->valid ? source : nullptr;
  }
  bool isWatched(PortName port) const {
    const auto found = watches_.find(port);
    return found != watches_.end() && !found->second.expired();
  }
  void portDies(PortName port) {
    dead_.insert(port);
    if (const auto watch = watches_[port].lock()) tell(watch);
  }
  std::size_t livingSources() const {
    std::size_t count = 0;
    for (const auto& [port, each] : routines_) count += each.expired() ? 0U : 1U;
    for (const auto& [port, each] : watches_) count += each.expired() ? 0U : 1U;
    return count;
  }

 private:
  void tell(const std::weak_ptr<FakeDeathWatch>& weak) {
    world_.postToLoop([weak] {
      if (const auto watch = weak.lock()) watch->tellDeath();
    });
  }
  World& world_;
  FakePortSpace& ports_;
  std::map<PortName, std::weak_ptr<FakeRoutineSource>> routines_;
  std::map<PortName, std::weak_ptr<FakeDeathWatch>> watches_;
  std::set<PortName> dead_;
};

}  // namespace brenvik::simulation

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/web/linux/LoadedWebModule.h"

#include <dlfcn.h>
#include <limits.h>
#include <unistd.h>

#include <array>
#include <cstring>
#include <mutex>
#include <utility>

#include "platform/log/Log.h"
#include "platform/web/linux/WebModule.h"

namespace brenvik {
namespace {

// Stands for a session when there is no client to make one.
class NoSession final : public WebSession {
 public:
  void setCellularAllowed(bool) noexcept override {}
};

// A request that can only fail.
class NoRequest final : public WebRequest {
 public:
  explicit NoRequest(WebErrorKind kind) : kind_(kind) {}
  void setCallbackQueue(std::shared_ptr<WorkQueue> queue) override { queue_ = std::move(queue); }
  void setCompletion(Completion completion) override { completion_ = std::move(completion); }
  void setTimeLimit(std::chrono::milliseconds) noexcept override {}
  void setLargestBody(std::uint64_t) noexcept override {}
  void send(std::vector<std::byte>) override {
    const auto queue = std::exchange(queue_, nullptr);
    if (queue == nullptr || !completion_) return;
    auto response = std::make_shared<WebResponse>();
    response->errorKind = kind_;
    queue->post([done = std::move(completion_), response] { done(response); });
  }

 private:
  const WebErrorKind kind_;
  std::shared_ptr<WorkQueue> queue_;
  Completion completion_;
};

}  // namespace

std::vector<std::string> webModulePlaces() {
  std::vector<std::string> places;
  std::array<char, PATH_MAX> program{};
  const auto size = ::readlink("/proc/self/exe", program.data(), program.size() - 1);
  if (size > 0) {
    const std::string path(program.data(), static_cast<std::size_t>(size));
    places.push_back(path.substr(0, path.rfind('/') + 1) + kWebModuleFile);
  }
  places.push_back(std::string(BRENVIK_MODULE_DIRECTORY "/") + kWebModuleFile);
  return places;
}

// The module itself: not looked for before it is needed, never unloaded (its libraries may have threads of
// their own). One that cannot be had is looked for again the next time, as only descriptors or memory may
// have been missing; the reason is told once.
class LoadedWebModule::Module {
 public:
  Module(WorkQueues& queues, std::vector<std::string> places) : queues_(queues), places_(std::move(places)) {}

  // Null when there is none, and after shutDown().
  std::shared_ptr<WebClient> client() {
    const std::lock_guard lock(mutex_);
    load();
    return client_;
  }
  std::shared_ptr<Gunzip> gunzip() {
    const std::lock_guard lock(mutex_);
    load();
    return gunzip_;
  }
  WebErrorKind whyNone() {
    const std::lock_guard lock(mutex_);
    return closed_ ? WebErrorKind::cancelled : WebErrorKind::clientUnavailable;
  }
  void shutDown() noexcept {
    std::shared_ptr<WebClient> client;
    {
      const std::lock_guard lock(mutex_);
      closed_ = true;
      client = std::move(client_);
    }
  }

 private:
  void load() {
    if (closed_ || client_ != nullptr) return;
    if (places_.empty()) places_ = webModulePlaces();
    std::string reason;
    for (const std::string& place : places_) {
      // Everything bound now: a symbol that is missing shows here and not in the middle of a transfer.
      void* const handle = ::dlopen(place.c_str(), RTLD_NOW | RTLD_LOCAL);
      void* const symbol = handle != nullptr ? ::dlsym(handle, kWebModuleSymbol) : nullptr;
      if (symbol == nullptr) {
        const char* const told = ::dlerror();
        // The first place's file that is there but does not load says more than the last place's absence.
        if (place == places_.front() || ::access(place.c_str(), F_OK) == 0)
          reason = told != nullptr ? told : place;
        continue;
      }
      const WebModuleFunctions* const functions = reinterpret_cast<WebModuleEntry>(symbol)();
      if (std::strcmp(functions->version, BRENVIK_VERSION) != 0) {
        reason = place + ": of version " + functions->version;
        continue;
      }
      std::shared_ptr<WebClient> client = functions->makeWebClient(queues_);
      std::shared_ptr<Gunzip> gunzip = functions->makeGunzip();
      if (client != nullptr && gunzip != nullptr) {
        client_ = std::move(client);
        gunzip_ = std::move(gunzip);
        return;
      }
      reason = place + ": it does not start";
    }
    if (reason == told_) return;
    told_ = std::move(reason);
    logUnified(LogLevel::error, "Cannot load the HTTP client: %s", told_.c_str());
  }

  WorkQueues& queues_;
  std::mutex mutex_;  // guards everything below
  std::vector<std::string> places_;
  std::string told_;  // why there is none
  bool closed_ = false;
  std::shared_ptr<WebClient> client_;
  std::shared_ptr<Gunzip> gunzip_;
};

class LoadedWebModule::LazyWebClient final : public WebClient {
 public:
  explicit LazyWebClient(Module& module) : module_(module) {}
  std::shared_ptr<WebSession> makeSession() override {
    const auto client = module_.client();
    return client != nullptr ? client->makeSession() : std::make_shared<NoSession>();
  }
  std::shared_ptr<WebRequest> makeRequest(WebRequestType type, const std::string& url,
                                          const HeaderMap& headers,
                                          std::shared_ptr<WebSession> session) override {
    const auto client = module_.client();
    if (client == nullptr || dynamic_cast<NoSession*>(session.get()) != nullptr) {
      return std::make_shared<NoRequest>(module_.whyNone());
    }
    return client->makeRequest(type, url, headers, std::move(session));
  }

 private:
  Module& module_;
};

class LoadedWebModule::LazyGunzip final : public Gunzip {
 public:
  explicit LazyGunzip(Module& module) : module_(module) {}
  GunzipOutcome gunzipInto(const GunzipInput& input, int file, std::uint64_t room,
                           std::uint64_t largestOutput) noexcept override {
    std::shared_ptr<Gunzip> gunzip;
    try {
      gunzip = module_.gunzip();
    } catch (...) {  // out of memory
    }
    return gunzip != nullptr ? gunzip->gunzipInto(input, file, room, largestOutput) : GunzipOutcome();
  }

 private:
  Module& module_;
};

LoadedWebModule::LoadedWebModule(WorkQueues& queues, std::vector<std::string> places)
    : module_(std::make_unique<Module>(queues, std::move(places))),
      webClient_(std::make_unique<LazyWebClient>(*module_)),
      gunzip_(std::make_unique<LazyGunzip>(*module_)) {}

LoadedWebModule::~LoadedWebModule() { shutDown(); }

WebClient& LoadedWebModule::webClient() noexcept { return *webClient_; }

Gunzip& LoadedWebModule::gunzip() noexcept { return *gunzip_; }

void LoadedWebModule::shutDown() noexcept { module_->shutDown(); }

}  // namespace brenvik

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <memory>
#include <string>
#include <vector>

#include "platform/gzip/Gunzip.h"
#include "platform/runloop/WorkQueue.h"
#include "platform/web/WebClient.h"

namespace brenvik {

// The places where the module may lie, best first: beside the running program, then where it is installed.
std::vector<std::string> webModulePlaces();

// The HTTP client and gunzip, from a module (dlopen(3)) that is loaded when one of them is first used: its
// libraries would be most of what an idle process has in memory, and of what it takes to start. When it
// cannot be loaded, the reason is logged once, requests complete as clientUnavailable and gunzip is
// unavailable; the next use tries again.
class LoadedWebModule {
 public:
  // The queues outlive it. Without places it looks in webModulePlaces().
  explicit LoadedWebModule(WorkQueues& queues, std::vector<std::string> places = {});
  LoadedWebModule(const LoadedWebModule&) = delete;
  LoadedWebModule& operator=(const LoadedWebModule&) = delete;
  // As shutDown(). Whoever holds a session or a request lets go of it first.
  ~LoadedWebModule();

  // Both live as long as this object. Any thread.
  WebClient& webClient() noexcept;
  Gunzip& gunzip() noexcept;

  // Completes what is under way, and from now on every request, as cancelled. Not on a queue that a
  // completion was asked for on.
  void shutDown() noexcept;

 private:
  class Module;
  class LazyWebClient;
  class LazyGunzip;
  const std::unique_ptr<Module> module_;
  const std::unique_ptr<LazyWebClient> webClient_;
  const std::unique_ptr<LazyGunzip> gunzip_;
};

}  // namespace brenvik

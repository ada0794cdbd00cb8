// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "helper/core/EntryPoint.h"

#include <memory>
#include <new>
#include <utility>

#include "platform/log/Log.h"

namespace brenvik {

int runHelper(BasebandLibrary& baseband, const ServerPlatform& platform, const RoutineTable& requests,
              const std::function<void()>& endWork, const std::function<void(ServerContext&)>& beginWork) {
  std::shared_ptr<HostedBasebandServer> hosted;
  if (baseband.canHost()) {
    hosted = baseband.create(nullptr);
    if (hosted != nullptr) hosted->start();
  }

  int status = 1;
  auto server = CreateServer(platform, kServiceName, requests);
  if (server != nullptr && hosted != nullptr) {
    try {
      SetIdleCheck(server.get(), [hosted] { return hosted->isBusy(); });
    } catch (const std::bad_alloc&) {
      // Without the check a busy hosted server would be ended; not serving at all says what is wrong.
      DestroyServer(std::move(server));
    }
  }
  if (server != nullptr) {
    if (beginWork) beginWork(*server);
    RunServer(*server);
    endWork();
    DestroyServer(std::move(server));
    status = 0;
  }

  if (hosted != nullptr) hosted->stop();
  if (status != 0) logUnified(LogLevel::error, "unable to startup BrenvikMobileHelper server");
  return status;
}

int runReportingFailure(const std::function<int()>& work) noexcept {
  try {
    return work();
  } catch (...) {
    logUnified(LogLevel::error, "unable to startup BrenvikMobileHelper server");
    return 1;
  }
}

}  // namespace brenvik

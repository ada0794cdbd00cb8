// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <functional>

#include "Helper/Shared/Server/HelperServerUtils.h"
#include "platform/baseband/HostedBasebandServer.h"

namespace brenvik {

// Runs the helper: hosts the baseband server if there is one, checks the service name in, serves until the
// idle rule ends it, and stops the hosted server. Returns the exit status: 0, or 1 if the service could not
// be set up (which is logged). Main thread.
//
// `beginWork`, which may be empty, runs with the server before it serves. `endWork` runs after serving, while
// the server still exists: it ends the work of other threads, which give their busy tokens back to the
// server.
int runHelper(BasebandLibrary& baseband, const ServerPlatform& platform, const RoutineTable& requests,
              const std::function<void()>& endWork,
              const std::function<void(ServerContext&)>& beginWork = {});

// Runs `work` and returns its exit status. If `work` throws, the exception is logged as a failure to start,
// and the status is 1. The log sink must outlive this call.
int runReportingFailure(const std::function<int()>& work) noexcept;

}  // namespace brenvik

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <functional>

#include "Helper/Shared/Server/HelperServerUtils.h"
#include "platform/baseband/HostedBasebandServer.h"

namespace brenvik {

// The life of the process from the first service to the exit status: hosts the baseband server where there is
// one, checks the service name in, serves until the idle rule ends it, and stops the hosted server. 0, or 1
// when the service could not be set up (which is logged). Main thread.
//
// `endWork` runs when serving is over and the server still stands: it ends the work of other threads, which
// gives its busy tokens back to that server. `beginWork`, where there is one, runs with the server before it
// serves.
int runHelper(BasebandLibrary& baseband, const ServerPlatform& platform, const RoutineTable& requests,
              const std::function<void()>& endWork,
              const std::function<void(ServerContext&)>& beginWork = {});

// Runs the process's work and returns its exit status; an exception that comes out of it is logged as the
// failure to start that it is, and becomes 1. The log sink must outlive this call.
int runReportingFailure(const std::function<int()>& work) noexcept;

}  // namespace brenvik

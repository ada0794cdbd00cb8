// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <memory>

namespace brenvik {

// Where a hosted baseband server would log; the helper always passes none.
class BasebandLogServer;

// The baseband helper library's own request server, hosted in this process. Main thread only.
class HostedBasebandServer {
 public:
  virtual ~HostedBasebandServer() = default;
  virtual void start() = 0;
  virtual bool isBusy() = 0;
  virtual void stop() = 0;
};

// The baseband helper library, where the system has one.
class BasebandLibrary {
 public:
  virtual ~BasebandLibrary() = default;
  // False, too, when the library or its function is absent.
  virtual bool canHost() = 0;
  virtual std::shared_ptr<HostedBasebandServer> create(std::shared_ptr<BasebandLogServer> logServer) = 0;
};

}  // namespace brenvik

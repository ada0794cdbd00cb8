// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <memory>

namespace brenvik {

// Where a hosted baseband server would log; the helper always passes none.
class BasebandLogServer;

// The baseband helper library's own request server, hosted in this process. Main thread only; no call may
// block, since every client's request waits on that thread. Nothing is thrown. A call cannot report a
// failure: what goes wrong in the library is the library's own affair.
//
// Order of calls: start(), then isBusy() any number of times, then stop(), each of the other two once. A
// server that was started is stopped before the last reference to it goes; that frees it.
class HostedBasebandServer {
 public:
  virtual ~HostedBasebandServer() = default;
  // Begins to serve.
  virtual void start() = 0;
  // True as long as the server has work, which keeps the process alive. Asked every ten seconds while the
  // helper has neither a client nor a busy token.
  virtual bool isBusy() = 0;
  // Ends the serving, threads of the library's own included, before it returns.
  virtual void stop() = 0;
};

// The baseband helper library, where the system has one. Main thread only. Nothing is thrown.
class BasebandLibrary {
 public:
  virtual ~BasebandLibrary() = default;
  // True when the system has a baseband whose server should be hosted; false when it has none, and when the
  // library or one of its functions is absent or cannot be loaded. The first call loads the library.
  virtual bool canHost() = 0;
  // A new server, not started. Null when the library makes none or memory does not suffice. To be called
  // only after canHost() was true. The server keeps a reference to the log server, which may be null.
  virtual std::shared_ptr<HostedBasebandServer> create(std::shared_ptr<BasebandLogServer> logServer) = 0;
};

}  // namespace brenvik

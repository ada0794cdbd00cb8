// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <memory>

namespace brenvik {

// Receives the log of a hosted baseband server. The helper never passes one.
class BasebandLogServer;

// The baseband helper library's own request server, hosted in this process. Main thread only; no call may
// block, because that thread serves every client. Nothing is thrown, and no call reports a failure: the
// library handles its own.
//
// Order of calls: start() once, then isBusy() any number of times, then stop() once. A server that was
// started must be stopped before the last reference to it is dropped, which frees it.
class HostedBasebandServer {
 public:
  virtual ~HostedBasebandServer() = default;
  // Begins to serve.
  virtual void start() = 0;
  // True as long as the server has work, which keeps the process alive. The helper asks every ten seconds
  // while it has neither a client nor a busy token.
  virtual bool isBusy() = 0;
  // Stops serving. The library's own threads have ended when it returns.
  virtual void stop() = 0;
};

// The baseband helper library, which a system may lack. Main thread only. Nothing is thrown.
class BasebandLibrary {
 public:
  virtual ~BasebandLibrary() = default;
  // True if the system has a baseband whose server should be hosted; false if it has none, or if the library
  // or one of its functions is absent or cannot be loaded. The first call loads the library.
  virtual bool canHost() = 0;
  // Makes a server, which is not started yet. Returns null if the library makes none or memory runs out. Call
  // it only after canHost() returned true. The server keeps a reference to the log server, which may be null.
  virtual std::shared_ptr<HostedBasebandServer> create(std::shared_ptr<BasebandLogServer> logServer) = 0;
};

}  // namespace brenvik

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <functional>
#include <string>

#include "platform/baseband/HostedBasebandServer.h"

namespace brenvik {

// A baseband library that does what the test says and records every call, in order. Main thread only; it must
// outlive the servers it made.
class FakeBasebandLibrary final : public BasebandLibrary {
 public:
  bool canHost() override {
    record += "canHost ";
    return hosts;
  }
  std::shared_ptr<HostedBasebandServer> create(std::shared_ptr<BasebandLogServer> logServer) override {
    record += logServer == nullptr ? "create " : "createWithLogServer ";
    if (!makesServer) return nullptr;
    return std::make_shared<Server>(*this);
  }

  bool hosts = true;
  bool makesServer = true;
  bool busy = false;
  int busyQuestions = 0;
  std::function<void()> whenStarted;
  std::function<void()> whenStopped;
  std::string record;  // words, each followed by a blank

 private:
  class Server final : public HostedBasebandServer {
   public:
    explicit Server(FakeBasebandLibrary& library) : library_(library) {}
    Server(const Server&) = delete;
    Server& operator=(const Server&) = delete;
    ~Server() override { library_.record += "release "; }
    void start() override {
      library_.record += "start ";
      if (library_.whenStarted) library_.whenStarted();
    }
    bool isBusy() override {
      ++library_.busyQuestions;
      return library_.busy;
    }
    void stop() override {
      library_.record += "stop ";
      if (library_.whenStopped) library_.whenStopped();
    }

   private:
    FakeBasebandLibrary& library_;
  };
};

}  // namespace brenvik

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <string>

#include "platform/baseband/HostedBasebandServer.h"

namespace brenvik {

// The baseband helper library, whose functions BasebandAbi.h declares. The first canHost() loads it with
// dlopen(3). Main thread only.
class LoadedBasebandLibrary final : public BasebandLibrary {
 public:
  // Uses the library named at build time (BRENVIK_BASEBAND_LIBRARY).
  LoadedBasebandLibrary();
  // `name` as dlopen takes it: a file name to search for, or a path.
  explicit LoadedBasebandLibrary(std::string name);

  bool canHost() noexcept override;
  // Returns null if the library is absent, makes no server, or memory runs out. The caller must stop a server
  // that it started; the last reference frees the server without stopping it.
  std::shared_ptr<HostedBasebandServer> create(
      std::shared_ptr<BasebandLogServer> logServer) noexcept override;

 private:
  bool load() noexcept;

  const std::string name_;
  bool tried_ = false;
  struct Functions {
    int (*canHost)();
    void* (*create)(void*);
    void (*start)(void*);
    int (*isBusy)(void*);
    void (*stop)(void*);
    void (*release)(void*);
  };
  Functions functions_{};
  bool loaded_ = false;

  class Server;
};

}  // namespace brenvik

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <string>

#include "platform/baseband/HostedBasebandServer.h"

namespace brenvik {

// The baseband helper library, loaded with dlopen(3) when canHost() first asks for it, never before; its
// functions are those of BasebandAbi.h. Main thread only.
class LoadedBasebandLibrary final : public BasebandLibrary {
 public:
  // The library named at build time (BRENVIK_BASEBAND_LIBRARY).
  LoadedBasebandLibrary();
  // `name` as dlopen takes it: a file name to search for, or a path.
  explicit LoadedBasebandLibrary(std::string name);

  bool canHost() noexcept override;
  // Empty when the library is absent, gave no server, or memory ran out. The server stops nothing by itself:
  // the caller stops what it started, and the last reference then frees the server.
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

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <array>
#include <atomic>
#include <chrono>
#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <mutex>

#include "Helper/Shared/Server/BusyTokens.h"
#include "Helper/Shared/Server/PortServerRegistry.h"
#include "interface/Messages.h"
#include "platform/base/Clock.h"
#include "platform/ipc/AuditToken.h"
#include "platform/ipc/Ports.h"
#include "platform/log/LogContext.h"
#include "platform/runloop/RunLoop.h"

// The server frame: the per-process server object, its creation and teardown, running and stopping, the busy
// tokens and the idle rule, and check-in with the per-client ports.
//
// Everything runs on the main thread unless it says otherwise. Lock order: the server's lock, then the
// registry's.
namespace brenvik {

inline constexpr const char kAllowEntitlement[] = "com.norvale.Teravox.BrenvikHelper.allow";

// What a server needs of the platform; all of it outlives the server.
struct ServerPlatform {
  PortSpace& ports;
  Bootstrap& bootstrap;
  PortSources& sources;
  RunLoop& loop;
  // Whether the caller holds a boolean entitlement.
  std::function<bool(const char* entitlement, const AuditToken& caller)> hasEntitlement;
  PortServerRegistry& registry = PortServerRegistry::shared();
  // How long the process waits before it leaves for being idle, and between the times it then asks.
  std::chrono::nanoseconds idlePeriod = std::chrono::seconds(10);
  // Who an admitted caller is, for the fields of the lines that its requests cause; null when not known.
  std::function<std::shared_ptr<const LogCaller>(const AuditToken& caller)> describeCaller = {};
  // Called after a client has come or gone and a busy token was taken or given back, on the thread that did
  // it and with no lock held.
  std::function<void()> onChange = {};
  // The clock of the idle period, for whoever asks how long is left of it.
  std::function<std::chrono::nanoseconds()> now = timeSinceBoot;
};

class ServerContext;

// Checks the service name in and serves the check-in routine on its port; clients will be served
// `clientSubsystem`, which outlives the server. Null when the service could not be set up (an error is
// logged, unless memory ran out at once). The caller destroys the server with DestroyServer.
ServerContext* CreateServer(const ServerPlatform& platform, const char* serviceName,
                            const RoutineTable& clientSubsystem);

// Asked at each tick of the idle timer whether the process must stay alive. Replaces the previous check; does
// nothing when either argument is absent.
void SetIdleCheck(ServerContext* server, std::function<bool()> idleCheck);

// Serves until StopServer; returns the last result of the run loop, 0 when it was stopped already.
std::int32_t RunServer(ServerContext& server);

// Ends RunServer, for good. Any thread. Always 0.
std::int32_t StopServer(ServerContext& server);

// Tears down every client and gives the service port back.
void DestroyServer(ServerContext* server);

// The server that owns a port; null when none does. Any thread.
ServerContext* LookupServer(PortServerRegistry& registry, PortName port) noexcept;

// Admits the caller when it holds the entitlement: makes it a receive port of its own that serves the client
// subsystem until `callerPort` dies. Results: kern::success and *clientPort; kern::invalidSecurity, and
// nothing is changed; the code of the failed port call; kern::failure when a source could not be made or the
// caller's port was dead already. *clientPort is 0 unless a port was made.
KernelReturn BVMobileHelperCheckIn(PortServerRegistry& registry, const ServerPlatform& platform,
                                   PortName servicePort, PortName callerPort, PortName* clientPort,
                                   const AuditToken& caller);

// Runs when a client's port has died: tears the client down and, when it was the last and nothing is busy,
// starts the idle countdown.
void OnClientPortDied(DeathWatch& deathWatch, ServerContext* context, PortServerRegistry& registry);

// One per process. Its members are this folder's business; others use the functions above.
class ServerContext {
 public:
  ServerContext(const ServerPlatform& serverPlatform, const RoutineTable& subsystem)
      : platform(serverPlatform), clientSubsystem(subsystem) {}

  const ServerPlatform platform;
  PortName servicePort = kNullPort;
  std::unique_ptr<RoutineTable> checkInSubsystem;
  std::shared_ptr<RoutineSource> serviceSource;
  RunLoop* runLoop = nullptr;  // recorded by RunServer
  const RoutineTable& clientSubsystem;
  std::function<bool()> idleCheck;

  struct Client {
    std::shared_ptr<DeathWatch> deathWatch;
    PortName receivePort;
  };

  mutable std::mutex lock;  // guards everything below
  std::unique_ptr<LoopSource> idleTimer;
  std::map<DeathWatch*, Client> clientWatches;
  std::map<PortName, std::shared_ptr<RoutineSource>> clientSources;
  std::uint32_t busyMask = 0;
  std::array<const char*, 32> busyReasons{};  // of the bits that are set
  std::chrono::nanoseconds idleSince{0};      // when the idle timer was armed
  bool isKeptByIdleCheck = false;             // its last answer

  std::atomic<bool> stopFlag{false};  // looked at after each request, so that a lock would be felt
};

}  // namespace brenvik

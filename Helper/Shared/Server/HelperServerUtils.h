// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <array>
#include <atomic>
#include <chrono>
#include <cstddef>
#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <mutex>

#include "Helper/Shared/Server/BusyTokens.h"
#include "Helper/Shared/Server/PortServerRegistry.h"
#include "Helper/Shared/Server/ServerFacts.h"
#include "interface/Messages.h"
#include "platform/base/Clock.h"
#include "platform/ipc/AuditToken.h"
#include "platform/ipc/Ports.h"
#include "platform/ipc/Rights.h"
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
  // Called after a client has come or gone and after a busy token was taken or given back, on the thread that
  // did it and with no lock held.
  std::function<void()> onChange = {};
  // The clock of the idle period, for whoever asks how much of it is left.
  std::function<std::chrono::nanoseconds()> now = timeSinceBoot;
};

// The server; one per process. Destroying it tears down every client and gives the service port back.
class ServerContext {
 public:
  // See CreateServer.
  static std::unique_ptr<ServerContext> make(const ServerPlatform& platform, const char* serviceName,
                                             const RoutineTable& clientSubsystem);
  ~ServerContext();
  ServerContext(const ServerContext&) = delete;
  ServerContext& operator=(const ServerContext&) = delete;

  PortName servicePort() const noexcept { return servicePort_.name(); }

  // See the functions of these names below.
  void setIdleCheck(std::function<bool()> idleCheck) { idleCheck_ = std::move(idleCheck); }
  std::int32_t run();
  void stop() noexcept;
  std::uint32_t acquireBusyToken(const char* reason);
  void releaseBusyToken(std::uint32_t token);
  void clientPortDied(DeathWatch& deathWatch);

  // Gives a caller that holds the entitlement a receive port of its own; see BVMobileHelperCheckIn.
  KernelReturn admit(PortName callerPort, PortName* clientPort, const AuditToken& caller);

  // What keeps the server at this moment. Any thread. Throws std::bad_alloc.
  ServerFacts facts() const;
  // One bit for each busy token that is held. Any thread.
  std::uint32_t busyMask() const noexcept;
  // Whether the idle countdown runs. Any thread.
  bool isCountingDown() const noexcept;
  // Whether it was asked to stop. Any thread.
  bool isStopped() const noexcept { return isStopped_; }

 private:
  class Client;
  // The lock of a server, held. A member that takes one needs it held.
  class Locked : public std::unique_lock<std::mutex> {
   public:
    explicit Locked(const ServerContext& server) : unique_lock(server.mutex_) {}
  };

  ServerContext(const ServerPlatform& platform, const RoutineTable& clientSubsystem);
  bool serve(const char* serviceName);
  void tellOfChange() const;
  void armIdleTimerIfIdle(Locked& lock);  // gives the lock up for a moment when the timer cannot be made
  void cancelIdleTimer(const Locked& lock) noexcept;
  void idleTimerTick();
  void TearDownClient(const Locked& lock, DeathWatch& deathWatch) noexcept;

  const ServerPlatform platform_;
  const RoutineTable& clientSubsystem_;
  ReceiveRight servicePort_;
  std::unique_ptr<RoutineTable> checkInSubsystem_;
  std::shared_ptr<RoutineSource> serviceSource_;
  RunLoop* runLoop_ = nullptr;  // recorded by run()
  std::function<bool()> idleCheck_;

  mutable std::mutex mutex_;  // guards everything below
  std::unique_ptr<LoopSource> idleTimer_;
  std::map<const DeathWatch*, std::unique_ptr<Client>> clients_;
  std::uint32_t busyMask_ = 0;
  std::array<const char*, 32> busyReasons_{};  // of the bits that are set
  std::chrono::nanoseconds nextIdleTick_{0};   // when the idle timer fires next
  bool isKeptByIdleCheck_ = false;             // the check's last answer

  std::atomic<bool> isStopped_{false};  // looked at after each request, where a lock would cost time
};

// Checks the service name in and serves the check-in routine on its port; clients will be served
// `clientSubsystem`, which outlives the server. Null when the service could not be set up (an error is
// logged, unless memory ran out at once).
std::unique_ptr<ServerContext> CreateServer(const ServerPlatform& platform, const char* serviceName,
                                            const RoutineTable& clientSubsystem);

// Asked at each tick of the idle timer whether the process must stay alive. Replaces the previous check; does
// nothing when either argument is absent.
void SetIdleCheck(ServerContext* server, std::function<bool()> idleCheck);

// Serves until StopServer; returns the last result of the run loop, 0 when it was stopped already.
std::int32_t RunServer(ServerContext& server);

// Ends RunServer, for good. Any thread. Always 0.
std::int32_t StopServer(ServerContext& server);

// Tears down every client and gives the service port back. Null: does nothing.
void DestroyServer(std::unique_ptr<ServerContext> server);

// The server that owns a port; null when none does. Any thread.
ServerContext* LookupServer(PortServerRegistry& registry, PortName port) noexcept;

// Admits the caller when it holds the entitlement: makes it a receive port of its own that serves the client
// subsystem until `callerPort` dies. Results: kern::success and *clientPort; kern::invalidSecurity, and
// nothing is changed; the code of the failed port call; kern::failure when no server owns the service port, a
// source could not be made, or the caller's port was dead already. *clientPort is 0 unless the result is
// kern::success. Only then does the server own the caller's right; else it stays with whoever calls this.
// Throws std::bad_alloc; then nothing is left of the check-in.
KernelReturn BVMobileHelperCheckIn(const ServerPlatform& platform, PortName servicePort, PortName callerPort,
                                   PortName* clientPort, const AuditToken& caller);

// Runs when a client's port has died: tears the client down and, when it was the last and nothing is busy,
// starts the idle countdown. Without a context the server is found by the watched port; when no server owns
// that either, the process ends on an assertion.
void OnClientPortDied(DeathWatch& deathWatch, ServerContext* context, PortServerRegistry& registry);

}  // namespace brenvik

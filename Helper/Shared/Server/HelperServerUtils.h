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

// A server's dependencies on the platform, which must outlive the server.
struct ServerPlatform {
  PortSpace& ports;
  Bootstrap& bootstrap;
  PortSources& sources;
  RunLoop& loop;
  // Whether the caller holds a boolean entitlement.
  std::function<bool(const char* entitlement, const AuditToken& caller)> hasEntitlement;
  PortServerRegistry& registry = PortServerRegistry::shared();
  // How long the process is idle before it exits, and the period of the idle check.
  std::chrono::nanoseconds idlePeriod = std::chrono::seconds(10);
  // Describes an admitted caller for the fields of the log lines that its requests cause; null if unknown.
  std::function<std::shared_ptr<const LogCaller>(const AuditToken& caller)> describeCaller = {};
  // Called after a client has checked in or gone and after a busy token was taken or given back, on that
  // thread and without a lock.
  std::function<void()> onChange = {};
  // The clock of the idle period, for reporting how much of it is left.
  std::function<std::chrono::nanoseconds()> now = timeSinceBoot;
  // Gives freed memory back to the system. Called a second after most of many clients have gone: between what
  // stays, the heap would otherwise keep what they used. Main thread, without a lock; must not throw.
  std::function<void()> releaseMemory = {};
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

  // The reasons why the server keeps running now. Any thread. Throws std::bad_alloc.
  ServerFacts facts() const;
  // One bit for each busy token that is held. Any thread.
  std::uint32_t busyMask() const noexcept;
  // Whether the idle countdown runs. Any thread.
  bool isCountingDown() const noexcept;
  // Whether stop() was called. Any thread.
  bool isStopped() const noexcept { return isStopped_; }

 private:
  class Client;
  // Proof that the server's lock is held, for members that need it.
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
  bool haveMostClientsGone(const Locked& lock) noexcept;
  void releaseMemorySoon() noexcept;
  void TearDownClient(const Locked& lock, DeathWatch& deathWatch) noexcept;

  const ServerPlatform platform_;
  const RoutineTable& clientSubsystem_;
  ReceiveRight servicePort_;
  std::unique_ptr<RoutineTable> checkInSubsystem_;
  std::shared_ptr<RoutineSource> serviceSource_;
  RunLoop* runLoop_ = nullptr;  // recorded by run()
  std::function<bool()> idleCheck_;
  std::unique_ptr<LoopSource> releaseTimer_;  // while memory is to be given back; main thread only

  mutable std::mutex mutex_;  // guards everything below
  std::unique_ptr<LoopSource> idleTimer_;
  std::map<const DeathWatch*, std::unique_ptr<Client>> clients_;
  std::size_t mostClients_ = 0;  // since memory was given back
  std::uint32_t busyMask_ = 0;
  std::array<const char*, 32> busyReasons_{};  // valid for the bits that are set
  std::chrono::nanoseconds nextIdleTick_{0};   // when the idle timer fires next
  bool isKeptByIdleCheck_ = false;             // the check's last answer

  std::atomic<bool> isStopped_{false};  // looked at after each request, where a lock would cost time
};

// Checks the service name in and serves the check-in routine on its port; clients will be served
// `clientSubsystem`, which outlives the server. Null when the service could not be set up (an error is
// logged, unless memory ran out at once).
std::unique_ptr<ServerContext> CreateServer(const ServerPlatform& platform, const char* serviceName,
                                            const RoutineTable& clientSubsystem);

// Sets the idle check, which is called at each tick of the idle timer and returns true if the process must
// stay alive. Replaces the previous check; does nothing if either argument is absent.
void SetIdleCheck(ServerContext* server, std::function<bool()> idleCheck);

// Serves until StopServer; returns the last result of the run loop, or 0 if it was already stopped.
std::int32_t RunServer(ServerContext& server);

// Ends RunServer, for good. Any thread. Always 0.
std::int32_t StopServer(ServerContext& server);

// Tears down every client and gives the service port back. Null: does nothing.
void DestroyServer(std::unique_ptr<ServerContext> server);

// Returns the server that owns a port, or null. Any thread.
ServerContext* LookupServer(PortServerRegistry& registry, PortName port) noexcept;

// If the caller holds the entitlement, makes it a receive port of its own that serves the client subsystem
// until `callerPort` dies. Returns kern::success and sets *clientPort; kern::invalidSecurity if it refuses,
// and changes nothing; the code of a failed port call; or kern::failure if no server owns the service port, a
// source could not be made, or the caller's port was already dead. *clientPort is 0 unless the result is
// kern::success. Only on success does the server own the caller's right; otherwise the caller of this
// function still owns it. Throws std::bad_alloc, and then nothing is left of the check-in.
KernelReturn BVMobileHelperCheckIn(const ServerPlatform& platform, PortName servicePort, PortName callerPort,
                                   PortName* clientPort, const AuditToken& caller);

// Runs when a client's port has died: tears the client down and, if it was the last and nothing is busy,
// starts the idle countdown. If `context` is null, it finds the server by the watched port; if no server owns
// that port, the process ends on an assertion.
void OnClientPortDied(DeathWatch& deathWatch, ServerContext* context, PortServerRegistry& registry);

}  // namespace brenvik

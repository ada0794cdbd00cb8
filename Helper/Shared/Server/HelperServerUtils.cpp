// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "Helper/Shared/Server/HelperServerUtils.h"

#include <bit>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <limits>
#include <new>
#include <utility>

#include "Helper/Shared/Server/CheckInTable.h"
#include "interface/Routines.h"
#include "platform/log/Log.h"

namespace brenvik {
namespace {

constexpr std::chrono::duration<double> kNoTimeOut{std::numeric_limits<double>::max()};

using Lock = std::unique_lock<std::mutex>;

void idleTimerTick(ServerContext& server) {
  {
    const Lock lock(server.lock);
    // Cancelled by another thread while this tick was on its way.
    if (server.idleTimer == nullptr) return;
  }
  if (!server.idleCheck || !server.idleCheck()) {
    StopServer(server);
    return;
  }
  const Lock lock(server.lock);
  server.isKeptByIdleCheck = true;
}

// No lock held.
void tellOfChange(const ServerContext& server) {
  if (server.platform.onChange) server.platform.onChange();
}

// Lock held; given up for a moment when the timer cannot be made.
void armIdleTimer(ServerContext& server, Lock& lock) {
  if (server.idleTimer != nullptr) return;
  server.idleSince = server.platform.now();
  server.isKeptByIdleCheck = false;
  RunLoop& loop = server.runLoop != nullptr ? *server.runLoop : server.platform.loop;
  const std::chrono::nanoseconds period = server.platform.idlePeriod;
  try {
    server.idleTimer = loop.addTimer(
        period, period, [&server] { idleTimerTick(server); }, [&server] { StopServer(server); });
  } catch (const std::bad_alloc&) {
    // No timer, as below.
  }
  if (server.idleTimer != nullptr) return;
  lock.unlock();
  StopServer(server);
  lock.lock();
}

// Lock held.
void cancelIdleTimer(ServerContext& server) {
  if (server.idleTimer == nullptr) return;
  server.idleTimer->invalidate();
  server.idleTimer.reset();
}

// Lock held.
void TearDownClient(ServerContext& server, const std::shared_ptr<DeathWatch>& deathWatch,
                    PortName clientPort) {
  const ServerPlatform& platform = server.platform;
  if (deathWatch != nullptr) {
    deathWatch->setInvalidationCallback({});
    const PortName watched = deathWatch->port();
    deathWatch->invalidate();
    platform.registry.remove(watched);
    (void)platform.ports.deallocateSendRight(watched);  // gone already when the check-in was refused late
  }
  server.clientWatches.erase(deathWatch.get());
  if (const auto source = server.clientSources.find(clientPort); source != server.clientSources.end()) {
    source->second->invalidate();
    server.clientSources.erase(source);
  }
  if (isUsablePort(clientPort)) {
    platform.registry.remove(clientPort);
    LogCallers::shared().remove(clientPort);
    (void)platform.ports.dropReceiveRight(clientPort);
    (void)platform.ports.deallocateSendRight(clientPort);
  }
}

[[noreturn]] void assertionFailed(const char* expression, const char* function, const char* source,
                                  int line) {
  logUnified(LogLevel::error, "Assertion failed: (%s), function %s, file %s, line %d.", expression, function,
             source, line);
  std::abort();
}

}  // namespace

ServerContext* CreateServer(const ServerPlatform& platform, const char* serviceName,
                            const RoutineTable& clientSubsystem) {
  ServerContext* server = nullptr;
  try {
    server = new ServerContext(platform, clientSubsystem);
  } catch (const std::bad_alloc&) {
    return nullptr;
  }

  PortName port = kNullPort;
  try {
    if (platform.bootstrap.checkIn(serviceName, &port) == kern::success) {
      server->servicePort = port;
      platform.registry.add(port, server);
      server->checkInSubsystem = makeCheckInTable(platform);
      server->serviceSource =
          platform.sources.makeRoutineSource(port, *server->checkInSubsystem, WantTrailer::yes);
      if (server->serviceSource != nullptr && server->serviceSource->addTo(platform.loop)) return server;
    }
  } catch (const std::bad_alloc&) {
    // Out of resources, as the line says.
  }
  // After a successful check-in DestroyServer drops the same right again, to no effect.
  if (isUsablePort(port)) (void)platform.ports.dropReceiveRight(port);
  logUnified(LogLevel::error, "unable to create server objects - out of resources");
  DestroyServer(server);
  return nullptr;
}

void SetIdleCheck(ServerContext* server, std::function<bool()> idleCheck) {
  if (server == nullptr || !idleCheck) return;
  server->idleCheck = std::move(idleCheck);
}

std::int32_t RunServer(ServerContext& server) {
  server.runLoop = &server.platform.loop;
  if (server.stopFlag) return 0;
  RunResult result{};
  do {
    result = server.runLoop->run(kNoTimeOut, ReturnAfterSource::yes);
  } while (!server.stopFlag);
  return static_cast<std::int32_t>(result);
}

std::int32_t StopServer(ServerContext& server) {
  server.stopFlag = true;
  if (server.runLoop != nullptr) server.runLoop->stop();
  return 0;
}

void DestroyServer(ServerContext* server) {
  if (server == nullptr) return;
  const ServerPlatform& platform = server->platform;
  server->idleCheck = nullptr;
  if (server->serviceSource != nullptr) {
    server->serviceSource->invalidate();
    server->serviceSource.reset();
  }
  if (isUsablePort(server->servicePort)) {
    platform.registry.remove(server->servicePort);
    (void)platform.ports.dropReceiveRight(server->servicePort);
  }
  {
    const Lock lock(server->lock);
    while (!server->clientWatches.empty()) {
      const ServerContext::Client client = server->clientWatches.begin()->second;
      TearDownClient(*server, client.deathWatch, client.receivePort);
    }
    server->clientSources.clear();
    cancelIdleTimer(*server);
  }
  delete server;
}

std::uint32_t AcquireBusyToken(ServerContext& server, const char* reason) {
  Lock lock(server.lock);
  // The run of set bits from bit 0 is what counts: a hole above a clear bit 0 is not looked for. With all 32
  // set the shift wraps, and bit 0 is given once more.
  const auto run = static_cast<unsigned>(std::countr_one(server.busyMask));
  const std::uint32_t token = std::uint32_t{1} << (run % 32U);
  server.busyMask |= token;
  server.busyReasons[run % 32U] = reason;
  cancelIdleTimer(server);
  lock.unlock();
  tellOfChange(server);
  return token;
}

std::uint32_t ReleaseBusyToken(ServerContext& server, std::uint32_t token) {
  if (!std::has_single_bit(token)) return 0;
  Lock lock(server.lock);
  server.busyMask &= ~token;
  if (server.busyMask == 0 && server.clientWatches.empty()) armIdleTimer(server, lock);
  lock.unlock();
  tellOfChange(server);
  return 1;
}

ServerContext* LookupServer(PortServerRegistry& registry, PortName port) noexcept {
  return registry.lookUp(port);
}

KernelReturn BVMobileHelperCheckIn(PortServerRegistry& registry, const ServerPlatform& platform,
                                   PortName servicePort, PortName callerPort, PortName* clientPort,
                                   const AuditToken& caller) {
  *clientPort = kNullPort;
  const LogScope scope(kCheckInRoutine.name, servicePort);
  if (!platform.hasEntitlement(kAllowEntitlement, caller)) return kern::invalidSecurity;
  ServerContext* const server = LookupServer(registry, servicePort);
  if (server == nullptr) return kern::failure;

  PortName port = kNullPort;
  KernelReturn code = platform.ports.allocateReceiveRight(&port);
  if (code != kern::success) return code;
  code = platform.ports.insertSendRight(port);
  if (code != kern::success) {
    (void)platform.ports.dropReceiveRight(port);
    return code;
  }

  const auto giveUp = [&](KernelReturn status) {
    (void)platform.ports.dropReceiveRight(port);
    (void)platform.ports.deallocateSendRight(port);
    return status;
  };
  auto source = platform.sources.makeRoutineSource(port, server->clientSubsystem, WantTrailer::no);
  if (source == nullptr) return giveUp(kern::failure);
  auto deathWatch = platform.sources.makeDeathWatch(callerPort, platform.loop, server);
  if (deathWatch == nullptr) {
    source->invalidate();
    return giveUp(kern::failure);
  }

  try {
    registry.add(port, server);
    registry.add(deathWatch->port(), server);
    if (platform.describeCaller) LogCallers::shared().add(port, platform.describeCaller(caller));
    const Lock lock(server->lock);
    server->clientWatches.emplace(deathWatch.get(), ServerContext::Client{deathWatch, port});
    server->clientSources.emplace(port, source);
  } catch (const std::bad_alloc&) {
    source->invalidate();
    const Lock lock(server->lock);
    TearDownClient(*server, deathWatch, port);
    return kern::resourceShortage;
  }
  const bool added = source->addTo(platform.loop);
  deathWatch->setInvalidationCallback([&registry](DeathWatch& dead) {
    OnClientPortDied(dead, static_cast<ServerContext*>(dead.info()), registry);
  });

  Lock lock(server->lock);
  if (!added) {
    // The loop cannot watch the new port: a client that nobody would serve is not let in.
    TearDownClient(*server, deathWatch, port);
    return kern::failure;
  }
  cancelIdleTimer(*server);
  lock.unlock();
  tellOfChange(*server);
  if (!deathWatch->isValid())
    return kern::failure;  // the callback, already on its way, tears the client down
  *clientPort = port;
  return kern::success;
}

void OnClientPortDied(DeathWatch& deathWatch, ServerContext* context, PortServerRegistry& registry) {
  ServerContext* const server = context != nullptr ? context : LookupServer(registry, deathWatch.port());
  if (server == nullptr) assertionFailed("server", "MachPortInvalidationCallBack", "HelperServerUtils", 317);
  Lock lock(server->lock);
  const auto client = server->clientWatches.find(&deathWatch);
  if (client != server->clientWatches.end()) {
    const ServerContext::Client dead = client->second;
    TearDownClient(*server, dead.deathWatch, dead.receivePort);
  }
  if (server->busyMask == 0 && server->clientWatches.empty()) armIdleTimer(*server, lock);
  lock.unlock();
  tellOfChange(*server);
}

}  // namespace brenvik

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "Helper/Shared/Server/HelperServerUtils.h"

#include <algorithm>
#include <bit>
#include <chrono>
#include <cstdlib>
#include <cstring>
#include <limits>
#include <new>
#include <utility>

#include "Helper/Shared/Server/CheckInTable.h"
#include "interface/Routines.h"
#include "platform/log/Log.h"

namespace brenvik {
namespace {

constexpr std::chrono::duration<double> kNoTimeOut{std::numeric_limits<double>::max()};
// A client costs the heap about 2 KiB: what fewer of them leave is less than the helper itself takes.
constexpr std::size_t kManyClients = 256;
// What belongs to a client's process is freed when the process has ended, a little after its port died.
constexpr std::chrono::seconds kUntilAllIsFree{1};

[[noreturn]] void assertionFailed(const char* expression, const char* function, const char* source,
                                  int line) {
  logUnified(LogLevel::error, "Assertion failed: (%s), function %s, file %s, line %d.", expression, function,
             source, line);
  std::abort();
}

}  // namespace

// ---- a client ----

// What was made for one client, as far as the making has come. Destroying it takes all of that back.
class ServerContext::Client {
 public:
  explicit Client(const ServerPlatform& platform) noexcept : platform_(platform) {}
  Client(const Client&) = delete;
  Client& operator=(const Client&) = delete;
  ~Client();

  // Steps of the making, in this order. Each returns kern::success or the code of the check-in.
  KernelReturn makePort() noexcept;
  KernelReturn makeSource(const RoutineTable& table) noexcept;
  KernelReturn watch(PortName callerPort) noexcept;
  // Makes both ports known. Throws std::bad_alloc.
  void enlist(ServerContext& server, const AuditToken& caller) const;
  // The check-in succeeds: the server owns the right that is watched.
  void adoptCallersRight() noexcept { watched_ = SendRight(platform_.ports, deathWatch_->port()); }

  PortName port() const noexcept { return receive_.name(); }
  DeathWatch& deathWatch() const noexcept { return *deathWatch_; }
  RoutineSource& source() const noexcept { return *source_; }

 private:
  const ServerPlatform& platform_;
  ReceiveRight receive_;
  SendRight send_;
  std::shared_ptr<RoutineSource> source_;
  std::shared_ptr<DeathWatch> deathWatch_;
  SendRight watched_;
};

KernelReturn ServerContext::Client::makePort() noexcept {
  PortName port = kNullPort;
  if (const KernelReturn code = platform_.ports.allocateReceiveRight(&port); code != kern::success) {
    return code;
  }
  receive_ = ReceiveRight(platform_.ports, port);
  if (const KernelReturn code = platform_.ports.insertSendRight(port); code != kern::success) return code;
  send_ = SendRight(platform_.ports, port);
  return kern::success;
}

KernelReturn ServerContext::Client::makeSource(const RoutineTable& table) noexcept {
  source_ = platform_.sources.makeRoutineSource(port(), table, WantTrailer::no);
  return source_ != nullptr ? kern::success : kern::failure;
}

KernelReturn ServerContext::Client::watch(PortName callerPort) noexcept {
  deathWatch_ = platform_.sources.makeDeathWatch(callerPort, platform_.loop);
  return deathWatch_ != nullptr ? kern::success : kern::failure;
}

void ServerContext::Client::enlist(ServerContext& server, const AuditToken& caller) const {
  platform_.registry.add(port(), &server);
  platform_.registry.add(deathWatch_->port(), &server);
  if (platform_.describeCaller) LogCallers::shared().add(port(), platform_.describeCaller(caller));
}

ServerContext::Client::~Client() {
  if (deathWatch_ != nullptr) {
    deathWatch_->setInvalidationCallback({});
    deathWatch_->invalidate();
    platform_.registry.remove(deathWatch_->port());
    watched_.reset();
  }
  if (source_ != nullptr) source_->invalidate();
  if (receive_) {
    platform_.registry.remove(port());
    LogCallers::shared().remove(port());
    receive_.reset();
    send_.reset();
  }
}

// ---- creation and destruction ----

ServerContext::ServerContext(const ServerPlatform& platform, const RoutineTable& clientSubsystem)
    : platform_(platform), clientSubsystem_(clientSubsystem) {}

std::unique_ptr<ServerContext> ServerContext::make(const ServerPlatform& platform, const char* serviceName,
                                                   const RoutineTable& clientSubsystem) {
  std::unique_ptr<ServerContext> server;
  try {
    server.reset(new ServerContext(platform, clientSubsystem));
  } catch (const std::bad_alloc&) {
    return nullptr;
  }
  try {
    if (server->serve(serviceName)) return server;
  } catch (const std::bad_alloc&) {
    // Out of resources, as the line says.
  }
  // The destruction drops the same right again, to no effect.
  if (server->servicePort_) (void)platform.ports.dropReceiveRight(server->servicePort());
  logUnified(LogLevel::error, "unable to create server objects - out of resources");
  return nullptr;
}

bool ServerContext::serve(const char* serviceName) {
  PortName port = kNullPort;
  if (platform_.bootstrap.checkIn(serviceName, &port) != kern::success) return false;
  servicePort_ = ReceiveRight(platform_.ports, port);
  platform_.registry.add(port, this);
  checkInSubsystem_ = makeCheckInTable(platform_);
  serviceSource_ = platform_.sources.makeRoutineSource(port, *checkInSubsystem_, WantTrailer::yes);
  return serviceSource_ != nullptr && serviceSource_->addTo(platform_.loop);
}

ServerContext::~ServerContext() {
  idleCheck_ = nullptr;
  if (serviceSource_ != nullptr) {
    serviceSource_->invalidate();
    serviceSource_.reset();
  }
  if (servicePort_) {
    platform_.registry.remove(servicePort());
    servicePort_.reset();
  }
  const Locked lock(*this);
  while (!clients_.empty()) TearDownClient(lock, clients_.begin()->second->deathWatch());
  cancelIdleTimer(lock);
}

// ---- run and stop ----

std::int32_t ServerContext::run() {
  runLoop_ = &platform_.loop;
  if (isStopped_) return 0;
  RunResult result{};
  do {
    result = runLoop_->run(kNoTimeOut, ReturnAfterSource::yes);
  } while (!isStopped_);
  return static_cast<std::int32_t>(result);
}

void ServerContext::stop() noexcept {
  isStopped_ = true;
  if (runLoop_ != nullptr) runLoop_->stop();
}

// ---- the idle rule ----

void ServerContext::idleTimerTick() {
  {
    const Locked lock(*this);
    // Cancelled by another thread while this tick was on its way.
    if (idleTimer_ == nullptr) return;
  }
  if (!idleCheck_ || !idleCheck_()) {
    stop();
    return;
  }
  const Locked lock(*this);
  isKeptByIdleCheck_ = true;
  const auto period = platform_.idlePeriod;
  nextIdleTick_ += period * ((platform_.now() - nextIdleTick_) / period + 1);
}

void ServerContext::armIdleTimerIfIdle(Locked& lock) {
  if (busyMask_ != 0 || !clients_.empty() || idleTimer_ != nullptr) return;
  const std::chrono::nanoseconds period = platform_.idlePeriod;
  nextIdleTick_ = platform_.now() + period;
  isKeptByIdleCheck_ = false;
  try {
    idleTimer_ = platform_.loop.addTimer(
        period, period, [this] { idleTimerTick(); }, [this] { stop(); });
  } catch (const std::bad_alloc&) {
    // No timer, as below.
  }
  if (idleTimer_ != nullptr) return;
  lock.unlock();
  stop();
  lock.lock();
}

void ServerContext::cancelIdleTimer(const Locked&) noexcept {
  if (idleTimer_ == nullptr) return;
  idleTimer_->invalidate();
  idleTimer_.reset();
}

void ServerContext::tellOfChange() const {
  if (platform_.onChange) platform_.onChange();
}

// ---- busy tokens ----

std::uint32_t ServerContext::acquireBusyToken(const char* reason) {
  Locked lock(*this);
  // The run of set bits from bit 0 is what counts: a hole above a clear bit 0 is not looked for. With all 32
  // set the shift wraps, and bit 0 is given once more.
  const auto run = static_cast<unsigned>(std::countr_one(busyMask_));
  const std::uint32_t token = std::uint32_t{1} << (run % 32U);
  busyMask_ |= token;
  busyReasons_[run % 32U] = reason;
  cancelIdleTimer(lock);
  lock.unlock();
  tellOfChange();
  return token;
}

void ServerContext::releaseBusyToken(std::uint32_t token) {
  Locked lock(*this);
  busyMask_ &= ~token;
  armIdleTimerIfIdle(lock);
  lock.unlock();
  tellOfChange();
}

std::uint32_t ServerContext::busyMask() const noexcept {
  const Locked lock(*this);
  return busyMask_;
}

bool ServerContext::isCountingDown() const noexcept {
  const Locked lock(*this);
  return idleTimer_ != nullptr;
}

ServerFacts ServerContext::facts() const {
  ServerFacts facts;
  const Locked lock(*this);
  facts.clients = clients_.size();
  for (std::size_t bit = 0; bit < busyReasons_.size(); ++bit) {
    if ((busyMask_ >> bit & 1U) == 0) continue;
    const char* const reason = busyReasons_[bit];
    const auto known =
        std::find_if(facts.busyTokens.begin(), facts.busyTokens.end(),
                     [reason](const auto& each) { return std::strcmp(each.first, reason) == 0; });
    if (known != facts.busyTokens.end()) {
      ++known->second;
    } else {
      facts.busyTokens.emplace_back(reason, 1);
    }
  }
  if (idleTimer_ == nullptr) return facts;
  facts.leavesIn = std::max(nextIdleTick_ - platform_.now(), std::chrono::nanoseconds::zero());
  facts.isKeptByIdleCheck = isKeptByIdleCheck_;
  return facts;
}

// ---- clients ----

KernelReturn ServerContext::admit(PortName callerPort, PortName* clientPort, const AuditToken& caller) {
  auto made = std::make_unique<Client>(platform_);
  Client& client = *made;
  if (const KernelReturn code = client.makePort(); code != kern::success) return code;
  if (const KernelReturn code = client.makeSource(clientSubsystem_); code != kern::success) return code;
  if (const KernelReturn code = client.watch(callerPort); code != kern::success) return code;
  client.enlist(*this, caller);
  DeathWatch& deathWatch = client.deathWatch();
  {
    const Locked lock(*this);
    clients_.emplace(&deathWatch, std::move(made));
    mostClients_ = std::max(mostClients_, clients_.size());
  }
  const bool isServed = client.source().addTo(platform_.loop);
  deathWatch.setInvalidationCallback(
      [this](DeathWatch& dead) { OnClientPortDied(dead, this, platform_.registry); });

  Locked lock(*this);
  if (!isServed) {
    // The loop cannot watch the new port: a client that nobody would serve is not let in.
    TearDownClient(lock, deathWatch);
    return kern::failure;
  }
  cancelIdleTimer(lock);
  lock.unlock();
  tellOfChange();
  // The callback, which is on its way, tears the client down.
  if (!deathWatch.isValid()) return kern::failure;
  client.adoptCallersRight();
  *clientPort = client.port();
  return kern::success;
}

void ServerContext::TearDownClient(const Locked&, DeathWatch& deathWatch) noexcept {
  (void)clients_.extract(&deathWatch);
}

// True once, and then again after as many have come and gone.
bool ServerContext::haveMostClientsGone(const Locked&) noexcept {
  if (mostClients_ < kManyClients || clients_.size() > mostClients_ / 8) return false;
  mostClients_ = clients_.size();
  return true;
}

void ServerContext::clientPortDied(DeathWatch& deathWatch) {
  Locked lock(*this);
  TearDownClient(lock, deathWatch);
  armIdleTimerIfIdle(lock);
  const bool isMuchFree = haveMostClientsGone(lock);
  lock.unlock();
  tellOfChange();
  if (isMuchFree) releaseMemorySoon();
}

void ServerContext::releaseMemorySoon() noexcept {
  if (!platform_.releaseMemory || releaseTimer_ != nullptr) return;
  try {
    releaseTimer_ = platform_.loop.addTimer(
        kUntilAllIsFree, std::chrono::nanoseconds::zero(),
        [this] {
          const auto once = std::move(releaseTimer_);
          platform_.releaseMemory();
        },
        [] {});
  } catch (const std::bad_alloc&) {
    // The heap keeps it.
  }
}

// ---- the functions ----

std::unique_ptr<ServerContext> CreateServer(const ServerPlatform& platform, const char* serviceName,
                                            const RoutineTable& clientSubsystem) {
  return ServerContext::make(platform, serviceName, clientSubsystem);
}

void SetIdleCheck(ServerContext* server, std::function<bool()> idleCheck) {
  if (server != nullptr && idleCheck) server->setIdleCheck(std::move(idleCheck));
}

std::int32_t RunServer(ServerContext& server) { return server.run(); }

std::int32_t StopServer(ServerContext& server) {
  server.stop();
  return 0;
}

void DestroyServer(std::unique_ptr<ServerContext> server) { server.reset(); }

std::uint32_t AcquireBusyToken(ServerContext& server, const char* reason) {
  return server.acquireBusyToken(reason);
}

std::uint32_t ReleaseBusyToken(ServerContext& server, std::uint32_t token) {
  if (!std::has_single_bit(token)) return 0;
  server.releaseBusyToken(token);
  return 1;
}

ServerContext* LookupServer(PortServerRegistry& registry, PortName port) noexcept {
  return registry.lookUp(port);
}

KernelReturn BVMobileHelperCheckIn(const ServerPlatform& platform, PortName servicePort, PortName callerPort,
                                   PortName* clientPort, const AuditToken& caller) {
  *clientPort = kNullPort;
  const LogScope scope(kCheckInRoutine.name, servicePort);
  if (!platform.hasEntitlement(kAllowEntitlement, caller)) return kern::invalidSecurity;
  ServerContext* const server = LookupServer(platform.registry, servicePort);
  return server != nullptr ? server->admit(callerPort, clientPort, caller) : kern::failure;
}

void OnClientPortDied(DeathWatch& deathWatch, ServerContext* context, PortServerRegistry& registry) {
  ServerContext* const server = context != nullptr ? context : LookupServer(registry, deathWatch.port());
  if (server == nullptr) assertionFailed("server", "MachPortInvalidationCallBack", "HelperServerUtils", 317);
  server->clientPortDied(deathWatch);
}

}  // namespace brenvik

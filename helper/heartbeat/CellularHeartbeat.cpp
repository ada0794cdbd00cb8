// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "helper/heartbeat/CellularHeartbeat.h"

#include <arpa/inet.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <chrono>
#include <cstring>
#include <new>
#include <optional>
#include <span>
#include <utility>

#include "helper/heartbeat/EchoMessage.h"
#include "interface/status/Status.h"
#include "platform/base/Utf8.h"
#include "platform/log/Log.h"

namespace brenvik {
namespace {

using namespace std::chrono_literals;

constexpr const char kQueueLabel[] = "com.norvale.otaheartbeat";
constexpr const char kProtocolName[] = "icmp";
constexpr const char kInterfaceName[] = "pdp_ip0";
constexpr auto kInterval = 2s;
constexpr auto kLeeway = 5'000ns;
constexpr auto kReceiveTimeOut = 1s;
constexpr int kReceiveBufferSize = 50 * 1024;
constexpr std::size_t kLargestDatagram = 2048;
constexpr std::size_t kAddressTextSize = 256;  // terminating NUL included

// Errors that a system call may leave without a number still have to be errors.
int errorOr(int error, int otherwise) noexcept { return error != 0 ? error : otherwise; }

CellularHeartbeat sharedHeartbeat;

}  // namespace

const char* const kReachabilityAddress = BRENVIK_REACHABILITY_ADDRESS;

CellularHeartbeat& CellularHeartbeat::shared() noexcept { return sharedHeartbeat; }

CellularHeartbeat::~CellularHeartbeat() = default;

void CellularHeartbeat::configure(Parts parts) { parts_ = std::make_unique<Parts>(std::move(parts)); }

void CellularHeartbeat::shutDown() noexcept {
  queue_.reset();
  timer_.reset();
}

void CellularHeartbeat::setHeartbeat(ServerContext& server, bool enable) {
  // Made here and not before, so that a process which never needs it does not pay for it.
  if (queue_ == nullptr) queue_ = parts_->queues.makeSerial(kQueueLabel, QualityOfService::standard);
  if (enable) {
    queue_->post([this, &server] { start(server); });
  } else {
    queue_->post([this, &server] { stop(server); });
  }
}

void CellularHeartbeat::start(ServerContext& server) {
  server_ = &server;
  timer_.reset();
  bool isArmed = false;
  try {
    timer_ = queue_->makeTimer(0s, kInterval, kLeeway, [this] { (void)ping(); });  // told nobody, by design
    (void)ping();                                                                  // likewise
    if (timer_ != nullptr) {
      isOn_ = true;
      busyToken_ = AcquireBusyToken(server, StatusReport::kHeartbeat);
      isArmed = timer_->activate();
    }
  } catch (const std::bad_alloc&) {  // as below
  }
  if (isArmed) return;
  logUnified(LogLevel::error, "The cellular heartbeat is off: its timer cannot be armed");
  stop(server);  // a helper that only seems to be kept by a heartbeat would never leave
}

void CellularHeartbeat::stop(ServerContext& server) {
  timer_.reset();
  isOn_ = false;
  // Never started: token 0 goes to the server that asked, and is refused there.
  (void)ReleaseBusyToken(server_ != nullptr ? *server_ : server, std::exchange(busyToken_, 0));
}

int CellularHeartbeat::ping() noexcept try {
  std::array<char, kAddressTextSize> address{};
  if (parts_->address.size() >= address.size() || !isValidUtf8(parts_->address)) return EINVAL;
  std::copy(parts_->address.begin(), parts_->address.end(), address.begin());

  EchoNetwork& network = parts_->network;
  in_addr destination{};
  destination.s_addr = ::inet_addr(address.data());
  if (destination.s_addr == INADDR_NONE) {
    const auto found = network.addressOfHost(address.data());
    if (!found) return EHOSTUNREACH;
    destination = *found;
  }

  const auto protocol = network.protocolByName(kProtocolName);
  if (!protocol) return EPFNOSUPPORT;
  const auto identifier = static_cast<std::uint16_t>(::getpid() & 0xFFFF);
  const auto socket = network.openEchoSocket(*protocol, identifier);
  if (socket == nullptr) return EPERM;

  socket->setReceiveBufferSize(kReceiveBufferSize);
  if (const unsigned index = network.indexOfInterface(kInterfaceName); index != 0)
    socket->bindToInterface(index);
  if (const int error = socket->setReceiveTimeOut(kReceiveTimeOut); error != 0) return error;

  timeval now{};
  errno = 0;
  if (network.timeOfDay(&now) != 0) return errorOr(errno, 1);
  const EchoMessage request = makeEchoRequest(identifier, now);
  const EchoTransfer sent = socket->sendTo(destination, request);
  if (sent.count != static_cast<std::ptrdiff_t>(request.size())) return errorOr(sent.error, 1);
  sent_.add(request.size());

  std::array<std::byte, kLargestDatagram> buffer;
  std::optional<std::chrono::microseconds> begin;
  for (;;) {
    const EchoTransfer received = socket->receive(buffer);
    // A clock that is never set: with the wall clock, setting it back would hold the queue until it caught
    // up.
    const auto time = network.steadyTime();
    if (!begin) begin = time;
    if (received.count >= 0) {
      const auto datagram = std::span(buffer).first(static_cast<std::size_t>(received.count));
      if (isEchoReply(datagram, socket->deliversIpHeader(), identifier)) {
        received_.add(request.size());  // a reply says what the request said
        return 0;
      }
    } else if (received.error != EAGAIN) {
      return errorOr(received.error, 1);
    }
    if (time - *begin >= 1s) return ETIMEDOUT;
  }
} catch (const std::bad_alloc&) {
  return ENOMEM;
}

}  // namespace brenvik

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "Helper/Shared/Server/CheckInTable.h"

#include <cstring>

namespace brenvik {
namespace {

// The code that the request's form earns; 0 when it may be served.
KernelReturn checkForm(const Request& request) noexcept {
  const bool sized = request.isComplex() && request.size() == sizeof(CheckInRequest);
  if (!sized || request.descriptorCount() != kCheckInRoutine.descriptors) return mig::badArguments;
  const auto& port = request.as<CheckInRequest>().clientPort;
  if (port.disposition != kDispositionMoveSend || port.type != kPortDescriptorType) return mig::typeError;
  constexpr std::uint32_t kTrailerWithToken = 32;  // the least that the check has ever asked for
  if (request.trailer().type != 0 || request.trailer().size < kTrailerWithToken) return mig::trailerError;
  return kern::success;
}

Outcome checkIn(void* context, const Request& request, Reply& reply) {
  const auto& platform = *static_cast<const ServerPlatform*>(context);
  if (const KernelReturn refusal = checkForm(request); refusal != kern::success) {
    reply.setStatus(refusal);
    return Outcome::refused;
  }

  AuditToken caller;
  std::memcpy(caller.words.data(), request.trailer().auditToken, sizeof caller.words);
  PortName clientPort = kNullPort;
  const KernelReturn code = BVMobileHelperCheckIn(
      platform, request.localPort(), request.as<CheckInRequest>().clientPort.name, &clientPort, caller);
  if (code != kern::success) {
    reply.setStatus(code);
    return Outcome::refused;
  }

  auto& message = reply.as<CheckInReply>();
  message.header.bits = kReplyDisposition | kComplexBit;
  message.header.size = sizeof message;
  message.descriptorCount = 1;
  message.servicePort.name = clientPort;
  message.servicePort.disposition = kDispositionCopySend;
  message.servicePort.type = kPortDescriptorType;
  return Outcome::accepted;
}

class CheckInTable final : public RoutineTable {
 public:
  explicit CheckInTable(const ServerPlatform& platform) noexcept : platform_(platform) {}
  Handler find(std::int32_t id) const noexcept override {
    return id == kCheckInRoutine.id ? &checkIn : nullptr;
  }
  void* context() const noexcept override { return const_cast<ServerPlatform*>(&platform_); }

 private:
  const ServerPlatform& platform_;
};

}  // namespace

std::unique_ptr<RoutineTable> makeCheckInTable(const ServerPlatform& platform) {
  return std::make_unique<CheckInTable>(platform);
}

}  // namespace brenvik

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "helper/requests/RoutineHandlers.h"

namespace brenvik {

KernelReturn checkForm(const RoutineFacts& facts, const Request& request) noexcept {
  if (facts.descriptors == 0) {
    return !request.isComplex() && request.size() == facts.requestSize ? kern::success : mig::badArguments;
  }
  if (!request.isComplex() || request.size() != facts.requestSize ||
      request.descriptorCount() != facts.descriptors) {
    return mig::badArguments;
  }
  for (std::uint32_t i = 0; i < facts.descriptors; ++i) {
    const auto& region =
        request.at<OutOfLineDescriptor>(kDescriptorsOffset + i * sizeof(OutOfLineDescriptor));
    const auto length = request.at<std::uint32_t>(facts.lengthsOffset + i * sizeof(std::uint32_t));
    if (region.type != kOutOfLineDescriptorType || region.size != length) return mig::typeError;
  }
  return kern::success;
}

void buildReply(ReplyForm form, ReplyNdr ndr, Reply& reply) noexcept {
  if (form == ReplyForm::outOfLine) {
    auto& message = reply.as<OutOfLineReply>();
    message.header.bits = kReplyDisposition | kComplexBit;
    message.header.size = sizeof message;
    message.descriptorCount = 1;
    message.payload.deallocate = 1;
    message.payload.copy = kVirtualCopy;
    message.payload.type = kOutOfLineDescriptorType;
    message.payload.size = message.byteCount;
    message.ndr = kNdrRecord;
    return;
  }
  auto& message = reply.as<StatusReply>();
  message.header.bits = kReplyDisposition;
  message.header.size = static_cast<std::uint32_t>(sizeOfReply(form));
  if (ndr == ReplyNdr::ours) message.ndr = kNdrRecord;
  message.returnCode = kern::success;
}

}  // namespace brenvik

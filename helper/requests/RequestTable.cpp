// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "helper/requests/RequestTable.h"

#include <array>

#include "interface/Routines.h"
#include "platform/log/LogContext.h"

namespace brenvik {
namespace {

// What a row is: its facts, and how its arguments reach its routine. `Message` is the request's struct;
// `call` returns the routine's code and writes results straight into the reply.
template <class Message>
using Call = KernelReturn (*)(ServerRoutines& routines, PortName port, Message& message, Reply& reply);

// The code that a request's form earns, before anything else is looked at; 0 when it may be served.
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

// Where the NDR record of the update check's reply comes from: its handler leaves the field to the source.
enum class ReplyNdr { ours, ofTheSource };

// Completes the header and the fixed fields around what the routine wrote.
void buildReply(ReplyForm form, Reply& reply, ReplyNdr ndr) noexcept {
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

template <std::size_t row, class Message, Call<Message> call, ReplyNdr ndr = ReplyNdr::ours>
Outcome handle(void* context, const Request& request, Reply& reply) {
  constexpr const RoutineFacts& facts = kRequestRoutines[row];
  static_assert(sizeof(Message) == facts.requestSize);
  const LogScope scope(facts.name, request.localPort());

  KernelReturn code = checkForm(facts, request);
  if (code != kern::success) {
    reply.setStatus(code);
    return Outcome::refused;
  }
  code = call(*static_cast<ServerRoutines*>(context), request.localPort(), request.as<Message>(), reply);
  if (code != kern::success) {
    reply.setStatus(code);
    return Outcome::refused;
  }
  buildReply(facts.reply, reply, ndr);
  return Outcome::accepted;
}

// An out-of-line result goes into the reply only when there is success to report; what a failed routine left
// in it stays behind.
template <class Routine>
KernelReturn withPayload(Reply& reply, Routine routine) {
  OutOfLinePayload payload;
  const KernelReturn code = routine(&payload);
  if (code == kern::success) {
    auto& message = reply.as<OutOfLineReply>();
    message.payload.address = reinterpret_cast<std::uint64_t>(payload.address);
    message.byteCount = payload.length;
  }
  return code;
}

const void* regionOf(const OutOfLineDescriptor& descriptor) noexcept {
  return reinterpret_cast<const void*>(descriptor.address);
}

using R = ServerRoutines;

// In the order of the ids.
constexpr std::array<RoutineTable::Handler, kRequestRoutines.size()> kHandlers{
    handle<0, String256Request,
           [](R& r, PortName port, String256Request& m, Reply&) {
             return r.server_BVMobileHelperSetVoicemailToken(port, m.text);
           }>,
    handle<1, TwoStrings256Request,
           [](R& r, PortName port, TwoStrings256Request& m, Reply&) {
             return r.server_BVMobileHelperSetVoicemailTokenForKey(port, m.first, m.second);
           }>,
    handle<2, EmptyRequest,
           [](R& r, PortName port, EmptyRequest&, Reply&) {
             return r.server_BVMobileHelperClearVoicemailToken(port);
           }>,
    handle<3, EmptyRequest,
           [](R& r, PortName port, EmptyRequest&, Reply&) {
             return r.server_BVMobileHelperResetVoicemailStore(port);
           }>,
    handle<4, String256Request,
           [](R& r, PortName port, String256Request& m, Reply& reply) {
             return r.server_BVMobileHelperCopyVoicemailTokenForKey(port, m.text,
                                                                    reply.as<String256Reply>().text);
           }>,
    handle<5, EmptyRequest,
           [](R& r, PortName port, EmptyRequest&, Reply& reply) {
             return r.server_BVMobileHelperCopyVoicemailToken(port, reply.as<String256Reply>().text);
           }>,
    handle<6, SetPreferenceValueRequest,
           [](R& r, PortName port, SetPreferenceValueRequest& m, Reply&) {
             return r.server_BVMobileHelperSetPreferenceValue(port, m.domain, m.key, regionOf(m.value),
                                                              m.value.size);
           }>,
    handle<7, TwoStrings256Request,
           [](R& r, PortName port, TwoStrings256Request& m, Reply& reply) {
             return withPayload(reply, [&](OutOfLinePayload* payload) {
               return r.server_BVMobileHelperCopyPreferenceValue(port, m.first, m.second, payload);
             });
           }>,
    handle<8, TwoStrings256Request,
           [](R& r, PortName port, TwoStrings256Request& m, Reply& reply) {
             return withPayload(reply, [&](OutOfLinePayload* payload) {
               return r.server_BVMobileHelperCopyAppPreferenceValue(port, m.first, m.second, payload);
             });
           }>,
    handle<9, ThreeStrings1024Request,
           [](R& r, PortName port, ThreeStrings1024Request& m, Reply&) {
             return r.server_BVMobileHelperReplaceCarrierSymlink(port, m.first, m.second, m.third);
           }>,
    handle<10, TwoStrings1024Request,
           [](R& r, PortName port, TwoStrings1024Request& m, Reply&) {
             return r.server_BVMobileHelperCreateSymlink(port, m.first, m.second);
           }>,
    handle<11, TwoStrings1024Request,
           [](R& r, PortName port, TwoStrings1024Request& m, Reply&) {
             return r.server_BVMobileHelperRemoveCarrierFile(port, m.first, m.second);
           }>,
    handle<12, EmptyRequest,
           [](R& r, PortName port, EmptyRequest&, Reply& reply) {
             return r.server_BVMobileHelperIsVoicemailServiceSubscribed(port,
                                                                        reply.as<IntegerReply>().result);
           }>,
    handle<13, IntegerRequest,
           [](R& r, PortName port, IntegerRequest& m, Reply&) {
             return r.server_BVMobileHelperCellularHeartbeat(port, m.value);
           }>,
    handle<14, IntegerRequest,
           [](R& r, PortName port, IntegerRequest& m, Reply&) {
             return r.server_BVMobileHelperCheckLASDUpdate(port, m.value);
           },
           ReplyNdr::ofTheSource>,
    handle<15, ThreeStrings256Request,
           [](R& r, PortName port, ThreeStrings256Request& m, Reply& reply) {
             return r.server_BVMobileHelperCopyCarrierFile(port, m.first, m.second, m.third,
                                                           reply.as<IntegerReply>().result);
           }>,
    handle<16, String256Request,
           [](R& r, PortName port, String256Request& m, Reply& reply) {
             return r.server_BVMobileHelperCopyCrashLogs(port, m.text, reply.as<IntegerReply>().result);
           }>,
    handle<17, ThreeStrings256Request,
           [](R& r, PortName port, ThreeStrings256Request& m, Reply& reply) {
             return r.server_BVMobileHelperMoveIntoCarrierBundles(port, m.first, m.second, m.third,
                                                                  reply.as<IntegerReply>().result);
           }>,
    handle<18, CoordinateRequest,
           [](R& r, PortName port, CoordinateRequest& m, Reply&) {
             return r.server_BVMobileHelperRequestCountryCodeFromLocation(port, m.latitude, m.longitude);
           }>,
    handle<19, EmptyRequest,
           [](R& r, PortName port, EmptyRequest&, Reply& reply) {
             return r.server_BVMobileHelperCopyCountryCode(port, reply.as<String64Reply>().text);
           }>,
    handle<20, EmptyRequest,
           [](R& r, PortName port, EmptyRequest&, Reply&) {
             return r.server_BVMobileHelperRequestWanIPFromLocation(port);
           }>,
    handle<21, IntegerRequest,
           [](R& r, PortName port, IntegerRequest& m, Reply&) {
             return r.server_BVMobileHelperEnableRadioManagerLogs(port, m.value);
           }>,
    handle<22, TwoStrings256Request,
           [](R& r, PortName port, TwoStrings256Request& m, Reply& reply) {
             return r.server_BVMobileHelperUnpackArchive(port, m.first, m.second,
                                                         reply.as<IntegerReply>().result);
           }>,
    handle<23, String256Request,
           [](R& r, PortName port, String256Request& m, Reply& reply) {
             return withPayload(reply, [&](OutOfLinePayload* payload) {
               return r.server_BVMobileHelperLoadPlistFile(port, m.text, payload);
             });
           }>,
    handle<24, LabelsRequest,
           [](R& r, PortName port, LabelsRequest& m, Reply& reply) {
             return withPayload(reply, [&](OutOfLinePayload* payload) {
               return r.server_BVMobileHelperCopyBadgeLabels(
                   port, regionOf(m.labels), m.labels.size, regionOf(m.languages), m.languages.size, payload);
             });
           }>,
    handle<25, LabelsRequest,
           [](R& r, PortName port, LabelsRequest& m, Reply& reply) {
             return withPayload(reply, [&](OutOfLinePayload* payload) {
               return r.server_BVMobileHelperCopyLocalizedLabels(
                   port, regionOf(m.labels), m.labels.size, regionOf(m.languages), m.languages.size, payload);
             });
           }>,
    handle<26, TwoStrings64Request,
           [](R& r, PortName port, TwoStrings64Request& m, Reply& reply) {
             return r.server_BVMobileHelperRemapContactsChannel(port, m.first, m.second,
                                                                reply.as<IntegerReply>().result);
           }>,
};

}  // namespace

RoutineTable::Handler RequestTable::find(std::int32_t id) const noexcept {
  const auto index = static_cast<std::uint32_t>(id) - static_cast<std::uint32_t>(kFirstRequestId);
  return index < kHandlers.size() ? kHandlers[index] : nullptr;
}

}  // namespace brenvik

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <array>
#include <cstddef>
#include <tuple>
#include <utility>

#include "helper/requests/RequestAreas.h"
#include "interface/Routines.h"
#include "platform/ipc/OutOfLinePayload.h"
#include "platform/ipc/RoutineTable.h"
#include "platform/log/LogContext.h"

namespace brenvik {

// The NDR record of a reply: our own, or the bytes that the routine source left in the reply.
enum class ReplyNdr { ours, ofTheSource };

template <class MessageStruct, auto areaRoutine, ReplyNdr replyNdr = ReplyNdr::ours>
struct Binding {
  using Message = MessageStruct;
  static constexpr auto routine = areaRoutine;
  static constexpr ReplyNdr ndr = replyNdr;
};

// Binds each row of interface/Routines.h, in the order of the rows, to the struct of its request, whose
// fields are the routine's arguments, and to the area's routine.
using RoutineBindings =
    std::tuple<Binding<String256Request, &VoicemailOperations::setVoicemailToken>,
               Binding<TwoStrings256Request, &VoicemailOperations::setVoicemailTokenForKey>,
               Binding<EmptyRequest, &VoicemailOperations::clearVoicemailToken>,
               Binding<EmptyRequest, &VoicemailOperations::resetVoicemailStore>,
               Binding<String256Request, &VoicemailOperations::copyVoicemailTokenForKey>,
               Binding<EmptyRequest, &VoicemailOperations::copyVoicemailToken>,
               Binding<SetPreferenceValueRequest, &PreferenceTransfer::setPreferenceValue>,
               Binding<TwoStrings256Request, &PreferenceTransfer::copyPreferenceValue>,
               Binding<TwoStrings256Request, &PreferenceTransfer::copyAppPreferenceValue>,
               Binding<ThreeStrings1024Request, &CarrierOperations::replaceCarrierSymlink>,
               Binding<TwoStrings1024Request, &CarrierOperations::createSymlink>,
               Binding<TwoStrings1024Request, &CarrierOperations::removeCarrierFile>,
               Binding<EmptyRequest, &VoicemailOperations::isVoicemailServiceSubscribed>,
               Binding<IntegerRequest, &cellularHeartbeat>,
               Binding<IntegerRequest, &checkLASDUpdate, ReplyNdr::ofTheSource>,
               Binding<ThreeStrings256Request, &CarrierOperations::copyCarrierFile>,
               Binding<String256Request, &CarrierOperations::copyCrashLogs>,
               Binding<ThreeStrings256Request, &CarrierOperations::moveIntoCarrierBundles>,
               Binding<CoordinateRequest, &LocationRoutines::requestCountryCodeFromLocation>,
               Binding<EmptyRequest, &LocationRoutines::copyCountryCode>,
               Binding<EmptyRequest, &LocationRoutines::requestWanIPFromLocation>,
               Binding<IntegerRequest, &RadioLogging::enableRadioManagerLogs>,
               Binding<TwoStrings256Request, &CarrierOperations::unpackArchive>,
               Binding<String256Request, &PreferenceTransfer::loadPlistFile>,
               Binding<LabelsRequest, &LabelRoutines::copyBadgeLabels>,
               Binding<LabelsRequest, &LabelRoutines::copyLocalizedLabels>,
               Binding<TwoStrings64Request, &ChannelRemap::remapContactsChannel>>;
static_assert(std::tuple_size_v<RoutineBindings> == kRequestRoutines.size());

// Checks a request's form against its row. Returns kern::success if it may be served, else the code of the
// error reply.
KernelReturn checkForm(const RoutineFacts& facts, const Request& request) noexcept;

// Completes the header and the fixed fields around the result that the routine wrote.
void buildReply(ReplyForm form, ReplyNdr ndr, Reply& reply) noexcept;

// A request's arguments, in the order of its fields. Texts point into the request, where the older routines
// terminate them in place; they have their field's size and need not be terminated. A region is passed as its
// address and its size in bytes; it is read in place and the transport owns it.
inline std::tuple<> argumentsOf(EmptyRequest&) noexcept { return {}; }
inline auto argumentsOf(String256Request& m) noexcept { return std::tie(m.text); }
inline auto argumentsOf(TwoStrings64Request& m) noexcept { return std::tie(m.first, m.second); }
inline auto argumentsOf(TwoStrings256Request& m) noexcept { return std::tie(m.first, m.second); }
inline auto argumentsOf(TwoStrings1024Request& m) noexcept { return std::tie(m.first, m.second); }
inline auto argumentsOf(ThreeStrings256Request& m) noexcept { return std::tie(m.first, m.second, m.third); }
inline auto argumentsOf(ThreeStrings1024Request& m) noexcept { return std::tie(m.first, m.second, m.third); }
// A reference cannot bind to a number in a packed struct, so the argument is a copy.
inline auto argumentsOf(IntegerRequest& m) noexcept { return std::tuple(std::int32_t{m.value}); }
inline auto argumentsOf(CoordinateRequest& m) noexcept {
  return std::tuple(double{m.latitude}, double{m.longitude});
}
inline std::tuple<const void*, std::uint32_t> regionOf(const OutOfLineDescriptor& descriptor) noexcept {
  return {reinterpret_cast<const void*>(descriptor.address), std::uint32_t{descriptor.size}};
}
inline auto argumentsOf(SetPreferenceValueRequest& m) noexcept {
  return std::tuple_cat(std::tie(m.domain, m.key), regionOf(m.value));
}
inline auto argumentsOf(LabelsRequest& m) noexcept {
  return std::tuple_cat(regionOf(m.labels), regionOf(m.languages));
}

// Calls the routine of a row. The routine writes its result straight into the reply, which starts as zeros.
// An out-of-line result is copied only on success: the payload of a failed routine is not sent.
template <std::size_t row, class Areas>
KernelReturn callRoutine(Areas& areas, const Request& request, Reply& reply) {
  using Row = std::tuple_element_t<row, RoutineBindings>;
  constexpr ReplyForm form = kRequestRoutines[row].reply;
  const auto arguments = argumentsOf(request.as<typename Row::Message>());
  const auto call = [&](auto*... result) {
    return areas.template call<Row::routine>(request.localPort(), arguments, result...);
  };
  if constexpr (form == ReplyForm::integer) {
    return call(&reply.as<IntegerReply>().result[0]);
  } else if constexpr (form == ReplyForm::string64) {
    return call(&reply.as<String64Reply>().text[0]);
  } else if constexpr (form == ReplyForm::string256) {
    return call(&reply.as<String256Reply>().text[0]);
  } else if constexpr (form == ReplyForm::outOfLine) {
    OutOfLinePayload payload;
    const KernelReturn code = call(&payload);
    if (code != kern::success) return code;
    auto& message = reply.as<OutOfLineReply>();
    message.payload.address = reinterpret_cast<std::uint64_t>(payload.address);
    message.byteCount = payload.length;
    return code;
  } else {
    static_assert(form == ReplyForm::status);
    return call();
  }
}

template <std::size_t row, class Areas>
Outcome serveRow(void* areas, const Request& request, Reply& reply) {
  using Row = std::tuple_element_t<row, RoutineBindings>;
  constexpr const RoutineFacts& facts = kRequestRoutines[row];
  static_assert(sizeof(typename Row::Message) == facts.requestSize);
  const LogScope scope(facts.name, request.localPort());

  KernelReturn code = checkForm(facts, request);
  if (code == kern::success) code = callRoutine<row>(*static_cast<Areas*>(areas), request, reply);
  if (code != kern::success) {
    reply.setStatus(code);
    return Outcome::refused;
  }
  buildReply(facts.reply, Row::ndr, reply);
  return Outcome::accepted;
}

template <class Areas>
inline constexpr auto kRowHandlers = []<std::size_t... row>(std::index_sequence<row...>) {
  return std::array<RoutineTable::Handler, sizeof...(row)>{&serveRow<row, Areas>...};
}
(std::make_index_sequence<kRequestRoutines.size()>());

}  // namespace brenvik

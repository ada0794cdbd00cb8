// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <cstdint>
#include <functional>
#include <tuple>
#include <type_traits>

#include "Helper/Shared/Server/HelperServerUtils.h"
#include "helper/carrier/CarrierOperations.h"
#include "helper/heartbeat/CellularHeartbeat.h"
#include "helper/labels/ChannelRemap.h"
#include "helper/labels/LabelRoutines.h"
#include "helper/lasd/LASDUpdater.h"
#include "helper/location/LocationRoutines.h"
#include "helper/preferences/PreferenceTransfer.h"
#include "helper/radio/RadioLogging.h"
#include "helper/voicemail/VoicemailOperations.h"

namespace brenvik {

// These two routines continue to work after their reply. They need the server of the client's port, which
// their work keeps alive.
inline KernelReturn cellularHeartbeat(CellularHeartbeat& heartbeat, ServerContext& server,
                                      std::int32_t value) {
  heartbeat.setHeartbeat(server, value != 0);
  return kern::success;
}
inline KernelReturn checkLASDUpdate(LASDUpdater& updater, ServerContext& server, std::int32_t mask) {
  updater.checkForUpdate(server, static_cast<std::uint32_t>(mask));
  return kern::success;
}

// The area that a routine belongs to: the class of a member function, the first parameter of a function.
template <class Routine>
struct AreaOf;
template <class Owner, class... Parameters>
struct AreaOf<KernelReturn (Owner::*)(Parameters...)> : std::type_identity<Owner> {};
template <class Owner, class... Parameters>
struct AreaOf<KernelReturn (Owner::*)(Parameters...) noexcept> : std::type_identity<Owner> {};
template <class Owner, class... Parameters>
struct AreaOf<KernelReturn (*)(Owner&, Parameters...)> : std::type_identity<Owner> {};

// References to the areas, each of which must outlive this object. Main loop only.
template <class... Area>
class AreasByReference {
 public:
  AreasByReference(PortServerRegistry& registry, Area&... areas) noexcept
      : areas_(areas...), registry_(registry) {}

  // Calls the routine of its area. It passes the port that the request arrived on, or that port's server, if
  // the routine takes one; then the arguments; then the place of the result, if there is one. Returns
  // kern::failure if the routine takes a server and the port has none.
  template <auto routine, class... Arguments, class... Results>
  KernelReturn call(PortName port, const std::tuple<Arguments...>& arguments, Results*... results) {
    using Routine = decltype(routine);
    auto& area = std::get<typename AreaOf<Routine>::type&>(areas_);
    return std::apply(
        [&](auto&... each) -> KernelReturn {
          if constexpr (std::is_invocable_v<Routine, decltype(area), ServerContext&, Arguments...>) {
            ServerContext* const server = LookupServer(registry_, port);
            return server != nullptr ? std::invoke(routine, area, *server, each...) : kern::failure;
          } else if constexpr (std::is_invocable_v<Routine, decltype(area), PortName, Arguments...,
                                                   Results*...>) {
            return std::invoke(routine, area, port, each..., results...);
          } else {
            return std::invoke(routine, area, each..., results...);
          }
        },
        arguments);
  }

 private:
  const std::tuple<Area&...> areas_;
  PortServerRegistry& registry_;
};

// The areas that serve the 27 routines.
using RequestAreas =
    AreasByReference<PreferenceTransfer, CarrierOperations, VoicemailOperations, LocationRoutines,
                     RadioLogging, LabelRoutines, ChannelRemap, LASDUpdater, CellularHeartbeat>;

}  // namespace brenvik

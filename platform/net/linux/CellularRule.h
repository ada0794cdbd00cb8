// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <sys/socket.h>

#include <string>
#include <string_view>

namespace brenvik {

// Files the rule reads.
struct CellularRuleFiles {
  std::string interfaces = "/sys/class/net";
  std::string nameServers = "/etc/resolv.conf";
  std::string hosts = "/etc/hosts";
};

// True for an interface whose packets cost: named pdp_ip*, or of the kernel's device type "wwan".
bool isCellularInterface(std::string_view name, const CellularRuleFiles& files = {}) noexcept;

// How a connection to a peer would go.
struct ConnectionWay {
  enum class Kind { open, cellular, none };  // none: no route, or it cannot be told
  Kind kind = Kind::none;
  // With `open`, the interface. A socket bound to it (SO_BINDTODEVICE) cannot stray when routes change.
  std::string interfaceName;
};
ConnectionWay routeTo(const sockaddr& peer, const CellularRuleFiles& files = {}) noexcept;

// Whether looking up the name may be tried without a packet leaving by a cellular interface: some route that
// leads further than the link is not cellular, or there is no route at all; and every name server is reached
// without a cellular interface, unless the hosts file has the name.
bool mayLookUpName(std::string_view host, const CellularRuleFiles& files = {}) noexcept;

}  // namespace brenvik

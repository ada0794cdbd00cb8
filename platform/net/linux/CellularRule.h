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

// The name of the interface that a connection to `peer` would use, when that is not a cellular one. Empty
// when it is, when there is no route, and when that cannot be told. A socket bound to that interface
// (SO_BINDTODEVICE) cannot stray to another when routes change.
std::string interfaceWithoutCellular(const sockaddr& peer, const CellularRuleFiles& files = {}) noexcept;

// Whether looking up the name may be tried without a packet leaving by a cellular interface: some route that
// leads further than the link is not cellular, or there is none at all; and every name server stands on a way
// that is not cellular, unless the hosts file has the name.
bool mayLookUpName(std::string_view host, const CellularRuleFiles& files = {}) noexcept;

}  // namespace brenvik

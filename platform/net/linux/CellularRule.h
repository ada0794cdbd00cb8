// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <sys/socket.h>

#include <string>
#include <string_view>

namespace brenvik {

// The files that the rule reads.
struct CellularRuleFiles {
  std::string interfaces = "/sys/class/net";
  std::string nameServers = "/etc/resolv.conf";
  std::string hosts = "/etc/hosts";
};

// True for an interface whose packets cost money: named pdp_ip*, or of the kernel's device type "wwan".
bool isCellularInterface(std::string_view name, const CellularRuleFiles& files = {}) noexcept;

// The route of a connection to a peer.
struct ConnectionWay {
  enum class Kind { open, cellular, none };  // none: no route, or it cannot be found out
  Kind kind = Kind::none;
  // With `open`, the interface. A socket bound to it (SO_BINDTODEVICE) stays there even if routes change.
  std::string interfaceName;
};
ConnectionWay routeTo(const sockaddr& peer, const CellularRuleFiles& files = {}) noexcept;

// Whether the name can be looked up without sending a packet over a cellular interface. That is so if some
// route beyond the link is not cellular, or there is no route at all; and if every name server is reached
// without a cellular interface, or the hosts file has the name.
bool mayLookUpName(std::string_view host, const CellularRuleFiles& files = {}) noexcept;

}  // namespace brenvik

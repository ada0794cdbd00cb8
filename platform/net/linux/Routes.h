// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <sys/socket.h>

#include <cstdint>
#include <optional>
#include <set>

namespace brenvik {

// Questions to the kernel's routing, see rtnetlink(7). Each opens a socket of its own. Any thread. Both
// throw std::bad_alloc.

// Index of the interface that a packet to `peer` (AF_INET or AF_INET6) would leave by. Nothing when there is
// no route, the family is another one or the kernel did not answer.
std::optional<unsigned> interfaceTo(const sockaddr& peer);

// The interfaces of all unicast routes that lead further than the link, of every table; the loopback
// interface, link-local destinations and dead next hops left out. Nothing when the kernel did not answer.
std::optional<std::set<unsigned>> interfacesWithRoutes();

}  // namespace brenvik

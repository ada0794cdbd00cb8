// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <sys/socket.h>

#include <cstdint>
#include <optional>
#include <set>

namespace brenvik {

// These functions ask the kernel about routes, see rtnetlink(7). Each opens a socket of its own. Any thread.
// Both throw std::bad_alloc.

// Returns the index of the interface for packets to `peer` (AF_INET or AF_INET6). Returns nothing if there is
// no route, the family is another one, or the kernel did not answer.
std::optional<unsigned> interfaceTo(const sockaddr& peer);

// Returns the interfaces of all unicast routes beyond the link, in every table, without the loopback
// interface, link-local destinations and dead next hops. Returns nothing if the kernel did not answer.
std::optional<std::set<unsigned>> interfacesWithRoutes();

}  // namespace brenvik

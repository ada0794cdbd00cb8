// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <cstddef>
#include <cstdint>
#include <optional>
#include <set>
#include <span>

namespace brenvik {

// What the kernel answers to questions about routes, see rtnetlink(7). An answer comes in pieces, each one
// datagram; after `complete` and `failed` no further piece is read. Any thread. Both throw std::bad_alloc.
enum class RouteAnswer { goesOn, complete, failed };

// Reads a piece of the answer to a question about the route to one address. Sets *index to the interface of
// that route; leaves it alone if packets cannot go that way.
RouteAnswer readRoute(std::span<const std::byte> piece, std::optional<unsigned>* index);

// Reads a piece of the answer to a question about all routes of a family (AF_INET or AF_INET6). Adds the
// interfaces of unicast routes beyond the link, except the `loopback` one, link-local destinations and dead
// next hops.
RouteAnswer readRoutes(std::span<const std::byte> piece, std::uint8_t family, unsigned loopback,
                       std::set<unsigned>* interfaces);

}  // namespace brenvik

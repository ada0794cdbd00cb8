// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <sys/socket.h>
#include <sys/un.h>

#include <cstdint>
#include <optional>
#include <string_view>

#include "platform/base/UniqueFd.h"

// AF_UNIX sockets of type SOCK_SEQPACKET: what channels and named services are made of. Nothing here throws
// or allocates. Any thread.
namespace brenvik {

// The address of a socket file; nothing when the path is empty or too long for one.
std::optional<sockaddr_un> socketAddress(std::string_view path) noexcept;
std::optional<sockaddr_un> socketAddress(std::string_view directory, std::string_view name) noexcept;

enum class Blocking : std::uint8_t { no, yes };

// A socket without an address, close-on-exec. Invalid with errno set when the kernel refuses.
UniqueFd makeSocket(Blocking blocking) noexcept;
// Two connected sockets, blocking and close-on-exec. Returns 0 or an errno; then both stay as they are.
int makeSocketPair(UniqueFd* one, UniqueFd* other) noexcept;
// connect(2) and bind(2): 0, or -1 with errno set.
int connectSocket(int socket, const sockaddr_un& address) noexcept;
int bindSocket(int socket, const sockaddr_un& address) noexcept;

// Whether a descriptor is such a socket, connected or not. Two system calls.
bool isLocalSocket(int descriptor) noexcept;
// The same, and whether it listens as well. Three system calls.
enum class Listening : std::uint8_t { no, yes };
bool isLocalSocket(int descriptor, Listening listening) noexcept;

// Who made the connection (SO_PEERCRED); nothing when the kernel does not say.
std::optional<ucred> peerOf(int connection) noexcept;

// Has each datagram come with its sender's credentials from now on. False with errno set when the kernel
// refuses.
bool askForCredentials(int socket) noexcept;

// Whether no message lies in a socket that can receive none any more, so that closing it drops nothing. Asks
// for credentials on the way: only so an empty message is told from the end of the channel.
bool isDrained(int socket) noexcept;

}  // namespace brenvik

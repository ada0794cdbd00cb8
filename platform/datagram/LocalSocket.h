// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <sys/socket.h>
#include <sys/un.h>

#include <cstdint>
#include <optional>
#include <string_view>

#include "platform/base/UniqueFd.h"

// AF_UNIX sockets of type SOCK_SEQPACKET, on which channels and named services are built. Nothing here throws
// or allocates. Any thread.
namespace brenvik {

// Returns the address of a socket file; nothing if the path is empty or too long for an address.
std::optional<sockaddr_un> socketAddress(std::string_view path) noexcept;
std::optional<sockaddr_un> socketAddress(std::string_view directory, std::string_view name) noexcept;

enum class Blocking : std::uint8_t { no, yes };

// Makes a socket without an address, close-on-exec. Returns an invalid descriptor and sets errno on failure.
UniqueFd makeSocket(Blocking blocking) noexcept;
// Makes two connected sockets, blocking and close-on-exec. Returns 0, or an errno and leaves both as they
// are.
int makeSocketPair(UniqueFd* one, UniqueFd* other) noexcept;
// connect(2) and bind(2). Return 0, or -1 and set errno.
int connectSocket(int socket, const sockaddr_un& address) noexcept;
int bindSocket(int socket, const sockaddr_un& address) noexcept;

// Whether a descriptor is such a socket, connected or not. Makes two system calls.
bool isLocalSocket(int descriptor) noexcept;
// The same, and whether it listens or not. Makes three system calls.
enum class Listening : std::uint8_t { no, yes };
bool isLocalSocket(int descriptor, Listening listening) noexcept;

// The credentials of the process that made the connection (SO_PEERCRED); nothing if the kernel has none.
std::optional<ucred> peerOf(int connection) noexcept;

// From now on, each datagram comes with its sender's credentials. Returns false and sets errno on failure.
bool askForCredentials(int socket) noexcept;

// For a socket that can receive no more: whether it holds no unread message, so that closing it drops
// nothing. It turns credentials on, because only they tell an empty message from the end of the channel.
bool isDrained(int socket) noexcept;

}  // namespace brenvik

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/ipc/linux/ServiceManagerSocket.h"

#include <fcntl.h>
#include <unistd.h>

#include <algorithm>
#include <charconv>
#include <cstdlib>
#include <cstring>
#include <string>
#include <string_view>
#include <system_error>
#include <utility>

#include "platform/datagram/LocalSocket.h"
#include "platform/log/Log.h"

namespace brenvik {
namespace {

// sd_listen_fds(3) tells how a service manager hands over sockets: descriptors from 3 on, for the process
// that LISTEN_PID names, as many as LISTEN_FDS says, with names between colons in LISTEN_FDNAMES. The
// library's own function took 20 us of a start, most of it pages of the library that nothing else at the
// start needs.
constexpr int kFirstListenDescriptor = 3;
struct ListenDescriptors {
  int count = 0;
  std::string names;
};

int numberIn(const char* variable) noexcept {
  const char* const text = std::getenv(variable);
  if (text == nullptr) return 0;
  const char* const end = text + std::strlen(text);
  int number = 0;
  const auto [stopped, error] = std::from_chars(text, end, number);
  return error == std::errc() && stopped == end ? number : 0;
}

// Once: the variables are gone afterwards, for programs that are started from here.
ListenDescriptors takeListenDescriptors() {
  ListenDescriptors given;
  if (numberIn("LISTEN_PID") == ::getpid()) {
    given.count = std::max(numberIn("LISTEN_FDS"), 0);
    if (const char* const names = std::getenv("LISTEN_FDNAMES")) given.names = names;
  }
  for (const char* const variable : {"LISTEN_PID", "LISTEN_FDS", "LISTEN_FDNAMES"}) ::unsetenv(variable);
  return given;
}

}  // namespace

UniqueFd takeServiceManagerSocket(const char* serviceName) {
  const ListenDescriptors given = takeListenDescriptors();
  std::string_view names = given.names;
  UniqueFd chosen;
  for (int i = 0; i < given.count; ++i) {
    // More were promised than are open: the rest was never ours.
    if (::fcntl(kFirstListenDescriptor + i, F_SETFD, FD_CLOEXEC) != 0) break;
    UniqueFd descriptor(kFirstListenDescriptor + i);
    const std::string name(names.substr(0, names.find(':')));
    names.remove_prefix(std::min(name.size() + 1, names.size()));
    if (name != serviceName || chosen.isValid()) {
      logUnified(LogLevel::error, "passed over a listening descriptor named \"%s\"", name.c_str());
    } else if (!isLocalSocket(descriptor.get(), Listening::yes)) {
      logUnified(LogLevel::error, "the descriptor named \"%s\" is no listening SOCK_SEQPACKET socket",
                 serviceName);
    } else {
      chosen = std::move(descriptor);
    }
  }
  return chosen;
}

}  // namespace brenvik

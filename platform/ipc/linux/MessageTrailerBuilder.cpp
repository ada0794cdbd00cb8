// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/ipc/linux/MessageTrailerBuilder.h"

#include <fcntl.h>
#include <poll.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <charconv>
#include <string_view>

#include "platform/base/ProcPath.h"
#include "platform/base/ProcessFacts.h"
#include "platform/base/UniqueFd.h"

#ifndef SO_PEERPIDFD
#define SO_PEERPIDFD 77  // asm-generic/socket.h of Linux 6.5; Debian 12's headers are older
#endif

namespace brenvik {
namespace {

constexpr std::uint32_t kNoLoginUid = 0xFFFFFFFF;

std::uint32_t loginUid(pid_t pid) noexcept {
  const UniqueFd file(::open(ProcPath(pid, "loginuid").c_str(), O_RDONLY | O_CLOEXEC));
  std::array<char, 16> text;
  const ssize_t size = ::read(file.get(), text.data(), text.size());
  std::uint32_t uid = kNoLoginUid;
  if (size > 0) std::from_chars(text.data(), text.data() + size, uid);
  return uid;
}

}  // namespace

MessageTrailer buildTrailer(const ucred& sender, std::uint32_t sequence) noexcept {
  MessageTrailer trailer{};
  trailer.size = sizeof trailer;
  trailer.sequence = sequence;
  trailer.senderUid = sender.uid;
  trailer.senderGid = sender.gid;
  // A sender of another process namespace has the id 0, of which /proc knows nothing.
  const ProcessFacts facts = processFacts(sender.pid).value_or(ProcessFacts{});
  const std::array<std::uint32_t, 8> token{loginUid(sender.pid),
                                           sender.uid,
                                           sender.gid,
                                           sender.uid,
                                           sender.gid,
                                           static_cast<std::uint32_t>(sender.pid),
                                           static_cast<std::uint32_t>(std::max(facts.session, 0)),
                                           facts.startTime};
  for (std::size_t i = 0; i < token.size(); ++i) trailer.auditToken[i] = token[i];
  return trailer;
}

MessageTrailer minimalTrailer() noexcept {
  MessageTrailer trailer{};
  trailer.size = kMinimalTrailerSize;
  return trailer;
}

PeerPin pinPeer(int connection, pid_t peer, pid_t sender) noexcept {
  int raw = -1;
  socklen_t size = sizeof raw;
  if (::getsockopt(connection, SOL_SOCKET, SO_PEERPIDFD, &raw, &size) != 0) {
    return errno == ENOPROTOOPT ? PeerPin::unsupported : PeerPin::refused;
  }
  const UniqueFd pidfd(raw);
  pollfd gone{pidfd.get(), POLLIN, 0};
  if (::poll(&gone, 1, 0) != 0) return PeerPin::refused;  // readable: the process has exited
  return peer > 0 && peer == sender ? PeerPin::confirmed : PeerPin::refused;
}

}  // namespace brenvik

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/messageport/linux/ChannelMessagePorts.h"

#include <sys/socket.h>
#include <sys/uio.h>
#include <sys/un.h>

#include <array>
#include <cstring>
#include <new>
#include <utility>

#include "interface/Wire.h"
#include "platform/base/UniqueFd.h"

namespace brenvik {
namespace {

class ChannelMessagePort final : public RemoteMessagePort {
 public:
  explicit ChannelMessagePort(UniqueFd fd) noexcept : fd_(std::move(fd)) {}

  bool send(std::int32_t messageId, std::span<const std::byte> data) noexcept override {
    const std::size_t size = sizeof(MessageHeader) + data.size();
    if (size > kLargestDatagram) return false;
    MessageHeader header{};
    header.size = static_cast<std::uint32_t>(size);
    header.id = messageId;
    std::array<iovec, 2> parts{iovec{&header, sizeof header},
                               iovec{const_cast<std::byte*>(data.data()), data.size()}};
    msghdr message{};
    message.msg_iov = parts.data();
    message.msg_iovlen = parts.size();
    return ::sendmsg(fd_.get(), &message, MSG_DONTWAIT | MSG_NOSIGNAL) == static_cast<ssize_t>(size);
  }

 private:
  const UniqueFd fd_;
};

}  // namespace

std::unique_ptr<RemoteMessagePort> ChannelMessagePorts::openRemote(const std::string& name) noexcept {
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  if (directory_.size() + 1 + name.size() >= sizeof address.sun_path) return nullptr;
  std::memcpy(address.sun_path, directory_.data(), directory_.size());
  address.sun_path[directory_.size()] = '/';
  std::memcpy(address.sun_path + directory_.size() + 1, name.data(), name.size());

  // Non-blocking from the start: with a full backlog connect() would wait for the listener.
  UniqueFd fd(::socket(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC | SOCK_NONBLOCK, 0));
  if (!fd.isValid()) return nullptr;
  if (::connect(fd.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address) != 0) return nullptr;
  return std::unique_ptr<RemoteMessagePort>(new (std::nothrow) ChannelMessagePort(std::move(fd)));
}

}  // namespace brenvik

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/messageport/linux/ChannelMessagePorts.h"

#include <array>
#include <new>
#include <utility>

#include "interface/Wire.h"
#include "platform/datagram/Datagram.h"
#include "platform/datagram/LocalSocket.h"

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
    const std::array parts{iovecOf(std::as_bytes(std::span(&header, 1))), iovecOf(data)};
    return sendDatagram(fd_.get(), parts) == 0;
  }

 private:
  const UniqueFd fd_;
};

}  // namespace

std::unique_ptr<RemoteMessagePort> ChannelMessagePorts::openRemote(const std::string& name) noexcept {
  const auto address = socketAddress(directory_, name);
  if (!address) return nullptr;
  // Non-blocking from the start: with a full backlog connect() would wait for the listener.
  UniqueFd fd = makeSocket(Blocking::no);
  if (!fd.isValid() || connectSocket(fd.get(), *address) != 0) return nullptr;
  return std::unique_ptr<RemoteMessagePort>(new (std::nothrow) ChannelMessagePort(std::move(fd)));
}

}  // namespace brenvik

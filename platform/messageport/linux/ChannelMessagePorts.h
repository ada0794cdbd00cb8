// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <string>

#include "platform/messageport/MessagePort.h"

namespace brenvik {

// Ports that are named services of the bootstrap directory: sequenced-packet sockets (unix(7)). Each message
// is one datagram: a message header with no reply port, then the data. A datagram of more than
// kLargestDatagram bytes is dropped.
class ChannelMessagePorts final : public MessagePorts {
 public:
  explicit ChannelMessagePorts(std::string bootstrapDirectory) : directory_(std::move(bootstrapDirectory)) {}
  std::unique_ptr<RemoteMessagePort> openRemote(const std::string& name) noexcept override;

 private:
  const std::string directory_;
};

}  // namespace brenvik

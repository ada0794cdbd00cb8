// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "client/Reply.h"

#include <cstring>
#include <utility>

#include "platform/datagram/LocalSocket.h"

namespace brenvik::client {
namespace {

template <class Message>
Message readAs(std::span<const std::byte> datagram) noexcept {
  Message message;
  std::memcpy(&message, datagram.data(), sizeof message);
  return message;
}

bool readPort(std::span<const std::byte> datagram, Incoming* incoming, Reply* reply) noexcept {
  if (datagram.size() != sizeof(CheckInReply) || incoming->descriptorCount != 1) return false;
  const auto message = readAs<CheckInReply>(datagram);
  if (message.descriptorCount != 1 || message.servicePort.type != kPortDescriptorType ||
      message.servicePort.disposition != kDispositionCopySend ||
      !isLocalSocket(incoming->descriptors[0].get())) {
    return false;
  }
  reply->port = std::move(incoming->descriptors[0]);
  return true;
}

bool readOutOfLine(std::span<const std::byte> datagram, const Incoming& incoming, Reply* reply) noexcept {
  if (datagram.size() < sizeof(OutOfLineReply)) return false;
  const auto message = readAs<OutOfLineReply>(datagram);
  if (message.descriptorCount != 1 || message.payload.type != kOutOfLineDescriptorType ||
      message.payload.size != message.byteCount) {
    return false;
  }
  const auto place = placeOfRegion(datagram, sizeof(OutOfLineReply), incoming);
  if (place) reply->region = *place;
  return place.has_value();
}

}  // namespace

std::optional<PortName> answeredPort(std::span<const std::byte> datagram) noexcept {
  if (datagram.size() < sizeof(MessageHeader)) return std::nullopt;
  return readAs<MessageHeader>(datagram).localPort;
}

bool readReply(const RoutineFacts& routine, std::span<const std::byte> datagram, Incoming* incoming,
               Reply* reply) noexcept {
  if (incoming->isCut || datagram.size() < sizeof(MessageHeader)) return false;
  const auto header = readAs<MessageHeader>(datagram);
  if (header.id != routine.id + kReplyIdOffset || header.replyPort != kNullPort) return false;
  reply->datagram = datagram;

  if ((header.bits & kComplexBit) != 0) {
    if (routine.reply == ReplyForm::checkIn) return readPort(datagram, incoming, reply);
    if (routine.reply == ReplyForm::outOfLine) return readOutOfLine(datagram, *incoming, reply);
    return false;
  }

  if (incoming->descriptorCount != 0 || datagram.size() < sizeof(StatusReply)) return false;
  reply->code = readAs<StatusReply>(datagram).returnCode;
  // The transport's own failures have codes that no helper may claim.
  if (reply->code >= BVMH_ERROR_FIRST && reply->code <= BVMH_ERROR_LAST) return false;
  // A failure is always the bare status; a success always has the results that its routine promises.
  if (reply->code != kern::success) return datagram.size() == sizeof(StatusReply);
  return routine.reply != ReplyForm::checkIn && routine.reply != ReplyForm::outOfLine &&
         datagram.size() == sizeOfReply(routine.reply);
}

}  // namespace brenvik::client

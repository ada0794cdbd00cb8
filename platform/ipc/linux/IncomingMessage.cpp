// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/ipc/linux/IncomingMessage.h"

#include <sys/mman.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

#include "platform/datagram/DescriptorWalk.h"
#include "platform/datagram/LocalSocket.h"
#include "platform/datagram/SealedMemory.h"

namespace brenvik {
namespace {

// Bytes of memory that are given back in less time than a request takes that needs the disk. The last close
// of larger memory would hold everybody up, for a second with some gigabytes.
constexpr std::int64_t kQuicklyFreed = std::int64_t{4} << 20;

}  // namespace

IncomingMessage::~IncomingMessage() { release(false); }

IncomingMessage::Received IncomingMessage::receive(int fd) noexcept {
  return receive(fd, 0, sizeof storage_.control, ClosingLine::kClients);
}

IncomingMessage::Received IncomingMessage::peek(int fd, ClosingLine::Account account) noexcept {
  const Received received = receive(fd, MSG_PEEK, kControlRoomOfAStranger, account);
  peeked_ = received == Received::message;
  return received;
}

bool IncomingMessage::take(int fd) noexcept {
  // One descriptor is still ours afterwards; a second one would be dropped here.
  if (descriptorsCut_) return false;
  (void)::recv(fd, nullptr, 0, MSG_DONTWAIT | MSG_TRUNC);
  return true;
}

IncomingMessage::Received IncomingMessage::receive(int fd, int flags, std::size_t controlRoom,
                                                   ClosingLine::Account account) noexcept {
  release(false);
  account_ = account;
  const iovec room{storage_.bytes.data(), storage_.bytes.size()};
  ReceivedDatagram received;
  const int error =
      receiveDatagram(fd, std::span(&room, 1), std::span(storage_.control.bytes).first(controlRoom), fds_,
                      flags | MSG_DONTWAIT, &received);
  if (error != 0) return error == EAGAIN ? Received::nothing : Received::endOfChannel;
  sender_ = received.sender;
  fdCount_ = received.descriptorCount;
  bytesCut_ = received.areBytesCut;
  descriptorsCut_ = received.areDescriptorsCut;
  length_ = received.length;
  if (length_ == 0) {
    release(false);
    return Received::endOfChannel;
  }
  return Received::message;
}

KernelReturn IncomingMessage::mapRegion(UniqueFd& fd, std::uint32_t length, std::uint64_t* address) noexcept {
  const std::int64_t size = sizeOfSealedMemory(fd.get());
  if (size < static_cast<std::int64_t>(length)) return mig::badArguments;
  void* const mapped = mapSealedMemory(fd.get(), length);
  if (mapped == nullptr) return kern::resourceShortage;
  mappings_[mappingCount_++] = {mapped, length};
  *address = reinterpret_cast<std::uint64_t>(mapped);
  // Large memory stays open, for release() to have it closed elsewhere.
  if (size <= kQuicklyFreed) fd.reset();
  return kern::success;
}

KernelReturn IncomingMessage::checkForm() const noexcept {
  if (bytesCut_) return mig::badArguments;
  if (isPlain()) return kern::success;
  const auto walk = walkDescriptors({storage_.bytes.data(), length_});
  if (!walk) return mig::badArguments;
  if (!descriptorsCut_) return walk->rights == fdCount_ ? kern::success : mig::badArguments;
  // Of a stranger's descriptors no more than one was asked for. Else there was room for all that a message
  // may carry, so it was this process that had no descriptor left.
  const bool areTooMany = peeked_ && fdCount_ > 0;
  return areTooMany ? mig::badArguments : kern::resourceShortage;
}

KernelReturn IncomingMessage::unpack(PortName localPort) noexcept {
  if (const KernelReturn code = checkForm(); code != kern::success) return code;
  auto& header = *reinterpret_cast<MessageHeader*>(storage_.bytes.data());
  if (isPlain()) {
    header.size = static_cast<std::uint32_t>(length_);
    header.localPort = localPort;
    return kern::success;
  }
  const std::span<const std::byte> datagram(storage_.bytes.data(), length_);
  const auto walk = walkDescriptors(datagram);

  std::size_t nextFd = 0;
  DescriptorCursor cursor(datagram, walk->messageSize);
  while (const auto descriptor = cursor.next()) {
    std::byte* const at = storage_.bytes.data() + descriptor->offset;
    if (descriptor->kind == WalkedDescriptor::Kind::port) {
      UniqueFd& fd = fds_[nextFd++];
      // One that listens is nobody's other end: nothing would ever tell that a client with it is gone.
      if (!isLocalSocket(fd.get(), Listening::no)) return mig::badArguments;
      const PortName name = ports_.adoptSendRight(std::move(fd), account_);
      if (name == kNullPort) return kern::resourceShortage;
      names_[nameCount_++] = name;
      std::memcpy(at + offsetof(PortDescriptor, name), &name, sizeof name);
      continue;
    }
    std::uint64_t address = 0;  // an empty region stands nowhere, whatever the sender wrote
    if (descriptor->kind == WalkedDescriptor::Kind::inLineRegion) {
      address = reinterpret_cast<std::uint64_t>(storage_.bytes.data() + descriptor->regionOffset);
    } else if (descriptor->kind == WalkedDescriptor::Kind::memfdRegion) {
      if (peeked_) return mig::badArguments;  // nothing of a stranger's is mapped
      const KernelReturn code = mapRegion(fds_[nextFd++], descriptor->regionLength, &address);
      if (code != kern::success) return code;
    }
    std::memcpy(at + offsetof(OutOfLineDescriptor, address), &address, sizeof address);
  }
  header.size = walk->messageSize;
  header.localPort = localPort;
  return kern::success;
}

void IncomingMessage::release(bool keepRights) noexcept {
  // Mappings first: the last of the two to go frees the memory.
  for (std::size_t i = 0; i < mappingCount_; ++i) ::munmap(mappings_[i].address, mappings_[i].length);
  for (std::size_t i = 0; i < fdCount_; ++i) ports_.closing().close(std::move(fds_[i]), account_);
  if (!keepRights) {
    for (std::size_t i = 0; i < nameCount_; ++i) (void)ports_.deallocateSendRight(names_[i]);
  }
  fdCount_ = mappingCount_ = nameCount_ = length_ = 0;
  peeked_ = false;
  account_ = ClosingLine::kClients;
}

}  // namespace brenvik

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <array>
#include <cstddef>
#include <memory>
#include <optional>

#include "interface/Wire.h"
#include "platform/base/UniqueFd.h"
#include "platform/datagram/Datagram.h"
#include "platform/ipc/linux/SystemPortSpace.h"

namespace brenvik {

// One datagram at a time, with everything that came with it, in memory made once. Descriptors, mappings and
// rights that nobody took over are released by release() or by the next receive(). Main loop only.
class IncomingMessage {
 public:
  enum class Received { message, nothing, endOfChannel };

  explicit IncomingMessage(SystemPortSpace& ports) noexcept : ports_(ports) {}
  ~IncomingMessage();
  IncomingMessage(const IncomingMessage&) = delete;
  IncomingMessage& operator=(const IncomingMessage&) = delete;

  // Takes the next datagram of a socket, without waiting: one system call.
  Received receive(int fd) noexcept;

  // As receive, for a stranger's message: it stays in the socket until taken(), and of its descriptors no
  // more than one is received. What is not a message of at most one port is refused by checkForm() and
  // unpack().
  Received peek(int fd, ClosingLine::Account account) noexcept;
  // Takes the message that was peeked at off the socket. False when that would drop descriptors that nobody
  // else holds: it is still there then, and a thread that may wait must take it (ClosingLine).
  bool take(int fd) noexcept;

  // Long enough to be looked at; a shorter datagram is dropped without an answer.
  bool hasHeader() const noexcept { return length_ >= sizeof(MessageHeader); }

  // Whether the framing is right, and as many descriptors came as it asks for. Looks at nothing else.
  // Precondition: hasHeader().
  KernelReturn checkForm() const noexcept;

  // Checks the form, maps what travels as a memfd, gives names to the rights and writes both into the
  // message, with its size and `localPort`. A code of the message layer when no correct sender makes such a
  // datagram, one of the kernel when this process lacks what it takes; the header is as sent then.
  // Precondition: hasHeader().
  KernelReturn unpack(PortName localPort) noexcept;

  // The message, after unpack(); 8-byte aligned.
  std::byte* bytes() noexcept { return storage_.bytes.data(); }
  const MessageHeader& header() const noexcept {
    return *reinterpret_cast<const MessageHeader*>(storage_.bytes.data());
  }

  // What the kernel says of the sender; nothing where the socket does not ask for it.
  const std::optional<ucred>& sender() const noexcept { return sender_; }

  // Ends the message: regions are unmapped; rights are kept when the routine took them over.
  void release(bool keepRights) noexcept;

 private:
  // For one right: CMSG_SPACE would leave room for two.
  static constexpr std::size_t kControlRoomOfAStranger = CMSG_SPACE(sizeof(ucred)) + CMSG_LEN(sizeof(int));

  struct Mapping {
    void* address;
    std::size_t length;
  };
  // Whether it is nothing but its bytes, as most are: then there is nothing to be walked.
  bool isPlain() const noexcept {
    return (header().bits & kComplexBit) == 0 && fdCount_ == 0 && !descriptorsCut_;
  }
  KernelReturn mapRegion(UniqueFd& fd, std::uint32_t length, std::uint64_t* address) noexcept;

  Received receive(int fd, int flags, std::size_t controlRoom, ClosingLine::Account account) noexcept;

  SystemPortSpace& ports_;
  std::size_t length_ = 0;
  bool peeked_ = false;
  bool bytesCut_ = false;
  bool descriptorsCut_ = false;
  ClosingLine::Account account_ = ClosingLine::kClients;
  std::optional<ucred> sender_;
  std::size_t fdCount_ = 0;
  std::size_t mappingCount_ = 0;
  std::size_t nameCount_ = 0;
  std::array<UniqueFd, kMaxDatagramDescriptors> fds_;
  std::array<PortName, kMaxDatagramDescriptors> names_;
  // The control data first: it shares the pages of the above. The mappings last: a check-in has none.
  struct Storage {
    ControlRoom<kMaxDatagramDescriptors> control;
    alignas(16) std::array<std::byte, kLargestDatagram> bytes;
  };
  Storage storage_;
  std::array<Mapping, kMaxDatagramDescriptors> mappings_;
};

}  // namespace brenvik

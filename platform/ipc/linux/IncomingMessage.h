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

// Receives one datagram at a time, with everything that came with it, into memory that is allocated once.
// release() or the next receive() releases the descriptors, mappings and rights that nobody took over. Main
// loop only.
class IncomingMessage {
 public:
  enum class Received { message, nothing, endOfChannel };

  explicit IncomingMessage(SystemPortSpace& ports) noexcept : ports_(ports) {}
  ~IncomingMessage();
  IncomingMessage(const IncomingMessage&) = delete;
  IncomingMessage& operator=(const IncomingMessage&) = delete;

  // Takes the next datagram of a socket without waiting; makes one system call.
  Received receive(int fd) noexcept;

  // Like receive(), for a stranger's message: it stays in the socket until take(), and at most one of its
  // descriptors is received. checkForm() and unpack() refuse any message but one with at most one port.
  Received peek(int fd, ClosingLine::Account account) noexcept;
  // Takes the message that was peeked at off the socket. Returns false if that would close descriptors that
  // nobody else holds: the message then stays, and a thread that may block must take it (ClosingLine).
  bool take(int fd) noexcept;

  // Whether the datagram is long enough for a header; a shorter one is dropped without an answer.
  bool hasHeader() const noexcept { return length_ >= sizeof(MessageHeader); }

  // Returns kern::success if the framing is right and the number of descriptors that came matches it, else a
  // code of the message layer. Looks at nothing else. Precondition: hasHeader().
  KernelReturn checkForm() const noexcept;

  // Checks the form, maps regions that travel as a memfd, gives names to the rights, and writes both into the
  // message, with its size and `localPort`. Returns a code of the message layer if the datagram is malformed,
  // or a kernel code if this process lacks memory or descriptors; the header then stays as it was sent.
  // Precondition: hasHeader().
  KernelReturn unpack(PortName localPort) noexcept;

  // The message, after unpack(); 8-byte aligned.
  std::byte* bytes() noexcept { return storage_.bytes.data(); }
  const MessageHeader& header() const noexcept {
    return *reinterpret_cast<const MessageHeader*>(storage_.bytes.data());
  }

  // The sender's credentials from the kernel; nothing if the socket does not ask for them.
  const std::optional<ucred>& sender() const noexcept { return sender_; }

  // Ends the message: unmaps its regions, and releases its rights unless the routine took them over
  // (`keepRights`).
  void release(bool keepRights) noexcept;

 private:
  // Room for exactly one right; CMSG_SPACE would leave room for two.
  static constexpr std::size_t kControlRoomOfAStranger = CMSG_SPACE(sizeof(ucred)) + CMSG_LEN(sizeof(int));

  struct Mapping {
    void* address;
    std::size_t length;
  };
  // Whether the message is nothing but its bytes, as most are. Then there are no descriptors to walk.
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
  // The control data comes first, because it shares pages with the members above. The mappings come last,
  // because a check-in has none.
  struct Storage {
    ControlRoom<kMaxDatagramDescriptors> control;
    alignas(16) std::array<std::byte, kLargestDatagram> bytes;
  };
  Storage storage_;
  std::array<Mapping, kMaxDatagramDescriptors> mappings_;
};

}  // namespace brenvik

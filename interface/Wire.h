// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <cstddef>
#include <cstdint>

// The elements of every message. All integers are little-endian; sizes are in bytes.
namespace brenvik {

using PortName = std::uint32_t;
inline constexpr PortName kNullPort = 0;
inline constexpr PortName kDeadPort = 0xFFFFFFFF;

// True for the name of a port that can be used: neither null nor dead.
constexpr bool isUsablePort(PortName name) noexcept { return name != kNullPort && name != kDeadPort; }

// Return codes as they cross the interface.
using KernelReturn = std::int32_t;
namespace kern {
inline constexpr KernelReturn success = 0;
inline constexpr KernelReturn noSpace = 3;
inline constexpr KernelReturn failure = 5;
inline constexpr KernelReturn resourceShortage = 6;
inline constexpr KernelReturn noAccess = 8;
inline constexpr KernelReturn memoryFailure = 9;
inline constexpr KernelReturn invalidName = 15;
inline constexpr KernelReturn invalidRight = 17;
inline constexpr KernelReturn invalidSecurity = 35;
}  // namespace kern

// Codes of the message layer itself.
namespace mig {
inline constexpr KernelReturn typeError = -300;     // descriptor of the wrong type, disposition or length
inline constexpr KernelReturn badId = -303;         // unknown message id
inline constexpr KernelReturn badArguments = -304;  // size, complex flag or descriptor count wrong
inline constexpr KernelReturn trailerError = -309;  // receive trailer missing or of another format
}  // namespace mig

inline constexpr std::uint32_t kComplexBit = 0x80000000;
inline constexpr std::uint32_t kReplyDisposition = 18;  // the message wants a reply, or is one
inline constexpr std::int32_t kReplyIdOffset = 100;     // a reply carries the request's id plus this
inline constexpr std::size_t kLargestDatagram = 65536;  // one message, in-line regions included
inline constexpr std::size_t kRegionAlignment = 8;      // an in-line region starts at a multiple of this
inline constexpr std::uint8_t kDispositionMoveSend = 17;
inline constexpr std::uint8_t kDispositionCopySend = 19;
inline constexpr std::uint8_t kPortDescriptorType = 0;
inline constexpr std::uint8_t kOutOfLineDescriptorType = 1;
inline constexpr std::uint8_t kVirtualCopy = 1;

struct [[gnu::packed]] MessageHeader {
  std::uint32_t bits;
  std::uint32_t size;
  PortName replyPort;
  PortName localPort;
  std::uint32_t voucher;
  std::int32_t id;
};
static_assert(sizeof(MessageHeader) == 24 && offsetof(MessageHeader, bits) == 0 &&
              offsetof(MessageHeader, size) == 4 && offsetof(MessageHeader, replyPort) == 8 &&
              offsetof(MessageHeader, localPort) == 12 && offsetof(MessageHeader, voucher) == 16 &&
              offsetof(MessageHeader, id) == 20);

struct [[gnu::packed]] NdrRecord {
  std::uint8_t bytes[8];
};
static_assert(sizeof(NdrRecord) == 8);
inline constexpr NdrRecord kNdrRecord{{0, 0, 0, 0, 1, 0, 0, 0}};

struct [[gnu::packed]] PortDescriptor {
  PortName name;
  std::uint32_t pad1;
  std::uint16_t pad2;
  std::uint8_t disposition;
  std::uint8_t type;
};
static_assert(sizeof(PortDescriptor) == 12 && offsetof(PortDescriptor, name) == 0 &&
              offsetof(PortDescriptor, disposition) == 10 && offsetof(PortDescriptor, type) == 11);

struct [[gnu::packed]] OutOfLineDescriptor {
  std::uint64_t address;
  std::uint8_t deallocate;
  std::uint8_t copy;
  std::uint8_t pad;
  std::uint8_t type;
  std::uint32_t size;
};
static_assert(sizeof(OutOfLineDescriptor) == 16 && offsetof(OutOfLineDescriptor, address) == 0 &&
              offsetof(OutOfLineDescriptor, deallocate) == 8 && offsetof(OutOfLineDescriptor, copy) == 9 &&
              offsetof(OutOfLineDescriptor, type) == 11 && offsetof(OutOfLineDescriptor, size) == 12);

// A complex message: the descriptor count follows the header, the descriptors follow the count.
inline constexpr std::size_t kDescriptorCountOffset = 24;
inline constexpr std::size_t kDescriptorsOffset = 28;

// The offset, in bytes, of the next in-line region in a datagram that is filled up to `end`. The first region
// follows the message, each other one the region before.
constexpr std::size_t regionOffsetAfter(std::size_t end) noexcept {
  return (end + kRegionAlignment - 1) / kRegionAlignment * kRegionAlignment;
}

// The receiving platform appends this to a message, at the message's size rounded up to a multiple of 4.
struct [[gnu::packed]] MessageTrailer {
  std::uint32_t type;
  std::uint32_t size;
  std::uint32_t sequence;
  std::uint32_t senderUid;
  std::uint32_t senderGid;
  std::uint32_t auditToken[8];
};
static_assert(sizeof(MessageTrailer) == 52 && offsetof(MessageTrailer, type) == 0 &&
              offsetof(MessageTrailer, size) == 4 && offsetof(MessageTrailer, sequence) == 8 &&
              offsetof(MessageTrailer, senderUid) == 12 && offsetof(MessageTrailer, senderGid) == 16 &&
              offsetof(MessageTrailer, auditToken) == 20);
inline constexpr std::uint32_t kMinimalTrailerSize = 8;

}  // namespace brenvik

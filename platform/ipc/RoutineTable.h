// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <cstddef>
#include <cstdint>
#include <span>

#include "interface/Routines.h"

namespace brenvik {

// A received request, as the routine's handler sees it. No peer can change its bytes, the rights' names and
// the regions' addresses are filled in, and everything stays valid until the reply has been sent.
class Request {
 public:
  Request(std::byte* bytes, std::uint32_t size, const MessageTrailer* trailer) noexcept
      : bytes_(bytes), size_(size), trailer_(trailer) {}

  const MessageHeader& header() const noexcept { return *reinterpret_cast<const MessageHeader*>(bytes_); }
  // The message's size in bytes, without trailer and in-line regions.
  std::uint32_t size() const noexcept { return size_; }
  bool isComplex() const noexcept { return (header().bits & kComplexBit) != 0; }
  // Precondition: a complex message of at least 28 bytes.
  std::uint32_t descriptorCount() const noexcept { return at<std::uint32_t>(kDescriptorCountOffset); }
  PortName localPort() const noexcept { return header().localPort; }

  // The message as its struct. Precondition: size() is at least the struct's. Writable, because the older
  // routines cut a string field at its last byte in place.
  template <class Message>
  Message& as() const noexcept {
    return *reinterpret_cast<Message*>(bytes_);
  }
  // A field at an offset. Precondition: it lies within the message.
  template <class Field>
  const Field& at(std::size_t offset) const noexcept {
    return *reinterpret_cast<const Field*>(bytes_ + offset);
  }

  // Type and size (kMinimalTrailerSize or the whole 52 bytes) are always valid; the other fields only if the
  // size covers them.
  const MessageTrailer& trailer() const noexcept { return *trailer_; }

 private:
  std::byte* bytes_;
  std::uint32_t size_;
  const MessageTrailer* trailer_;
};

// The reply under construction, zero-filled, at least as large as the largest form. The source fills in the
// header's reply fields; a handler sets the complex bit, the size and the body.
class Reply {
 public:
  explicit Reply(std::byte* bytes) noexcept : bytes_(bytes) {}

  template <class Message>
  Message& as() noexcept {
    return *reinterpret_cast<Message*>(bytes_);
  }
  MessageHeader& header() noexcept { return as<MessageHeader>(); }

  // Makes it the 36-byte status form carrying `code`.
  void setStatus(KernelReturn code) noexcept {
    auto& reply = as<StatusReply>();
    reply.header.bits = kReplyDisposition;
    reply.header.size = sizeof(StatusReply);
    reply.ndr = kNdrRecord;
    reply.returnCode = code;
  }

 private:
  std::byte* bytes_;
};

// Who owns the rights that a request carried: the routine (accepted) or still the transport (refused).
enum class Outcome : bool { refused, accepted };

// A table of routines to be served on a port. It and its context must outlive every source that serves it.
class RoutineTable {
 public:
  using Handler = Outcome (*)(void* context, const Request& request, Reply& reply);

  virtual ~RoutineTable() = default;
  // Returns the handler of a message id, or null for an unknown id. A handler must leave a complete reply,
  // and may allocate only an out-of-line region for it. If it throws std::bad_alloc, the source answers with
  // kern::resourceShortage and the request counts as refused.
  virtual Handler find(std::int32_t id) const noexcept = 0;
  // The `context` argument of the handlers. Called after find().
  virtual void* context() const noexcept = 0;
};

}  // namespace brenvik

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <cstddef>
#include <cstdint>
#include <memory>
#include <span>
#include <string>

namespace brenvik {

// A named port of another process that accepts one-way data messages. One thread at a time.
class RemoteMessagePort {
 public:
  virtual ~RemoteMessagePort() = default;
  // Sends one message without waiting for room or for an answer. Returns false if it was dropped.
  virtual bool send(std::int32_t messageId, std::span<const std::byte> data) noexcept = 0;
};

// The local machine's message ports. Any thread.
class MessagePorts {
 public:
  virtual ~MessagePorts() = default;
  // Returns null if nobody listens under that name, or the listener is too busy. Never waits.
  virtual std::unique_ptr<RemoteMessagePort> openRemote(const std::string& name) noexcept = 0;
};

}  // namespace brenvik

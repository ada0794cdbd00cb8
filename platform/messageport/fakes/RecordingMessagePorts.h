// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <mutex>
#include <new>
#include <string>
#include <utility>
#include <vector>

#include "platform/messageport/MessagePort.h"

namespace brenvik {

// Records every message sent to any name; can also act as if nobody listened.
class RecordingMessagePorts final : public MessagePorts {
 public:
  struct Message {
    std::string port;
    std::int32_t id;
    std::vector<std::byte> data;
  };
  bool nobodyListens = false;
  bool listenerIsBusy = false;

  std::vector<Message> messages() const {
    const std::lock_guard lock(mutex_);
    return messages_;
  }

  std::size_t count() const {
    const std::lock_guard lock(mutex_);
    return messages_.size();
  }

  std::unique_ptr<RemoteMessagePort> openRemote(const std::string& name) noexcept override try {
    if (nobodyListens) return nullptr;
    return std::make_unique<Port>(*this, name);
  } catch (const std::bad_alloc&) {
    return nullptr;
  }

 private:
  class Port final : public RemoteMessagePort {
   public:
    Port(RecordingMessagePorts& ports, std::string name) : ports_(ports), name_(std::move(name)) {}
    bool send(std::int32_t messageId, std::span<const std::byte> data) noexcept override try {
      if (ports_.listenerIsBusy) return false;
      const std::lock_guard lock(ports_.mutex_);
      ports_.messages_.push_back({name_, messageId, {data.begin(), data.end()}});
      return true;
    } catch (const std::bad_alloc&) {
      return false;
    }

   private:
    RecordingMessagePorts& ports_;
    const std::string name_;
  };

  mutable std::mutex mutex_;
  std::vector<Message> messages_;
};

}  // namespace brenvik

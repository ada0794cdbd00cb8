// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/network/linux/LargeMessage.h"

#include <sys/stat.h>

#include <new>
#include <utility>

#include "platform/base/WriteAll.h"

namespace brenvik {
namespace {

// The payload's first byte.
enum class Travels : std::uint8_t { here = 0, inMemory = 1 };

}  // namespace

WorkerMessage packLarge(std::uint32_t kind, std::vector<std::byte> payload,
                        std::vector<UniqueFd> descriptors) {
  WorkerMessage message{kind, {}, std::move(descriptors)};
  if (payload.size() < WorkerMessage::kLongestPayload) {
    payload.insert(payload.begin(), static_cast<std::byte>(Travels::here));
    message.payload = std::move(payload);
  } else {
    message.payload.push_back(static_cast<std::byte>(Travels::inMemory));
    UniqueFd memory = makeSealedMemory("brenvik-message", payload);
    if (!memory.isValid()) throw std::bad_alloc();
    message.descriptors.insert(message.descriptors.begin(), std::move(memory));
  }
  return message;
}

std::optional<LargePayload> LargePayload::open(WorkerMessage message) noexcept {
  LargePayload opened;
  opened.message_ = std::move(message);
  auto& [kind, payload, descriptors] = opened.message_;
  if (payload.empty()) return std::nullopt;
  if (payload[0] == static_cast<std::byte>(Travels::here)) return opened;
  if (payload[0] != static_cast<std::byte>(Travels::inMemory) || payload.size() != 1 || descriptors.empty())
    return std::nullopt;
  struct stat status {};
  if (::fstat(descriptors[0].get(), &status) != 0 || status.st_size < 0 ||
      static_cast<std::uint64_t>(status.st_size) > kLongestLargePayload ||
      SealedMemory::map(descriptors[0].get(), static_cast<std::size_t>(status.st_size), &opened.memory_) !=
          0) {
    return std::nullopt;
  }
  descriptors.erase(descriptors.begin());
  opened.isInMemory_ = true;
  return opened;
}

std::span<const std::byte> LargePayload::bytes() const noexcept {
  return isInMemory_ ? memory_.bytes() : std::span(message_.payload).subspan(1);
}

}  // namespace brenvik

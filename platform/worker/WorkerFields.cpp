// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/worker/WorkerFields.h"

#include <limits>
#include <new>

namespace brenvik {

FieldWriter& FieldWriter::bytes(std::span<const std::byte> value) {
  if (value.size() > std::numeric_limits<std::uint32_t>::max()) throw std::bad_alloc();
  u32(static_cast<std::uint32_t>(value.size()));
  payload_.insert(payload_.end(), value.begin(), value.end());
  return *this;
}

std::span<const std::byte> FieldReader::take(std::size_t size) noexcept {
  if (failed_ || left_.size() < size) {
    fail();
    return {};
  }
  const auto taken = left_.first(size);
  left_ = left_.subspan(size);
  return taken;
}

bool FieldReader::boolean() noexcept {
  const std::uint8_t value = u8();
  if (value > 1) fail();
  return value == 1;
}

std::span<const std::byte> FieldReader::bytes() noexcept {
  const std::uint32_t size = u32();
  return take(size);
}

std::string_view FieldReader::text() noexcept {
  const auto taken = bytes();
  return {reinterpret_cast<const char*>(taken.data()), taken.size()};
}

}  // namespace brenvik

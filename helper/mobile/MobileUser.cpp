// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "helper/mobile/MobileUser.h"

#include <array>
#include <string_view>

namespace brenvik {
namespace {

constexpr std::string_view kName = "mobile";

}  // namespace

MobileUser::MobileUser(AccountDirectory& accounts, CStringAllocator& allocator) noexcept
    : accounts_(accounts), allocator_(allocator) {}

MobileUser::~MobileUser() {
  if (homeDirectory_ != nullptr) allocator_.deallocate(homeDirectory_);
}

MobileUser& MobileUser::processWide(AccountDirectory& accounts) {
  // Work queues may still ask for it while static objects are being destroyed.
  static MobileUser& shared = *new MobileUser(accounts);
  return shared;
}

const char* MobileUser::homeDirectory() noexcept {
  fillOnce();
  return homeDirectory_;
}

uid_t MobileUser::uid() noexcept {
  fillOnce();
  return uid_;
}

gid_t MobileUser::gid() noexcept {
  fillOnce();
  return gid_;
}

void MobileUser::fillOnce() noexcept {
  std::call_once(once_, [this] { fill(); });
}

void MobileUser::fill() noexcept {
  std::array<char, 32> buffer;
  std::size_t size = buffer.size();
  char* const name = GetOrCreateCString(allocator_, kName, buffer.data(), &size, StringEncoding::utf8);
  if (const auto path = accounts_.homeDirectoryOf(name)) {
    homeDirectory_ = GetOrCreateCString(allocator_, *path, nullptr, nullptr, StringEncoding::utf8);
  }
  if (const auto ids = accounts_.idsOf(name)) {
    uid_ = ids->uid;
    gid_ = ids->gid;
  }
  if (name != buffer.data()) allocator_.deallocate(name);
}

}  // namespace brenvik

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "helper/mobile/MobileUser.h"

#include <array>
#include <new>
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

MobileUser& MobileUser::shared(AccountDirectory& accounts) {
  // Work queues may still ask for it while static objects are being destroyed.
  static MobileUser& user = *new MobileUser(accounts);
  return user;
}

const char* MobileUser::homeDirectory() {
  fillOnce();
  return homeDirectory_;
}

uid_t MobileUser::uid() {
  fillOnce();
  return uid_;
}

gid_t MobileUser::gid() {
  fillOnce();
  return gid_;
}

void MobileUser::fillOnce() {
  const std::lock_guard lock(mutex_);
  if (!filled_) fill();
  filled_ = true;
}

void MobileUser::fill() {
  std::array<char, 32> buffer;
  static_assert(kName.size() < buffer.size());  // so that nothing is allocated for it
  std::size_t size = buffer.size();
  const char* const name = GetOrCreateCString(allocator_, kName, buffer.data(), &size, StringEncoding::utf8);
  auto path = accounts_.homeDirectoryOf(name);
  const auto ids = accounts_.idsOf(name);
  if (path) {
    // Paths are built as home + "/Library/..." and compared as text.
    while (path->size() > 1 && path->back() == '/') path->pop_back();
    homeDirectory_ = GetOrCreateCString(allocator_, *path, nullptr, nullptr, StringEncoding::utf8);
    if (homeDirectory_ == nullptr) throw std::bad_alloc();
  }
  if (ids) {
    uid_ = ids->uid;
    gid_ = ids->gid;
  }
}

}  // namespace brenvik

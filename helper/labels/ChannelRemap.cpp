// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "helper/labels/ChannelRemap.h"

#include <algorithm>
#include <array>
#include <cstddef>
#include <memory>
#include <new>
#include <optional>
#include <string>

#include "platform/base/Utf8.h"
#include "platform/log/Log.h"

namespace brenvik {
namespace {

constexpr std::size_t kFieldSize = 64;

// A field's text with the terminator that the field may lack.
std::array<char, kFieldSize + 1> terminated(const char* field) noexcept {
  std::array<char, kFieldSize + 1> text{};
  std::ranges::copy(textOfField(field, kFieldSize), text.begin());
  return text;
}

}  // namespace

KernelReturn ChannelRemap::remapContactsChannel(const char* from, const char* to,
                                                std::uint8_t* success) noexcept {
  *success = remapChannelIdentifier(terminated(from).data(), terminated(to).data()) ? 1 : 0;
  return kern::success;
}

bool ChannelRemap::remapChannelIdentifier(const char* from, const char* to) noexcept {
  logUnified(LogLevel::standard, "remapChannelIdentifier %s -> %s", from, to);
  std::unique_ptr<ContactsChannelManager> manager;
  try {
    manager = contacts_.makeChannelManager();
  } catch (const std::bad_alloc&) {
    // Not the system without contacts that the lines below are about.
    logUnified(LogLevel::standard, "remapChannelIdentifier result: %s : %s", "failure", "out of memory");
    return false;
  }
  if (manager == nullptr) {
    logUnified(LogLevel::error, "unable to create ContactsChannelManager");
    // Kept so: on a system without contacts there is nothing that could have stayed behind.
    return true;
  }
  std::optional<std::string> error;
  const bool done = manager->remapChannelIdentifier(from, to, &error);
  logUnified(LogLevel::standard, "remapChannelIdentifier result: %s : %s", done ? "success" : "failure",
             error.has_value() ? error->c_str() : "(none)");
  return done;
}

}  // namespace brenvik

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <cstdint>
#include <memory>
#include <new>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "platform/base/Utf8.h"
#include "platform/contacts/ContactsChannelManager.h"

namespace brenvik {

// Contacts in memory, which can be made unreachable or failing.
class InMemoryContacts final : public ContactsService {
 public:
  std::unique_ptr<ContactsChannelManager> makeChannelManager() override {
    ++managersAsked;
    if (exhausted) throw std::bad_alloc();
    return isReachable ? std::make_unique<Manager>(*this) : nullptr;
  }

  struct Reference {
    std::int64_t contact;
    std::string channel;
    bool operator==(const Reference&) const = default;
  };
  std::vector<Reference> references;
  bool isReachable = true;
  bool exhausted = false;  // there is no memory
  std::optional<std::string> failWith;
  int managersAsked = 0;
  std::vector<std::pair<std::string, std::string>> remaps;  // as they were asked for

 private:
  class Manager final : public ContactsChannelManager {
   public:
    explicit Manager(InMemoryContacts& contacts) noexcept : contacts_(contacts) {}
    bool remapChannelIdentifier(std::string_view from, std::string_view to,
                                std::optional<std::string>* error) noexcept override {
      contacts_.remaps.emplace_back(from, to);
      if (!isValidUtf8(from) || !isValidUtf8(to)) {
        *error = "not UTF-8";
        return false;
      }
      if (contacts_.failWith.has_value()) {
        *error = contacts_.failWith;
        return false;
      }
      for (Reference& reference : contacts_.references) {
        if (reference.channel == from) reference.channel = to;
      }
      return true;
    }

   private:
    InMemoryContacts& contacts_;
  };
};

}  // namespace brenvik

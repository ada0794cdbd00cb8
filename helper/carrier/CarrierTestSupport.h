// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <array>
#include <cstddef>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "interface/Wire.h"
#include "platform/preferences/PreferencesStore.h"

// Helpers that the tests of the carrier requests share.
namespace brenvik {

inline constexpr PortName kPort = 77;  // any port: the requests do not use it

// A request field: NUL-padded, and full of letters behind its last byte when a test leaves it unterminated.
template <std::size_t size>
struct Field : std::array<char, size> {
  explicit Field(std::string_view text) : std::array<char, size>{} { text.copy(this->data(), size); }
};
using Long = Field<1024>;
using Short = Field<256>;

// Records which domains were flushed; holds no values.
class FlushRecorder final : public PreferencesStore {
 public:
  std::vector<std::optional<std::string>> flushed;

  void setValue(std::string_view, const PropertyList&, std::string_view, UserScope, HostScope) override {}
  bool synchronize(std::string_view, UserScope, HostScope) override { return true; }
  PropertyList copyValue(std::string_view, std::string_view, UserScope, HostScope) override { return {}; }
  bool synchronizeApplication(std::string_view) override { return true; }
  PropertyList copyApplicationValue(std::string_view, std::string_view) override { return {}; }
  void flushCachesForAnyUser(const std::string* domain) noexcept override {
    flushed.push_back(domain == nullptr ? std::nullopt : std::optional(*domain));
  }
};

}  // namespace brenvik

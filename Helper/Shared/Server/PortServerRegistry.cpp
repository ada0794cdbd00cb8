// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "Helper/Shared/Server/PortServerRegistry.h"

namespace brenvik {

PortServerRegistry& PortServerRegistry::shared() {
  static PortServerRegistry registry;
  return registry;
}

void PortServerRegistry::add(PortName name, ServerContext* server) {
  const std::lock_guard lock(mutex_);
  servers_.insert_or_assign(name, server);
}

void PortServerRegistry::remove(PortName name) noexcept {
  const std::lock_guard lock(mutex_);
  servers_.erase(name);
}

ServerContext* PortServerRegistry::lookUp(PortName name) const noexcept {
  const std::lock_guard lock(mutex_);
  const auto found = servers_.find(name);
  return found == servers_.end() ? nullptr : found->second;
}

std::size_t PortServerRegistry::size() const noexcept {
  const std::lock_guard lock(mutex_);
  return servers_.size();
}

}  // namespace brenvik

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "Helper/Shared/Server/ServerFacts.h"

#include <algorithm>
#include <cstring>
#include <mutex>

#include "Helper/Shared/Server/HelperServerUtils.h"

namespace brenvik {

ServerFacts describeServer(const ServerContext& server) {
  ServerFacts facts;
  const std::lock_guard lock(server.lock);
  facts.clients = server.clientWatches.size();
  for (std::size_t bit = 0; bit < server.busyReasons.size(); ++bit) {
    if ((server.busyMask >> bit & 1U) == 0) continue;
    const char* const reason = server.busyReasons[bit];
    const auto known =
        std::find_if(facts.busyTokens.begin(), facts.busyTokens.end(),
                     [reason](const auto& each) { return std::strcmp(each.first, reason) == 0; });
    if (known != facts.busyTokens.end()) {
      ++known->second;
    } else {
      facts.busyTokens.emplace_back(reason, 1);
    }
  }
  if (server.idleTimer == nullptr) return facts;
  const auto period = server.platform.idlePeriod;
  facts.leavesIn = period - (server.platform.now() - server.idleSince) % period;
  facts.isKeptByIdleCheck = server.isKeptByIdleCheck;
  return facts;
}

}  // namespace brenvik

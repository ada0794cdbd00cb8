// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <chrono>
#include <mutex>
#include <string>
#include <vector>

#include "platform/telephony/TelephonyDaemonConnection.h"

namespace brenvik {

// The time limit from a connection's construction to its last answer. A telephony daemon that needs longer
// counts as hung.
inline constexpr std::chrono::milliseconds kTelephonyPatience{1000};

// The telephony daemon behind its named service, a unix(7) SOCK_SEQPACKET socket in the bootstrap directory.
class ChannelTelephonyDaemon final : public TelephonyDaemon {
 public:
  // Opens nothing.
  explicit ChannelTelephonyDaemon(std::string bootstrapDirectory,
                                  std::chrono::milliseconds patience = kTelephonyPatience);

  void addIdentifierException(std::string_view identifier) override;
  std::unique_ptr<TelephonyDaemonConnection> create(std::function<void()> callback) noexcept override;

 private:
  const std::string socketPath_;
  const std::chrono::milliseconds patience_;
  std::mutex mutex_;
  std::vector<std::string> identifiers_;
};

}  // namespace brenvik

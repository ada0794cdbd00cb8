// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

namespace brenvik {

// The result of a push: the error's domain in the lower 32 bits, its code in the upper; code 0 is success.
using TelephonyResult = std::uint64_t;
inline constexpr std::uint32_t kPosixErrorDomain = 1;
inline constexpr std::uint32_t kKernelErrorDomain = 2;  // return codes of the message layer

constexpr TelephonyResult telephonyResult(std::uint32_t domain, std::int32_t code) noexcept {
  return (std::uint64_t{static_cast<std::uint32_t>(code)} << 32) | domain;
}
constexpr std::int32_t errorCodeOf(TelephonyResult result) noexcept {
  return static_cast<std::int32_t>(static_cast<std::uint32_t>(result >> 32));
}

// An open connection to the telephony daemon; destroying it closes it. From its construction to its last
// answer it blocks for at most one second in total, so do not use it on the main loop. One thread at a time.
class TelephonyDaemonConnection {
 public:
  virtual ~TelephonyDaemonConnection() = default;

  // Each text is UTF-8; one that could not be converted is absent, which is not the same as empty.
  virtual TelephonyResult setCivicInfoBasedOnCurrentLocation(
      const std::optional<std::string>& countryCode, const std::optional<std::string>& state,
      const std::optional<std::string>& city, const std::optional<std::string>& postalCode) noexcept = 0;
  virtual TelephonyResult setLocalRoutableAddress(const std::optional<std::string>& address) noexcept = 0;
};

// The client side of the telephony daemon. Any thread.
class TelephonyDaemon {
 public:
  virtual ~TelephonyDaemon() = default;

  // Adds the name of the program for which later connections are made. Adding a name twice has no effect.
  virtual void addIdentifierException(std::string_view identifier) = 0;

  // Opens a connection; returns null if the daemon is absent, refuses, or does not answer within the second.
  // `callback` runs, on the thread that uses the connection, for each message of the daemon that is not an
  // answer.
  virtual std::unique_ptr<TelephonyDaemonConnection> create(std::function<void()> callback) noexcept = 0;
};

}  // namespace brenvik

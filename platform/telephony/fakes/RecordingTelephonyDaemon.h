// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "platform/telephony/TelephonyDaemonConnection.h"

namespace brenvik {

// A telephony daemon that writes down what it is told, and can be absent, refuse, or speak out of turn.
// One thread only.
class RecordingTelephonyDaemon final : public TelephonyDaemon {
 public:
  struct Push {
    std::string what;
    std::vector<std::optional<std::string>> values;
    bool operator==(const Push&) const = default;
  };

  void addIdentifierException(std::string_view identifier) override {
    for (const auto& known : identifiers) {
      if (known == identifier) return;
    }
    identifiers.emplace_back(identifier);
  }
  std::unique_ptr<TelephonyDaemonConnection> create(std::function<void()> callback) noexcept override {
    if (whenCreated) whenCreated();
    identifiersAtCreate.push_back(identifiers);
    if (absent) return nullptr;
    ++connectionsMade;
    ++connectionsOpen;
    return std::make_unique<Connection>(*this, std::move(callback));
  }

  bool absent = false;
  bool speaksOutOfTurn = false;
  TelephonyResult result = 0;
  std::function<void()> whenCreated;
  std::vector<Push> pushes;
  std::vector<std::string> identifiers;
  std::vector<std::vector<std::string>> identifiersAtCreate;
  int connectionsMade = 0;
  int connectionsOpen = 0;

 private:
  class Connection final : public TelephonyDaemonConnection {
   public:
    Connection(RecordingTelephonyDaemon& daemon, std::function<void()> callback)
        : daemon_(daemon), callback_(std::move(callback)) {}
    ~Connection() override { --daemon_.connectionsOpen; }
    TelephonyResult setCivicInfoBasedOnCurrentLocation(
        const std::optional<std::string>& countryCode, const std::optional<std::string>& state,
        const std::optional<std::string>& city,
        const std::optional<std::string>& postalCode) noexcept override {
      return take({"civic", {countryCode, state, city, postalCode}});
    }
    TelephonyResult setLocalRoutableAddress(const std::optional<std::string>& address) noexcept override {
      return take({"address", {address}});
    }

   private:
    TelephonyResult take(Push push) {
      if (daemon_.speaksOutOfTurn) callback_();
      daemon_.pushes.push_back(std::move(push));
      return daemon_.result;
    }
    RecordingTelephonyDaemon& daemon_;
    const std::function<void()> callback_;
  };
};

}  // namespace brenvik

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/geo/linux/StunTransaction.h"

#include <algorithm>
#include <utility>

#include "platform/log/Log.h"

namespace brenvik {
namespace {

// One request's way through the peers.
class Transaction {
 public:
  Transaction(StunNetwork& network, const StunTransactionId& id)
      : network_(network), id_(id), request_(makeStunBindingRequest(id)) {}

  StunOutcome run() {
    peers_.resize(network_.findPeers(kStunPatience));
    if (peers_.empty()) return failure("the name of the STUN server cannot be resolved");
    std::size_t sendings = 0;
    for (;;) {
      const auto now = network_.elapsed();
      if (now >= kStunPatience) return failure("the STUN server does not answer");
      // Sendings that fell due while the name was looked up are one.
      bool due = false;
      for (; sendings < kStunSchedule.size() && kStunSchedule[sendings] <= now; ++sendings) due = true;
      if (due) sendTo(std::exchange(first_, false) ? 1 : peers_.size());
      if (allFailed()) return failure(problem_);
      const std::chrono::nanoseconds until =
          sendings < kStunSchedule.size() ? kStunSchedule[sendings] : kStunPatience;
      auto event = network_.wait(until);
      if (event.kind == StunNetwork::Event::Kind::stopped) return failure("the geo service is stopping");
      if (auto outcome = handle(event)) return *std::move(outcome);
    }
  }

 private:
  struct Peer {
    bool asked = false;
    bool failed = false;
  };

  static StunOutcome failure(const char* description) { return {{}, GeoError{description}}; }
  bool allFailed() const {
    return std::all_of(peers_.begin(), peers_.end(), [](const Peer& peer) { return peer.failed; });
  }

  // Sends to the first `count` peers that have not failed; a failure makes room for one that was not yet
  // asked.
  void sendTo(std::size_t count) {
    for (std::size_t i = 0; i < peers_.size() && count > 0; ++i) {
      if (peers_[i].failed) continue;
      peers_[i].asked = true;
      peers_[i].failed = !network_.send(i, request_);
      if (!peers_[i].failed) --count;
    }
  }

  void fail(std::size_t peer) {
    peers_[peer].failed = true;
    const bool anotherIsAsked = std::any_of(peers_.begin(), peers_.end(),
                                            [](const Peer& other) { return other.asked && !other.failed; });
    if (!anotherIsAsked) sendTo(1);
  }

  std::optional<StunOutcome> handle(StunNetwork::Event& event) {
    if (event.kind == StunNetwork::Event::Kind::peerFailed) fail(event.peer);
    if (event.kind != StunNetwork::Event::Kind::datagram) return std::nullopt;
    auto answer = readStunAnswer(event.bytes, id_);
    switch (answer.verdict) {
      case StunVerdict::address:
        return StunOutcome{std::move(answer.address), {}};
      case StunVerdict::refused:
        problem_ = "the STUN server refuses";
        fail(event.peer);
        break;
      case StunVerdict::noAddress:
        problem_ = "the STUN server's answer has no address";
        fail(event.peer);
        break;
      case StunVerdict::ignored:
        // Anybody who guesses the port can send these; one line says it as well as a thousand.
        if (!std::exchange(complained_, true)) {
          logUnified(LogLevel::error, "geo service: ignored what does not answer the STUN request");
        }
        break;
    }
    return std::nullopt;
  }

  StunNetwork& network_;
  const StunTransactionId& id_;
  const StunRequest request_;
  std::vector<Peer> peers_;
  bool first_ = true;
  const char* problem_ = "the STUN server cannot be reached";  // once all peers have failed
  bool complained_ = false;
};

}  // namespace

StunOutcome runStunTransaction(StunNetwork& network, const StunTransactionId& id) {
  return Transaction(network, id).run();
}

}  // namespace brenvik

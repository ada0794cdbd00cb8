// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <chrono>
#include <cstdint>

// The protocol between the helper and its network worker: the kinds of work, one for each channel, and the
// kinds of messages on a channel. Both programs come from one build.
namespace brenvik {

// The worker's named service in the bootstrap directory.
inline constexpr const char kNetworkWorkerService[] = "com.norvale.brenvik.mobile-helper.network";

enum class NetworkWork : std::uint32_t {
  web = 1,             // one HTTP request
  gunzip = 2,          // one gzip file
  reverseGeocode = 3,  // the address at one coordinate
  publicAddress = 4,   // this device's public address
  echo = 5,            // look-ups and one echo socket: one question and its answer at a time
};

// Messages of all work but `echo`. The helper asks once. The worker sends `alive` from time to time and
// answers once, or refuses because it has no memory, thread or room. If the channel hangs up without either,
// the worker has died.
enum class NetworkMessage : std::uint32_t { ask = 1, alive = 2, answer = 3, refusal = 4 };

// How often a worker sends `alive`, and how long it may be silent before it counts as hung.
inline constexpr std::chrono::seconds kAliveInterval{5};
inline constexpr std::chrono::seconds kLongestSilence{30};

// Messages of `echo`. An answer has the kind of its question; the marked questions have no answer.
enum class EchoMessageKind : std::uint32_t {
  addressOfHost = 1,
  protocolByName = 2,
  indexOfInterface = 3,
  openSocket = 4,
  setReceiveBufferSize = 5,  // no answer
  bindToInterface = 6,       // no answer
  setReceiveTimeOut = 7,
  sendTo = 8,
  receive = 9,
  refusal = 10,  // instead of any answer: no memory, thread or room
};

}  // namespace brenvik

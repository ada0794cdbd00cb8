// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <chrono>
#include <cstdint>

// What the helper and its network worker agree on: the sorts of work, one a channel, and the kinds of
// messages on such a channel. Both programs come from one build.
namespace brenvik {

// The worker's named service in the bootstrap directory.
inline constexpr const char kNetworkWorkerService[] = "com.norvale.brenvik.mobile-helper.network";

enum class NetworkWork : std::uint32_t {
  web = 1,             // one HTTP request
  gunzip = 2,          // one gzip file
  reverseGeocode = 3,  // the address at one coordinate
  publicAddress = 4,   // the address under which this device is seen from outside
  echo = 5,            // look-ups and one echo socket: a question and its answer at a time
};

// On a channel of any work but `echo`: the helper asks once; the worker says now and then that it is at work,
// and answers once, or says that it has no memory, thread or room for this one. A channel that hangs up
// without either is that of a worker that is gone.
enum class NetworkMessage : std::uint32_t { ask = 1, alive = 2, answer = 3, refusal = 4 };

// How often a worker says that it is at work, and how long it may say nothing before it counts as hung.
inline constexpr std::chrono::seconds kAliveInterval{5};
inline constexpr std::chrono::seconds kLongestSilence{30};

// On a channel of `echo`. An answer has the kind of its question; those marked have none.
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
  refusal = 10,  // in the place of any answer: no memory, thread or room
};

}  // namespace brenvik

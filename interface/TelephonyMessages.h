// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <cstddef>
#include <cstdint>

#include "interface/Wire.h"

// The messages between this helper and the telephony daemon's services, byte for byte. Both programs and
// their stand-ins use these definitions.
namespace brenvik {

inline constexpr const char kTelephonyServiceName[] = "com.norvale.brenvik";

inline constexpr const char kNotificationServiceName[] = "com.norvale.Brenvik.lasd";

inline constexpr std::int32_t kSetCivicInfoMessageId = 9100001;
inline constexpr std::int32_t kSetLocalRoutableAddressMessageId = 9100002;

// The region is a binary property list, a dictionary: kClientKey holds an array of strings, the other keys
// hold the pushed values as strings. An absent value has no key.
struct [[gnu::packed]] TelephonyPushMessage {
  MessageHeader header;
  std::uint32_t descriptorCount;
  OutOfLineDescriptor values;
  NdrRecord ndr;
};
static_assert(sizeof(TelephonyPushMessage) == 52 && offsetof(TelephonyPushMessage, descriptorCount) == 24 &&
              offsetof(TelephonyPushMessage, values) == 28 && offsetof(TelephonyPushMessage, ndr) == 44);

struct [[gnu::packed]] TelephonyPushReply {
  MessageHeader header;
  NdrRecord ndr;
  KernelReturn returnCode;  // 0, or the push's error code
  std::uint64_t result;     // error domain in the lower half, error code in the upper
};
static_assert(sizeof(TelephonyPushReply) == 44 && offsetof(TelephonyPushReply, ndr) == 24 &&
              offsetof(TelephonyPushReply, returnCode) == 32 && offsetof(TelephonyPushReply, result) == 36);

inline constexpr const char kClientKey[] = "Client";
inline constexpr const char kCountryCodeKey[] = "CountryCode";
inline constexpr const char kStateKey[] = "State";
inline constexpr const char kCityKey[] = "City";
inline constexpr const char kPostalCodeKey[] = "PostalCode";
inline constexpr const char kAddressKey[] = "Address";

// A notification has no struct of its own: a header with this id and no reply port, then a binary property
// list to the end of the datagram.
inline constexpr std::int32_t kNotificationMessageId = 0;

}  // namespace brenvik

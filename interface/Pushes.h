// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include "interface/Wire.h"

// What the helper sends to the telephony daemon, byte for byte: pushes, which are answered, and
// notifications, which are not.
namespace brenvik {

inline constexpr const char kTelephonyServiceName[] = "com.norvale.brenvik";
inline constexpr const char kNotificationServiceName[] = "com.norvale.Brenvik.lasd";

inline constexpr std::int32_t kSetCivicInfoId = 9100001;
inline constexpr std::int32_t kSetLocalRoutableAddressId = 9100002;
inline constexpr std::int32_t kNotificationId = 0;

// A push. The region is a binary property list: a dictionary with the key "Client" and the push's values.
struct [[gnu::packed]] PushRequest {
  MessageHeader header;
  std::uint32_t descriptorCount;
  OutOfLineDescriptor values;
  NdrRecord ndr;
};
static_assert(sizeof(PushRequest) == 52 && offsetof(PushRequest, values) == 28 &&
              offsetof(PushRequest, ndr) == 44);

struct [[gnu::packed]] PushReply {
  MessageHeader header;
  NdrRecord ndr;
  KernelReturn returnCode;
  std::uint32_t errorDomain;
  std::uint32_t errorCode;
};
static_assert(sizeof(PushReply) == 44 && offsetof(PushReply, returnCode) == 32 &&
              offsetof(PushReply, errorDomain) == 36 && offsetof(PushReply, errorCode) == 40);

// A notification is a header with kNotificationId and no reply port, then a binary property list to the end
// of the datagram.

}  // namespace brenvik

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include "platform/base/UniqueFd.h"

namespace brenvik {

// Returns the listening SOCK_SEQPACKET socket of this name that the service manager passed to this process;
// invalid if there is none. Works once: it removes the environment variables that describe the sockets and
// closes the descriptors with other names. Throws std::bad_alloc.
UniqueFd takeServiceManagerSocket(const char* serviceName);

}  // namespace brenvik

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include "platform/base/UniqueFd.h"

namespace brenvik {

// The listening SOCK_SEQPACKET socket of this name that the service manager started this process with;
// invalid when there is none. Once: the variables that tell of it are gone afterwards, and descriptors under
// other names are closed. May throw std::bad_alloc.
UniqueFd takeServiceManagerSocket(const char* serviceName);

}  // namespace brenvik

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

namespace brenvik::client {

// The descriptor with this name among those that the service manager handed to this process, as the
// environment variables LISTEN_PID, LISTEN_FDS and LISTEN_FDNAMES say (sd_listen_fds(3)); the first of them
// when there are several, -1 when there is none. Reads the environment, so no other thread may change it
// meanwhile.
int descriptorHandedOver(const char* name) noexcept;

}  // namespace brenvik::client

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <sys/resource.h>
#include <sys/types.h>

#include <cstdint>
#include <functional>
#include <string>
#include <vector>

namespace brenvik {

// The rights that a worker keeps of those that it was started with.
struct WorkerRights {
  // If root started it, it changes to the first of these accounts that exists.
  std::vector<std::string> accounts;
  // If none of them exists: this number, as user and as group. -1: the worker then does not run.
  uid_t otherwise = static_cast<uid_t>(-1);
  // Returns the capabilities (capabilities(7)) that it keeps if root started it and this is its group. Empty:
  // it keeps none.
  std::function<std::vector<int>(gid_t)> keptCapabilities;
  // A system call filter (seccomp(2)) lets it open only local sockets, and forbids it to start programs and
  // to inspect other processes. There is no filter on architectures that it does not support.
  bool isLocalOnly = false;
  // If not empty, a filter refuses every other call (EPERM), and the threads that there will be have it, too.
  // Not with sanitizers, which need more calls.
  std::vector<std::uint32_t> onlyCalls = {};
  rlim_t descriptors = 256;
  // Bytes of address space; 0: no limit. Ignored with sanitizers, whose shadow memory exceeds any limit.
  rlim_t addressSpace = 0;
};

// Irrevocably gives up everything else: root's account and groups, capabilities, new privileges through
// exec(2), core dumps, and inspection by other processes of the account. Then checks that it cannot get them
// back. In a user namespace with a single account it keeps that account. Returns null, or a description of
// the failure, after which the process must not continue. Call it before other threads start.
const char* giveUpRights(const WorkerRights& rights) noexcept;

}  // namespace brenvik

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <sys/resource.h>
#include <sys/types.h>

#include <functional>
#include <string>
#include <vector>

namespace brenvik {

// What a worker keeps of the power that it is started with.
struct WorkerRights {
  // The account that it becomes when root started it: the first of these that exists.
  std::vector<std::string> accounts;
  // Where none of them exists: this number, as user and as group. -1: then the worker does not run.
  uid_t otherwise = static_cast<uid_t>(-1);
  // Capabilities (capabilities(7)) that it keeps when root started it and its group is this one. None: no
  // capability.
  std::function<std::vector<int>(gid_t)> keptCapabilities;
  // It opens no socket but local ones, starts no program and looks into no other process: a filter of system
  // calls (seccomp(2)) refuses that. On machines that the filter does not know it is left out.
  bool isLocalOnly = false;
  rlim_t descriptors = 256;
  // Bytes of address space; 0: no limit. Not with sanitizers, whose shadow memory is larger than any limit.
  rlim_t addressSpace = 0;
};

// Gives up everything else for good: root's account and groups, capabilities, new privileges through exec(2),
// core dumps, and being looked at by other processes of the account. Then checks that there is no way back.
// In a user namespace that has one account only, that account stays, unless it is root outside. Null, or in
// words what went wrong: then the process must not go on. Before other threads start.
const char* giveUpRights(const WorkerRights& rights) noexcept;

}  // namespace brenvik

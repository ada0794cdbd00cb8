// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <linux/capability.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <functional>
#include <optional>

#include "platform/security/linux/CallerReader.h"

// For tests of a process that may not look at others.
namespace brenvik {

inline CallerFacts someFacts() { return {FileIdentity{1, 2}, "/usr/bin/program", FileIdentity{3, 4}}; }

// Gives each question the same answer.
class AnsweringReader final : public CallerReader {
 public:
  std::optional<CallerFacts> read(int folder) override {
    ++asked;
    struct stat facts {};
    isFolder = ::fstat(folder, &facts) == 0 && S_ISDIR(facts.st_mode);
    return answer;
  }
  std::optional<CallerFacts> answer = someFacts();
  int asked = 0;
  bool isFolder = false;
};

// The exit status of `work`, run in a child of no capability.
inline int withoutCapabilities(const std::function<int()>& work) {
  const pid_t child = ::fork();
  if (child == 0) {
    __user_cap_header_struct header{_LINUX_CAPABILITY_VERSION_3, 0};
    __user_cap_data_struct none[_LINUX_CAPABILITY_U32S_3] = {};
    ::_exit(::syscall(SYS_capset, &header, none) == 0 ? work() : 99);
  }
  int status = 0;
  if (::waitpid(child, &status, 0) != child || !WIFEXITED(status)) return -1;
  return WEXITSTATUS(status);
}

}  // namespace brenvik

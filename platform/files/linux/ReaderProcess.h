// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <sys/types.h>

#include <chrono>
#include <functional>
#include <string>
#include <string_view>

#include "platform/base/UniqueFd.h"

namespace brenvik {

// A program reading a file and writing to this process. Killed and reaped with the object. One thread.
class ReaderProcess {
 public:
  ReaderProcess() = default;
  ReaderProcess(const ReaderProcess&) = delete;
  ReaderProcess& operator=(const ReaderProcess&) = delete;
  ~ReaderProcess();

  // Starts the program with `input` as its standard input, without arguments, and with no descriptor of this
  // process but that and its output. 0 or errno.
  int start(const std::string& program, int input);

  // Hands what the program writes, at most `wanted` bytes at a time, to `take` until that returns another
  // value than 0, the program closes its output (then EPIPE, unless isComplete() says that nothing is
  // missing) or the time is over (ETIMEDOUT).
  int drain(std::chrono::steady_clock::time_point deadline, const std::function<int(std::string_view)>& take,
            const std::function<std::size_t()>& wanted, const std::function<bool()>& isComplete);

 private:
  pid_t pid_ = -1;
  UniqueFd output_;
};

}  // namespace brenvik

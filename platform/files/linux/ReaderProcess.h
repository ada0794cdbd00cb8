// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <sys/types.h>

#include <chrono>
#include <cstddef>
#include <string>
#include <string_view>

#include "platform/base/UniqueFd.h"

namespace brenvik {

// Takes what a program writes.
class ReaderOutput {
 public:
  virtual ~ReaderOutput() = default;
  // The next bytes. 0 to go on, else the value that ends it.
  virtual int take(std::string_view bytes) = 0;
  // How many bytes the next piece should have at most.
  virtual std::size_t bestPiece() const = 0;
  // Whether the program may end here.
  virtual bool isComplete() const = 0;

  // The next bytes may go into the file at its position instead, at most so many.
  struct Direct {
    int file = -1;
    std::size_t bytes = 0;
  };
  virtual Direct direct() const = 0;
  // So many bytes went there.
  virtual void wentDirectly(std::size_t bytes) = 0;
};

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

  // Hands on what the program writes until that fails (then the answer is its value), the program closes its
  // output (EPIPE, unless isComplete()) or the time is over (ETIMEDOUT).
  int drain(std::chrono::steady_clock::time_point deadline, ReaderOutput& to);

 private:
  int awaitOutput(std::chrono::milliseconds patience) const noexcept;

  pid_t pid_ = -1;
  UniqueFd output_;
};

}  // namespace brenvik

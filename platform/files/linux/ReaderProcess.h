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

// Receives the output of a program.
class ReaderOutput {
 public:
  virtual ~ReaderOutput() = default;
  // Takes the next bytes. Returns 0 to go on; any other value ends drain(), which returns it.
  virtual int take(std::string_view bytes) = 0;
  // The most bytes that the next piece should have.
  virtual std::size_t bestPiece() const = 0;
  // Whether the program may end here.
  virtual bool isComplete() const = 0;

  // A file that the next bytes may be written to at its position, instead of take(), and how many at most.
  struct Direct {
    int file = -1;
    std::size_t bytes = 0;
  };
  virtual Direct direct() const = 0;
  // Called after this many bytes were written to that file.
  virtual void wentDirectly(std::size_t bytes) = 0;
};

// A program that reads a file and writes to this process. The destructor kills and reaps it. One thread.
class ReaderProcess {
 public:
  ReaderProcess() = default;
  ReaderProcess(const ReaderProcess&) = delete;
  ReaderProcess& operator=(const ReaderProcess&) = delete;
  ~ReaderProcess();

  // Starts the program without arguments. Its standard input is `input`; it gets no other descriptor of this
  // process but its output. Returns 0 or an errno.
  int start(const std::string& program, int input);

  // Passes the program's output to `to` until take() fails (returns its value), the program closes its output
  // (returns EPIPE, or 0 if isComplete()) or the deadline has passed (returns ETIMEDOUT).
  int drain(std::chrono::steady_clock::time_point deadline, ReaderOutput& to);

 private:
  int awaitOutput(std::chrono::milliseconds patience) const noexcept;

  pid_t pid_ = -1;
  UniqueFd output_;
};

}  // namespace brenvik

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <string>

namespace brenvik {

// The service manager that started this process and shows its state to people.
class ServiceManager {
 public:
  virtual ~ServiceManager() = default;

  // True if somebody listens. Otherwise show() has no effect.
  virtual bool listens() const noexcept = 0;
  // Shows the line from now on. Does not wait; a line that cannot be sent is lost. Any thread.
  // Throws std::bad_alloc.
  virtual void show(const std::string& line) = 0;
};

}  // namespace brenvik

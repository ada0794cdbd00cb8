// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <string_view>

#include "platform/log/Log.h"

namespace brenvik {

// Drops every line. Any thread.
class NoLog final : public LogSink {
 public:
  void unified(LogLevel, std::string_view, const LogPlace&, const MessageId&) noexcept override {}
  void bsd(SyslogPriority, std::string_view, const MessageId&) noexcept override {}
};

}  // namespace brenvik

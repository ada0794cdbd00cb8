// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include "platform/log/Log.h"
#include "platform/log/linux/Journal.h"

namespace brenvik {

// Writes the unified log to the journal (Journal.h), or, while there is none, to standard error with the <N>
// priority prefix of sd-daemon(3); the BSD log to syslog(3), facility daemon. Lines are escaped
// (EscapedLine.h); one trailing newline of a BSD line is dropped. Any thread.
//
// Every journal entry has the MESSAGE_ID of its text, and the fields of the request it belongs to
// (LogContext.h). syslog(3) cannot carry these fields: if /dev/log is the journal's own socket, the BSD log's
// lines are sent by the journal's protocol, with the same identifier, priority and facility.
class SystemLog final : public LogSink {
 public:
  // `identifier` is not copied; pass a string literal.
  explicit SystemLog(const char* identifier) noexcept;
  ~SystemLog() override;
  SystemLog(const SystemLog&) = delete;
  SystemLog& operator=(const SystemLog&) = delete;

  void unified(LogLevel level, std::string_view line, const LogPlace& place,
               const MessageId& id) noexcept override;
  void bsd(SyslogPriority priority, std::string_view line, const MessageId& id) noexcept override;

 private:
  const char* const identifier_;
  Journal journal_;
};

}  // namespace brenvik

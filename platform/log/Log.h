// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <cstdint>
#include <string_view>

namespace brenvik {

// Levels of the unified log, with the priority each has in the journal.
enum class LogLevel : int { error = 3, standard = 5, info = 6, debug = 7 };

// Priorities of the BSD log, as syslog(3) numbers them.
enum class SyslogPriority : int { error = 3, notice = 5 };

// The place in the source that wrote a line.
struct LogPlace {
  const char* file;
  int line;
  const char*
      function;  // for a sink its name alone; in a call of logUnifiedAt the signature as the compiler has it
};

// Returns the function's name in such a signature, without scope and arguments; for a lambda, the name of the
// enclosing function.
std::string_view functionNameIn(std::string_view signature) noexcept;

// The journal's id for a log text, 128 bits. It is a hash (FNV-1a) of the text in the source, so it stays the
// same as long as the text does. The catalogue that explains the texts uses the same rule.
struct MessageId {
  std::uint64_t high = 0;
  std::uint64_t low = 0;
  bool operator==(const MessageId&) const = default;
};

// The id of a format, without its trailing newline. The format "%s" has no text of its own, so its id is made
// from the line.
MessageId messageIdOf(std::string_view format, std::string_view line) noexcept;

// Receives finished lines. Any thread may call it; implementations never throw, block on a reader or call
// back into the log. `line` is the whole text as the helper wrote it, control characters included; the sink
// must escape characters that a terminal or a log reader could misread.
class LogSink {
 public:
  virtual ~LogSink() = default;
  virtual void unified(LogLevel level, std::string_view line, const LogPlace& place,
                       const MessageId& id) noexcept = 0;
  virtual void bsd(SyslogPriority priority, std::string_view line, const MessageId& id) noexcept = 0;
};

// Replaces the process-wide sink; returns the previous one. The sink must outlive its use; null discards
// every line. Call it before other threads log.
LogSink* setLogSink(LogSink* sink) noexcept;

// Write one line to the unified log or to the BSD log. Any thread. A line longer than 4,096 bytes is cut.
// They allocate nothing and keep errno. logUnified(level, format, ...) is a macro only to pass the line's
// place in the source to the journal.
#define logUnified(...) ::brenvik::logUnifiedAt({__FILE__, __LINE__, __PRETTY_FUNCTION__}, __VA_ARGS__)
[[gnu::format(printf, 3, 4)]] void logUnifiedAt(const LogPlace& place, LogLevel level, const char* format,
                                                ...) noexcept;
[[gnu::format(printf, 2, 3)]] void logBsd(SyslogPriority priority, const char* format, ...) noexcept;

}  // namespace brenvik

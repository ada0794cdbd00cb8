// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/log/linux/SystemLog.h"

#include <poll.h>
#include <sys/stat.h>
#include <sys/uio.h>
#include <syslog.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <atomic>
#include <cinttypes>
#include <cstdio>
#include <span>

#include "platform/log/LogContext.h"
#include "platform/log/linux/EscapedLine.h"

namespace brenvik {
namespace {

constexpr char kSyslogSocket[] = "/dev/log";
constexpr std::string_view kJournalsSyslogSocket = "/run/systemd/journal/dev-log";

// Sends an entry of these fields, followed by those of the request that the line belongs to.
template <std::size_t count>
bool sendWithContext(Journal& journal, const std::array<JournalField, count>& own) noexcept {
  static_assert(count + LogFields::kMaxFields <= Journal::kMaxFields);
  const LogFields context;
  std::array<JournalField, count + LogFields::kMaxFields> all;
  std::copy(own.begin(), own.end(), all.begin());
  std::size_t size = count;
  for (const LogFields::Field& each : context.all()) all[size++] = {each.key, each.value};
  return journal.send(std::span(all).first(size));
}

// Whether syslog(3) would end in the journal anyway, which is then better told natively. Asked anew for each
// line, because the journal may start after the daemon; a look costs less than the line.
bool syslogIsTheJournal() noexcept {
  std::array<char, 64> target;
  const ssize_t size = ::readlink(kSyslogSocket, target.data(), target.size());
  struct stat status {};
  return size > 0 &&
         std::string_view(target.data(), static_cast<std::size_t>(size)) == kJournalsSyslogSocket &&
         ::stat(Journal::kSocket, &status) == 0 && S_ISSOCK(status.st_mode);
}

// How long a reader who makes no room may keep the daemon waiting; after that it misses lines, and nobody
// waits for it again before there is room.
constexpr int kPatienceInMilliseconds = 100;

void writeToStandardError(LogLevel level, std::string_view line) noexcept {
  std::array prefix{'<', static_cast<char>('0' + static_cast<int>(level)), '>'};
  char newline = '\n';
  const std::array<iovec, 3> parts{iovec{prefix.data(), prefix.size()},
                                   iovec{const_cast<char*>(line.data()), line.size()}, iovec{&newline, 1}};
  static std::atomic<bool> isSlow{false};
  pollfd room{STDERR_FILENO, POLLOUT, 0};
  isSlow = ::poll(&room, 1, isSlow ? 0 : kPatienceInMilliseconds) == 0;
  if (isSlow) return;
  // One write a line, so that lines of several threads do not mix; there is nobody to tell when it fails.
  (void)!::writev(STDERR_FILENO, parts.data(), static_cast<int>(parts.size()));
}

class Id {
 public:
  explicit Id(const MessageId& id) noexcept {
    std::snprintf(text_.data(), text_.size(), "%016" PRIx64 "%016" PRIx64, id.high, id.low);
  }
  std::string_view view() const noexcept { return {text_.data(), text_.size() - 1}; }

 private:
  std::array<char, 33> text_;
};

}  // namespace

SystemLog::SystemLog(const char* identifier) noexcept : identifier_(identifier) {
  ::openlog(identifier_, 0, LOG_DAEMON);
}

SystemLog::~SystemLog() { ::closelog(); }

void SystemLog::unified(LogLevel level, std::string_view line, const LogPlace& place,
                        const MessageId& id) noexcept {
  const EscapedLine escaped(line);
  const char digit = static_cast<char>('0' + static_cast<int>(level));
  std::array<char, 12> number;
  const int digits = std::snprintf(number.data(), number.size(), "%d", place.line);
  const Id messageId(id);
  const std::array<JournalField, 7> fields{{{"MESSAGE", escaped.view()},
                                            {"PRIORITY", {&digit, 1}},
                                            {"SYSLOG_IDENTIFIER", identifier_},
                                            {"CODE_FILE", place.file},
                                            {"CODE_LINE", {number.data(), static_cast<std::size_t>(digits)}},
                                            {"CODE_FUNC", place.function},
                                            {"MESSAGE_ID", messageId.view()}}};
  if (!sendWithContext(journal_, fields)) writeToStandardError(level, escaped.view());
}

void SystemLog::bsd(SyslogPriority priority, std::string_view line, const MessageId& id) noexcept {
  if (line.ends_with('\n')) line.remove_suffix(1);
  const EscapedLine escaped(line);
  if (syslogIsTheJournal()) {
    const char digit = static_cast<char>('0' + static_cast<int>(priority));
    const Id messageId(id);
    const std::array<JournalField, 5> fields{{{"MESSAGE", escaped.view()},
                                              {"PRIORITY", {&digit, 1}},
                                              {"SYSLOG_IDENTIFIER", identifier_},
                                              {"SYSLOG_FACILITY", "3"},
                                              {"MESSAGE_ID", messageId.view()}}};
    if (sendWithContext(journal_, fields)) return;
  }
  ::syslog(LOG_DAEMON | static_cast<int>(priority), "%s", escaped.text());
}

}  // namespace brenvik

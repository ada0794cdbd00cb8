// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
// The place of the log call is sent, not this file's.
#define SD_JOURNAL_SUPPRESS_LOCATION

#include "platform/log/linux/SystemLog.h"

#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/uio.h>
#include <sys/un.h>
#include <syslog.h>
#include <systemd/sd-journal.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cinttypes>
#include <cstdio>
#include <cstring>
#include <optional>

#include "platform/base/Utf8.h"
#include "platform/log/LogContext.h"

namespace brenvik {
namespace {

constexpr char kJournalSocket[] = "/run/systemd/journal/socket";
constexpr char kSyslogSocket[] = "/dev/log";
constexpr std::string_view kJournalsSyslogSocket = "/run/systemd/journal/dev-log";

// Whether the byte must be escaped: all beyond ASCII where the line is no UTF-8, the controls of ASCII, and
// both bytes of those from U+0080 to U+009F, which a terminal heeds as well.
bool isDangerous(std::string_view line, std::size_t at, bool utf8) noexcept {
  const auto byteAt = [line](std::size_t i) { return static_cast<unsigned char>(line[i]); };
  const unsigned char byte = byteAt(at);
  if (byte < 0x80) return byte < 0x20 || byte == 0x7F;
  if (!utf8) return true;
  return byte == 0xC2 ? byteAt(at + 1) < 0xA0 : byte < 0xA0 && byteAt(at - 1) == 0xC2;
}

// A finished line with everything escaped that could forge another line or drive a terminal.
class EscapedLine {
 public:
  explicit EscapedLine(std::string_view line) noexcept {
    const bool utf8 = isValidUtf8(line);
    for (std::size_t i = 0; i < line.size(); ++i) {
      if (isDangerous(line, i, utf8)) {
        if (size_ + 4 >= text_.size()) break;
        const auto byte = static_cast<unsigned char>(line[i]);
        std::snprintf(text_.data() + size_, 5, "\\x%02x", static_cast<unsigned>(byte));
        size_ += 4;
      } else {
        if (size_ + 1 >= text_.size()) break;
        text_[size_++] = line[i];
      }
    }
    text_[size_] = '\0';
  }
  const char* text() const noexcept { return text_.data(); }
  std::string_view view() const noexcept { return {text_.data(), size_}; }

 private:
  std::array<char, 8192> text_;
  std::size_t size_ = 0;
};

// One KEY=value field of a journal entry.
class Field {
 public:
  Field(std::string_view key, std::string_view value) noexcept {
    append(key);
    append("=");
    append(value);
  }
  iovec io() const noexcept { return {const_cast<char*>(text_.data()), size_}; }

 private:
  void append(std::string_view part) noexcept {
    const std::size_t count = std::min(part.size(), text_.size() - size_);
    std::memcpy(text_.data() + size_, part.data(), count);
    size_ += count;
  }
  std::array<char, 8200> text_;
  std::size_t size_ = 0;
};

// The fields of an entry, followed by those of the request that the line belongs to.
template <std::size_t count>
bool sendWithContext(const std::array<iovec, count>& own) noexcept {
  const LogFields context;
  std::array<std::optional<Field>, LogFields::kMost> kept;
  std::array<iovec, count + LogFields::kMost> all;
  std::copy(own.begin(), own.end(), all.begin());
  std::size_t size = count;
  for (const LogFields::Field& each : context.all()) {
    all[size] = kept[size - count].emplace(each.key, each.value).io();
    ++size;
  }
  return ::sd_journal_sendv(all.data(), static_cast<int>(size)) >= 0;
}

// Asked anew for each line, because the journal may start after the daemon; a stat costs less than the line.
bool journalIsThere() noexcept {
  struct stat status {};
  return ::stat(kJournalSocket, &status) == 0 && S_ISSOCK(status.st_mode);
}

// Whether syslog(3) would end in the journal anyway, which is then better told natively.
bool syslogIsTheJournal() noexcept {
  std::array<char, 64> target;
  const ssize_t size = ::readlink(kSyslogSocket, target.data(), target.size());
  return size > 0 &&
         std::string_view(target.data(), static_cast<std::size_t>(size)) == kJournalsSyslogSocket &&
         journalIsThere();
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
  if (journalIsThere()) {
    const char digit = static_cast<char>('0' + static_cast<int>(level));
    std::array<char, 12> number;
    const int digits = std::snprintf(number.data(), number.size(), "%d", place.line);
    const Field message("MESSAGE", escaped.view());
    const Field priority("PRIORITY", {&digit, 1});
    const Field identifier("SYSLOG_IDENTIFIER", identifier_);
    const Field file("CODE_FILE", place.file);
    const Field codeLine("CODE_LINE", {number.data(), static_cast<std::size_t>(digits)});
    const Field function("CODE_FUNC", place.function);
    const Field messageId("MESSAGE_ID", Id(id).view());
    const std::array fields{message.io(),  priority.io(), identifier.io(), file.io(),
                            codeLine.io(), function.io(), messageId.io()};
    if (sendWithContext(fields)) return;
  }
  std::array<char, 8200> text;
  const int size =
      std::snprintf(text.data(), text.size(), "<%d>%s\n", static_cast<int>(level), escaped.text());
  // One write a line, so that lines of several threads do not mix; there is nobody to tell when it fails.
  (void)!::write(STDERR_FILENO, text.data(), static_cast<std::size_t>(size));
}

void SystemLog::bsd(SyslogPriority priority, std::string_view line, const MessageId& id) noexcept {
  if (line.ends_with('\n')) line.remove_suffix(1);
  const EscapedLine escaped(line);
  if (syslogIsTheJournal()) {
    const char digit = static_cast<char>('0' + static_cast<int>(priority));
    const Field message("MESSAGE", escaped.view());
    const Field level("PRIORITY", {&digit, 1});
    const Field identifier("SYSLOG_IDENTIFIER", identifier_);
    const Field facility("SYSLOG_FACILITY", "3");
    const Field messageId("MESSAGE_ID", Id(id).view());
    const std::array fields{message.io(), level.io(), identifier.io(), facility.io(), messageId.io()};
    if (sendWithContext(fields)) return;
  }
  ::syslog(LOG_DAEMON | static_cast<int>(priority), "%s", escaped.text());
}

}  // namespace brenvik

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/log/Log.h"

#include <algorithm>
#include <array>
#include <atomic>
#include <cerrno>
#include <cstdarg>
#include <cstdio>

namespace brenvik {
namespace {

// A log line is for people; the longest text of the system with two 1,024-byte fields in it fits.
constexpr std::size_t kLongestLine = 4096;

std::atomic<LogSink*> currentSink{nullptr};

class Line {
 public:
  [[gnu::format(printf, 2, 0)]] Line(const char* format, va_list arguments) noexcept {
    const int wanted = std::vsnprintf(text_.data(), text_.size(), format, arguments);
    if (wanted > 0) size_ = std::min(static_cast<std::size_t>(wanted), text_.size() - 1);
  }
  std::string_view view() const noexcept { return {text_.data(), size_}; }

 private:
  std::array<char, kLongestLine> text_;
  std::size_t size_ = 0;
};

}  // namespace

MessageId messageIdOf(std::string_view format, std::string_view line) noexcept {
  __extension__ using Wide = unsigned __int128;
  constexpr auto wide = [](std::uint64_t high, std::uint64_t low) { return Wide{high} << 64 | low; };
  std::string_view text = format == "%s" ? line : format;
  if (text.ends_with('\n')) text.remove_suffix(1);
  Wide hash = wide(0x6C62272E07BB0142, 0x62B821756295C58D);
  for (const char c : text) hash = (hash ^ static_cast<unsigned char>(c)) * wide(1 << 24, 0x13B);
  return {static_cast<std::uint64_t>(hash >> 64), static_cast<std::uint64_t>(hash)};
}

std::string_view functionNameIn(std::string_view signature) noexcept {
  std::size_t begin = 0;
  int depth = 0;  // of template arguments
  for (std::size_t i = 0; i < signature.size(); ++i) {
    const char c = signature[i];
    if (c == '<') ++depth;
    if (c == '>') --depth;
    if (depth != 0) continue;
    if (c == ' ' || c == ':' || c == '*' || c == '&') begin = i + 1;
    if (c != '(') continue;
    // A scope without a name, as one compiler writes it.
    if (signature.substr(i).starts_with("(anonymous")) {
      i = std::min(signature.find(')', i), signature.size());
      continue;
    }
    if (signature.substr(begin, i - begin) == "operator" && signature.substr(i).starts_with("()"))
      ++i;
    else
      return signature.substr(begin, i - begin);
    if (signature.substr(i).starts_with(")(")) return signature.substr(begin, i + 1 - begin);
  }
  return signature.substr(std::min(begin, signature.size()));
}

LogSink* setLogSink(LogSink* sink) noexcept { return currentSink.exchange(sink); }

void logUnifiedAt(const LogPlace& place, LogLevel level, const char* format, ...) noexcept {
  LogSink* const sink = currentSink.load(std::memory_order_acquire);
  if (sink == nullptr) return;
  const int savedErrno = errno;
  va_list arguments;
  va_start(arguments, format);
  const Line line(format, arguments);
  va_end(arguments);
  std::array<char, 128> function{};
  (void)functionNameIn(place.function).copy(function.data(), function.size() - 1);
  sink->unified(level, line.view(), {place.file, place.line, function.data()},
                messageIdOf(format, line.view()));
  errno = savedErrno;
}

void logBsd(SyslogPriority priority, const char* format, ...) noexcept {
  LogSink* const sink = currentSink.load(std::memory_order_acquire);
  if (sink == nullptr) return;
  const int savedErrno = errno;
  va_list arguments;
  va_start(arguments, format);
  const Line line(format, arguments);
  va_end(arguments);
  sink->bsd(priority, line.view(), messageIdOf(format, line.view()));
  errno = savedErrno;
}

}  // namespace brenvik

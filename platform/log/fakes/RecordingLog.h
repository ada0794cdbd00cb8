// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <map>
#include <mutex>
#include <ostream>
#include <string>
#include <vector>

#include "platform/log/Log.h"
#include "platform/log/LogContext.h"

namespace brenvik {

// Records every line with its channel and level while it lives; its destructor puts the previous sink back.
// Any thread may log; read the lines after the work under test has ended.
class RecordingLog final : public LogSink {
 public:
  struct Entry {
    enum class Channel { unified, bsd };
    Channel channel;
    int level;  // the number of LogLevel or SyslogPriority
    std::string line;
    bool operator==(const Entry&) const = default;
  };

  RecordingLog() : previous_(setLogSink(this)) {}
  RecordingLog(const RecordingLog&) = delete;
  RecordingLog& operator=(const RecordingLog&) = delete;
  ~RecordingLog() override { setLogSink(previous_); }

  void unified(LogLevel level, std::string_view line, const LogPlace&, const MessageId&) noexcept override {
    const std::lock_guard lock(mutex_);
    entries_.push_back({Entry::Channel::unified, static_cast<int>(level), std::string(line)});
    recordFields();
  }
  void bsd(SyslogPriority priority, std::string_view line, const MessageId&) noexcept override {
    const std::lock_guard lock(mutex_);
    entries_.push_back({Entry::Channel::bsd, static_cast<int>(priority), std::string(line)});
    recordFields();
  }

  std::vector<Entry> entries() const {
    const std::lock_guard lock(mutex_);
    return entries_;
  }
  // The fields of each line's request, in the same order.
  std::vector<std::map<std::string, std::string>> fields() const {
    const std::lock_guard lock(mutex_);
    return fields_;
  }
  void clear() {
    const std::lock_guard lock(mutex_);
    entries_.clear();
    fields_.clear();
  }

  static Entry unifiedLine(LogLevel level, std::string line) {
    return {Entry::Channel::unified, static_cast<int>(level), std::move(line)};
  }
  static Entry bsdLine(SyslogPriority priority, std::string line) {
    return {Entry::Channel::bsd, static_cast<int>(priority), std::move(line)};
  }

 private:
  void recordFields() {
    const LogFields fields;
    auto& recorded = fields_.emplace_back();
    for (const auto& each : fields.all()) recorded.emplace(each.key, each.value);
  }
  LogSink* const previous_;
  mutable std::mutex mutex_;
  std::vector<Entry> entries_;
  std::vector<std::map<std::string, std::string>> fields_;
};

// Makes a failed assertion show the line instead of its bytes.
inline void PrintTo(const RecordingLog::Entry& entry, std::ostream* out) {
  *out << (entry.channel == RecordingLog::Entry::Channel::unified ? "unified" : "bsd") << "/" << entry.level
       << " \"" << entry.line << "\"";
}

}  // namespace brenvik

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "interface/status/Status.h"

#include <algorithm>
#include <charconv>
#include <set>
#include <system_error>

namespace brenvik {
namespace {

constexpr std::string_view kFirstLine = "brenvik-status=1";
constexpr std::size_t kLongestWord = 64;
constexpr std::size_t kMaxItems = 64;  // of a list
// Longer than any machine runs, and short enough for a clock's arithmetic.
constexpr std::uint64_t kLongestTime = std::uint64_t{1} << 53;

bool isWord(std::string_view text) noexcept {
  return !text.empty() && text.size() <= kLongestWord && std::all_of(text.begin(), text.end(), [](char c) {
    return (c >= 'a' && c <= 'z') || (c >= '0' && c <= '9') || c == '-';
  });
}

// ---- writing ----------------------------------------------------------------------------------------------

std::string word(const std::string& text) { return isWord(text) ? text : "unknown"; }
std::string number(std::uint64_t value) { return std::to_string(value); }
std::string time(std::chrono::milliseconds value) {
  return std::to_string(std::max<std::int64_t>(value.count(), 0));
}

class Writer {
 public:
  void add(std::string_view key, std::string_view value) {
    text_ += key;
    text_ += '=';
    for (const char c : value) {
      if (static_cast<unsigned char>(c) >= ' ' && c != '\x7f') text_ += c;
    }
    text_ += '\n';
  }
  void add(std::string_view key, bool value) { add(key, std::string_view(value ? "yes" : "no")); }
  std::string take() { return std::move(text_); }

 private:
  std::string text_ = std::string(kFirstLine) + '\n';
};

// ---- reading ----------------------------------------------------------------------------------------------

// The text up to the first blank; the rest stays.
std::string_view firstOf(std::string_view* text) noexcept {
  const std::string_view first = text->substr(0, text->find(' '));
  text->remove_prefix(std::min(first.size() + 1, text->size()));
  return first;
}

bool read(std::string_view text, std::uint64_t* value) noexcept {
  const char* const end = text.data() + text.size();
  const auto [stop, error] = std::from_chars(text.data(), end, *value);
  return error == std::errc() && stop == end && !text.empty();
}

bool read(std::string_view text, std::chrono::milliseconds* value) noexcept {
  std::uint64_t count = 0;
  if (!read(text, &count) || count > kLongestTime) return false;
  *value = std::chrono::milliseconds(count);
  return true;
}

bool read(std::string_view text, bool* value) noexcept {
  *value = text == "yes";
  return *value || text == "no";
}

bool read(std::string_view text, std::string* value) {
  *value = text;
  return true;
}

bool read(std::string_view text, std::optional<std::chrono::milliseconds>* value) noexcept {
  return read(text, &value->emplace());
}

bool readWord(std::string_view text, std::string* value) {
  *value = text;
  return isWord(text);
}

bool read(std::string_view text, StatusReport::Traffic* value) noexcept {
  const std::string_view packets = firstOf(&text);
  return read(packets, &value->packets) && read(text, &value->bytes);
}

bool read(std::string_view text, StatusReport::Event* value) {
  const std::string_view outcome = firstOf(&text);
  return readWord(outcome, &value->outcome) && read(text, &value->age);
}

bool read(std::string_view text, std::optional<StatusReport::Event>* value) {
  return read(text, &value->emplace());
}

bool read(std::string_view text, StatusReport::Busy* value) {
  const std::string_view reason = firstOf(&text);
  return readWord(reason, &value->reason) && read(text, &value->tokens);
}

bool read(std::string_view text, StatusReport::Database* value) {
  const std::string_view type = firstOf(&text);
  return readWord(type, &value->type) && read(text, &value->lastCheck);
}

bool read(std::string_view text, StatusReport::Worker* value) {
  const std::string_view name = firstOf(&text);
  value->isRunning = text == "running";
  return readWord(name, &value->name) && (value->isRunning || text == "stopped");
}

template <class Item>
bool readItem(std::string_view text, std::vector<Item>* list) {
  return list->size() < kMaxItems && read(text, &list->emplace_back());
}

// One line into the report. Lists may have several; any other key stands once.
bool take(std::string_view key, std::string_view value, StatusReport* report) {
  if (key == "version") return read(value, &report->version);
  if (key == "process") return read(value, &report->process);
  if (key == "executable") return read(value, &report->executable);
  if (key == "replaced") return read(value, &report->isReplaced);
  if (key == "socket") return read(value, &report->socket);
  if (key == "running-ms") return read(value, &report->running);
  if (key == "clients") return read(value, &report->clients);
  if (key == "busy-tokens") return read(value, &report->busyTokens);
  if (key == "busy") return readItem(value, &report->busy);
  if (key == "kept-by-baseband") return read(value, &report->isKeptByBaseband);
  if (key == "leaves-in-ms") return read(value, &report->leavesIn);
  if (key == "heartbeat") return read(value, &report->isHeartbeatOn);
  if (key == "heartbeat-sent") return read(value, &report->heartbeatSent);
  if (key == "heartbeat-received") return read(value, &report->heartbeatReceived);
  if (key == "database") return readItem(value, &report->databases);
  if (key == "location-answer") return read(value, &report->locationAnswer);
  if (key == "worker") return readItem(value, &report->workers);
  return true;
}

bool isList(std::string_view key) noexcept { return key == "busy" || key == "database" || key == "worker"; }

constexpr std::string_view kRequired[] = {"version", "process", "running-ms", "clients", "busy-tokens"};

}  // namespace

std::string writeStatus(const StatusReport& report) {
  Writer out;
  out.add("version", report.version);
  out.add("process", number(report.process));
  out.add("executable", report.executable);
  out.add("replaced", report.isReplaced);
  out.add("socket", report.socket);
  out.add("running-ms", time(report.running));
  out.add("clients", number(report.clients));
  out.add("busy-tokens", number(report.busyTokens));
  for (const auto& each : report.busy) out.add("busy", word(each.reason) + ' ' + number(each.tokens));
  out.add("kept-by-baseband", report.isKeptByBaseband);
  if (report.leavesIn) out.add("leaves-in-ms", time(*report.leavesIn));
  out.add("heartbeat", report.isHeartbeatOn);
  const auto traffic = [](const StatusReport::Traffic& each) {
    return number(each.packets) + ' ' + number(each.bytes);
  };
  out.add("heartbeat-sent", traffic(report.heartbeatSent));
  out.add("heartbeat-received", traffic(report.heartbeatReceived));
  const auto event = [](const StatusReport::Event& each) {
    return word(each.outcome) + ' ' + time(each.age);
  };
  for (const auto& each : report.databases)
    out.add("database", word(each.type) + ' ' + event(each.lastCheck));
  if (report.locationAnswer) out.add("location-answer", event(*report.locationAnswer));
  for (const auto& each : report.workers)
    out.add("worker", word(each.name) + (each.isRunning ? " running" : " stopped"));
  return out.take();
}

std::optional<StatusReport> readStatus(std::string_view text) {
  if (text.size() > kLargestStatus || !text.ends_with('\n')) return std::nullopt;
  StatusReport report;
  std::set<std::string_view> seen;
  for (bool isFirst = true; !text.empty(); isFirst = false) {
    const std::string_view line = text.substr(0, text.find('\n'));
    text.remove_prefix(line.size() + 1);
    if (isFirst) {
      if (line != kFirstLine) return std::nullopt;
      continue;
    }
    const std::size_t equals = line.find('=');
    if (equals == std::string_view::npos) return std::nullopt;
    const std::string_view key = line.substr(0, equals);
    if (!isWord(key) || (!seen.insert(key).second && !isList(key))) return std::nullopt;
    if (!take(key, line.substr(equals + 1), &report)) return std::nullopt;
  }
  for (const std::string_view key : kRequired) {
    if (!seen.contains(key)) return std::nullopt;
  }
  return report;
}

std::vector<std::string> busyReasons(const StatusReport& report) {
  std::vector<std::string> words;
  if (report.clients != 0) {
    words.push_back(std::to_string(report.clients) + (report.clients == 1 ? " client" : " clients"));
  }
  for (const auto& each : report.busy) {
    if (each.reason == StatusReport::kDatabaseCheck) {
      words.emplace_back("a database check");
    } else if (each.reason == StatusReport::kHeartbeat) {
      // Switched on twice, it forgets its first token.
      words.emplace_back(report.isHeartbeatOn ? "the heartbeat"
                                              : "a heartbeat that was switched on more than once");
    } else {
      words.push_back(each.reason);
    }
  }
  if (words.empty() && report.isKeptByBaseband) words.emplace_back("the hosted baseband server");
  return words;
}

}  // namespace brenvik

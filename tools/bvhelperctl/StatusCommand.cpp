// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "tools/bvhelperctl/StatusCommand.h"

#include <fcntl.h>
#include <poll.h>
#include <sys/mman.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <chrono>
#include <cstdio>
#include <cstring>
#include <ctime>
#include <filesystem>
#include <system_error>
#include <thread>
#include <utility>

#include "interface/status/Status.h"
#include "platform/base/UniqueFd.h"
#include "tools/bvhelperctl/Advice.h"
#include "tools/bvhelperctl/HelperProcess.h"
#include "tools/support/EventStream.h"
#include "tools/support/PropertyListText.h"

namespace brenvik::tools {
namespace {

using std::chrono::milliseconds;

// The helper answers in a millisecond, or after the one thing that its main loop does at that moment.
constexpr double kPatience = 5;  // seconds

// A helper that is starting or leaving has no status socket for about this long.
constexpr double kBetween = 0.5;  // seconds
constexpr milliseconds kPause{20};

constexpr const char* kServiceUnit = "brenvik-mobile-helper.service";
constexpr const char* kSocketUnit = "brenvik-mobile-helper.socket";

// ---- the socket -------------------------------------------------------------------------------------------

struct Asked {
  enum class Came : std::uint8_t { text, nobody, forbidden, nothing, wrongPeer, failed };
  Came came = Came::nothing;
  std::string text;
  int error = 0;
};

// One try, which may come too early or too often: `nothing`.
Asked askOnce(const sockaddr_un& address, const Patience& patience) {
  const UniqueFd socket(::socket(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC | SOCK_NONBLOCK, 0));
  if (::connect(socket.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address) != 0) {
    switch (errno) {
      case ENOENT:
      case ENOTDIR:
      case ECONNREFUSED:
        return {Asked::Came::nobody, "", errno};
      case EACCES:
      case EPERM:
        return {Asked::Came::forbidden, "", errno};
      case EAGAIN:  // others wait before us
        return {};
      default:
        return {Asked::Came::failed, "", errno};
    }
  }
  ucred peer{};
  socklen_t size = sizeof peer;
  if (::getsockopt(socket.get(), SOL_SOCKET, SO_PEERCRED, &peer, &size) != 0 ||
      (peer.uid != 0 && peer.uid != ::geteuid())) {
    return {Asked::Came::wrongPeer, "", 0};
  }
  pollfd ready{socket.get(), POLLIN, 0};
  if (::poll(&ready, 1, patience.milliseconds()) != 1) return {};
  std::string text(kLargestStatus + 1, '\0');
  const ssize_t length = ::recv(socket.get(), text.data(), text.size(), 0);
  if (length <= 0) return {};  // closed without a word: asked too often
  text.resize(static_cast<std::size_t>(length));
  return {Asked::Came::text, std::move(text), 0};
}

// Whether somebody listens at the path, without connecting to it: that would start the helper.
const char* stateOfSocket(const std::string& path) {
  struct stat facts {};
  if (::stat(path.c_str(), &facts) != 0) return errno == EACCES ? "unknown" : "missing";
  if (!S_ISSOCK(facts.st_mode)) return "no-socket";
  // "Num RefCount Protocol Flags Type St Inode Path"; the flag is the kernel's for a socket that listens.
  const std::string all = factsIn("/proc/net/unix");
  for (std::size_t at = 0; at < all.size();) {
    const std::size_t end = std::min(all.find('\n', at), all.size());
    const std::string_view line = std::string_view(all).substr(at, end - at);
    at = end + 1;
    if (line.ends_with(' ' + path) && line.find(" 00010000 ") != std::string_view::npos) return "listening";
  }
  return "not-listening";
}

// ---- words ------------------------------------------------------------------------------------------------

std::string lasting(milliseconds time) {
  const auto seconds = std::chrono::duration_cast<std::chrono::seconds>(time).count();
  if (seconds < 120) return std::to_string(seconds) + " s";
  if (seconds < 2 * 3600) return std::to_string(seconds / 60) + " min";
  if (seconds < 48 * 3600) return std::to_string(seconds / 3600) + " h";
  return std::to_string(seconds / 86400) + " days";
}

// So long ago, in universal time.
std::string momentBefore(milliseconds age) {
  const auto moment = std::chrono::system_clock::now() - age;
  const std::time_t seconds = std::chrono::system_clock::to_time_t(moment);
  std::tm parts{};
  std::array<char, 64> text{};
  if (::gmtime_r(&seconds, &parts) == nullptr) return "unknown";
  const std::size_t size = std::strftime(text.data(), text.size(), "%Y-%m-%dT%H:%M:%SZ", &parts);
  return {text.data(), size};
}

double secondsOf(milliseconds time) { return static_cast<double>(time.count()) / 1000; }

std::string spaced(std::string word) {
  for (char& c : word) {
    if (c == '-') c = ' ';
  }
  return word;
}

std::string counted(std::uint64_t count, const char* one) {
  return std::to_string(count) + ' ' + one + (count == 1 ? "" : "s");
}

std::string column(std::string word) {
  constexpr std::size_t kWidth = 14;
  word.resize(std::max(word.size(), kWidth), ' ');
  return word;
}

// ---- outcomes ---------------------------------------------------------------------------------------------

Outcome failedWith(ExitStatus status, std::string failure, std::string advice) {
  Outcome outcome;
  outcome.isDone = false;
  outcome.status = status;
  outcome.failure = std::move(failure);
  outcome.advice = std::move(advice);
  return outcome;
}

nlohmann::ordered_json socketFields(const std::string& path) {
  return {{"path", path}, {"state", stateOfSocket(path)}};
}

std::string socketText(const nlohmann::ordered_json& fields) {
  const auto state = fields["state"].get<std::string>();
  const std::string path = printable(fields["path"].get<std::string>());
  if (state == "listening") return path + ", listening";
  if (state == "missing") return path + ", which is missing";
  if (state == "no-socket") return path + ", which is no socket";
  if (state == "not-listening") return path + ", at which nobody seems to listen";
  return path;
}

nlohmann::ordered_json orNull(const std::optional<std::string>& text) {
  return text ? nlohmann::ordered_json(*text) : nlohmann::ordered_json(nullptr);
}

Outcome notRunning(const std::string& servicePath) {
  const auto installed = versionIn(BRENVIK_HELPER_PROGRAM);
  Outcome outcome;
  outcome.fields["running"] = false;
  outcome.fields["installed"] = orNull(installed);
  outcome.fields["socket"] = socketFields(servicePath);
  const bool isListening = outcome.fields["socket"]["state"] == "listening";
  outcome.text = column("helper") +
                 (isListening ? "not running, starts with the next request" : "not running") + '\n' +
                 column("installed") + (installed ? "version " + printable(*installed) : "not known") + '\n' +
                 column("socket") + socketText(outcome.fields["socket"]);
  if (!isListening) {
    outcome.notes.push_back(std::string("nothing would start the helper: systemctl status ") + kSocketUnit +
                            " tells why");
  }
  return outcome;
}

nlohmann::ordered_json fieldsOf(const StatusReport& report, const std::optional<std::string>& installed,
                                bool isPending) {
  const auto traffic = [](const StatusReport::Traffic& each) {
    return nlohmann::ordered_json{{"packets", each.packets}, {"bytes", each.bytes}};
  };
  nlohmann::ordered_json fields{{"running", true},
                                {"version", printable(report.version)},
                                {"installed", orNull(installed)},
                                {"restartPending", isPending},
                                {"pid", report.process},
                                {"executable", jsonOfText(report.executable)},
                                {"socket", socketFields(report.socket)},
                                {"since", momentBefore(report.running)},
                                {"seconds", secondsOf(report.running)},
                                {"clients", report.clients},
                                {"busyTokens", report.busyTokens},
                                {"heldBy", busyReasons(report)},
                                {"leavesIn", nullptr}};
  if (report.leavesIn) fields["leavesIn"] = secondsOf(*report.leavesIn);
  fields["heartbeat"] = {{"on", report.isHeartbeatOn},
                         {"sent", traffic(report.heartbeatSent)},
                         {"received", traffic(report.heartbeatReceived)}};
  fields["databases"] = nlohmann::ordered_json::array();
  for (const auto& [type, check] : report.databases) {
    fields["databases"].push_back({{"type", type},
                                   {"outcome", check.outcome},
                                   {"at", momentBefore(check.age)},
                                   {"age", secondsOf(check.age)}});
  }
  fields["locationAnswer"] = nullptr;
  if (report.locationAnswer) {
    fields["locationAnswer"] = {{"outcome", report.locationAnswer->outcome},
                                {"age", secondsOf(report.locationAnswer->age)}};
  }
  fields["workers"] = nlohmann::ordered_json::array();
  for (const auto& [name, isRunning] : report.workers)
    fields["workers"].push_back({{"name", name}, {"running", isRunning}});
  return fields;
}

std::string textOf(const StatusReport& report, const std::optional<std::string>& installed,
                   const nlohmann::ordered_json& fields) {
  const std::string version = printable(report.version);
  std::string text = column("helper") + "running since " + momentBefore(report.running) + " (" +
                     lasting(report.running) + "), process " + std::to_string(report.process) + '\n';
  text += column("version") + version;
  if (installed && *installed != report.version) text += ", installed is " + printable(*installed);
  text += '\n' + column("socket") + socketText(fields["socket"]) + '\n';

  std::string held;
  for (const std::string& each : busyReasons(report)) held += (held.empty() ? "" : ", ") + each;
  if (held.empty()) {
    held = report.leavesIn ? "nothing: idle, leaves in " +
                                 lasting(std::chrono::ceil<std::chrono::seconds>(*report.leavesIn))
                           : "nothing: waits for its first client";
  }
  text += column("held by") + held + '\n' + column("busy tokens") + std::to_string(report.busyTokens) + '\n';

  const auto traffic = [](const StatusReport::Traffic& each) {
    return counted(each.packets, "packet") + " (" + counted(each.bytes, "byte") + ")";
  };
  text += column("heartbeat") + (report.isHeartbeatOn ? "on" : "off");
  if (report.isHeartbeatOn || report.heartbeatSent.packets != 0) {
    text +=
        ", " + traffic(report.heartbeatSent) + " sent, " + traffic(report.heartbeatReceived) + " received";
  }
  const char* heading = "databases";
  for (const auto& [type, check] : report.databases) {
    text +=
        '\n' + column(std::exchange(heading, "")) + type + ": " + spaced(check.outcome) +
        (check.outcome == "checking" ? ", since " + lasting(check.age) : ", " + lasting(check.age) + " ago");
  }
  if (report.databases.empty()) text += '\n' + column(heading) + "not checked since it runs";
  text += '\n' + column("location");
  if (report.locationAnswer) {
    text += "last request " + spaced(report.locationAnswer->outcome) + ", " +
            lasting(report.locationAnswer->age) + " ago";
  } else {
    text += "no answer since it runs";
  }
  heading = "workers";
  for (const auto& [name, isRunning] : report.workers) {
    text += '\n' + column(std::exchange(heading, "")) + name + (isRunning ? ": running" : ": not running");
  }
  return text;
}

Outcome running(const StatusReport& report) {
  const auto installed = versionIn(report.executable);
  const bool isPending = report.isReplaced || (installed && *installed != report.version);
  Outcome outcome;
  outcome.fields = fieldsOf(report, installed, isPending);
  outcome.text = textOf(report, installed, outcome.fields);
  if (isPending) {
    const std::string what = installed && *installed != report.version
                                 ? "version " + printable(report.version) + " runs, version " +
                                       printable(*installed) + " is installed"
                                 : "the program that runs is not the one that is installed";
    const std::string early =
        report.busyTokens == 0 ? ""
                               : ", for which it is too early: " + counted(report.busyTokens, "busy token");
    outcome.notes.push_back("restart pending: " + what +
                            "; the helper leaves by itself when it is idle, or by systemctl stop " +
                            kServiceUnit + early);
  }
  return outcome;
}

// Whether the program that the process was started from has been replaced since. /proc shows that to root
// alone.
bool isReplaced(const HelperProcess& process) {
  std::error_code error;
  const auto program =
      std::filesystem::read_symlink("/proc/" + std::to_string(process.id) + "/exe", error).string();
  // As the kernel marks a file that has been removed, or replaced by another.
  return !error && program.ends_with(" (deleted)");
}

Outcome runsUnseen(const HelperProcess& process, const std::string& path) {
  const std::string tells = "the helper runs (process " + std::to_string(process.id) +
                            "), and tells nothing: there is no " + printable(path);
  if (isReplaced(process)) {
    return failedWith(
        ExitStatus::failed, tells + "; restart pending: its program is not the one that is installed",
        std::string("It is of an older version, which has no status. It leaves by itself when it is "
                    "idle, or by systemctl stop ") +
            kServiceUnit + "; a call that it carries out then gets no answer.");
  }
  return failedWith(
      ExitStatus::failed, tells,
      std::string("It is starting or leaving, is of an older version, or may not write that folder; "
                  "journalctl -u ") +
          kServiceUnit + " tells.");
}

std::optional<HelperProcess> helperHere() {
  for (HelperProcess& each : helperProcesses()) {
    if (each.isOfThisSystem) return std::move(each);
  }
  return std::nullopt;
}

}  // namespace

std::optional<std::string> versionIn(const std::string& path) {
  const UniqueFd file(::open(path.c_str(), O_RDONLY | O_NONBLOCK | O_NOCTTY | O_CLOEXEC));
  struct stat facts {};
  if (::fstat(file.get(), &facts) != 0 || !S_ISREG(facts.st_mode) || facts.st_size <= 0) return std::nullopt;
  const auto size = static_cast<std::size_t>(facts.st_size);
  void* const mapped = ::mmap(nullptr, size, PROT_READ, MAP_PRIVATE, file.get(), 0);
  if (mapped == MAP_FAILED) return std::nullopt;
  // As what(1) has it; in two parts, so that this program is not taken for the helper.
  const std::string mark = std::string("@(#)") + "BrenvikMobileHelper ";
  const std::string_view content(static_cast<const char*>(mapped), size);
  std::optional<std::string> version;
  if (const std::size_t at = content.find(mark); at != std::string_view::npos) {
    const std::string_view rest = content.substr(at + mark.size(), 64);
    version = std::string(rest.substr(0, rest.find('\0')));
  }
  (void)::munmap(mapped, size);  // fails for wrong arguments only
  return version;
}

Outcome showStatus(const Values& values) {
  const std::string servicePath = values.get("--socket", bvmh_service_socket());
  const std::string path = servicePath + std::string(kStatusSocketSuffix);
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  if (servicePath.empty() || path.size() >= sizeof address.sun_path) {
    throw UsageError{"--socket: the path is empty or too long for a socket"};
  }
  path.copy(address.sun_path, path.size());

  const double seconds = values.has("--timeout") ? secondsIn(values["--timeout"]) : kPatience;
  const Patience patience(seconds);
  const Patience between(std::min(seconds, kBetween));
  for (;;) {
    const Asked asked = askOnce(address, patience);
    switch (asked.came) {
      case Asked::Came::text: {
        const auto report = readStatus(asked.text);
        if (report) return running(*report);
        return failedWith(ExitStatus::protocol, "what came from " + printable(path) + " is no status",
                          "Are the helper and this program of the same release?");
      }
      case Asked::Came::nobody: {
        const auto process = helperHere();
        if (!process) return notRunning(servicePath);
        if (between.isOver()) return runsUnseen(*process, path);
        break;
      }
      case Asked::Came::forbidden:
        return failedWith(ExitStatus::refused, "refused: this account may not connect to " + printable(path),
                          groupAdvice());
      case Asked::Came::wrongPeer:
        return failedWith(ExitStatus::protocol,
                          printable(path) + " is not the helper's: another account listens there", "");
      case Asked::Came::failed:
        return failedWith(ExitStatus::unreachable,
                          "cannot reach the helper at " + printable(path) + ": " + std::strerror(asked.error),
                          "");
      case Asked::Came::nothing:
        if (patience.isOver()) {
          std::array<char, 32> text{};
          std::snprintf(text.data(), text.size(), "%g", seconds);
          return failedWith(
              ExitStatus::timedOut, std::string("no status in ") + text.data() + " s",
              "The helper is busy with one request, or this account asks too often. --timeout waits longer.");
        }
        break;
    }
    std::this_thread::sleep_for(kPause);
  }
}

}  // namespace brenvik::tools

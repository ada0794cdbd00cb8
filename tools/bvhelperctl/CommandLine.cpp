// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "tools/bvhelperctl/CommandLine.h"

#include <sys/stat.h>
#include <unistd.h>

#include <array>
#include <cmath>
#include <cstdio>
#include <cstring>
#include <memory>
#include <new>
#include <optional>
#include <string>

#include "tools/bvhelperctl/Advice.h"
#include "tools/bvhelperctl/CommandTable.h"
#include "tools/bvhelperctl/Completion.h"
#include "tools/support/EventStream.h"
#include "tools/support/ExitStatus.h"
#include "tools/support/Output.h"
#include "tools/support/PropertyListText.h"

namespace brenvik::tools {
namespace {

constexpr const char* kProgram = "bvhelperctl";

struct Settings {
  bool asJson = false;
  double timeout = BVMH_DEFAULT_TIMEOUT_MS / 1000.0;  // seconds
  std::optional<std::string> socket;                  // none: the place compiled in
};

struct FreeClient {
  void operator()(bvmh_client* client) const { bvmh_client_free(client); }
};
using ClientPointer = std::unique_ptr<bvmh_client, FreeClient>;

// ---- what the user sees ---------------------------------------------------------------------------------

ExitStatus fail(const Settings& settings, ExitStatus status, const std::string& message,
                const std::string& advice = "",
                const nlohmann::ordered_json& fields = nlohmann::ordered_json::object()) {
  printFailure(kProgram, settings.asJson, message, advice, fields);
  return status;
}

std::string pathOfThisProgram() {
  std::array<char, 4096> path{};
  const ssize_t length = ::readlink("/proc/self/exe", path.data(), path.size() - 1);
  return length > 0 ? printable({path.data(), static_cast<std::size_t>(length)}) : std::string(kProgram);
}

// Whether others than root could change this program: it gets no entitlement then.
bool isChangeableByOthers() {
  struct stat facts {};
  return ::stat("/proc/self/exe", &facts) == 0 && (facts.st_uid != 0 || (facts.st_mode & 022) != 0);
}

// What to do about a refused check-in, ready to be copied.
std::string entitlementAdvice() {
  const std::string owner = isChangeableByOthers()
                                ? "This program must belong to root first, and be writable by nobody else.\n"
                                : "";
  return owner +
         "bvhelperctl access shows why, step by step. Give it one: put the following into a "
         "file " BRENVIK_ENTITLEMENT_DIRECTORY
         "/bvhelperctl.plist, owned by root and writable by nobody else:\n"
         "  <?xml version=\"1.0\" encoding=\"UTF-8\"?>\n"
         "  <plist version=\"1.0\"><dict>\n"
         "    <key>Executable</key><string>" +
         pathOfThisProgram() +
         "</string>\n"
         "    <key>User</key><string>" +
         accountOfThisProcess() +
         "</string>\n"
         "    <key>Entitlements</key>\n"
         "    <dict><key>com.norvale.Teravox.BrenvikHelper.allow</key><true/></dict>\n"
         "  </dict></plist>";
}

bool isTransportFailure(std::int32_t code) { return code >= BVMH_ERROR_FIRST && code <= BVMH_ERROR_LAST; }

std::string socketOf(const Settings& settings) { return settings.socket.value_or(bvmh_service_socket()); }

ExitStatus reportCode(const Settings& settings, bvmh_client* client, const Outcome& outcome) {
  nlohmann::ordered_json fields{{"routine", outcome.routine}, {"code", outcome.code}};
  fields.update(outcome.fieldsOfFailure);
  const std::string text = bvmh_error_text(outcome.code);
  const int error = client == nullptr ? 0 : bvmh_client_errno(client);
  const std::string reason = error == 0 ? "" : std::string(": ") + std::strerror(error);
  const std::string& failure = outcome.failure.empty() ? text : outcome.failure;
  const ExitStatus status = outcome.status.value_or(statusOfCode(outcome.code));
  switch (outcome.code) {
    case BVMH_ERROR_UNREACHABLE:
      return fail(settings, status, "cannot reach the helper at " + printable(socketOf(settings)) + reason,
                  "Is BrenvikMobileHelper installed, and its socket unit started? systemctl status "
                  "brenvik-mobile-helper.socket tells.",
                  fields);
    case BVMH_ERROR_TIMED_OUT: {
      std::array<char, 32> seconds{};
      std::snprintf(seconds.data(), seconds.size(), "%g", settings.timeout);
      return fail(settings, status, std::string("no answer in ") + seconds.data() + " s",
                  "The request may still be carried out. --timeout waits longer.", fields);
    }
    case BVMH_INVALID_SECURITY:
      if (error == EACCES) {
        return fail(settings, status,
                    "refused: this account may not connect to " + printable(socketOf(settings)),
                    groupAdvice() + "\nIt then needs the entitlement, too: this command tells how.", fields);
      }
      return fail(settings, status, "refused: " + text, entitlementAdvice(), fields);
    case BVMH_NO_ACCESS:
      return fail(settings, status, "refused: " + failure, "", fields);
    default:
      break;
  }
  if (isTransportFailure(outcome.code)) return fail(settings, status, text + reason, "", fields);
  return fail(settings, status, failure + " (code " + std::to_string(outcome.code) + ")", "", fields);
}

ExitStatus report(const Settings& settings, bvmh_client* client, const Outcome& outcome) {
  if (outcome.code != BVMH_OK) return reportCode(settings, client, outcome);
  nlohmann::ordered_json fields = nlohmann::ordered_json::object();
  if (*outcome.routine != '\0') fields = {{"routine", outcome.routine}, {"code", outcome.code}};
  if (!outcome.isDone) {
    fields.update(outcome.fieldsOfFailure);
    return fail(settings, outcome.status.value_or(ExitStatus::failed), outcome.failure, outcome.advice,
                fields);
  }
  // A loss is told at the end.
  if (settings.asJson) {
    nlohmann::ordered_json line{{"ok", true}};
    line.update(fields);
    line.update(outcome.fields);
    if (!outcome.notes.empty()) line["notes"] = outcome.notes;
    (void)printOut(jsonLine(line) + '\n');
  } else if (outcome.raw) {
    (void)printOut(*outcome.raw);
  } else if (!outcome.text.empty()) {
    (void)printOut(outcome.text + '\n');
  }
  if (!settings.asJson) {
    for (const std::string& each : outcome.notes)
      std::fprintf(stderr, "%s: note: %s\n", kProgram, each.c_str());
  }
  return outcome.status.value_or(ExitStatus::done);
}

// ---- running a command ----------------------------------------------------------------------------------

ExitStatus watch(const Settings& settings, const Values& values) {
  EventStreamOptions options;
  options.program = kProgram;
  options.asJson = settings.asJson;
  options.directory = values.get("--directory", "");
  if (values.has("--count")) options.most = numberIn<std::uint64_t>(values["--count"]);
  if (values.has("--timeout")) options.seconds = secondsIn(values["--timeout"]);
  if (values.has("--helper-uid")) options.helperUid = numberIn<std::uint32_t>(values["--helper-uid"]);
  return printEvents(options);
}

ExitStatus run(const Settings& settings, const Command& command, const Values& values) {
  if (command.run == nullptr) return watch(settings, values);
  if (command.isLocal) return report(settings, nullptr, command.run(nullptr, values));
  const ClientPointer client(bvmh_client_create());
  if (client == nullptr) throw std::bad_alloc();
  bvmh_client_set_timeout(client.get(), static_cast<std::uint32_t>(std::ceil(settings.timeout * 1000)));
  if (settings.socket && bvmh_client_set_socket(client.get(), settings.socket->c_str()) != BVMH_OK) {
    throw UsageError{"--socket: the path is empty or too long for a socket"};
  }
  return report(settings, client.get(), command.run(client.get(), values));
}

ExitStatus runLine(Settings& settings, int argc, const char* const* argv) {
  const ProgramSyntax syntax = programSyntax();
  const ParsedLine line = parseCommandLine(syntax, argc, argv);
  if (line.wish != ParsedLine::Wish::command) {
    // Asked for before or after it.
    const bool asJson = isFlagGiven("--json", argc, argv);
    // A loss is told at the end.
    (void)printOut(line.wish == ParsedLine::Wish::help ? helpOutput(syntax, line, asJson)
                                                       : versionOutput(syntax, BRENVIK_VERSION, asJson));
    return ExitStatus::done;
  }
  const Command& command = commandTable()[*line.command];
  settings.asJson = line.globals.has("--json");
  // The library says whether the path of a socket will do.
  if (line.globals.has("--socket")) settings.socket = line.globals["--socket"];
  if (line.globals.has("--timeout")) {
    settings.timeout =
        secondsIn(checkedValue(parameterNamed(globalOptions(), "--timeout"), line.globals["--timeout"]));
  }
  Values values = checkedValues(command.positionals, command.options, line.given);
  for (const auto& [name, value] : line.globals.all()) values.add(name, value);
  return run(settings, command, values);
}

}  // namespace

int runCommandLine(int argc, const char* const* argv) {
  prepareStandardStreams();
  Settings settings;
  ExitStatus status = ExitStatus::failed;
  try {
    if (isCompletionRequest(argc, argv)) {
      status = printOffers(argc, argv);
    } else {
      status = runLine(settings, argc, argv);
    }
  } catch (const UsageError& error) {
    // A program that asked for JSON gets it for wrong usage too, which may have been met before the wish.
    settings.asJson = isFlagGiven("--json", argc, argv);
    const std::string advice =
        error.advice.empty() && error.isAboutSyntax ? "Run with --help for more." : error.advice;
    status = fail(settings, ExitStatus::usage, error.message, advice);
  } catch (const std::bad_alloc&) {
    // Nothing here may need memory.
    static constexpr char kMessage[] = "bvhelperctl: out of memory\n";
    (void)!::write(STDERR_FILENO, kMessage, sizeof kMessage - 1);
  } catch (const std::exception& error) {
    status = fail(settings, ExitStatus::failed, error.what());
  }
  return finishOutput(kProgram, status);
}

}  // namespace brenvik::tools

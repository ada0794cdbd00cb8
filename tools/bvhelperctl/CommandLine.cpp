// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "tools/bvhelperctl/CommandLine.h"

#include <pwd.h>
#include <sys/stat.h>
#include <unistd.h>

#include <CLI/CLI.hpp>
#include <algorithm>
#include <array>
#include <chrono>
#include <cmath>
#include <cstdio>
#include <cstring>
#include <deque>
#include <memory>
#include <optional>
#include <string>

#include "tools/bvhelperctl/AccessCommand.h"
#include "tools/bvhelperctl/CommandTable.h"
#include "tools/support/EventStream.h"
#include "tools/support/PropertyListText.h"

namespace brenvik::tools {
namespace {

constexpr const char* kProgram = "bvhelperctl";

enum ExitStatus { kDone = 0, kRefused = 1, kUnusable = 2 };

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

void printJson(const nlohmann::ordered_json& value) { std::printf("%s\n", jsonLine(value).c_str()); }

int fail(const Settings& settings, ExitStatus status, const std::string& message,
         const std::string& advice = "", nlohmann::ordered_json fields = nlohmann::ordered_json::object()) {
  if (settings.asJson) {
    nlohmann::ordered_json line{{"ok", false}};
    line.update(fields);
    line["error"] = message;
    if (!advice.empty()) line["advice"] = advice;
    printJson(line);
  } else {
    std::fprintf(stderr, "%s: %s\n", kProgram, message.c_str());
    if (!advice.empty()) std::fprintf(stderr, "%s\n", advice.c_str());
  }
  return status;
}

std::string pathOfThisProgram() {
  std::array<char, 4096> path{};
  const ssize_t length = ::readlink("/proc/self/exe", path.data(), path.size() - 1);
  return length > 0 ? printable({path.data(), static_cast<std::size_t>(length)}) : std::string(kProgram);
}

std::string accountOfThisProcess() {
  const passwd* account = ::getpwuid(::geteuid());
  return account == nullptr ? "user " + std::to_string(::geteuid()) : printable(account->pw_name);
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

// What to do when the account may not even connect.
std::string groupAdvice() {
  return "Only root and members of the group \"" BRENVIK_SERVICE_GROUP
         "\" may. Let an administrator add the account, and log in anew:\n"
         "  usermod -aG " BRENVIK_SERVICE_GROUP " " +
         accountOfThisProcess() +
         "\n"
         "It then needs the entitlement, too: this command tells how.";
}

bool isTransportFailure(std::int32_t code) { return code >= BVMH_ERROR_FIRST && code <= BVMH_ERROR_LAST; }

std::string socketOf(const Settings& settings) { return settings.socket.value_or(bvmh_service_socket()); }

int reportCode(const Settings& settings, bvmh_client* client, const char* routine, std::int32_t code,
               const std::string& failure) {
  const nlohmann::ordered_json fields{{"routine", routine}, {"code", code}};
  const std::string text = bvmh_error_text(code);
  const int error = bvmh_client_errno(client);
  const std::string reason = error == 0 ? "" : std::string(": ") + std::strerror(error);
  switch (code) {
    case BVMH_ERROR_UNREACHABLE:
      return fail(settings, kUnusable, "cannot reach the helper at " + printable(socketOf(settings)) + reason,
                  "Is BrenvikMobileHelper installed, and its socket unit started? systemctl status "
                  "brenvik-mobile-helper.socket tells.",
                  fields);
    case BVMH_ERROR_TIMED_OUT: {
      std::array<char, 32> seconds{};
      std::snprintf(seconds.data(), seconds.size(), "%g", settings.timeout);
      return fail(settings, kUnusable, std::string("no answer in ") + seconds.data() + " s",
                  "The request may still be carried out. --timeout waits longer.", fields);
    }
    case BVMH_INVALID_SECURITY:
      if (error == EACCES) {
        return fail(settings, kRefused,
                    "refused: this account may not connect to " + printable(socketOf(settings)),
                    groupAdvice(), fields);
      }
      return fail(settings, kRefused, "refused: " + text, entitlementAdvice(), fields);
    case BVMH_NO_ACCESS:
      return fail(settings, kRefused, "refused: " + (failure.empty() ? text : failure), "", fields);
    default:
      break;
  }
  if (isTransportFailure(code)) return fail(settings, kUnusable, text + reason, "", fields);
  return fail(settings, kRefused, (failure.empty() ? text : failure) + " (code " + std::to_string(code) + ")",
              "", fields);
}

int report(const Settings& settings, bvmh_client* client, const Outcome& outcome) {
  if (outcome.code != BVMH_OK)
    return reportCode(settings, client, outcome.routine, outcome.code, outcome.failure);
  nlohmann::ordered_json fields{{"routine", outcome.routine}, {"code", outcome.code}};
  if (!outcome.isDone) return fail(settings, kRefused, outcome.failure, "", fields);
  if (settings.asJson) {
    nlohmann::ordered_json line{{"ok", true}};
    line.update(fields);
    line.update(outcome.fields);
    printJson(line);
  } else if (!outcome.text.empty()) {
    std::printf("%s\n", outcome.text.c_str());
  }
  return kDone;
}

// ---- running a command ----------------------------------------------------------------------------------

int watch(const Settings& settings, const Values& values) {
  EventStreamOptions options;
  options.program = kProgram;
  options.asJson = settings.asJson;
  options.directory = values.get("--directory", "");
  if (values.has("--count")) options.most = std::stoull(values["--count"]);
  if (values.has("--helper-uid"))
    options.helperUid = static_cast<std::uint32_t>(std::stoul(values["--helper-uid"]));
  return printEvents(options);
}

int run(const Settings& settings, const Command& command, const Values& values) {
  if (command.isLocal && std::strcmp(command.name, "access") == 0)
    return printAccess(settings.asJson, values);
  if (command.isLocal) return watch(settings, values);
  const ClientPointer client(bvmh_client_create());
  if (client == nullptr) return fail(settings, kUnusable, "out of memory");
  bvmh_client_set_timeout(client.get(), static_cast<std::uint32_t>(std::ceil(settings.timeout * 1000)));
  if (settings.socket && bvmh_client_set_socket(client.get(), settings.socket->c_str()) != BVMH_OK) {
    return fail(settings, kUnusable, "--socket: the path is empty or too long for a socket");
  }
  return report(settings, client.get(), command.run(client.get(), values));
}

// ---- the parser, from the table -------------------------------------------------------------------------

// A subcommand as the parser sees it; where its values land.
struct Parsed {
  const Command* command = nullptr;
  CLI::App* app = nullptr;
  struct Slot {
    const Parameter* parameter;
    CLI::Option* option;
    std::vector<std::string> values;
    std::size_t taken = 0;
  };
  std::deque<Slot> slots;  // the parser keeps pointers to them
};

void addParameter(Parsed& parsed, const Parameter& parameter, bool isPositional) {
  Parsed::Slot& slot = parsed.slots.emplace_back(Parsed::Slot{&parameter, nullptr, {}, 0});
  slot.option = parsed.app->add_option(parameter.name, slot.values, parameter.help);
  slot.option->allow_extra_args(false);
  if (isPositional) {
    slot.option->required()->expected(1)->option_text(" ");
  } else {
    slot.option->option_text(parameter.valueName);
    if (!parameter.isRepeatable) slot.option->multi_option_policy(CLI::MultiOptionPolicy::Throw)->expected(1);
  }
}

void addCommand(CLI::App& parent, Parsed& parsed) {
  const Command& command = *parsed.command;
  parsed.app = parent.add_subcommand(command.name, command.summary);
  parsed.app->fallthrough();
  for (const Parameter& each : command.positionals) addParameter(parsed, each, true);
  for (const Parameter& each : command.options) addParameter(parsed, each, false);
}

// The values in the order in which they stood on the command line, checked.
Values collect(Parsed& parsed) {
  Values values;
  for (const CLI::Option* option : parsed.app->parse_order()) {
    for (Parsed::Slot& slot : parsed.slots) {
      if (slot.option != option || slot.taken == slot.values.size()) continue;
      values.add(slot.parameter->name, checkedValue(*slot.parameter, slot.values[slot.taken++]));
    }
  }
  return values;
}

const Parameter& globalOption(std::string_view name) {
  const auto& all = globalOptions();
  return *std::find_if(all.begin(), all.end(), [&](const Parameter& each) { return name == each.name; });
}

constexpr const char* kStatuses =
    "Exit status: 0 done; 1 the helper refused or could not do it; 2 wrong usage, or no helper.";

}  // namespace

int runCommandLine(int argc, const char* const* argv) {
  Settings settings;
  // A program that asked for JSON gets it for wrong usage too, which the parser may meet first.
  const auto wantsJson = [&] {
    for (int i = 1; i < argc && std::strcmp(argv[i], "--") != 0; ++i) {
      if (std::strcmp(argv[i], "--json") == 0) return true;
    }
    return false;
  };
  try {
    CLI::App app("Asks BrenvikMobileHelper for what it does for the telephony daemon.", kProgram);
    app.require_subcommand(1);
    app.set_version_flag("--version", std::string(kProgram) + " " BRENVIK_VERSION);
    std::string timeout;
    app.add_flag("--json", settings.asJson, globalOption("--json").help);
    app.add_option("--timeout", timeout, globalOption("--timeout").help)->option_text("SECONDS");
    app.add_option("--socket", settings.socket, globalOption("--socket").help)->option_text("PATH");
    // Of the groups and commands, which are added below.
    app.footer(std::string("--json, --timeout and --socket may stand here, too: see ") + kProgram +
               " --help.\n" + kStatuses);

    std::map<std::string, CLI::App*> groups;
    for (const Group& each : commandGroups()) {
      CLI::App* group = app.add_subcommand(each.name, each.summary);
      group->require_subcommand(1)->fallthrough();
      groups[each.name] = group;
    }
    std::deque<Parsed> commands;
    for (const Command& each : commandTable()) {
      Parsed& parsed = commands.emplace_back();
      parsed.command = &each;
      addCommand(*each.group == '\0' ? app : *groups.at(each.group), parsed);
    }
    app.footer(kStatuses);
    try {
      app.parse(argc, argv);
    } catch (const CLI::ParseError& error) {
      // Help and version come this way too.
      if (error.get_exit_code() == 0) return app.exit(error) == 0 ? kDone : kUnusable;
      settings.asJson = wantsJson();
      const std::vector<std::string> unknown = app.remaining(true);
      const std::string message =
          unknown.empty() ? error.what() : "not expected: " + printable(unknown.front());
      return fail(settings, kUnusable, message, "Run with --help for more.");
    }
    if (app.count("--timeout") != 0) {
      settings.timeout = secondsIn(checkedValue(globalOption("--timeout"), timeout));
    }
    for (Parsed& each : commands) {
      if (each.app->parsed()) return run(settings, *each.command, collect(each));
    }
    return fail(settings, kUnusable, "no command");
  } catch (const UsageError& error) {
    return fail(settings, kUnusable, error.message);
  } catch (const std::exception& error) {
    return fail(settings, kUnusable, error.what());
  }
}

}  // namespace brenvik::tools

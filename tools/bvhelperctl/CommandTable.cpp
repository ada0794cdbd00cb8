// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "tools/bvhelperctl/CommandTable.h"

#include <cstddef>

#include "tools/bvhelperctl/AccessCommand.h"
#include "tools/bvhelperctl/Commands.h"
#include "tools/bvhelperctl/StatusCommand.h"
#include "tools/bvhelperctl/Switches.h"
#include "tools/bvhelperctl/Waiting.h"
#include "tools/support/StandInSyntax.h"

namespace brenvik::tools {
namespace {

constexpr std::size_t kShort = 63;
constexpr std::size_t kText = 255;
constexpr std::size_t kLong = 1023;
// The domain's file is named DOMAIN.plist, and a file name has at most 255 bytes.
constexpr std::size_t kDomainName = 249;

const Parameter kDomain{.name = "DOMAIN",
                        .help = "preference domain, such as com.norvale.carrier",
                        .limit = kDomainName,
                        .offer = Offer::domains};
const Parameter kKey{.name = "KEY", .help = "name of the value", .limit = kText, .offer = Offer::keys};
const Parameter kValue{
    .name = "VALUE",
    .help = "the value; with --type plist-file, a file. - reads it from standard input, @FILE from a file",
    .kind = ValueKind::bytes,
    .source = ValueSource::byCommand};
const Parameter kToken{.name = "TOKEN",
                       .help = "the token. - reads it from standard input, @FILE from a file",
                       .limit = kText,
                       .source = ValueSource::argumentOrFile};
const Parameter kLiteral{.name = "--literal",
                         .help = "take values that are - or begin with @ as they stand",
                         .valueName = nullptr};
const Parameter kRaw{
    .name = "--raw", .help = "print a text or data byte for byte, with nothing added", .valueName = nullptr};
const Parameter kWait{.name = "--wait",
                      .help = "take the telephony daemon's place, and show what it would be told",
                      .valueName = nullptr};
const Parameter kState{
    .name = "STATE", .help = "on or off", .kind = ValueKind::choice, .choices = {"on", "off"}};
const Parameter kTokenKey{.name = "--key",
                          .help = "the token under this key instead of the general one",
                          .limit = kText,
                          .valueName = "KEY",
                          .source = ValueSource::argumentOrFile};
const Parameter kFlushedDomain{.name = "--domain",
                               .help = "preference domain whose cached values are dropped",
                               .limit = kLong,
                               .valueName = "DOMAIN"};
const Parameter kLanguage{.name = "--language",
                          .help = "language to answer in, such as de or pt-BR; the first that fits is taken",
                          .isRepeatable = true,
                          .valueName = "LANGUAGE"};
const Parameter kLabel{
    .name = "--label",
    .help =
        "predefined label: primary, secondary, personal, business, travel, cell-data, or a key as it is "
        "(USER_LABEL_...)",
    .choices = {"primary", "secondary", "personal", "business", "travel", "cell-data", "USER_LABEL_PRIMARY",
                "USER_LABEL_SECONDARY", "USER_LABEL_PERSONAL", "USER_LABEL_BUSINESS", "USER_LABEL_TRAVEL",
                "USER_LABEL_CELL_DATA"},
    .isRepeatable = true,
    .valueName = "LABEL"};
const Parameter kLabelText{.name = "--text",
                           .help = "a label's own text. - reads it from standard input, @FILE from a file",
                           .isRepeatable = true,
                           .valueName = "TEXT",
                           .source = ValueSource::argumentOrFile};

// Names of files that the helper opens, texts, and bytes that it takes as they stand.
Parameter file(const char* name, const char* help, std::size_t limit) {
  return {.name = name, .help = help, .kind = ValueKind::path, .limit = limit};
}
Parameter words(const char* name, const char* help, std::size_t limit) {
  return {.name = name, .help = help, .kind = ValueKind::text, .limit = limit};
}
Parameter bytes(const char* name, const char* help, std::size_t limit) {
  return {.name = name, .help = help, .kind = ValueKind::bytes, .limit = limit};
}

// The rows are built in place: a start must not pay for copies of them.
std::span<const Command> makeTable() {
  static const Command rows[] = {
      {.name = "ping",
       .summary = "check in and leave again",
       .routines = {"BVMobileHelperCheckIn"},
       .run = ping},
      {.group = "prefs",
       .name = "set",
       .summary = "store a preference value",
       .routines = {"BVMobileHelperSetPreferenceValue"},
       .positionals = {kDomain, kKey, kValue},
       .options = {{.name = "--type",
                    .help = "string (default), integer, real, bool, data (base64), bytes (data as it stands) "
                            "or plist-file",
                    .kind = ValueKind::choice,
                    .choices = {"string", "integer", "real", "bool", "data", "bytes", "plist-file"},
                    .valueName = "TYPE"},
                   kLiteral},
       .run = setPreference},
      {.group = "prefs",
       .name = "get",
       .summary = "show a preference value",
       .routines = {"BVMobileHelperCopyPreferenceValue"},
       .positionals = {kDomain, kKey},
       .options = {kRaw},
       .run = getPreference},
      {.group = "prefs",
       .name = "get-app",
       .summary = "show a preference value in application scope",
       .routines = {"BVMobileHelperCopyAppPreferenceValue"},
       .positionals = {kDomain, kKey},
       .options = {kRaw},
       .run = getAppPreference},
      {.group = "prefs",
       .name = "delete",
       .summary = "remove a preference value",
       .routines = {"BVMobileHelperSetPreferenceValue"},
       .positionals = {kDomain, kKey},
       .run = deletePreference},
      {.group = "plist",
       .name = "load",
       .summary = "show a property-list file that the helper can read",
       .routines = {"BVMobileHelperLoadPlistFile"},
       .positionals = {file("PATH", "the file", kText)},
       .run = loadPropertyList},
      {.group = "voicemail",
       .name = "set-token",
       .summary = "store a voicemail token",
       .routines = {"BVMobileHelperSetVoicemailToken", "BVMobileHelperSetVoicemailTokenForKey"},
       .positionals = {kToken},
       .options = {kTokenKey, kLiteral},
       .run = setVoicemailToken},
      {.group = "voicemail",
       .name = "token",
       .summary = "show a voicemail token",
       .routines = {"BVMobileHelperCopyVoicemailToken", "BVMobileHelperCopyVoicemailTokenForKey"},
       .options = {kTokenKey},
       .run = showVoicemailToken},
      {.group = "voicemail",
       .name = "clear",
       .summary = "remove the general token",
       .routines = {"BVMobileHelperClearVoicemailToken"},
       .run = clearVoicemailToken},
      {.group = "voicemail",
       .name = "reset",
       .summary = "remove the general token and every record",
       .routines = {"BVMobileHelperResetVoicemailStore"},
       .run = resetVoicemailStore},
      {.group = "voicemail",
       .name = "subscribed",
       .summary = "tell whether visual voicemail is subscribed",
       .routines = {"BVMobileHelperIsVoicemailServiceSubscribed"},
       .run = showVoicemailSubscription},
      {.group = "carrier",
       .name = "replace-link",
       .summary = "replace one of the carrier links",
       .routines = {"BVMobileHelperReplaceCarrierSymlink"},
       .positionals = {bytes("TARGET", "what the link says, as it stands", kLong),
                       file("LINK", "one of the known carrier files", kLong)},
       .options = {kFlushedDomain},
       .run = replaceCarrierLink},
      {.group = "carrier",
       .name = "create-link",
       .summary = "replace any file by a link",
       .routines = {"BVMobileHelperCreateSymlink"},
       .positionals = {bytes("TARGET", "what the link says, as it stands", kLong),
                       file("LINK", "the link", kLong)},
       .run = createLink},
      {.group = "carrier",
       .name = "remove",
       .summary = "remove a carrier file",
       .routines = {"BVMobileHelperRemoveCarrierFile"},
       .positionals = {file("PATH", "the file, or an empty folder", kLong)},
       .options = {kFlushedDomain},
       .run = removeCarrierFile},
      {.group = "carrier",
       .name = "copy-file",
       .summary = "copy a file into a carrier folder",
       .routines = {"BVMobileHelperCopyCarrierFile"},
       .positionals = {file("SOURCE-DIR", "folder to copy from", kText),
                       file("DESTINATION-DIR", "carrier folder to copy into", kText),
                       bytes("NAME", "the file's name in both", kText)},
       .run = copyCarrierFile},
      {.group = "carrier",
       .name = "copy-crash-logs",
       .summary = "copy a folder into the crash logs",
       .routines = {"BVMobileHelperCopyCrashLogs"},
       .positionals = {file("PATH", "the folder", kText)},
       .run = copyCrashLogs},
      {.group = "carrier",
       .name = "move-bundle",
       .summary = "move a folder into the carrier bundles",
       .routines = {"BVMobileHelperMoveIntoCarrierBundles"},
       .positionals = {file("SOURCE", "the folder", kText),
                       file("DESTINATION-DIR", "carrier bundles folder", kText),
                       bytes("NAME", "its name there", kText)},
       .run = moveBundle},
      {.group = "carrier",
       .name = "unpack",
       .summary = "unpack a zip archive",
       .routines = {"BVMobileHelperUnpackArchive"},
       .positionals = {file("ARCHIVE", "the archive", kText),
                       file("DESTINATION", "folder to unpack into", kText)},
       .run = unpackArchive},
      {.name = "heartbeat",
       .summary = "switch the cellular heartbeat",
       .routines = {"BVMobileHelperCellularHeartbeat"},
       .positionals = {kState},
       .run = switchHeartbeat},
      {.group = "lasd",
       .name = "check",
       .summary = "check for newer location-aware service databases",
       .routines = {"BVMobileHelperCheckLASDUpdate"},
       .options = {{.name = "--type",
                    .help = "gsm, umts, cdma, lte or scdma; default: all",
                    .kind = ValueKind::choice,
                    .choices = {"gsm", "umts", "cdma", "lte", "scdma"},
                    .isRepeatable = true,
                    .valueName = "TYPE"},
                   {.name = "--mask",
                    .help = "the types as a number: umts 1, cdma 2, lte 4, gsm 8, scdma 16",
                    .kind = ValueKind::integer,
                    .valueName = "N"},
                   {.name = "--wait",
                    .help = "take the telephony daemon's place, ask for one database after the other, and "
                            "tell its outcome",
                    .valueName = nullptr},
                   listeningDirectory(),
                   listeningHelperUid()},
       .run = checkDatabases},
      {.group = "location",
       .name = "civic",
       .summary = "ask for the civic address of a place",
       .routines = {"BVMobileHelperRequestCountryCodeFromLocation"},
       .positionals =
           {{.name = "LATITUDE", .help = "degrees, north is positive", .kind = ValueKind::latitude},
            {.name = "LONGITUDE", .help = "degrees, east is positive", .kind = ValueKind::longitude}},
       .options = {kWait, listeningDirectory(), listeningHelperUid()},
       .run = requestCivicInfo},
      {.group = "location",
       .name = "country",
       .summary = "show the current country code",
       .routines = {"BVMobileHelperCopyCountryCode"},
       .run = showCountry},
      {.group = "location",
       .name = "wan-ip",
       .summary = "ask for the public address of this machine",
       .routines = {"BVMobileHelperRequestWanIPFromLocation"},
       .options = {kWait, listeningDirectory(), listeningHelperUid()},
       .run = requestWanAddress},
      {.group = "labels",
       .name = "badges",
       .summary = "show badges of subscription labels",
       .routines = {"BVMobileHelperCopyBadgeLabels"},
       .options = {kLanguage, kLabel, kLabelText, kLiteral},
       .run = showBadges},
      {.group = "labels",
       .name = "localized",
       .summary = "show names of predefined subscription labels",
       .routines = {"BVMobileHelperCopyLocalizedLabels"},
       .options = {kLanguage, kLabel},
       .run = showLocalizedLabels},
      {.group = "contacts",
       .name = "remap",
       .summary = "move contacts from one channel identifier to another",
       .routines = {"BVMobileHelperRemapContactsChannel"},
       .positionals = {words("FROM", "old channel identifier", kShort),
                       words("TO", "new channel identifier", kShort)},
       .run = remapChannel},
      {.name = "radio-logs",
       .summary = "switch the radio manager's log file",
       .routines = {"BVMobileHelperEnableRadioManagerLogs"},
       .positionals = {kState},
       .run = switchRadioLogs},
      {.name = "access",
       .summary = "explain who would be let in, from the entitlement files",
       .options = {{.name = "--exe",
                    .help = "program that asks, default this one",
                    .kind = ValueKind::path,
                    .valueName = "FILE"},
                   {.name = "--user", .help = "account it runs under, default yours", .valueName = "USER"},
                   {.name = "--unit", .help = "unit of the service manager it runs in", .valueName = "UNIT"}},
       .run = [](bvmh_client*, const Values& values) { return explainAccess(values); },
       .isLocal = true},
      {.name = "status",
       .summary = "show whether the helper runs, what keeps it, and what it did last",
       .run = [](bvmh_client*, const Values& values) { return showStatus(values); },
       .isLocal = true},
      {.name = "watch",
       .summary = "show the helper's pushes and notifications, in place of the telephony daemon",
       .options =
           {{.name = "--count", .help = "leave after so many", .kind = ValueKind::count, .valueName = "N"},
            listeningDirectory(),
            listeningHelperUid()},
       .isLocal = true},
  };
  return rows;
}

}  // namespace

const std::vector<Parameter>& globalOptions() {
  static const std::vector<Parameter> options{
      {.name = "--json", .help = "print one JSON object a line", .valueName = nullptr},
      {.name = "--timeout",
       .help = "seconds to wait for each answer, default 30; for watch, seconds to listen",
       .kind = ValueKind::seconds,
       .valueName = "SECONDS"},
      {.name = "--socket",
       .help = "the helper's service socket",
       .kind = ValueKind::path,
       .valueName = "PATH"},
      {.name = "--version", .help = "show the version", .valueName = nullptr},
      {.name = "--help", .help = "show this help", .valueName = nullptr},
  };
  return options;
}

const std::vector<Group>& commandGroups() {
  static const std::vector<Group> groups{
      {"prefs", "preference values"},
      {"plist", "property-list files"},
      {"voicemail", "tokens of the voicemail store"},
      {"carrier", "carrier bundles, links and files"},
      {"lasd", "location-aware service databases"},
      {"location", "country, civic address, public address"},
      {"labels", "subscription labels"},
      {"contacts", "contact channels"},
  };
  return groups;
}

std::span<const Command> commandTable() { return makeTable(); }

std::string wordsOf(const Command& command) {
  return wordsOf(CommandSyntax{command.group, command.name, command.summary, nullptr, nullptr});
}

ProgramSyntax programSyntax() {
  ProgramSyntax syntax{"bvhelperctl",
                       "Asks BrenvikMobileHelper for what it does for the telephony daemon.",
                       &commandGroups(),
                       {},
                       &globalOptions()};
  syntax.commands.reserve(commandTable().size());
  for (const Command& each : commandTable()) {
    syntax.commands.push_back({each.group, each.name, each.summary, &each.positionals, &each.options});
  }
  return syntax;
}

}  // namespace brenvik::tools

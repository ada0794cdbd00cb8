// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "tools/bvhelperctl/CommandTable.h"

#include <pwd.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <span>

#include "platform/plist/PropertyListCodec.h"
#include "tools/bvhelperctl/AccessCommand.h"
#include "tools/bvhelperctl/Call.h"
#include "tools/bvhelperctl/StatusCommand.h"
#include "tools/bvhelperctl/Switches.h"
#include "tools/bvhelperctl/Waiting.h"
#include "tools/support/Base64.h"
#include "tools/support/PropertyListText.h"
#include "tools/support/StandInSyntax.h"

namespace brenvik::tools {
namespace {

// ---- values ---------------------------------------------------------------------------------------------

PropertyList valueOfType(const std::string& type, const std::string& text, bool isSecret = false) {
  const auto wrong = [&](const char* what) {
    return UsageError{(isSecret ? "what was read" : '"' + printable(text) + '"') + " is not " + what};
  };
  if (type == "integer") {
    if (const auto number = numberIn<std::int64_t>(text)) return PropertyList::integer(*number);
    if (const auto number = numberIn<std::uint64_t>(text)) return PropertyList::unsignedInteger(*number);
    throw wrong("an integer of 64 bits");
  }
  if (type == "real") {
    if (const auto number = numberIn<double>(text)) return PropertyList::real(*number);
    throw wrong("a number");
  }
  if (type == "bool") {
    if (text == "true" || text == "yes" || text == "1") return PropertyList::boolean(true);
    if (text == "false" || text == "no" || text == "0") return PropertyList::boolean(false);
    throw wrong("true or false");
  }
  if (type == "bytes") return PropertyList::data(std::as_bytes(std::span(text)));
  if (type == "data") {
    if (const auto bytes = fromBase64(text)) return PropertyList::data(*bytes);
    throw wrong("base64");
  }
  PropertyList string = PropertyList::string(text);
  if (!string) throw wrong("UTF-8");
  return string;
}

std::string serialized(const PropertyList& value) {
  auto bytes = serializePropertyList(value, PropertyListFormat::binary);
  if (!bytes) throw UsageError{"the value is too large for a property list"};
  return *std::move(bytes);
}

// The helper answers with XML. A value that XML cannot say would be stored, never be read back, and take its
// whole domain from whoever reads that as a file.
void mustFitXml(const PropertyList& value) {
  if (serializePropertyList(value, PropertyListFormat::xml)) return;
  throw UsageError{
      "VALUE cannot be read back as XML: a text in it holds a control character, a date is outside "
      "the years that can be written, or it is too deep or too large",
      "--type bytes stores any bytes as data; prefs get --raw reads them back."};
}

// What is sent for VALUE: a property list.
std::string valueToStore(const Values& values) {
  const std::string type = values.get("--type", "string");
  const std::string& given = values["VALUE"];
  const bool isElsewhere = !values.has("--literal") && ValueReader::standsElsewhere(given);
  // In a document or in data a newline at the end may mean something.
  const LastNewline lastNewline =
      type == "plist-file" || type == "bytes" ? LastNewline::keep : LastNewline::drop;
  ValueReader reader;
  const std::string text = isElsewhere ? reader.read("VALUE", given, lastNewline) : given;
  if (type != "plist-file") {
    const PropertyList value = valueOfType(type, text, isElsewhere);
    mustFitXml(value);
    return serialized(value);
  }
  std::string document = isElsewhere ? text : contentOf(given);
  const PropertyList value = parsePropertyList(std::as_bytes(std::span(document)));
  if (!value) {
    const std::string name =
        given == "-" ? "standard input" : printable(isElsewhere ? given.substr(1) : given);
    throw UsageError{name + " is not a property list"};
  }
  mustFitXml(value);
  return document;
}

// The helper stores nothing under such a name, and its answer does not say so.
const std::string& domainOfAFile(const std::string& domain) {
  if (domain.empty() || domain == "." || domain == ".." || domain.find('/') != std::string::npos) {
    throw UsageError{"DOMAIN: \"" + printable(domain) +
                     "\" names no file: it is empty, \".\" or \"..\", or holds a slash"};
  }
  return domain;
}

// ---- outcomes -------------------------------------------------------------------------------------------

// Of a routine that answers whether its work succeeded.
Outcome attemptOutcome(const char* routine, std::int32_t code, bool success, std::string text,
                       std::string failure) {
  Outcome outcome = did(routine, code, std::move(text));
  if (code == BVMH_OK) {
    outcome.isDone = success;
    outcome.failure = std::move(failure) + "; the helper's log tells why";
  }
  return outcome;
}

// A text, or data, byte for byte.
std::string rawBytes(const PropertyList& value) {
  if (const auto text = value.asString()) return std::string(*text);
  if (const auto data = value.asData()) return {reinterpret_cast<const char*>(data->data()), data->size()};
  return humanText(value) + '\n';
}

// Shows a returned region, and frees it.
Outcome returned(const char* routine, std::int32_t code, bvmh_region& region, const Values& values) {
  Outcome outcome = did(routine, code, "");
  if (code != BVMH_OK) return outcome;
  const bool isFound = region.size != 0;
  const PropertyList value = parsePropertyList({static_cast<const std::byte*>(region.bytes), region.size});
  bvmh_region_free(&region);
  if (isFound && !value) {
    outcome.isDone = false;
    outcome.status = ExitStatus::protocol;
    outcome.failure = "the helper returned something that is no property list";
    return outcome;
  }
  outcome.fields["found"] = isFound;
  outcome.fields["value"] = jsonOf(value);
  outcome.text = humanText(value);
  if (values.has("--raw")) outcome.raw = isFound ? rawBytes(value) : "";
  if (!isFound) outcome.status = ExitStatus::noValue;
  return outcome;
}

Outcome returnedText(const char* routine, std::int32_t code, const char* name, const std::string& text,
                     const char* none) {
  Outcome outcome = did(routine, code, text.empty() ? none : printable(text));
  outcome.fields[name] = jsonOfText(text);
  if (code == BVMH_OK && text.empty()) outcome.status = ExitStatus::noValue;
  return outcome;
}

// ---- commands -------------------------------------------------------------------------------------------

Outcome ping(bvmh_client* client, const Values&) {
  return did("BVMobileHelperCheckIn", bvmh_connect(client), "the helper answers");
}

Outcome setPreference(bvmh_client* client, const Values& values) {
  const std::string& domain = domainOfAFile(values["DOMAIN"]);
  const std::string value = valueToStore(values);
  BVHELPERCTL_CALL(BVMobileHelperSetPreferenceValue, client, domain.c_str(), values["KEY"].c_str(),
                   value.data(), value.size());
  return did(name, code, "set " + printable(values["KEY"]) + " of " + printable(domain));
}

Outcome deletePreference(bvmh_client* client, const Values& values) {
  const std::string& domain = domainOfAFile(values["DOMAIN"]);
  // One byte, whatever it is, stands for "no value".
  BVHELPERCTL_CALL(BVMobileHelperSetPreferenceValue, client, domain.c_str(), values["KEY"].c_str(), "", 1);
  return did(name, code, "removed " + printable(values["KEY"]) + " of " + printable(domain));
}

Outcome getPreference(bvmh_client* client, const Values& values) {
  bvmh_region region{};
  BVHELPERCTL_CALL(BVMobileHelperCopyPreferenceValue, client, values["DOMAIN"].c_str(), values["KEY"].c_str(),
                   &region);
  return returned(name, code, region, values);
}

Outcome getAppPreference(bvmh_client* client, const Values& values) {
  bvmh_region region{};
  BVHELPERCTL_CALL(BVMobileHelperCopyAppPreferenceValue, client, values["DOMAIN"].c_str(),
                   values["KEY"].c_str(), &region);
  return returned(name, code, region, values);
}

Outcome loadPropertyList(bvmh_client* client, const Values& values) {
  bvmh_region region{};
  BVHELPERCTL_CALL(BVMobileHelperLoadPlistFile, client, values["PATH"].c_str(), &region);
  Outcome outcome = returned(name, code, region, values);
  if (code == BVMH_MEMORY_FAILURE) {
    outcome.failure =
        printable(values["PATH"]) +
        " is missing, not readable for the helper, or no property list with a dictionary on top";
  }
  return outcome;
}

Outcome setVoicemailToken(bvmh_client* client, const Values& values) {
  if (!values.has("--key")) {
    BVHELPERCTL_CALL(BVMobileHelperSetVoicemailToken, client, values["TOKEN"].c_str());
    return did(name, code, "set the voicemail token");
  }
  BVHELPERCTL_CALL(BVMobileHelperSetVoicemailTokenForKey, client, values["--key"].c_str(),
                   values["TOKEN"].c_str());
  return did(name, code, "set the voicemail token for " + printable(values["--key"]));
}

Outcome showVoicemailToken(bvmh_client* client, const Values& values) {
  char token[BVMH_TOKEN_SIZE] = "";
  if (!values.has("--key")) {
    BVHELPERCTL_CALL(BVMobileHelperCopyVoicemailToken, client, token, sizeof token);
    return returnedText(name, code, "token", token, "(no token)");
  }
  BVHELPERCTL_CALL(BVMobileHelperCopyVoicemailTokenForKey, client, values["--key"].c_str(), token,
                   sizeof token);
  return returnedText(name, code, "token", token, "(no token)");
}

Outcome clearVoicemailToken(bvmh_client* client, const Values&) {
  BVHELPERCTL_CALL(BVMobileHelperClearVoicemailToken, client);
  return did(name, code, "cleared the voicemail token");
}

Outcome resetVoicemailStore(bvmh_client* client, const Values&) {
  BVHELPERCTL_CALL(BVMobileHelperResetVoicemailStore, client);
  return did(name, code, "cleared the voicemail token and removed every record");
}

Outcome showVoicemailSubscription(bvmh_client* client, const Values&) {
  bool subscribed = false;
  BVHELPERCTL_CALL(BVMobileHelperIsVoicemailServiceSubscribed, client, &subscribed);
  Outcome outcome = did(name, code, subscribed ? "subscribed" : "not subscribed");
  outcome.fields["subscribed"] = subscribed;
  return outcome;
}

// Of a routine that answers "failed" when symlink(2) does.
std::string linkFailure(const std::string& link) {
  return printable(link) + " cannot be made: its folder is missing, or may not be written by the helper";
}

Outcome replaceCarrierLink(bvmh_client* client, const Values& values) {
  const std::string& link = values["LINK"];
  BVHELPERCTL_CALL(BVMobileHelperReplaceCarrierSymlink, client, values["TARGET"].c_str(), link.c_str(),
                   values.get("--domain", "").c_str());
  Outcome outcome = did(name, code, printable(link) + " -> " + printable(values["TARGET"]));
  if (code == BVMH_NO_ACCESS) {
    outcome.failure =
        printable(link) + " is not one of the carrier links and files that may be replaced, or is a folder";
  }
  if (code == BVMH_FAILURE) outcome.failure = linkFailure(link);
  return outcome;
}

Outcome createLink(bvmh_client* client, const Values& values) {
  const std::string& link = values["LINK"];
  BVHELPERCTL_CALL(BVMobileHelperCreateSymlink, client, values["TARGET"].c_str(), link.c_str());
  Outcome outcome = did(name, code, printable(link) + " -> " + printable(values["TARGET"]));
  if (code == BVMH_FAILURE) outcome.failure = linkFailure(link);
  return outcome;
}

Outcome removeCarrierFile(bvmh_client* client, const Values& values) {
  const std::string& path = values["PATH"];
  BVHELPERCTL_CALL(BVMobileHelperRemoveCarrierFile, client, path.c_str(), values.get("--domain", "").c_str());
  Outcome outcome = did(name, code, "removed " + printable(path));
  if (code == BVMH_NO_ACCESS) {
    outcome.failure =
        printable(path) + " is no carrier file: not listed, not in the carrier bundles, no package in /tmp";
  }
  if (code == BVMH_FAILURE) {
    outcome.failure =
        printable(path) + " cannot be removed: it is missing, a folder with something in it, or read-only";
  }
  return outcome;
}

Outcome copyCarrierFile(bvmh_client* client, const Values& values) {
  bool success = false;
  BVHELPERCTL_CALL(BVMobileHelperCopyCarrierFile, client, values["SOURCE-DIR"].c_str(),
                   values["DESTINATION-DIR"].c_str(), values["NAME"].c_str(), &success);
  const std::string file = printable(values["NAME"]) + " from " + printable(values["SOURCE-DIR"]) + " to " +
                           printable(values["DESTINATION-DIR"]);
  return attemptOutcome(name, code, success, "copied " + file, "did not copy " + file);
}

Outcome copyCrashLogs(bvmh_client* client, const Values& values) {
  bool success = false;
  BVHELPERCTL_CALL(BVMobileHelperCopyCrashLogs, client, values["PATH"].c_str(), &success);
  return attemptOutcome(name, code, success, "copied " + printable(values["PATH"]) + " to the crash logs",
                        "did not copy " + printable(values["PATH"]));
}

Outcome moveBundle(bvmh_client* client, const Values& values) {
  bool success = false;
  BVHELPERCTL_CALL(BVMobileHelperMoveIntoCarrierBundles, client, values["SOURCE"].c_str(),
                   values["DESTINATION-DIR"].c_str(), values["NAME"].c_str(), &success);
  const std::string move = printable(values["SOURCE"]) + " to " + printable(values["DESTINATION-DIR"]) + "/" +
                           printable(values["NAME"]);
  return attemptOutcome(name, code, success, "moved " + move, "did not move " + move);
}

Outcome unpackArchive(bvmh_client* client, const Values& values) {
  bool success = false;
  BVHELPERCTL_CALL(BVMobileHelperUnpackArchive, client, values["ARCHIVE"].c_str(),
                   values["DESTINATION"].c_str(), &success);
  const std::string what = printable(values["ARCHIVE"]) + " into " + printable(values["DESTINATION"]);
  return attemptOutcome(name, code, success, "unpacked " + what, "did not unpack " + what);
}

Outcome showCountry(bvmh_client* client, const Values&) {
  char country[BVMH_COUNTRY_CODE_SIZE] = "";
  BVHELPERCTL_CALL(BVMobileHelperCopyCountryCode, client, country, sizeof country);
  return returnedText(name, code, "country", country, "(not known)");
}

// The six that the helper knows; it leaves out any other without a word.
constexpr const char* kLabels[] = {"primary", "secondary", "personal", "business", "travel", "cell-data"};

std::string labelKey(const std::string& label) {
  if (label.starts_with("USER_LABEL_")) return label;
  if (std::none_of(std::begin(kLabels), std::end(kLabels), [&](const char* each) { return label == each; })) {
    std::string all;
    for (const char* each : kLabels) all += std::string(each) + ", ";
    throw UsageError{"--label: \"" + printable(label) + "\" is not one of: " + all +
                     "or a key that begins with USER_LABEL_"};
  }
  std::string key = "USER_LABEL_";
  for (const char each : label)
    key += each == '-' ? '_' : static_cast<char>(each >= 'a' && each <= 'z' ? each - 32 : each);
  return key;
}

using LabelsRoutine = decltype(&BVMobileHelperCopyBadgeLabels);

Outcome askForLabels(const char* name, LabelsRoutine routine, bvmh_client* client,
                     std::vector<PropertyList> labels, const Values& values) {
  if (labels.empty()) throw UsageError{"no label given"};
  std::vector<PropertyList> languages;
  for (const auto& [parameter, value] : values.all()) {
    if (parameter == "--language") languages.push_back(valueOfType("string", value));
  }
  const std::string labelBytes = serialized(PropertyList::array(std::move(labels)));
  const std::string languageBytes = serialized(PropertyList::array(std::move(languages)));
  bvmh_region region{};
  const std::int32_t connected = bvmh_connect(client);
  const std::int32_t code = connected != BVMH_OK
                                ? connected
                                : routine(client, labelBytes.data(), labelBytes.size(), languageBytes.data(),
                                          languageBytes.size(), &region);
  Outcome outcome = did(name, code, "");
  if (code == BVMH_FAILURE) outcome.failure = "the helper knows none of these labels";
  if (code != BVMH_OK) return outcome;
  const PropertyList result = parsePropertyList({static_cast<const std::byte*>(region.bytes), region.size});
  bvmh_region_free(&region);
  if (!result.is(PropertyList::Type::array)) {
    outcome.isDone = false;
    outcome.status = ExitStatus::protocol;
    outcome.failure = "the helper returned something that is no array of labels";
    return outcome;
  }
  outcome.fields["labels"] = jsonOf(result);
  for (std::size_t i = 0; i < result.size(); ++i)
    outcome.text += (i == 0 ? "" : "\n") + humanText(result.at(i));
  return outcome;
}

Outcome showBadges(bvmh_client* client, const Values& values) {
  std::vector<PropertyList> labels;
  for (const auto& [parameter, value] : values.all()) {
    if (parameter == "--label") {
      labels.push_back(valueOfType("string", labelKey(value)));
      labels.push_back(PropertyList::string(""));
    } else if (parameter == "--text") {
      labels.push_back(PropertyList::string(""));
      labels.push_back(valueOfType("string", value));
    }
  }
  return askForLabels("BVMobileHelperCopyBadgeLabels", BVMobileHelperCopyBadgeLabels, client,
                      std::move(labels), values);
}

Outcome showLocalizedLabels(bvmh_client* client, const Values& values) {
  std::vector<PropertyList> labels;
  for (const auto& [parameter, value] : values.all()) {
    if (parameter == "--label") labels.push_back(valueOfType("string", labelKey(value)));
  }
  return askForLabels("BVMobileHelperCopyLocalizedLabels", BVMobileHelperCopyLocalizedLabels, client,
                      std::move(labels), values);
}

// Whether there is a contacts store; nothing when this program may not look.
std::optional<bool> hasContactsStore() {
  const passwd* mobile = ::getpwnam("mobile");
  if (mobile == nullptr) return false;
  const std::string path = std::string(mobile->pw_dir) + "/Library/AddressBook/contacts.db";
  if (::access(path.c_str(), F_OK) == 0) return true;
  if (errno == ENOENT || errno == ENOTDIR) return false;
  return std::nullopt;
}

Outcome remapChannel(bvmh_client* client, const Values& values) {
  bool success = false;
  BVHELPERCTL_CALL(BVMobileHelperRemapContactsChannel, client, values["FROM"].c_str(), values["TO"].c_str(),
                   &success);
  const std::string what = "contacts from " + printable(values["FROM"]) + " to " + printable(values["TO"]);
  // The helper answers "done", too, when it cannot open a store, and never how many there were.
  const std::optional<bool> hasStore = hasContactsStore();
  Outcome outcome = attemptOutcome(
      name, code, success,
      hasStore == false ? "no contacts to move: there is no contacts store" : "remapped " + what,
      "did not move " + what);
  outcome.fields["store"] = hasStore ? nlohmann::ordered_json(*hasStore) : nlohmann::ordered_json();
  return outcome;
}

// ---- the table ------------------------------------------------------------------------------------------

constexpr std::size_t kShort = 63;
constexpr std::size_t kText = 255;
constexpr std::size_t kLong = 1023;
// The domain's file is named DOMAIN.plist, and a file name has at most 255 bytes.
constexpr std::size_t kDomainName = 249;

const Parameter kDomain{"DOMAIN",
                        "preference domain, such as com.norvale.carrier",
                        ValueKind::text,
                        kDomainName,
                        {},
                        false,
                        "VALUE",
                        ValueSource::argument,
                        Offer::domains};
const Parameter kKey{"KEY",   "name of the value",   ValueKind::text, kText, {}, false,
                     "VALUE", ValueSource::argument, Offer::keys};
const Parameter kValue{
    "VALUE",
    "the value; with --type plist-file, a file. - reads it from standard input, @FILE from a file",
    ValueKind::bytes,
    0,
    {},
    false,
    "VALUE",
    ValueSource::byCommand};
const Parameter kToken{"TOKEN",
                       "the token. - reads it from standard input, @FILE from a file",
                       ValueKind::text,
                       kText,
                       {},
                       false,
                       "VALUE",
                       ValueSource::argumentOrFile};
const Parameter kLiteral{
    "--literal", "take values that are - or begin with @ as they stand", ValueKind::text, 0, {}, false,
    nullptr};
const Parameter kRaw{
    "--raw", "print a text or data byte for byte, with nothing added", ValueKind::text, 0, {}, false,
    nullptr};
const Parameter kWait{"--wait",
                      "take the telephony daemon's place, and show what it would be told",
                      ValueKind::text,
                      0,
                      {},
                      false,
                      nullptr};
const Parameter kState{"STATE", "on or off", ValueKind::choice, 0, {"on", "off"}};
const Parameter kTokenKey{"--key",
                          "the token under this key instead of the general one",
                          ValueKind::text,
                          kText,
                          {},
                          false,
                          "KEY",
                          ValueSource::argumentOrFile};
const Parameter kFlushedDomain{
    "--domain", "preference domain whose cached values are dropped", ValueKind::text, kLong, {}, false,
    "DOMAIN"};
const Parameter kLanguage{"--language",
                          "language to answer in, such as de or pt-BR; the first that fits is taken",
                          ValueKind::text,
                          0,
                          {},
                          true,
                          "LANGUAGE"};
const Parameter kLabel{
    "--label",
    "predefined label: primary, secondary, personal, business, travel, cell-data, or a key as it is "
    "(USER_LABEL_...)",
    ValueKind::text,
    0,
    {"primary", "secondary", "personal", "business", "travel", "cell-data", "USER_LABEL_PRIMARY",
     "USER_LABEL_SECONDARY", "USER_LABEL_PERSONAL", "USER_LABEL_BUSINESS", "USER_LABEL_TRAVEL",
     "USER_LABEL_CELL_DATA"},
    true,
    "LABEL"};
const Parameter kLabelText{"--text",
                           "a label's own text. - reads it from standard input, @FILE from a file",
                           ValueKind::text,
                           0,
                           {},
                           true,
                           "TEXT",
                           ValueSource::argumentOrFile};

Parameter file(const char* name, const char* help, std::size_t limit) {
  return {name, help, ValueKind::path, limit};
}
Parameter words(const char* name, const char* help, std::size_t limit) {
  return {name, help, ValueKind::text, limit};
}
Parameter bytes(const char* name, const char* help, std::size_t limit) {
  return {name, help, ValueKind::bytes, limit};
}

// The rows are built in place: a start must not pay for copies of them.
std::span<const Command> makeTable() {
  static const Command rows[] = {
      {"", "ping", "check in and leave again", {"BVMobileHelperCheckIn"}, {}, {}, ping},

      {"prefs",
       "set",
       "store a preference value",
       {"BVMobileHelperSetPreferenceValue"},
       {kDomain, kKey, kValue},
       {{"--type",
         "string (default), integer, real, bool, data (base64), bytes (data as it stands) or plist-file",
         ValueKind::choice,
         0,
         {"string", "integer", "real", "bool", "data", "bytes", "plist-file"},
         false,
         "TYPE"},
        kLiteral},
       setPreference},
      {"prefs",
       "get",
       "show a preference value",
       {"BVMobileHelperCopyPreferenceValue"},
       {kDomain, kKey},
       {kRaw},
       getPreference},
      {"prefs",
       "get-app",
       "show a preference value in application scope",
       {"BVMobileHelperCopyAppPreferenceValue"},
       {kDomain, kKey},
       {kRaw},
       getAppPreference},
      {"prefs",
       "delete",
       "remove a preference value",
       {"BVMobileHelperSetPreferenceValue"},
       {kDomain, kKey},
       {},
       deletePreference},

      {"plist",
       "load",
       "show a property-list file that the helper can read",
       {"BVMobileHelperLoadPlistFile"},
       {file("PATH", "the file", kText)},
       {},
       loadPropertyList},

      {"voicemail",
       "set-token",
       "store a voicemail token",
       {"BVMobileHelperSetVoicemailToken", "BVMobileHelperSetVoicemailTokenForKey"},
       {kToken},
       {kTokenKey, kLiteral},
       setVoicemailToken},
      {"voicemail",
       "token",
       "show a voicemail token",
       {"BVMobileHelperCopyVoicemailToken", "BVMobileHelperCopyVoicemailTokenForKey"},
       {},
       {kTokenKey},
       showVoicemailToken},
      {"voicemail",
       "clear",
       "remove the general token",
       {"BVMobileHelperClearVoicemailToken"},
       {},
       {},
       clearVoicemailToken},
      {"voicemail",
       "reset",
       "remove the general token and every record",
       {"BVMobileHelperResetVoicemailStore"},
       {},
       {},
       resetVoicemailStore},
      {"voicemail",
       "subscribed",
       "tell whether visual voicemail is subscribed",
       {"BVMobileHelperIsVoicemailServiceSubscribed"},
       {},
       {},
       showVoicemailSubscription},

      {"carrier",
       "replace-link",
       "replace one of the carrier links",
       {"BVMobileHelperReplaceCarrierSymlink"},
       {bytes("TARGET", "what the link says, as it stands", kLong),
        file("LINK", "one of the known carrier files", kLong)},
       {kFlushedDomain},
       replaceCarrierLink},
      {"carrier",
       "create-link",
       "replace any file by a link",
       {"BVMobileHelperCreateSymlink"},
       {bytes("TARGET", "what the link says, as it stands", kLong), file("LINK", "the link", kLong)},
       {},
       createLink},
      {"carrier",
       "remove",
       "remove a carrier file",
       {"BVMobileHelperRemoveCarrierFile"},
       {file("PATH", "the file, or an empty folder", kLong)},
       {kFlushedDomain},
       removeCarrierFile},
      {"carrier",
       "copy-file",
       "copy a file into a carrier folder",
       {"BVMobileHelperCopyCarrierFile"},
       {file("SOURCE-DIR", "folder to copy from", kText),
        file("DESTINATION-DIR", "carrier folder to copy into", kText),
        bytes("NAME", "the file's name in both", kText)},
       {},
       copyCarrierFile},
      {"carrier",
       "copy-crash-logs",
       "copy a folder into the crash logs",
       {"BVMobileHelperCopyCrashLogs"},
       {file("PATH", "the folder", kText)},
       {},
       copyCrashLogs},
      {"carrier",
       "move-bundle",
       "move a folder into the carrier bundles",
       {"BVMobileHelperMoveIntoCarrierBundles"},
       {file("SOURCE", "the folder", kText), file("DESTINATION-DIR", "carrier bundles folder", kText),
        bytes("NAME", "its name there", kText)},
       {},
       moveBundle},
      {"carrier",
       "unpack",
       "unpack a zip archive",
       {"BVMobileHelperUnpackArchive"},
       {file("ARCHIVE", "the archive", kText), file("DESTINATION", "folder to unpack into", kText)},
       {},
       unpackArchive},

      {"",
       "heartbeat",
       "switch the cellular heartbeat",
       {"BVMobileHelperCellularHeartbeat"},
       {kState},
       {},
       switchHeartbeat},

      {"lasd",
       "check",
       "check for newer location-aware service databases",
       {"BVMobileHelperCheckLASDUpdate"},
       {},
       {{"--type",
         "gsm, umts, cdma, lte or scdma; default: all",
         ValueKind::choice,
         0,
         {"gsm", "umts", "cdma", "lte", "scdma"},
         true,
         "TYPE"},
        {"--mask",
         "the types as a number: umts 1, cdma 2, lte 4, gsm 8, scdma 16",
         ValueKind::integer,
         0,
         {},
         false,
         "N"},
        {"--wait",
         "take the telephony daemon's place, ask for one database after the other, and tell its outcome",
         ValueKind::text,
         0,
         {},
         false,
         nullptr},
        listeningDirectory(),
        listeningHelperUid()},
       checkDatabases},

      {"location",
       "civic",
       "ask for the civic address of a place",
       {"BVMobileHelperRequestCountryCodeFromLocation"},
       {{"LATITUDE", "degrees, north is positive", ValueKind::latitude},
        {"LONGITUDE", "degrees, east is positive", ValueKind::longitude}},
       {kWait, listeningDirectory(), listeningHelperUid()},
       requestCivicInfo},
      {"location",
       "country",
       "show the current country code",
       {"BVMobileHelperCopyCountryCode"},
       {},
       {},
       showCountry},
      {"location",
       "wan-ip",
       "ask for the public address of this machine",
       {"BVMobileHelperRequestWanIPFromLocation"},
       {},
       {kWait, listeningDirectory(), listeningHelperUid()},
       requestWanAddress},

      {"labels",
       "badges",
       "show badges of subscription labels",
       {"BVMobileHelperCopyBadgeLabels"},
       {},
       {kLanguage, kLabel, kLabelText, kLiteral},
       showBadges},
      {"labels",
       "localized",
       "show names of predefined subscription labels",
       {"BVMobileHelperCopyLocalizedLabels"},
       {},
       {kLanguage, kLabel},
       showLocalizedLabels},

      {"contacts",
       "remap",
       "move contacts from one channel identifier to another",
       {"BVMobileHelperRemapContactsChannel"},
       {words("FROM", "old channel identifier", kShort), words("TO", "new channel identifier", kShort)},
       {},
       remapChannel},

      {"",
       "radio-logs",
       "switch the radio manager's log file",
       {"BVMobileHelperEnableRadioManagerLogs"},
       {kState},
       {},
       switchRadioLogs},

      {"",
       "access",
       "explain who would be let in, from the entitlement files",
       {},
       {},
       {{"--exe", "program that asks, default this one", ValueKind::path, 0, {}, false, "FILE"},
        {"--user", "account it runs under, default yours", ValueKind::text, 0, {}, false, "USER"},
        {"--unit", "unit of the service manager it runs in", ValueKind::text, 0, {}, false, "UNIT"}},
       [](bvmh_client*, const Values& values) { return explainAccess(values); },
       true},

      {"",
       "status",
       "show whether the helper runs, what keeps it, and what it did last",
       {},
       {},
       {},
       [](bvmh_client*, const Values& values) { return showStatus(values); },
       true},

      {"",
       "watch",
       "show the helper's pushes and notifications, in place of the telephony daemon",
       {},
       {},
       {{"--count", "leave after so many", ValueKind::count, 0, {}, false, "N"},
        listeningDirectory(),
        listeningHelperUid()},
       nullptr,
       true},
  };
  return rows;
}

}  // namespace

Outcome did(const char* routine, std::int32_t code, std::string text) {
  Outcome outcome;
  outcome.routine = routine;
  outcome.code = code;
  outcome.text = std::move(text);
  return outcome;
}

const std::vector<Parameter>& globalOptions() {
  static const std::vector<Parameter> options{
      {"--json", "print one JSON object a line", ValueKind::text, 0, {}, false, nullptr},
      {"--timeout",
       "seconds to wait for each answer, default 30; for watch, seconds to listen",
       ValueKind::seconds,
       0,
       {},
       false,
       "SECONDS"},
      {"--socket", "the helper's service socket", ValueKind::path, 0, {}, false, "PATH"},
      {"--version", "show the version", ValueKind::text, 0, {}, false, nullptr},
      {"--help", "show this help", ValueKind::text, 0, {}, false, nullptr},
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

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "tools/bvhelperctl/CommandTable.h"

#include <algorithm>
#include <array>
#include <cerrno>
#include <charconv>
#include <cmath>
#include <cstdio>
#include <cstring>
#include <filesystem>
#include <memory>
#include <system_error>

#include "platform/base/Utf8.h"
#include "platform/plist/PropertyListCodec.h"
#include "tools/support/Base64.h"
#include "tools/support/PropertyListText.h"

namespace brenvik::tools {
namespace {

// ---- values ---------------------------------------------------------------------------------------------

template <class Number>
std::optional<Number> numberIn(const std::string& text) {
  Number number{};
  const char* end = text.data() + text.size();
  const auto [stop, error] = std::from_chars(text.data(), end, number);
  if (error != std::errc() || stop != end || text.empty()) return std::nullopt;
  return number;
}

double degrees(const std::string& text) { return numberIn<double>(text).value_or(0); }

PropertyList valueOfType(const std::string& type, const std::string& text) {
  const auto wrong = [&](const char* what) {
    return UsageError{"\"" + printable(text) + "\" is not " + what};
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
  if (type == "data") {
    if (const auto bytes = fromBase64(text)) return PropertyList::data(*bytes);
    throw wrong("base64");
  }
  PropertyList string = PropertyList::string(text);
  if (!string) throw wrong("UTF-8");
  return string;
}

std::string propertyListFile(const std::string& path) {
  const auto unreadable = [&] {
    return UsageError{"cannot read " + printable(path) + ": " + std::strerror(errno)};
  };
  struct Close {
    void operator()(std::FILE* file) const { (void)std::fclose(file); }  // only read from
  };
  const std::unique_ptr<std::FILE, Close> file(std::fopen(path.c_str(), "rbe"));
  if (file == nullptr) throw unreadable();
  std::string content;
  std::array<char, 65536> part;
  while (const std::size_t count = std::fread(part.data(), 1, part.size(), file.get()))
    content.append(part.data(), count);
  if (std::ferror(file.get()) != 0) throw unreadable();
  if (!parsePropertyList(std::as_bytes(std::span(content)))) {
    throw UsageError{printable(path) + " is not a property list"};
  }
  return content;
}

// The helper stores nothing under such a name, and its answer does not say so.
const std::string& domainOfAFile(const std::string& domain) {
  if (domain.empty() || domain == "." || domain == ".." || domain.find('/') != std::string::npos) {
    throw UsageError{"DOMAIN: \"" + printable(domain) +
                     "\" names no file: it is empty, \".\" or \"..\", or holds a slash"};
  }
  return domain;
}

std::string serialized(const PropertyList& value) {
  auto bytes = serializePropertyList(value, PropertyListFormat::binary);
  if (!bytes) throw UsageError{"the value is too large for a property list"};
  return *std::move(bytes);
}

// ---- outcomes -------------------------------------------------------------------------------------------

Outcome did(const char* routine, std::int32_t code, std::string text) {
  Outcome outcome;
  outcome.routine = routine;
  outcome.code = code;
  outcome.text = std::move(text);
  return outcome;
}

// Of a routine that answers whether its work succeeded.
Outcome triedTo(const char* routine, std::int32_t code, bool success, std::string text, std::string failure) {
  Outcome outcome = did(routine, code, std::move(text));
  if (code == BVMH_OK) {
    outcome.isDone = success;
    outcome.failure = std::move(failure) + "; the helper's log tells why";
  }
  return outcome;
}

// Shows a returned region, and frees it.
Outcome returned(const char* routine, std::int32_t code, bvmh_region& region) {
  Outcome outcome = did(routine, code, "");
  if (code != BVMH_OK) return outcome;
  const bool isFound = region.size != 0;
  const PropertyList value = parsePropertyList({static_cast<const std::byte*>(region.bytes), region.size});
  bvmh_region_free(&region);
  outcome.fields["found"] = isFound;
  outcome.fields["value"] = jsonOf(value);
  outcome.text = humanText(value);
  if (isFound && !value) {
    outcome.isDone = false;
    outcome.failure = "the helper returned something that is no property list";
  }
  return outcome;
}

Outcome returnedText(const char* routine, std::int32_t code, const char* name, const std::string& text,
                     const char* none) {
  Outcome outcome = did(routine, code, text.empty() ? none : printable(text));
  outcome.fields[name] = text;
  return outcome;
}

// Checks in and calls the routine, whose name is said once for the call and for the outcome. What was given
// has been checked by then: wrong usage is told whether there is a helper or not.
#define BVHELPERCTL_CALL(routine, ...)                 \
  constexpr const char* name = #routine;               \
  const std::int32_t connected = bvmh_connect(client); \
  const std::int32_t code = connected != BVMH_OK ? connected : routine(__VA_ARGS__)

// ---- commands -------------------------------------------------------------------------------------------

Outcome ping(bvmh_client* client, const Values&) {
  return did("BVMobileHelperCheckIn", bvmh_connect(client), "the helper answers");
}

Outcome setPreference(bvmh_client* client, const Values& values) {
  const std::string& domain = domainOfAFile(values["DOMAIN"]);
  const std::string type = values.get("--type", "string");
  const std::string value = type == "plist-file" ? propertyListFile(values["VALUE"])
                                                 : serialized(valueOfType(type, values["VALUE"]));
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
  return returned(name, code, region);
}

Outcome getAppPreference(bvmh_client* client, const Values& values) {
  bvmh_region region{};
  BVHELPERCTL_CALL(BVMobileHelperCopyAppPreferenceValue, client, values["DOMAIN"].c_str(),
                   values["KEY"].c_str(), &region);
  return returned(name, code, region);
}

Outcome loadPropertyList(bvmh_client* client, const Values& values) {
  bvmh_region region{};
  BVHELPERCTL_CALL(BVMobileHelperLoadPlistFile, client, values["PATH"].c_str(), &region);
  Outcome outcome = returned(name, code, region);
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
  return triedTo(name, code, success, "copied " + file, "did not copy " + file);
}

Outcome copyCrashLogs(bvmh_client* client, const Values& values) {
  bool success = false;
  BVHELPERCTL_CALL(BVMobileHelperCopyCrashLogs, client, values["PATH"].c_str(), &success);
  return triedTo(name, code, success, "copied " + printable(values["PATH"]) + " to the crash logs",
                 "did not copy " + printable(values["PATH"]));
}

Outcome moveBundle(bvmh_client* client, const Values& values) {
  bool success = false;
  BVHELPERCTL_CALL(BVMobileHelperMoveIntoCarrierBundles, client, values["SOURCE"].c_str(),
                   values["DESTINATION-DIR"].c_str(), values["NAME"].c_str(), &success);
  const std::string move = printable(values["SOURCE"]) + " to " + printable(values["DESTINATION-DIR"]) + "/" +
                           printable(values["NAME"]);
  return triedTo(name, code, success, "moved " + move, "did not move " + move);
}

Outcome unpackArchive(bvmh_client* client, const Values& values) {
  bool success = false;
  BVHELPERCTL_CALL(BVMobileHelperUnpackArchive, client, values["ARCHIVE"].c_str(),
                   values["DESTINATION"].c_str(), &success);
  const std::string what = printable(values["ARCHIVE"]) + " into " + printable(values["DESTINATION"]);
  return triedTo(name, code, success, "unpacked " + what, "did not unpack " + what);
}

Outcome switchHeartbeat(bvmh_client* client, const Values& values) {
  BVHELPERCTL_CALL(BVMobileHelperCellularHeartbeat, client, values["STATE"] == "on" ? 1 : 0);
  return did(name, code, "cellular heartbeat " + values["STATE"]);
}

Outcome switchRadioLogs(bvmh_client* client, const Values& values) {
  BVHELPERCTL_CALL(BVMobileHelperEnableRadioManagerLogs, client, values["STATE"] == "on" ? 1 : 0);
  return did(name, code, "radio manager logs " + values["STATE"]);
}

struct DatabaseType {
  const char* name;
  std::int32_t bit;
};
constexpr DatabaseType kDatabaseTypes[] = {{"gsm", BVMH_LASD_GSM},
                                           {"umts", BVMH_LASD_UMTS},
                                           {"cdma", BVMH_LASD_CDMA},
                                           {"lte", BVMH_LASD_LTE},
                                           {"scdma", BVMH_LASD_SCDMA}};

Outcome checkDatabases(bvmh_client* client, const Values& values) {
  std::int32_t mask = 0;
  if (values.has("--mask")) {
    if (values.has("--type")) throw UsageError{"--mask and --type say the same: give one of them"};
    mask = *numberIn<std::int32_t>(values["--mask"]);
  } else {
    for (const DatabaseType& type : kDatabaseTypes) {
      const bool isWanted =
          !values.has("--type") || std::any_of(values.all().begin(), values.all().end(), [&](auto& each) {
            return each.first == "--type" && each.second == type.name;
          });
      if (isWanted) mask |= type.bit;
    }
  }
  BVHELPERCTL_CALL(BVMobileHelperCheckLASDUpdate, client, mask);
  Outcome outcome =
      did(name, code, "update check started; its outcome goes to the telephony daemon (see \"watch\")");
  outcome.fields["mask"] = mask;
  return outcome;
}

constexpr const char* kAnsweredByPush = "asked; the answer goes to the telephony daemon (see \"watch\")";

Outcome requestCivicInfo(bvmh_client* client, const Values& values) {
  BVHELPERCTL_CALL(BVMobileHelperRequestCountryCodeFromLocation, client, degrees(values["LATITUDE"]),
                   degrees(values["LONGITUDE"]));
  return did(name, code, kAnsweredByPush);
}

Outcome requestWanAddress(bvmh_client* client, const Values&) {
  BVHELPERCTL_CALL(BVMobileHelperRequestWanIPFromLocation, client);
  return did(name, code, kAnsweredByPush);
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

Outcome remapChannel(bvmh_client* client, const Values& values) {
  bool success = false;
  BVHELPERCTL_CALL(BVMobileHelperRemapContactsChannel, client, values["FROM"].c_str(), values["TO"].c_str(),
                   &success);
  const std::string what = "contacts from " + printable(values["FROM"]) + " to " + printable(values["TO"]);
  return triedTo(name, code, success, "moved " + what, "did not move " + what);
}

// ---- the table ------------------------------------------------------------------------------------------

constexpr std::size_t kShort = 63;
constexpr std::size_t kText = 255;
constexpr std::size_t kLong = 1023;
// The domain's file is named DOMAIN.plist, and a file name has at most 255 bytes.
constexpr std::size_t kDomainName = 249;

const Parameter kDomain{"DOMAIN", "preference domain, such as com.norvale.carrier", ValueKind::text,
                        kDomainName};
const Parameter kKey{"KEY", "name of the value", ValueKind::text, kText};
const Parameter kState{"STATE", "on or off", ValueKind::choice, 0, {"on", "off"}};
const Parameter kTokenKey{
    "--key", "the token under this key instead of the general one", ValueKind::text, kText, {}, false, "KEY"};
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
    {},
    true,
    "LABEL"};

Parameter file(const char* name, const char* help, std::size_t limit) {
  return {name, help, ValueKind::path, limit};
}
Parameter words(const char* name, const char* help, std::size_t limit) {
  return {name, help, ValueKind::text, limit};
}
Parameter bytes(const char* name, const char* help, std::size_t limit) {
  return {name, help, ValueKind::bytes, limit};
}

std::vector<Command> makeTable() {
  return {
      {"", "ping", "check in and leave again", {"BVMobileHelperCheckIn"}, {}, {}, ping},

      {"prefs",
       "set",
       "store a preference value",
       {"BVMobileHelperSetPreferenceValue"},
       {kDomain, kKey, bytes("VALUE", "the value; with --type plist-file, a file", 0)},
       {{"--type",
         "string (default), integer, real, bool, data (base64) or plist-file",
         ValueKind::choice,
         0,
         {"string", "integer", "real", "bool", "data", "plist-file"},
         false,
         "TYPE"}},
       setPreference},
      {"prefs",
       "get",
       "show a preference value",
       {"BVMobileHelperCopyPreferenceValue"},
       {kDomain, kKey},
       {},
       getPreference},
      {"prefs",
       "get-app",
       "show a preference value in application scope",
       {"BVMobileHelperCopyAppPreferenceValue"},
       {kDomain, kKey},
       {},
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
       {words("TOKEN", "the token", kText)},
       {kTokenKey},
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
         "gsm, umts, cdma, lte or scdma; may be repeated; default: all",
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
         "N"}},
       checkDatabases},

      {"location",
       "civic",
       "ask for the civic address of a place",
       {"BVMobileHelperRequestCountryCodeFromLocation"},
       {{"LATITUDE", "degrees, north is positive", ValueKind::latitude},
        {"LONGITUDE", "degrees, east is positive", ValueKind::longitude}},
       {},
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
       {},
       requestWanAddress},

      {"labels",
       "badges",
       "show badges of subscription labels",
       {"BVMobileHelperCopyBadgeLabels"},
       {},
       {kLanguage, kLabel, {"--text", "a label's own text", ValueKind::text, 0, {}, true, "TEXT"}},
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
       nullptr,
       true},

      {"",
       "watch",
       "show the helper's pushes and notifications, in place of the telephony daemon",
       {},
       {},
       {{"--count", "leave after so many", ValueKind::count, 0, {}, false, "N"},
        {"--directory", "folder of named services", ValueKind::path, 0, {}, false, "DIR"},
        {"--helper-uid", "take messages from this user too", ValueKind::user, 0, {}, false, "UID"}},
       nullptr,
       true},
  };
}

}  // namespace

const std::string* Values::find(std::string_view name) const {
  const auto found =
      std::find_if(given_.begin(), given_.end(), [&](const auto& each) { return each.first == name; });
  return found == given_.end() ? nullptr : &found->second;
}

const std::vector<Parameter>& globalOptions() {
  static const std::vector<Parameter> options{
      {"--json", "print one JSON object a line", ValueKind::text, 0, {}, false, nullptr},
      {"--timeout",
       "seconds to wait for each answer, default 30",
       ValueKind::seconds,
       0,
       {},
       false,
       "SECONDS"},
      {"--socket", "the helper's service socket", ValueKind::path, 0, {}, false, "PATH"},
      {"--version", "show the version", ValueKind::text, 0, {}, false, nullptr},
      {"--help", "show what there is", ValueKind::text, 0, {}, false, nullptr},
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

const std::vector<Command>& commandTable() {
  static const std::vector<Command> table = makeTable();
  return table;
}

std::string wordsOf(const Command& command) {
  return *command.group == '\0' ? command.name : std::string(command.group) + ' ' + command.name;
}

std::string checkedValue(const Parameter& parameter, const std::string& given) {
  const auto wrong = [&](const std::string& what) {
    return UsageError{std::string(parameter.name) + ": \"" + printable(given) + "\" is not " + what};
  };
  const auto isBetween = [&](double least, double most) {
    const auto number = numberIn<double>(given);
    return number && *number >= least && *number <= most;
  };
  std::string value = given;
  switch (parameter.kind) {
    case ValueKind::text:
      if (!isValidUtf8(given)) throw wrong("UTF-8");
      break;
    case ValueKind::bytes:
      break;
    case ValueKind::path: {
      std::error_code error;
      if (given.empty()) throw wrong("a path");
      value = std::filesystem::absolute(given, error).string();
      if (error) throw wrong("a path from here: " + error.message());
      break;
    }
    case ValueKind::latitude:
      if (!isBetween(-90, 90)) throw wrong("a latitude, -90 to 90");
      break;
    case ValueKind::longitude:
      if (!isBetween(-180, 180)) throw wrong("a longitude, -180 to 180");
      break;
    case ValueKind::integer:
      if (!numberIn<std::int32_t>(given)) throw wrong("an integer of 32 bits");
      break;
    case ValueKind::count:
      if (numberIn<std::int32_t>(given).value_or(0) < 1) throw wrong("a number from 1 on");
      break;
    case ValueKind::user:
      if (!numberIn<std::uint32_t>(given)) throw wrong("a user's number");
      break;
    case ValueKind::seconds:
      // As milliseconds they must fit 32 bits.
      if (!isBetween(0.001, 4'000'000)) throw wrong("a number of seconds, 0.001 to 4000000");
      break;
    case ValueKind::choice:
      if (std::none_of(parameter.choices.begin(), parameter.choices.end(),
                       [&](const char* each) { return given == each; })) {
        std::string all;
        for (const char* each : parameter.choices) all += std::string(all.empty() ? "" : ", ") + each;
        throw wrong("one of: " + all);
      }
      break;
  }
  if (parameter.limit != 0 && value.size() > parameter.limit) {
    throw UsageError{std::string(parameter.name) + ": at most " + std::to_string(parameter.limit) + " bytes"};
  }
  return value;
}

double secondsIn(const std::string& value) { return numberIn<double>(value).value_or(0); }

}  // namespace brenvik::tools

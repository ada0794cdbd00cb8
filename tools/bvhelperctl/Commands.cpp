// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "tools/bvhelperctl/Commands.h"

#include <pwd.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstddef>
#include <cstdint>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "platform/plist/PropertyListCodec.h"
#include "tools/bvhelperctl/Call.h"
#include "tools/bvhelperctl/CommandValues.h"
#include "tools/support/PropertyListText.h"

namespace brenvik::tools {
namespace {

// Of a routine that answers whether its work succeeded.
Outcome outcomeOfWork(const char* routine, std::int32_t code, bool success, std::string text,
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

}  // namespace

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

namespace {

// Of a routine that answers "failed" when symlink(2) does.
std::string linkFailure(const std::string& link) {
  return printable(link) + " cannot be made: its folder is missing, or may not be written by the helper";
}

}  // namespace

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
  return outcomeOfWork(name, code, success, "copied " + file, "did not copy " + file);
}

Outcome copyCrashLogs(bvmh_client* client, const Values& values) {
  bool success = false;
  BVHELPERCTL_CALL(BVMobileHelperCopyCrashLogs, client, values["PATH"].c_str(), &success);
  return outcomeOfWork(name, code, success, "copied " + printable(values["PATH"]) + " to the crash logs",
                       "did not copy " + printable(values["PATH"]));
}

Outcome moveBundle(bvmh_client* client, const Values& values) {
  bool success = false;
  BVHELPERCTL_CALL(BVMobileHelperMoveIntoCarrierBundles, client, values["SOURCE"].c_str(),
                   values["DESTINATION-DIR"].c_str(), values["NAME"].c_str(), &success);
  const std::string move = printable(values["SOURCE"]) + " to " + printable(values["DESTINATION-DIR"]) + "/" +
                           printable(values["NAME"]);
  return outcomeOfWork(name, code, success, "moved " + move, "did not move " + move);
}

Outcome unpackArchive(bvmh_client* client, const Values& values) {
  bool success = false;
  BVHELPERCTL_CALL(BVMobileHelperUnpackArchive, client, values["ARCHIVE"].c_str(),
                   values["DESTINATION"].c_str(), &success);
  const std::string what = printable(values["ARCHIVE"]) + " into " + printable(values["DESTINATION"]);
  return outcomeOfWork(name, code, success, "unpacked " + what, "did not unpack " + what);
}

Outcome showCountry(bvmh_client* client, const Values&) {
  char country[BVMH_COUNTRY_CODE_SIZE] = "";
  BVHELPERCTL_CALL(BVMobileHelperCopyCountryCode, client, country, sizeof country);
  return returnedText(name, code, "country", country, "(not known)");
}

namespace {

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
                     const std::vector<PropertyList>& labels, const Values& values) {
  if (labels.empty()) throw UsageError{"no label given"};
  std::vector<PropertyList> languages;
  for (const auto& [parameter, value] : values.all()) {
    if (parameter == "--language") languages.push_back(valueOfType("string", value));
  }
  const std::string labelBytes = serialized(PropertyList::array(labels));
  const std::string languageBytes = serialized(PropertyList::array(languages));
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

}  // namespace

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
  return askForLabels("BVMobileHelperCopyBadgeLabels", BVMobileHelperCopyBadgeLabels, client, labels, values);
}

Outcome showLocalizedLabels(bvmh_client* client, const Values& values) {
  std::vector<PropertyList> labels;
  for (const auto& [parameter, value] : values.all()) {
    if (parameter == "--label") labels.push_back(valueOfType("string", labelKey(value)));
  }
  return askForLabels("BVMobileHelperCopyLocalizedLabels", BVMobileHelperCopyLocalizedLabels, client, labels,
                      values);
}

namespace {

// Whether there is a contacts store; nothing when this program may not look.
std::optional<bool> hasContactsStore() {
  const passwd* mobile = ::getpwnam("mobile");
  if (mobile == nullptr) return false;
  const std::string path = std::string(mobile->pw_dir) + "/Library/AddressBook/contacts.db";
  if (::access(path.c_str(), F_OK) == 0) return true;
  if (errno == ENOENT || errno == ENOTDIR) return false;
  return std::nullopt;
}

}  // namespace

Outcome remapChannel(bvmh_client* client, const Values& values) {
  bool success = false;
  BVHELPERCTL_CALL(BVMobileHelperRemapContactsChannel, client, values["FROM"].c_str(), values["TO"].c_str(),
                   &success);
  const std::string what = "contacts from " + printable(values["FROM"]) + " to " + printable(values["TO"]);
  // The helper answers "done", too, when it cannot open a store, and never how many there were.
  const std::optional<bool> hasStore = hasContactsStore();
  Outcome outcome = outcomeOfWork(
      name, code, success,
      hasStore == false ? "no contacts to move: there is no contacts store" : "remapped " + what,
      "did not move " + what);
  outcome.fields["store"] = hasStore ? nlohmann::ordered_json(*hasStore) : nlohmann::ordered_json();
  return outcome;
}

}  // namespace brenvik::tools

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
//
// Prints the protocol from the message structs, so that no page and no other language says anything else than
// the code: the table of routines for docs/protocol.md, or everything as JSON. Tests compare.
//
// usage: protocol-table [json]
#include <brenvik/mobile_helper.h>

#include <algorithm>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <nlohmann/json.hpp>
#include <string>
#include <vector>

#include "interface/Routines.h"
#include "interface/TelephonyMessages.h"

namespace {

using namespace brenvik;
using nlohmann::ordered_json;

struct Argument {
  const char* name;
  std::size_t offset;
  std::size_t size;
  const char* type;      // in the JSON
  std::string typeText;  // on the page
  ordered_json more = ordered_json::object();
};

struct Description {
  const char* routine;  // without its prefix
  std::size_t size;
  std::vector<Argument> arguments;
  const char* meaning;
  const char* codes;  // beside 0 and those of the message layer
};

// An argument is a field of the request's struct.
#define ARGUMENT(Request, field, name, type, ...) \
  Argument { name, offsetof(Request, field), sizeof(Request::field), type, __VA_ARGS__ }
#define TEXT(Request, field, name) \
  ARGUMENT(Request, field, name, "text", "char[" + std::to_string(sizeof(Request::field)) + "]")
#define INTEGER(Request, field, name) ARGUMENT(Request, field, name, "i32", "i32")
#define DEGREES(Request, field, name) \
  ARGUMENT(Request, field, name, "f64", "f64, degrees", {{"unit", "degrees"}})
#define COUNT(Request, count) \
  ARGUMENT(Request, descriptorCount, "descriptor count " #count, "descriptorCount", "u32", {{"value", count}})
#define REGION(Request, field, name) ARGUMENT(Request, field, name, "region", "out-of-line descriptor")
#define LENGTH(Request, field, name, region) \
  ARGUMENT(Request, field, name, "regionSize", "u32", {{"region", region}})

const char* const kPrefix = "BVMobileHelper";

std::vector<Description> descriptions() {
  const std::size_t none = sizeof(EmptyRequest);
  return {
      {"CheckIn",
       sizeof(CheckInRequest),
       {COUNT(CheckInRequest, 1),
        ARGUMENT(CheckInRequest, clientPort, "the caller's port", "port", "port descriptor")},
       "Makes a client of the caller; the reply carries its channel.",
       "5 the caller's port has died already, or its other end is the helper's; 6 out of descriptors; 35 not "
       "entitled"},
      {"SetVoicemailToken",
       sizeof(String256Request),
       {TEXT(String256Request, text, "token")},
       "Stores the general voicemail token.",
       "5 not UTF-8"},
      {"SetVoicemailTokenForKey",
       sizeof(TwoStrings256Request),
       {TEXT(TwoStrings256Request, first, "key"), TEXT(TwoStrings256Request, second, "token")},
       "Stores a token under a key.",
       "5 not UTF-8"},
      {"ClearVoicemailToken", none, {}, "Removes the general token.", ""},
      {"ResetVoicemailStore", none, {}, "Removes the general token, then every record of the store.", ""},
      {"CopyVoicemailTokenForKey",
       sizeof(String256Request),
       {TEXT(String256Request, text, "key")},
       "Returns the token under a key; empty when there is none.",
       "5 not UTF-8"},
      {"CopyVoicemailToken", none, {}, "Returns the general token; empty when there is none.", ""},
      {"SetPreferenceValue",
       sizeof(SetPreferenceValueRequest),
       {COUNT(SetPreferenceValueRequest, 1), REGION(SetPreferenceValueRequest, value, "value"),
        TEXT(SetPreferenceValueRequest, domain, "domain"), TEXT(SetPreferenceValueRequest, key, "key"),
        LENGTH(SetPreferenceValueRequest, valueLength, "value length", "value")},
       "Stores a value, a property list in XML or binary form, for the helper's own user on any host. A "
       "value of "
       "exactly one byte removes the key.",
       "5 not UTF-8, or no property list"},
      {"CopyPreferenceValue",
       sizeof(TwoStrings256Request),
       {TEXT(TwoStrings256Request, first, "domain"), TEXT(TwoStrings256Request, second, "key")},
       "Returns a value as an XML property list; an empty region when there is none.",
       "3 or 6 no memory for the region; 5 not UTF-8, or it cannot be written as XML"},
      {"CopyAppPreferenceValue",
       sizeof(TwoStrings256Request),
       {TEXT(TwoStrings256Request, first, "domain"), TEXT(TwoStrings256Request, second, "key")},
       "The same in application scope: this user on this host, this user on any host, any user.",
       "as CopyPreferenceValue"},
      {"ReplaceCarrierSymlink",
       sizeof(ThreeStrings1024Request),
       {TEXT(ThreeStrings1024Request, first, "target"), TEXT(ThreeStrings1024Request, second, "link path"),
        TEXT(ThreeStrings1024Request, third, "preference domain")},
       "Replaces one of the known carrier files by a symbolic link, then drops the cached values of the "
       "domain, "
       "unless that is empty.",
       "5 the link cannot be made; 8 not one of those files, or a folder"},
      {"CreateSymlink",
       sizeof(TwoStrings1024Request),
       {TEXT(TwoStrings1024Request, first, "target"), TEXT(TwoStrings1024Request, second, "link path")},
       "Replaces any file by a symbolic link.",
       "5 the link cannot be made"},
      {"RemoveCarrierFile",
       sizeof(TwoStrings1024Request),
       {TEXT(TwoStrings1024Request, first, "path"), TEXT(TwoStrings1024Request, second, "preference domain")},
       "Drops the cached values of the domain, unless that is empty, then removes a carrier file or an empty "
       "folder.",
       "5 it cannot be removed; 8 no carrier file"},
      {"IsVoicemailServiceSubscribed", none, {}, "Tells whether visual voicemail is subscribed.", ""},
      {"CellularHeartbeat",
       sizeof(IntegerRequest),
       {INTEGER(IntegerRequest, value, "value")},
       "Non-zero: an echo every two seconds over the cellular interface, and the helper stays; 0: off.",
       ""},
      {"CheckLASDUpdate",
       sizeof(IntegerRequest),
       {ARGUMENT(IntegerRequest, value, "value", "i32", "i32",
                 {{"bits",
                   {{"umts", BVMH_LASD_UMTS},
                    {"cdma", BVMH_LASD_CDMA},
                    {"lte", BVMH_LASD_LTE},
                    {"gsm", BVMH_LASD_GSM},
                    {"scdma", BVMH_LASD_SCDMA}}}})},
       "Starts an update check of location-aware service databases, a bit each: umts 1, cdma 2, lte 4, gsm "
       "8, scdma "
       "16. The outcome comes as notifications. The reply's NDR record is unset on success.",
       ""},
      {"CopyCarrierFile",
       sizeof(ThreeStrings256Request),
       {TEXT(ThreeStrings256Request, first, "source directory"),
        TEXT(ThreeStrings256Request, second, "destination directory"),
        TEXT(ThreeStrings256Request, third, "file name")},
       "Copies a file into a carrier folder and gives it to the account \"mobile\"; tells whether that "
       "succeeded.",
       ""},
      {"CopyCrashLogs",
       sizeof(String256Request),
       {TEXT(String256Request, text, "path")},
       "Copies a folder into the crash logs of the account \"mobile\"; tells whether that succeeded.",
       ""},
      {"MoveIntoCarrierBundles",
       sizeof(ThreeStrings256Request),
       {TEXT(ThreeStrings256Request, first, "source path"),
        TEXT(ThreeStrings256Request, second, "destination directory"),
        TEXT(ThreeStrings256Request, third, "name")},
       "Moves a folder to a name in a carrier bundles folder, which is made when missing; tells whether that "
       "succeeded.",
       ""},
      {"RequestCountryCodeFromLocation",
       sizeof(CoordinateRequest),
       {DEGREES(CoordinateRequest, latitude, "latitude"), DEGREES(CoordinateRequest, longitude, "longitude")},
       "Asks for the civic address of a place. It comes as a push, within about five seconds. Both exactly "
       "0: the push "
       "holds the configured country only.",
       ""},
      {"CopyCountryCode", none, {}, "Returns the current country code; empty when none is known.", ""},
      {"RequestWanIPFromLocation",
       none,
       {},
       "Asks for the public address of this machine. It comes as a push, within about five seconds; empty "
       "when there is "
       "none.",
       ""},
      {"EnableRadioManagerLogs",
       sizeof(IntegerRequest),
       {INTEGER(IntegerRequest, value, "enable")},
       "Non-zero: the radio manager logs to a file; 0: it does not.",
       ""},
      {"UnpackArchive",
       sizeof(TwoStrings256Request),
       {TEXT(TwoStrings256Request, first, "archive path"),
        TEXT(TwoStrings256Request, second, "destination path")},
       "Unpacks a zip archive into a folder, each entry with its permission bits but none that is set-id or "
       "sticky; tells whether that succeeded.",
       ""},
      {"LoadPlistFile",
       sizeof(String256Request),
       {TEXT(String256Request, text, "path")},
       "Returns a property-list file whose top level is a dictionary, as XML.",
       "3 or 6 no memory for the region; 9 missing, unreadable, or something else"},
      {"CopyBadgeLabels",
       sizeof(LabelsRequest),
       {COUNT(LabelsRequest, 2), REGION(LabelsRequest, labels, "labels"),
        REGION(LabelsRequest, languages, "languages"),
        LENGTH(LabelsRequest, labelsLength, "labels length", "labels"),
        LENGTH(LabelsRequest, languagesLength, "languages length", "languages")},
       "Returns short labels, an array of texts. `labels`: an array of pairs, a label key and a text that is "
       "not looked "
       "at, or an empty text and a label's own text. `languages`: an array of texts.",
       "3 or 6 no memory for the region; 5 an argument that is no array, or no label in it"},
      {"CopyLocalizedLabels",
       sizeof(LabelsRequest),
       {COUNT(LabelsRequest, 2), REGION(LabelsRequest, labels, "labels"),
        REGION(LabelsRequest, languages, "languages"),
        LENGTH(LabelsRequest, labelsLength, "labels length", "labels"),
        LENGTH(LabelsRequest, languagesLength, "languages length", "languages")},
       "Returns the names of predefined labels, an array of texts. `labels`: an array of label keys. "
       "`languages`: as "
       "above.",
       "3 or 6 no memory for the region; 5 an argument that is no array"},
      {"RemapContactsChannel",
       sizeof(TwoStrings64Request),
       {TEXT(TwoStrings64Request, first, "from"), TEXT(TwoStrings64Request, second, "to")},
       "Moves every contact's reference from one channel identifier to another; tells whether that "
       "succeeded.",
       ""},
  };
}

const char* nameOf(ReplyForm form) {
  switch (form) {
    case ReplyForm::status:
      return "status";
    case ReplyForm::integer:
      return "boolean";
    case ReplyForm::string64:
      return "text 64";
    case ReplyForm::string256:
      return "text 256";
    case ReplyForm::outOfLine:
      return "region";
    case ReplyForm::checkIn:
      return "check-in";
  }
  return "?";
}

// Whether the words fit the row of the routine.
bool fits(const RoutineFacts& routine, const Description& description) {
  if (routine.name == kPrefix + std::string(description.routine) && routine.requestSize == description.size)
    return true;
  std::fprintf(stderr, "protocol-table: the row of %s does not fit\n", description.routine);
  return false;
}

void printRow(const RoutineFacts& routine, const Description& description) {
  std::string arguments = std::to_string(routine.requestSize);
  const char* separator = ": ";
  for (const Argument& each : description.arguments) {
    arguments +=
        separator + std::string(each.name) + " (" + std::to_string(each.offset) + ", " + each.typeText + ")";
    separator = ", ";
  }
  std::printf("| %d | `%s` | %s | %s, %zu | %s | %s |\n", routine.id, description.routine, arguments.c_str(),
              nameOf(routine.reply), sizeOfReply(routine.reply), description.meaning, description.codes);
}

void printTable(const std::vector<const RoutineFacts*>& routines, const std::vector<Description>& all) {
  std::printf(
      "| Id | Routine | Request: size, then arguments (offset, type) | Reply: form, size | What it does | "
      "Codes |\n");
  std::printf("|---|---|---|---|---|---|\n");
  for (std::size_t i = 0; i < routines.size(); ++i) printRow(*routines[i], all[i]);
}

// ---- JSON -----------------------------------------------------------------------------------------------

// "link path": "link_path"
std::string identifierOf(const Argument& argument) {
  const std::string type = argument.type;
  if (type == "descriptorCount") return "descriptor_count";
  std::string name = argument.name;
  if (name == "the caller's port") return "client_port";
  std::replace(name.begin(), name.end(), ' ', '_');
  return name;
}

ordered_json jsonOf(const Argument& argument) {
  ordered_json json{{"name", identifierOf(argument)},
                    {"offset", argument.offset},
                    {"size", argument.size},
                    {"type", argument.type}};
  json.update(argument.more);
  return json;
}

ordered_json jsonOf(const std::vector<Argument>& arguments) {
  ordered_json json = ordered_json::array();
  for (const Argument& each : arguments) json.push_back(jsonOf(each));
  return json;
}

ordered_json jsonOf(const RoutineFacts& routine, const Description& description) {
  return {{"id", routine.id},
          {"name", description.routine},
          {"requestSize", routine.requestSize},
          {"descriptors", routine.descriptors},
          {"arguments", jsonOf(description.arguments)},
          {"reply", nameOf(routine.reply)},
          {"meaning", description.meaning},
          {"codes", description.codes}};
}

#define FIELD(Struct, field, name, type) ARGUMENT(Struct, field, name, type, "")
#define STATUS_FIELDS FIELD(StatusReply, ndr, "ndr", "ndr"), FIELD(StatusReply, returnCode, "code", "i32")
#define REPLY(form, Struct, ...)                                   \
  {                                                                \
    {"form", nameOf(ReplyForm::form)}, {"size", sizeof(Struct)}, { \
      "fields", jsonOf(std::vector<Argument>{__VA_ARGS__})         \
    }                                                              \
  }

ordered_json elements() {
  return {
      {"header",
       {{"size", sizeof(MessageHeader)},
        {"fields",
         jsonOf(std::vector<Argument>{
             FIELD(MessageHeader, bits, "bits", "u32"), FIELD(MessageHeader, size, "size", "u32"),
             FIELD(MessageHeader, replyPort, "reply_port", "u32"),
             FIELD(MessageHeader, localPort, "local_port", "u32"),
             FIELD(MessageHeader, voucher, "voucher", "u32"), FIELD(MessageHeader, id, "id", "i32")})}}},
      {"portDescriptor",
       {{"size", sizeof(PortDescriptor)},
        {"kind", kPortDescriptorType},
        {"fields", jsonOf(std::vector<Argument>{FIELD(PortDescriptor, name, "name", "u32"),
                                                FIELD(PortDescriptor, disposition, "disposition", "u8"),
                                                FIELD(PortDescriptor, type, "kind", "u8")})}}},
      {"outOfLineDescriptor",
       {{"size", sizeof(OutOfLineDescriptor)},
        {"kind", kOutOfLineDescriptorType},
        {"fields", jsonOf(std::vector<Argument>{FIELD(OutOfLineDescriptor, address, "address", "u64"),
                                                FIELD(OutOfLineDescriptor, deallocate, "deallocate", "u8"),
                                                FIELD(OutOfLineDescriptor, copy, "copy", "u8"),
                                                FIELD(OutOfLineDescriptor, type, "kind", "u8"),
                                                FIELD(OutOfLineDescriptor, size, "size", "u32")})}}}};
}

ordered_json constants() {
  return {{"ndr", std::vector<int>(std::begin(kNdrRecord.bytes), std::end(kNdrRecord.bytes))},
          {"complexBit", kComplexBit},
          {"replyDisposition", kReplyDisposition},
          {"replyIdOffset", kReplyIdOffset},
          {"largestDatagram", kLargestDatagram},
          {"descriptorCountOffset", kDescriptorCountOffset},
          {"descriptorsOffset", kDescriptorsOffset},
          {"regionAlignment", 8},
          {"checkInDisposition", kDispositionMoveSend},
          {"checkInReplyDisposition", kDispositionCopySend},
          {"copy", kVirtualCopy}};
}

ordered_json replyForms() {
  const ordered_json forms = {
      REPLY(status, StatusReply, STATUS_FIELDS),
      REPLY(integer, IntegerReply, STATUS_FIELDS,
            Argument{"result", offsetof(IntegerReply, result), 1, "boolean", ""}),
      REPLY(string64, String64Reply, STATUS_FIELDS, FIELD(String64Reply, text, "result", "text")),
      REPLY(string256, String256Reply, STATUS_FIELDS, FIELD(String256Reply, text, "result", "text")),
      REPLY(outOfLine, OutOfLineReply, COUNT(OutOfLineReply, 1),
            FIELD(OutOfLineReply, payload, "result", "region"), FIELD(OutOfLineReply, ndr, "ndr", "ndr"),
            LENGTH(OutOfLineReply, byteCount, "result size", "result")),
      REPLY(checkIn, CheckInReply, COUNT(CheckInReply, 1),
            Argument{"channel", offsetof(CheckInReply, servicePort), sizeof(CheckInReply::servicePort),
                     "port", ""}),
  };
  return forms;
}

// The codes with the words of the client library.
ordered_json codes() {
  struct Named {
    KernelReturn code;
    const char* name;
  };
  static_assert(kern::noSpace == BVMH_NO_SPACE && kern::failure == BVMH_FAILURE &&
                kern::resourceShortage == BVMH_RESOURCE_SHORTAGE && kern::noAccess == BVMH_NO_ACCESS &&
                kern::memoryFailure == BVMH_MEMORY_FAILURE &&
                kern::invalidSecurity == BVMH_INVALID_SECURITY && mig::typeError == BVMH_TYPE_ERROR &&
                mig::badId == BVMH_BAD_ID && mig::badArguments == BVMH_BAD_ARGUMENTS &&
                mig::trailerError == BVMH_TRAILER_ERROR);
  ordered_json json = ordered_json::array();
  for (const Named& each :
       {Named{kern::success, "success"}, Named{kern::noSpace, "noSpace"}, Named{kern::failure, "failure"},
        Named{kern::resourceShortage, "resourceShortage"}, Named{kern::noAccess, "noAccess"},
        Named{kern::memoryFailure, "memoryFailure"}, Named{kern::invalidSecurity, "invalidSecurity"},
        Named{BVMH_NOT_SUPPORTED, "notSupported"}, Named{mig::typeError, "typeError"},
        Named{mig::badId, "badId"}, Named{mig::badArguments, "badArguments"},
        Named{mig::trailerError, "trailerError"}}) {
    json.push_back({{"code", each.code}, {"name", each.name}, {"meaning", bvmh_error_text(each.code)}});
  }
  return json;
}

ordered_json pushes() {
  return {{"service", kTelephonyServiceName},
          {"requestSize", sizeof(TelephonyPushMessage)},
          {"arguments", jsonOf(std::vector<Argument>{COUNT(TelephonyPushMessage, 1),
                                                     FIELD(TelephonyPushMessage, values, "values", "region"),
                                                     FIELD(TelephonyPushMessage, ndr, "ndr", "ndr")})},
          {"replySize", sizeof(TelephonyPushReply)},
          {"replyFields", jsonOf(std::vector<Argument>{FIELD(TelephonyPushReply, ndr, "ndr", "ndr"),
                                                       FIELD(TelephonyPushReply, returnCode, "code", "i32"),
                                                       FIELD(TelephonyPushReply, result, "result", "u64")})},
          {"clientKey", kClientKey},
          {"messages",
           {{{"id", kSetCivicInfoMessageId},
             {"name", "SetCivicInfoBasedOnCurrentLocation"},
             {"keys", {kCountryCodeKey, kStateKey, kCityKey, kPostalCodeKey}}},
            {{"id", kSetLocalRoutableAddressMessageId},
             {"name", "SetLocalRoutableAddress"},
             {"keys", ordered_json::array({kAddressKey})}}}}};
}

ordered_json notifications() {
  return {{"service", kNotificationServiceName},
          {"id", kNotificationMessageId},
          {"kindKey", "Notification"},
          {"databaseKey", "DBType"},
          {"kinds",
           {"com.norvale.lasd.UpdateAvailable", "com.norvale.lasd.NoUpdateRequired",
            "com.norvale.lasd.UpdateFailed"}},
          {"databases", {"gsm", "umts", "cdma", "lte", "scdma"}}};
}

void printJson(const std::vector<const RoutineFacts*>& routines, const std::vector<Description>& all) {
  ordered_json json{
      {"format", 1}, {"service", kServiceName}, {"prefix", kPrefix}, {"constants", constants()}};
  json.update(elements());
  json["replyForms"] = replyForms();
  json["routines"] = ordered_json::array();
  for (std::size_t i = 0; i < routines.size(); ++i) json["routines"].push_back(jsonOf(*routines[i], all[i]));
  json["codes"] = codes();
  json["pushes"] = pushes();
  json["notifications"] = notifications();
  std::printf("%s\n", json.dump(2).c_str());
}

}  // namespace

int main(int argc, char** argv) {
  const bool asJson = argc == 2 && std::strcmp(argv[1], "json") == 0;
  if (argc != 1 && !asJson) {
    std::fprintf(stderr, "usage: protocol-table [json]\n");
    return 2;
  }
  std::vector<const RoutineFacts*> routines{&kCheckInRoutine};
  for (const RoutineFacts& each : kRequestRoutines) routines.push_back(&each);
  const std::vector<Description> all = descriptions();
  if (all.size() != routines.size()) {
    std::fprintf(stderr, "protocol-table: %zu rows described\n", all.size());
    return EXIT_FAILURE;
  }
  bool isRight = true;
  for (std::size_t i = 0; i < routines.size(); ++i) isRight &= fits(*routines[i], all[i]);
  if (!isRight) return EXIT_FAILURE;
  asJson ? printJson(routines, all) : printTable(routines, all);
  return EXIT_SUCCESS;
}

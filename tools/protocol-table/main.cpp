// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
//
// Prints the table of routines for docs/protocol.md from the message structs, so that the page cannot say
// anything else than the code. A test compares the two.
#include <algorithm>
#include <cstdio>
#include <cstdlib>
#include <string>
#include <vector>

#include "interface/Routines.h"

namespace {

using namespace brenvik;

struct Argument {
  const char* name;
  std::size_t offset;
  std::string type;
};

struct Description {
  const char* routine;  // without its prefix
  std::size_t size;
  std::vector<Argument> arguments;
  const char* meaning;
  const char* codes;  // beside 0 and those of the message layer
};

// An argument is a field of the request's struct.
#define TEXT(Request, field, name) \
  Argument { name, offsetof(Request, field), "char[" + std::to_string(sizeof(Request::field)) + "]" }
#define FIELD(Request, field, name, type) \
  Argument { name, offsetof(Request, field), type }

const char* const kPrefix = "BVMobileHelper";

std::vector<Description> descriptions() {
  const std::size_t none = sizeof(EmptyRequest);
  return {
      {"CheckIn",
       sizeof(CheckInRequest),
       {FIELD(CheckInRequest, descriptorCount, "descriptor count 1", "u32"),
        FIELD(CheckInRequest, clientPort, "the caller's port", "port descriptor")},
       "Makes a client of the caller; the reply carries its channel.",
       "5 the caller's port has died already; 6 out of descriptors; 35 not entitled"},
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
       {FIELD(SetPreferenceValueRequest, descriptorCount, "descriptor count 1", "u32"),
        FIELD(SetPreferenceValueRequest, value, "value", "out-of-line descriptor"),
        TEXT(SetPreferenceValueRequest, domain, "domain"), TEXT(SetPreferenceValueRequest, key, "key"),
        FIELD(SetPreferenceValueRequest, valueLength, "value length", "u32")},
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
       {FIELD(IntegerRequest, value, "value", "i32")},
       "Non-zero: an echo every two seconds over the cellular interface, and the helper stays; 0: off.",
       ""},
      {"CheckLASDUpdate",
       sizeof(IntegerRequest),
       {FIELD(IntegerRequest, value, "value", "i32")},
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
       {FIELD(CoordinateRequest, latitude, "latitude", "f64, degrees"),
        FIELD(CoordinateRequest, longitude, "longitude", "f64, degrees")},
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
       {FIELD(IntegerRequest, value, "enable", "i32")},
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
       {FIELD(LabelsRequest, descriptorCount, "descriptor count 2", "u32"),
        FIELD(LabelsRequest, labels, "labels", "out-of-line descriptor"),
        FIELD(LabelsRequest, languages, "languages", "out-of-line descriptor"),
        FIELD(LabelsRequest, labelsLength, "labels length", "u32"),
        FIELD(LabelsRequest, languagesLength, "languages length", "u32")},
       "Returns short labels, an array of texts. `labels`: an array of pairs, a label key and a text that is "
       "not looked "
       "at, or an empty text and a label's own text. `languages`: an array of texts.",
       "3 or 6 no memory for the region; 5 an argument that is no array, or no label in it"},
      {"CopyLocalizedLabels",
       sizeof(LabelsRequest),
       {FIELD(LabelsRequest, descriptorCount, "descriptor count 2", "u32"),
        FIELD(LabelsRequest, labels, "labels", "out-of-line descriptor"),
        FIELD(LabelsRequest, languages, "languages", "out-of-line descriptor"),
        FIELD(LabelsRequest, labelsLength, "labels length", "u32"),
        FIELD(LabelsRequest, languagesLength, "languages length", "u32")},
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

bool printRow(const RoutineFacts& routine, const Description& description) {
  if (routine.name != kPrefix + std::string(description.routine) || routine.requestSize != description.size) {
    std::fprintf(stderr, "protocol-table: the row of %s does not fit\n", description.routine);
    return false;
  }
  std::string arguments = std::to_string(routine.requestSize);
  const char* separator = ": ";
  for (const Argument& each : description.arguments) {
    arguments +=
        separator + std::string(each.name) + " (" + std::to_string(each.offset) + ", " + each.type + ")";
    separator = ", ";
  }
  std::printf("| %d | `%s` | %s | %s, %zu | %s | %s |\n", routine.id, description.routine, arguments.c_str(),
              nameOf(routine.reply), sizeOfReply(routine.reply), description.meaning, description.codes);
  return true;
}

}  // namespace

int main() {
  const std::vector<Description> all = descriptions();
  if (all.size() != 1 + kRequestRoutines.size()) {
    std::fprintf(stderr, "protocol-table: %zu rows described\n", all.size());
    return EXIT_FAILURE;
  }
  std::printf(
      "| Id | Routine | Request: size, then arguments (offset, type) | Reply: form, size | What it does | "
      "Codes |\n");
  std::printf("|---|---|---|---|---|---|\n");
  bool isRight = printRow(kCheckInRoutine, all[0]);
  for (std::size_t i = 0; i < kRequestRoutines.size(); ++i)
    isRight &= printRow(kRequestRoutines[i], all[i + 1]);
  return isRight ? EXIT_SUCCESS : EXIT_FAILURE;
}

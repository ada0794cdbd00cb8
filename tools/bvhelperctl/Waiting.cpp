// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "tools/bvhelperctl/Waiting.h"

#include <sys/stat.h>

#include <algorithm>
#include <cstdio>
#include <utility>

#include "platform/plist/PropertyListCodec.h"
#include "tools/bvhelperctl/Call.h"
#include "tools/support/EventStream.h"
#include "tools/support/Output.h"
#include "tools/support/PropertyListText.h"

namespace brenvik::tools {
namespace {

PropertyList valuesOf(const bvmh_event& event) {
  return parsePropertyList({static_cast<const std::byte*>(event.payload.bytes), event.payload.size});
}

std::optional<double> patienceIn(const Values& values, double otherwise) {
  return values.has("--timeout") ? secondsIn(values["--timeout"]) : otherwise;
}

void mustWaitToListen(const Values& values) {
  for (const char* each : {"--directory", "--helper-uid"}) {
    if (values.has(each) && !values.has("--wait")) throw UsageError{std::string(each) + " needs --wait"};
  }
}

// Takes the telephony daemon's place; *outcome says why not.
bool listen(StandIn& standIn, unsigned services, const Values& values, Outcome* outcome) {
  const std::string directory = values.get("--directory", bvmh_bootstrap_directory());
  std::optional<std::uint32_t> uid;
  if (values.has("--helper-uid")) uid = numberIn<std::uint32_t>(values["--helper-uid"]);
  if (standIn.listen(directory, services, uid)) return true;
  outcome->isDone = false;
  outcome->failure = "cannot listen in " + printable(directory) + ": " + standIn.reason();
  outcome->advice =
      "--wait takes the telephony daemon's place: it must not run, and only root may listen there. Nothing "
      "was asked.";
  return false;
}

// What a wait ends with that has no answer.
void endWithoutAnswer(StandIn::Came came, const StandIn& standIn, Outcome* outcome) {
  outcome->isDone = false;
  if (came == StandIn::Came::nothing) {
    outcome->status = ExitStatus::timedOut;
    outcome->failure = "the helper took the request, and told no answer in time";
    outcome->advice = "--timeout waits longer. The helper's log may tell why.";
  } else {
    outcome->failure =
        came == StandIn::Came::interrupt ? "interrupted" : "cannot listen: " + standIn.reason();
  }
}

// ---- location -------------------------------------------------------------------------------------------

constexpr double kLocationPatience = 30;  // seconds; the helper itself answers after five at the latest
constexpr const char* kAnsweredByPush = "asked; the answer goes to the telephony daemon (see \"watch\")";

// Waits for a push of this kind; others are answered as the telephony daemon would, and pass.
PropertyList awaitPush(StandIn& standIn, bvmh_event_kind kind, const Values& values, Outcome* outcome) {
  const Patience patience(patienceIn(values, kLocationPatience));
  for (;;) {
    bvmh_event event{};
    const StandIn::Came came = standIn.next(patience.milliseconds(), &event);
    if (came == StandIn::Came::nothing && !patience.isOver()) continue;
    if (came != StandIn::Came::event) {
      endWithoutAnswer(came, standIn, outcome);
      return {};
    }
    // A sender that no longer waits has told its values all the same.
    if (event.wants_reply) (void)standIn.answer(event, 0);
    const bool isWanted = event.kind == kind;
    PropertyList told = isWanted ? valuesOf(event) : PropertyList();
    bvmh_event_free(&event);
    if (!isWanted) continue;
    if (!told.is(PropertyList::Type::dictionary)) {
      outcome->isDone = false;
      outcome->status = ExitStatus::protocol;
      outcome->failure = "the helper told something that is no dictionary";
    }
    return told;
  }
}

std::string textUnder(const PropertyList& told, const char* key) {
  return std::string(told.find(key).asString().value_or(""));
}

// The fields that were told, a line each; on a terminal as a table.
std::string civicText(const PropertyList& told) {
  const bool isTable = isTerminal(Stream::output);
  std::string text;
  for (const char* key : {"CountryCode", "State", "City", "PostalCode"}) {
    const std::string value = textUnder(told, key);
    if (value.empty()) continue;
    std::string name = key;
    if (isTable) {
      name.resize(std::string_view("CountryCode  ").size(), ' ');
      name = styled(Look::strong, name, Stream::output);
    } else {
      name += ": ";
    }
    text += (text.empty() ? "" : "\n") + name + printable(value);
  }
  return text;
}

// ---- databases ------------------------------------------------------------------------------------------

struct DatabaseType {
  const char* name;
  std::int32_t bit;
};
// In the order in which the helper goes through them.
constexpr DatabaseType kDatabaseTypes[] = {{"gsm", BVMH_LASD_GSM},
                                           {"umts", BVMH_LASD_UMTS},
                                           {"cdma", BVMH_LASD_CDMA},
                                           {"lte", BVMH_LASD_LTE},
                                           {"scdma", BVMH_LASD_SCDMA}};
constexpr double kDatabasePatience = 600;  // seconds; a database may be a hundred megabytes
// Where the helper puts them, and where it records their versions.
constexpr const char* kDatabaseDirectory = "/var/mobile/Library/LASD";
constexpr const char* kVersionDomain = "com.norvale.lasd";

std::int32_t maskIn(const Values& values) {
  if (values.has("--mask")) {
    if (values.has("--type")) throw UsageError{"--mask and --type say the same: give one of them"};
    return *numberIn<std::int32_t>(values["--mask"]);
  }
  std::int32_t mask = 0;
  for (const DatabaseType& type : kDatabaseTypes) {
    const bool isWanted =
        !values.has("--type") || std::any_of(values.all().begin(), values.all().end(), [&](auto& each) {
          return each.first == "--type" && each.second == type.name;
        });
    if (isWanted) mask |= type.bit;
  }
  return mask;
}

// A line on a terminal that is written over again and again; nothing elsewhere.
class Progress {
 public:
  Progress() : isShown_(isTerminal(Stream::error)) {}
  Progress(const Progress&) = delete;
  Progress& operator=(const Progress&) = delete;
  ~Progress() { clear(); }
  bool isShown() const { return isShown_; }
  void show(const std::string& text) {
    if (isShown_) std::fprintf(stderr, "\r\033[K%s", text.c_str());
  }
  void clear() { show(""); }

 private:
  const bool isShown_;
};

struct CheckOutcome {
  StandIn::Came came = StandIn::Came::event;  // else there is no word
  std::string word;                           // "updated", "no update required" or "failed"
};

// Waits for the one notification that a check of one database ends with. `type`: its name, for progress.
CheckOutcome awaitNotification(StandIn& standIn, const std::string& type, const Values& values,
                               Progress& progress) {
  const Patience patience(patienceIn(values, kDatabasePatience));
  for (int seconds = 0;; ++seconds) {
    progress.show(type + ": checking, " + std::to_string(seconds) + " s");
    bvmh_event event{};
    const int slice = progress.isShown() ? 1000 : 1'000'000'000;
    const StandIn::Came came = standIn.next(patience.milliseconds(slice), &event);
    if (came == StandIn::Came::nothing && !patience.isOver()) continue;
    if (came != StandIn::Came::event) return {came, ""};
    const PropertyList told = valuesOf(event);
    bvmh_event_free(&event);
    const std::string kind = textUnder(told, "Notification");
    if (kind == "com.norvale.lasd.NoUpdateRequired") return {came, "no update required"};
    if (kind == "com.norvale.lasd.UpdateFailed") return {came, "failed"};
    // Another type is the outcome of somebody else's check.
    if (kind == "com.norvale.lasd.UpdateAvailable" && textUnder(told, "DBType") == type)
      return {came, "updated"};
  }
}

// The name of the file that the helper makes of such a URL.
std::string fileOfUrl(const std::string& url) {
  const std::string name = url.substr(url.rfind('/') + 1);
  return name.substr(0, name.find(".gz"));
}

// Adds what is recorded about an installed database: its version and its size.
void addFacts(bvmh_client* client, const char* type, nlohmann::ordered_json* entry) {
  bvmh_region region{};
  if (BVMobileHelperCopyPreferenceValue(client, kVersionDomain, type, &region) != BVMH_OK) return;
  const PropertyList record = parsePropertyList({static_cast<const std::byte*>(region.bytes), region.size});
  bvmh_region_free(&region);
  const std::string version = textUnder(record, "Version");
  if (!version.empty()) (*entry)["version"] = version;
  const std::string file = fileOfUrl(textUnder(record, "ContentURL"));
  struct stat facts {};
  if (!file.empty() && ::stat((std::string(kDatabaseDirectory) + '/' + file).c_str(), &facts) == 0 &&
      S_ISREG(facts.st_mode)) {
    (*entry)["bytes"] = facts.st_size;
  }
}

std::string lineOf(const nlohmann::ordered_json& entry) {
  std::string line = entry["type"].get<std::string>() + ": " + entry["outcome"].get<std::string>();
  if (entry.contains("version")) line += ", version " + printable(entry["version"].get<std::string>());
  if (entry.contains("bytes")) line += ", " + std::to_string(entry["bytes"].get<std::int64_t>()) + " bytes";
  return line;
}

// One database after the other: a notification of failure does not say which database it is about, and how
// many there will be is not told either. A check of one alone ends with exactly one.
Outcome checkAndWait(bvmh_client* client, std::int32_t mask, const Values& values) {
  std::vector<DatabaseType> wanted;
  std::copy_if(std::begin(kDatabaseTypes), std::end(kDatabaseTypes), std::back_inserter(wanted),
               [&](const DatabaseType& each) { return (mask & each.bit) != 0; });
  if (wanted.empty()) wanted.push_back({"none", mask});

  Outcome outcome;
  StandIn standIn;
  if (!listen(standIn, BVMH_NOTIFICATIONS, values, &outcome)) return outcome;
  nlohmann::ordered_json entries = nlohmann::ordered_json::array();
  int failures = 0;
  {
    Progress progress;
    for (const DatabaseType& type : wanted) {
      BVHELPERCTL_CALL(BVMobileHelperCheckLASDUpdate, client, type.bit);
      outcome.routine = name;
      outcome.code = code;
      if (code != BVMH_OK) break;
      const CheckOutcome check = awaitNotification(standIn, type.name, values, progress);
      progress.clear();
      if (check.came != StandIn::Came::event) {
        endWithoutAnswer(check.came, standIn, &outcome);
        outcome.failure = std::string(type.name) + ": " + outcome.failure;
        break;
      }
      nlohmann::ordered_json entry{{"type", type.name}, {"outcome", check.word}};
      if (check.word == "failed") {
        ++failures;
      } else {
        addFacts(client, type.name, &entry);
      }
      // A line as soon as it is known: the next database may take minutes.
      if (!values.has("--json"))
        (void)(printOut(lineOf(entry) + '\n') && flushOutput());  // a loss is told at the end
      entries.push_back(std::move(entry));
    }
  }
  outcome.fields["mask"] = mask;
  outcome.fields["databases"] = std::move(entries);
  outcome.fieldsOfFailure = outcome.fields;
  if (outcome.code == BVMH_OK && outcome.isDone && failures > 0) {
    outcome.isDone = false;
    outcome.failure = std::to_string(failures) + " of " + std::to_string(wanted.size()) +
                      " checks failed; the helper's log tells why";
  }
  return outcome;
}

}  // namespace

Outcome requestCivicInfo(bvmh_client* client, const Values& values) {
  mustWaitToListen(values);
  const auto degrees = [&](const char* which) { return numberIn<double>(values[which]).value_or(0); };
  Outcome outcome;
  StandIn standIn;
  if (values.has("--wait") && !listen(standIn, BVMH_PUSHES, values, &outcome)) return outcome;
  BVHELPERCTL_CALL(BVMobileHelperRequestCountryCodeFromLocation, client, degrees("LATITUDE"),
                   degrees("LONGITUDE"));
  outcome = did(name, code, kAnsweredByPush);
  if (code != BVMH_OK || !values.has("--wait")) return outcome;
  const PropertyList told = awaitPush(standIn, BVMH_EVENT_CIVIC_INFO, values, &outcome);
  if (!outcome.isDone) return outcome;
  outcome.fields["values"] = jsonOf(told);
  outcome.text = civicText(told);
  if (outcome.text.empty()) {
    outcome.text = "(not known)";
    outcome.status = ExitStatus::noValue;
  }
  return outcome;
}

Outcome requestWanAddress(bvmh_client* client, const Values& values) {
  mustWaitToListen(values);
  Outcome outcome;
  StandIn standIn;
  if (values.has("--wait") && !listen(standIn, BVMH_PUSHES, values, &outcome)) return outcome;
  BVHELPERCTL_CALL(BVMobileHelperRequestWanIPFromLocation, client);
  outcome = did(name, code, kAnsweredByPush);
  if (code != BVMH_OK || !values.has("--wait")) return outcome;
  const PropertyList told = awaitPush(standIn, BVMH_EVENT_LOCAL_ADDRESS, values, &outcome);
  if (!outcome.isDone) return outcome;
  outcome.fields["values"] = jsonOf(told);
  outcome.text = printable(textUnder(told, "Address"));
  if (outcome.text.empty()) {
    outcome.isDone = false;
    outcome.failure = "the public address could not be found; the helper's log tells why";
  }
  return outcome;
}

Outcome checkDatabases(bvmh_client* client, const Values& values) {
  mustWaitToListen(values);
  const std::int32_t mask = maskIn(values);
  if (values.has("--wait")) return checkAndWait(client, mask, values);
  BVHELPERCTL_CALL(BVMobileHelperCheckLASDUpdate, client, mask);
  Outcome outcome =
      did(name, code, "update check started; its outcome goes to the telephony daemon (see \"watch\")");
  outcome.fields["mask"] = mask;
  return outcome;
}

}  // namespace brenvik::tools

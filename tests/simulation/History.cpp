// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "History.h"

#include <algorithm>
#include <array>
#include <cerrno>
#include <iterator>

#include "Machine.h"
#include "interface/Routines.h"
#include "platform/plist/PropertyListCodec.h"

namespace brenvik::simulation {
namespace {

using namespace std::chrono_literals;

constexpr std::size_t kSteps = 80;
// How long everything is given to come to its end after the last step.
constexpr Time kEnd = 30min;

Time gapOf(Random& random) {
  switch (random.below(20)) {
    case 0:
      return random.upTo(8h);
    case 1:
    case 2:
      return random.upTo(40s);
    case 3:
    case 4:
    case 5:
    case 6:
    case 7:
      return random.upTo(4s);
    default:
      return random.upTo(60ms);
  }
}

// ---- arguments ----

PropertyList valueOf(Random& random, int depth) {
  switch (random.below(depth > 0 ? 8 : 6)) {
    case 0:
      return PropertyList::boolean(random.oneIn(2));
    case 1:
      return PropertyList::integer(static_cast<std::int64_t>(random.next()));
    case 2:
      return PropertyList::real(static_cast<double>(random.below(1000)) / 8);
    case 3:
      return PropertyList::data(std::as_bytes(std::span("bytes \0 and more")));
    case 4:
      return PropertyList::string("");
    case 5:
      return PropertyList::string("text <&> \xC3\xA9 " + std::to_string(random.below(9)));
    case 6: {
      std::vector<PropertyList> all;
      for (std::size_t i = random.below(4); i > 0; --i) all.push_back(valueOf(random, depth - 1));
      return PropertyList::array(std::move(all));
    }
    default: {
      std::vector<std::pair<std::string, PropertyList>> all;
      for (std::size_t i = random.below(4); i > 0; --i) {
        all.emplace_back("key" + std::to_string(i), valueOf(random, depth - 1));
      }
      return PropertyList::dictionary(all);
    }
  }
}

std::string serialized(Random& random, const PropertyList& value) {
  return *serializePropertyList(value,
                                random.oneIn(2) ? PropertyListFormat::xml : PropertyListFormat::binary);
}

std::string domainOf(Random& random) {
  if (random.oneIn(12)) {
    return random.of(std::array<std::string, 6>{"", ".", "..", "a/b", "\xff", std::string("d\0x", 3)});
  }
  return random.of(std::array<std::string, 4>{"com.example.a", "com.example.b", "com.norvale.carrier", "d"});
}
std::string keyOf(Random& random) {
  if (random.oneIn(15)) return random.of(std::array<std::string, 3>{"", "\xC3", "\xD0\xBA\xD0\xBB"});
  return "key" + std::to_string(random.below(5));
}

std::string bundlePath(Random& random) {
  static const std::array<std::string, 10> paths{
      "/var/mobile/Library/Carrier Bundle.bundle",
      "/var/mobile/Library/Operator1Bundle.bundle",
      "/var/mobile/Library/Preferences/com.norvale.carrier.plist",
      "/private/var/mobile/Library/CarrierDefault.bundle",
      "/private/var/mobile/Library/Preferences/com.norvale.operator_2.plist",
      "/var/mobile/Library/Carrier Bundles/link",
      "/tmp/link",
      "/nowhere/link",
      "/var/mobile/Library/Other.bundle",
      "/var/mobile/Library/CarrierBootstrap.bundle"};
  return random.of(paths);
}

std::string anyFile(Random& random) {
  static const std::array<std::string, 12> paths{"/tmp/a.tcpk",
                                                 "/tmp/b.tcpk",
                                                 "/tmp/a.tcpk/b.tcpk",
                                                 "/tmp/a.zip",
                                                 "/tmp.tcpk",
                                                 "/var/mobile/Library/Carrier Bundles/one",
                                                 "/var/mobile/Library/Carrier Bundles/two",
                                                 "/private/var/mobile/Library/Carrier Bundles/one",
                                                 "/private/var/mobile/Library/Carrier BundlesX/two",
                                                 "/var/mobile/Library/Carrier Bundles/link",
                                                 "/stage/one",
                                                 "/var/mobile/noise"};
  return random.oneIn(3) ? bundlePath(random) : random.of(paths);
}

std::string bundleFolder(Random& random) {
  static const std::array<std::string, 7> folders{"/var/mobile/Library/Carrier Bundles",
                                                  "/var/mobile/Library/Carrier Bundles/iPhone/deep",
                                                  "/private/var/mobile/Library/Carrier Bundles",
                                                  "/private/var/mobile/Library/Carrier BundlesX",
                                                  "/tmp",
                                                  "/elsewhere/folder",
                                                  "/var/mobile/Library"};
  return random.of(folders);
}

std::string labelsOf(Random& random) {
  static const std::array<std::string, 8> keys{"USER_LABEL_PRIMARY",
                                               "USER_LABEL_BUSINESS",
                                               "USER_LABEL_CELL_DATA",
                                               "USER_LABEL_DATA",
                                               "user_label_primary",
                                               "",
                                               "My own",
                                               "USER_LABEL_TRAVEL"};
  if (random.oneIn(8)) return serialized(random, valueOf(random, 2));
  if (random.oneIn(12)) return "no property list";
  std::vector<PropertyList> all;
  for (std::size_t i = random.below(7); i > 0; --i) {
    all.push_back(random.oneIn(9) ? PropertyList::integer(4) : PropertyList::string(random.of(keys)));
  }
  return serialized(random, PropertyList::array(std::move(all)));
}

std::string shortText(Random& random) {
  if (random.oneIn(12)) return std::string(300, 'x');
  if (random.oneIn(12)) return "\xff\xfe";
  // A long one takes memory.
  return random.of(std::array<std::string, 6>{"", "a", "token", "\xE2\x82\xAC", "a text that needs memory",
                                              "another text that needs memory"});
}

// The one that fails, counted from 0: most requests make a few, few make more than that.
long allocationOf(Random& random) {
  return static_cast<long>(random.below(random.of(std::array<std::size_t, 3>{4, 12, 80})));
}

WorkerEnd workerEndOf(Random& random) {
  return random.oneIn(2) ? WorkerEnd::beforeTheWork : WorkerEnd::afterTheWork;
}

CheckInWhims checkInWhims(Random& random) {
  CheckInWhims whims;
  whims.diesAtOnce = random.oneIn(12);
  if (random.oneIn(8)) {
    whims.failsAt = allocationOf(random);
  } else if (random.oneIn(10)) {
    whims.callerWorker = workerEndOf(random);
  }
  return whims;
}

void setTexts(Random& random, Call& call) {
  switch (call.row) {
    case 0:
    case 4:
      call.texts = {shortText(random)};
      break;
    case 1:
      call.texts = {shortText(random), shortText(random)};
      break;
    case 6: {
      call.texts = {domainOf(random), keyOf(random)};
      std::string value = serialized(random, valueOf(random, 3));
      if (random.oneIn(6)) value = random.of(std::array<std::string, 4>{"", "x", "xy", "bplist00 no"});
      call.regions = {value};
      break;
    }
    case 7:
    case 8:
      call.texts = {domainOf(random), keyOf(random)};
      break;
    case 9:
      call.texts = {
          random.of(std::array<std::string, 3>{"/stage/one", "/nowhere/at/all", "/var/mobile/noise"}),
          bundlePath(random), domainOf(random)};
      break;
    case 10:
      call.texts = {random.of(std::array<std::string, 2>{"/stage/two", "/nowhere"}), bundlePath(random)};
      break;
    case 11:
      call.texts = {anyFile(random), domainOf(random)};
      break;
    case 15:
      call.texts = {"/stage", bundleFolder(random),
                    random.of(std::array<std::string, 4>{"one", "two", "none", "Operator2Bundle.bundle"})};
      break;
    case 16:
      call.texts = {
          random.of(std::array<std::string, 4>{"/stage/crash", "/stage/one", "/none", "/stage/two"})};
      break;
    case 17:
      call.texts = {
          random.of(std::array<std::string, 4>{"/stage/crash", "/stage/one", "/stage/none", "/tmp/a.tcpk"}),
          bundleFolder(random), random.of(std::array<std::string, 3>{"one", "moved", "b.tcpk"})};
      break;
    case 22:
      call.texts = {"/tmp/a.zip", "/tmp/unpacked"};
      break;
    case 23:
      call.texts = {
          random.oneIn(2)
              ? "/root/Library/Preferences/" +
                    random.of(std::array<std::string, 3>{"com.example.a", "com.example.b", "d"}) + ".plist"
              : random.of(std::array<std::string, 5>{"/var/mobile/info.plist", "/var/mobile/list.plist",
                                                     "/var/mobile/noise", "/nowhere", ""})};
      break;
    case 24:
    case 25:
      call.regions = {labelsOf(random), labelsOf(random)};
      break;
    case 26:
      call.texts = {shortText(random), shortText(random)};
      break;
    default:
      break;
  }
}

void setNumbers(Random& random, Call& call) {
  switch (call.row) {
    case 13:
      call.value = random.oneIn(3) ? 1 : 0;
      return;
    case 14:
      call.value = static_cast<std::int32_t>(random.oneIn(6) ? random.next() : random.below(32));
      return;
    case 18:
      if (random.oneIn(5)) return;
      call.latitude = 52.5;
      call.longitude = random.oneIn(4) ? 0 : 13.4;
      return;
    case 21:
      call.value = static_cast<std::int32_t>(random.below(3));
      return;
    default:
      return;
  }
}

Call::Form formOf(Random& random, const RoutineFacts& facts) {
  if (!random.oneIn(25)) return Call::Form::right;
  if (facts.descriptors > 0 && random.oneIn(2)) {
    return random.oneIn(2) ? Call::Form::wrongLength : Call::Form::wrongType;
  }
  return random.of(
      std::array{Call::Form::shorter, Call::Form::longer, Call::Form::complexFlag, Call::Form::unknownId});
}

Call callOf(Random& random) {
  Call call;
  call.row = random.below(kRequestRoutines.size());
  setTexts(random, call);
  setNumbers(random, call);
  call.form = formOf(random, kRequestRoutines[call.row]);
  constexpr std::array workerRows{0, 1, 2, 3, 4, 5, 22, 26};
  const bool hasWorker =
      std::find(workerRows.begin(), workerRows.end(), static_cast<int>(call.row)) != workerRows.end();
  if (call.form != Call::Form::right) return call;
  if (random.oneIn(7)) {
    call.failsAt = allocationOf(random);
  } else if (hasWorker && random.oneIn(8)) {
    call.workerEnd = workerEndOf(random);
  }
  return call;
}

// What shows whether a request has done its work: a look at what it was to change, or the same once more.
Call lookAfter(Call call) {
  call.failsAt = -1;
  call.workerEnd = WorkerEnd::none;
  switch (call.row) {
    case 0:
    case 2:
    case 3:
      call.row = 5;
      call.texts.clear();
      break;
    case 1:
      call.row = 4;
      call.texts.pop_back();
      break;
    case 6:
      call.row = 7;
      call.regions.clear();
      break;
    default:
      break;
  }
  return call;
}

// ---- the world around ----

Manifest manifestOf(Random& random) {
  Manifest manifest;
  if (random.oneIn(10)) {
    manifest.isDictionary = false;
    manifest.body = random.oneIn(2) ? "no manifest" : serialized(random, PropertyList::array({}));
    return manifest;
  }
  std::vector<std::pair<std::string, PropertyList>> all;
  for (const char* name : {"gsm", "umts", "cdma", "lte", "scdma"}) {
    if (random.oneIn(4)) continue;
    Manifest::Entry entry;
    std::vector<std::pair<std::string, PropertyList>> facts;
    if (random.oneIn(10)) {
      entry.isDictionary = false;
      all.emplace_back(name, PropertyList::string("not a dictionary"));
    } else {
      if (!random.oneIn(10)) {
        entry.version = random.of(std::array<std::string, 7>{"1.0", "1.00", "2", "2a", "2A", "10", "010"});
        facts.emplace_back("Version", PropertyList::string(*entry.version));
      }
      if (!random.oneIn(10)) {
        entry.url = random.of(std::array<std::string, 5>{
            "https://x.example/" + std::string(name) + ".db.gz", "",
            "https://x.example/" + std::string(name) + ".db.gz?x=1", "http://x.example/plain.gz",
            "https://x.example/" + std::string(name)});
        facts.emplace_back("ContentURL", PropertyList::string(*entry.url));
      }
      all.emplace_back(name, PropertyList::dictionary(facts));
    }
    manifest.entries[name] = entry;
  }
  manifest.body = serialized(random, PropertyList::dictionary(all));
  return manifest;
}

WebAnswer webAnswer(Machine& machine, const std::string& url) {
  Random& random = machine.world.random();
  WebAnswer answer;
  answer.delay = random.oneIn(6) ? random.upTo(90s) : random.upTo(2s);
  if (random.oneIn(12)) answer.isNothing = true;
  if (random.oneIn(10)) answer.kind = WebErrorKind::timedOut;
  if (random.oneIn(10)) answer.status = random.oneIn(2) ? 404 : 304;
  if (url.ends_with("lasd.plist")) {
    const Manifest manifest = manifestOf(random);
    machine.rules.manifests[manifest.body] = manifest;
    answer.body = manifest.body;
  } else {
    answer.body = (random.oneIn(6) ? random.of(std::array{"gz!", "gz?", "gz."}) : "gz:") + url + " " +
                  std::to_string(random.below(100));
    if (!random.oneIn(12)) answer.contentType = random.oneIn(9) ? "text/GZIP" : "application/x-gzip";
  }
  if (random.oneIn(15)) answer.body.clear();
  return answer;
}

std::optional<MapItem> mapItemOf(Random& random) {
  if (random.oneIn(8)) return std::nullopt;
  MapItem item;
  item.valid = !random.oneIn(8);
  if (random.oneIn(8)) return item;
  item.address = GeoAddress();
  if (random.oneIn(8)) return item;
  StructuredAddress address;
  if (!random.oneIn(3)) address.countryCode = "DE";
  if (!random.oneIn(3)) address.administrativeArea = "Land";
  if (!random.oneIn(3)) address.locality = random.oneIn(6) ? "\xff" : "Stadt";
  if (!random.oneIn(3)) address.postCode = "10117";
  item.address->structuredAddress = address;
  return item;
}

Machine::GeoAnswer geoAnswer(Machine& machine) {
  Random& random = machine.world.random();
  Machine::GeoAnswer answer;
  if (random.oneIn(5)) return answer;
  answer.delay = random.oneIn(3) ? random.upTo(9s) : random.upTo(1s);
  if (random.oneIn(4)) answer.error = "the far side is closed";
  answer.address = random.oneIn(5) ? "" : "192.0.2." + std::to_string(random.below(256));
  if (random.oneIn(8)) return answer;  // nothing is known about the place
  answer.items = MapItems();
  for (std::size_t i = random.below(3); i > 0; --i) answer.items->push_back(mapItemOf(random));
  return answer;
}

void changeSurroundings(Machine& machine, Random& random) {
  Surroundings& around = machine.around;
  switch (random.below(14)) {
    case 0:
      around.countryCode = random.oneIn(3)   ? std::nullopt
                           : random.oneIn(4) ? std::optional(std::string(70, 'c'))
                                             : std::optional<std::string>("NO");
      break;
    case 1:
      around.telephonyIsAbsent = !around.telephonyIsAbsent;
      break;
    case 2:
      around.telephonyError = around.telephonyError == 0 ? ETIMEDOUT : 0;
      break;
    case 3:
      around.lasdListens = !around.lasdListens;
      break;
    case 4:
      around.hostsBaseband = machine.hasHelper() ? around.hostsBaseband : !around.hostsBaseband;
      break;
    case 5:
    case 6:
      around.basebandIsBusy = !around.basebandIsBusy;
      break;
    case 7:
      around.contactsAreReachable = !around.contactsAreReachable;
      around.contactsError = random.oneIn(2) ? std::optional<std::string>("locked") : std::nullopt;
      break;
    case 8:
      around.isSubscribed = !around.isSubscribed;
      break;
    case 9:
      machine.echo.far = random.of(std::array{SimulatedEcho::Far::answers, SimulatedEcho::Far::isSilent,
                                              SimulatedEcho::Far::isUnreachable});
      machine.echo.hasCellular = random.oneIn(2);
      // Each silent probe is a wait of seconds; hours of them tell nothing new.
      if (machine.echo.far == SimulatedEcho::Far::isSilent) {
        machine.world.clock.schedule(random.upTo(5min),
                                     [&machine] { machine.echo.far = SimulatedEcho::Far::answers; });
      }
      break;
    case 10:
      around.outOfDescriptors = !around.outOfDescriptors && random.oneIn(2);
      break;
    case 11:
      around.archiveResult = random.oneIn(2) ? 0 : EINVAL;
      around.archiveFatal =
          around.archiveResult != 0 && random.oneIn(2) ? std::optional(EINVAL) : std::nullopt;
      break;
    case 12:
      machine.networkWorkerDies();
      break;
    default:
      machine.web.route = random.of(std::array{Route::wifi, Route::wifi, Route::cellular, Route::none});
  }
  machine.surroundingsChange();
}

// ---- steps ----

Process::Holds holdsOf(Random& random) {
  if (!random.oneIn(4)) return Process::Holds::yes;
  return random.of(std::array{Process::Holds::nothing, Process::Holds::no, Process::Holds::text,
                              Process::Holds::number, Process::Holds::unreadable});
}

void everybodyExits(Machine& machine) {
  for (std::size_t i = 0; i < machine.processes.size(); ++i) machine.exits(i);
}

void callSome(Machine& machine, Random& random, const std::vector<int>& open) {
  for (std::size_t i = random.oneIn(8) ? random.below(20) : 1; i > 0; --i) {
    const int connection = random.of(open);
    const Call call = callOf(random);
    machine.call(connection, call);
    const bool isDoubtful = call.failsAt >= 0 || call.workerEnd != WorkerEnd::none;
    if (isDoubtful && random.oneIn(2)) machine.call(connection, lookAfter(call));
  }
}

void take(Machine& machine, const Step& step) {
  Random random(step.seed);
  machine.rules.settles();
  const std::size_t what = random.below(100);
  const std::size_t process = random.below(machine.processes.size());
  const bool hasProcess = !machine.processes.empty();
  std::vector<int> open;
  for (const auto& [id, connection] : machine.connections) {
    if (connection.isOpen && connection.port != kNullPort) open.push_back(id);
  }
  if (what < 8 || !hasProcess) {
    const uid_t uid = random.oneIn(3) ? 501 : 0;
    machine.checkIn(machine.spawn(uid, holdsOf(random)), CheckInForm::right, checkInWhims(random));
  } else if (what < 16) {
    const auto form = random.oneIn(8) ? static_cast<CheckInForm>(random.below(8)) : CheckInForm::right;
    machine.checkIn(process, form, checkInWhims(random));
  } else if (what < 78) {
    if (!open.empty()) callSome(machine, random, open);
  } else if (what < 83) {
    if (!open.empty()) machine.close(random.of(open));
  } else if (what < 87) {
    machine.exits(process);
  } else if (what < 89) {
    machine.exec(process, holdsOf(random));
  } else if (what < 90) {
    everybodyExits(machine);
  } else if (what < 98) {
    changeSurroundings(machine, random);
  } else {
    const Disaster disaster = random.oneIn(3) ? Disaster::killed : Disaster::powerCut;
    machine.bringAbout(disaster, static_cast<long>(random.below(30)));
  }
}

// A finding without its numbers, by which two are the same.
std::string kindOf(std::string finding) {
  std::erase_if(finding, [](char each) { return each >= '0' && each <= '9'; });
  return finding.substr(0, 40);
}

std::uint64_t mixed(std::uint64_t digest, const std::string& text) {
  for (const char each : text) digest = (digest ^ static_cast<unsigned char>(each)) * 0x100000001B3U;
  return digest;
}

}  // namespace

std::vector<Step> stepsOf(std::uint64_t seed) {
  Random random(seed);
  std::vector<Step> steps(kSteps / 2 + random.below(kSteps));
  for (Step& each : steps) each = {gapOf(random), random.next()};
  return steps;
}

Result play(std::uint64_t seed, const std::vector<Step>& steps,
            const std::function<void(const std::string&)>& trace) {
  Result result;
  result.digest = 0xCBF29CE484222325U;
  Machine machine(seed, [&](const std::string& text) {
    result.digest = mixed(result.digest, text);
    if (trace) trace(text);
  });
  machine.web.answer = [&machine](const std::string& url) { return webAnswer(machine, url); };
  machine.geoAnswer = [&machine] { return geoAnswer(machine); };
  try {
    Time at{0};
    for (const Step& each : steps) {
      at += each.gap;
      machine.world.clock.schedule(at, [&machine, each] { take(machine, each); });
    }
    machine.world.clock.schedule(at + kEnd / 2, [&machine] { everybodyExits(machine); });
    // A token that was forgotten keeps the helper for ever.
    machine.world.clock.schedule(at + kEnd, [&machine] {
      machine.rules.settles();
      machine.bringAbout(Disaster::killed, 0);
    });
    machine.runUntil(at + kEnd + 1s);
  } catch (const Finding& finding) {
    result.finding = finding.text;
  }
  if (machine.rules.finding() && !result.finding) result.finding = machine.rules.finding();
  result.simulated = machine.world.now();
  result.lives = machine.counts.lives;
  result.calls = machine.counts.calls;
  result.checkIns = machine.counts.checkIns;
  result.deaths = machine.counts.deaths;
  return result;
}

std::vector<Step> shrink(std::uint64_t seed, std::vector<Step> steps, const std::string& finding) {
  for (std::size_t size = steps.size() / 2; size > 0;) {
    bool hasDropped = false;
    for (std::size_t at = 0; at < steps.size();) {
      std::vector<Step> fewer = steps;
      const auto first = fewer.begin() + static_cast<std::ptrdiff_t>(at);
      fewer.erase(first, first + static_cast<std::ptrdiff_t>(std::min(size, fewer.size() - at)));
      if (const auto found = play(seed, fewer).finding; found && kindOf(*found) == kindOf(finding)) {
        steps = std::move(fewer);
        hasDropped = true;
      } else {
        at += size;
      }
    }
    if (!hasDropped || size > 1) size /= 2;
  }
  return steps;
}

}  // namespace brenvik::simulation

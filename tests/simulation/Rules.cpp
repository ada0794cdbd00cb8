// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "Rules.h"

#include <sys/stat.h>

#include <algorithm>
#include <array>
#include <cctype>
#include <cerrno>
#include <cstring>
#include <span>

#include "platform/plist/PropertyListCodec.h"

namespace brenvik::simulation {
namespace {

using namespace std::chrono_literals;

constexpr Time kIdle = 10s;
constexpr Time kGeoPatience = 5s;
const std::string kMain = "main";
const std::string kMainTasks = "main tasks";
const std::string kGeo = "GEO callback queue";
const std::string kUpdater = "LASDUpdater";
const std::string kHome = "/var/mobile";
const std::string kHomeBundles = kHome + "/Library/Carrier Bundles/";
const std::string kFixedBundles = "/private/var/mobile/Library/Carrier Bundles";
const std::string kCrashLogs = kHome + "/Library/Logs/CrashReporter/";
const std::string kDatabases = kHome + "/Library/LASD";
constexpr uid_t kMobile = 501;
constexpr std::array kOrder{8, 1, 2, 4, 16};

const char* nameOfType(int type) {
  switch (type) {
    case 1:
      return "umts";
    case 2:
      return "cdma";
    case 4:
      return "lte";
    case 8:
      return "gsm";
    default:
      return "scdma";
  }
}

std::vector<std::string> listedPaths() {
  std::vector<std::string> paths;
  for (const std::string& home : {kHome, std::string("/private/var/mobile")}) {
    for (const char* domain : {"carrier", "carrier_1", "carrier_2", "operator", "operator_1", "operator_2",
                               "carrier.default", "carrier.bootstrap"}) {
      paths.push_back(home + "/Library/Preferences/com.norvale." + domain + ".plist");
    }
    for (const char* bundle : {"Carrier Bundle", "Carrier1Bundle", "Carrier2Bundle", "Operator Bundle",
                               "Operator1Bundle", "Operator2Bundle", "CarrierDefault", "CarrierBootstrap"}) {
      paths.push_back(home + "/Library/" + bundle + ".bundle");
    }
  }
  return paths;
}

std::string parentOf(const std::string& path) { return path.substr(0, path.rfind('/')); }
std::string nameOf(std::string path) {
  while (path.size() > 1 && path.back() == '/') path.pop_back();
  return path.substr(path.rfind('/') + 1);
}
Item itemIn(const Tree& tree, const std::string& path) {
  const auto found = tree.find(path);
  return found == tree.end() ? Item() : found->second;
}
bool isHidden(const std::string& path) {
  return path.starts_with("/root") || path.find("/.brenvik-") != std::string::npos;
}

// Equal in the sense of the version check: letters without their case, runs of digits by their value.
bool sameVersion(std::string_view a, std::string_view b) {
  std::size_t i = 0;
  std::size_t j = 0;
  const auto isDigit = [](char c) { return c >= '0' && c <= '9'; };
  while (i < a.size() && j < b.size()) {
    if (isDigit(a[i]) && isDigit(b[j])) {
      unsigned long x = 0;
      unsigned long y = 0;
      for (; i < a.size() && isDigit(a[i]); ++i) x = x * 10 + static_cast<unsigned long>(a[i] - '0');
      for (; j < b.size() && isDigit(b[j]); ++j) y = y * 10 + static_cast<unsigned long>(b[j] - '0');
      if (x != y) return false;
    } else if (std::tolower(a[i++]) != std::tolower(b[j++])) {
      return false;
    }
  }
  return i == a.size() && j == b.size();
}

PropertyList parsed(const std::string& bytes) { return parsePropertyList(std::as_bytes(std::span(bytes))); }

std::string described(const Line& line) {
  return std::string(line.isBsd ? "bsd/" : "unified/") + std::to_string(line.level) + " \"" + line.text +
         "\"";
}

bool matches(const Line& wanted, const Line& line) {
  return wanted.isBsd == line.isBsd && wanted.level == line.level &&
         (wanted.isBeginning ? line.text.starts_with(wanted.text) : line.text == wanted.text);
}

// What a request may answer because memory is lacking, and the lines that tell of it.
struct LackOfMemory {
  std::vector<KernelReturn> codes;
  std::vector<const char*> lines;
};

LackOfMemory lackOfMemoryIn(std::size_t row) {
  constexpr const char* kNotWritten = "The voicemail store could not be written";
  constexpr const char* kNotRead = "The voicemail store could not be read";
  switch (row) {
    case 0:
    case 1:
      return {{5, 6}, {kNotWritten}};
    case 2:
    case 3:
      return {{6}, {kNotWritten}};
    case 4:
      return {{5, 6}, {kNotRead}};
    case 5:
      return {{6}, {kNotRead}};
    case 6:
      return {{5, 6}, {"Preferences: no memory to "}};
    case 7:
    case 8:
      return {{5, 6}, {"Preferences: no memory to "}};
    // A path of which the policy cannot tell for want of memory is refused.
    case 9:
      return {{5, 6, 8}, {"Cannot remove symlink: ", "Preferences: no memory to flush a domain"}};
    case 11:
      return {{5, 6, 8}, {"Preferences: no memory to flush a domain"}};
    case 10:
    case 12:
      return {{5, 6}, {}};
    case 15:
      return {{6}, {"Destination directory ", "Failed to copy the file "}};
    case 16:
      return {{6}, {"Failed to copy the directory "}};
    case 17:
      return {{6},
              {"Destination directory ", "Failed to move the directory ",
               "Failed to create CarrierBundles Dir "}};
    case 23:
      return {{6, 9}, {"Could not create data representation of dictionary", "Could not allocate "}};
    case 24:
      return {{5, 6}, {"CopyBadgeLabels, cannot build ", "CopyBadgeLabels, Could not allocate "}};
    case 25:
      return {{5, 6}, {"CopyLocalizedLabels, cannot build ", "CopyLocalizedLabels, Could not allocate "}};
    case 26:
      return {{6},
              {"remapChannelIdentifier result: failure : out of memory",
               "remapChannelIdentifier result: failure : (none)"}};
    default:
      return {{6}, {}};
  }
}

Expected status(KernelReturn code) { return {{code}, {}, {}, {}}; }
Expected flagged(bool flag) { return {{0}, flag, {}, {}}; }

// The bytes of the character that begins there; 0 if none does.
std::size_t sizeOfCharacter(std::string_view text) {
  const auto at = [&](std::size_t k) { return static_cast<unsigned char>(text[k]); };
  if (at(0) < 0x80) return 1;
  const std::size_t size = at(0) >> 5 == 6 ? 2 : at(0) >> 4 == 14 ? 3 : at(0) >> 3 == 30 ? 4 : 0;
  if (size == 0 || size > text.size()) return 0;
  unsigned code = at(0) & (0x7FU >> size);
  for (std::size_t k = 1; k < size; ++k) {
    if (at(k) >> 6 != 2) return 0;
    code = code << 6U | (at(k) & 0x3FU);
  }
  constexpr std::array<unsigned, 5> least{0, 0, 0x80, 0x800, 0x10000};
  return code < least[size] || code > 0x10FFFF || (code >= 0xD800 && code < 0xE000) ? 0 : size;
}

}  // namespace

std::string cut(const std::string& field, std::size_t size, bool isTerminated) {
  std::string text = field.substr(0, isTerminated ? size - 1 : size);
  text.resize(std::min(text.size(), std::strlen(text.c_str())));
  return text;
}

bool isUtf8(const std::string& text) {
  for (std::string_view left = text; !left.empty();) {
    const std::size_t size = sizeOfCharacter(left);
    if (size == 0) return false;
    left.remove_prefix(size);
  }
  return true;
}

Rules::Rules(World& world, const Surroundings& around, Tree files)
    : world_(world), around_(around), files_(std::move(files)) {}

// ---- what is seen ----

void Rules::expect(const std::string& actor, Line line) { lines_[actor].push_back(std::move(line)); }

void Rules::logs(const std::string& actorName, bool isBsd, int level, std::string text) {
  if (world_.isKilled()) return;
  timePasses();
  const std::string actor = actorName == "com.norvale.httpdownloadqueue" ? kUpdater : actorName;
  if (text.ends_with('\n')) text.pop_back();
  if (text.starts_with("refused ")) return;
  std::deque<Line>& waiting = lines_[actor];
  const Line line{isBsd, level, text};
  if (isUnsure()) {
    const auto said = lackOfMemoryIn(*unsureRow_).lines;
    const auto found =
        std::find_if(waiting.begin(), waiting.end(), [&](const Line& each) { return matches(each, line); });
    if (found != waiting.end()) {
      waiting.erase(waiting.begin(), std::next(found));
    } else if (std::none_of(said.begin(), said.end(), [&](auto each) { return text.starts_with(each); })) {
      breach("without memory, a line that nothing asks for: " + described(line));
    }
    return;
  }
  if (waiting.empty()) return breach("on " + actor + ", a line that nothing asks for: " + described(line));
  const Line wanted = waiting.front();
  waiting.pop_front();
  if (wanted.isBeginning) lastBeginning_ = text;
  if (!matches(wanted, line)) {
    breach("on " + actor + ", the line " + described(line) + " instead of " + described(wanted));
  }
}

void Rules::pushes(const std::string& what, const std::vector<std::optional<std::string>>& values) {
  timePasses();
  std::vector<std::optional<std::string>> push{what};
  push.insert(push.end(), values.begin(), values.end());
  const auto shown = [](const auto& texts) {
    std::string all;
    for (const auto& each : texts) all += " [" + each.value_or("(absent)") + "]";
    return all;
  };
  if (pushes_.empty()) return breach("a push that nothing asks for:" + shown(push));
  if (pushes_.front() != push) breach("the push" + shown(push) + " instead of" + shown(pushes_.front()));
  pushes_.pop_front();
}

void Rules::notifies(const PropertyList& notification) {
  const std::string name(notification.find("Notification").asString().value_or("(none)"));
  const std::string type(notification.find("DBType").asString().value_or(""));
  if (notifications_.empty()) return breach("a notification that nothing asks for: " + name + " " + type);
  if (notifications_.front() != std::pair(name, type)) {
    breach("the notification " + name + " " + type + " instead of " + notifications_.front().first + " " +
           notifications_.front().second);
  }
  notifications_.pop_front();
}

void Rules::settles() {
  timePasses();
  resolveHeartbeat();
  if (!world_.isKilled()) isAnswered();
  for (const auto& [actor, waiting] : lines_) {
    if (!waiting.empty()) {
      breach("on " + actor + ", a line that never came: " + described(waiting.front()));
    }
  }
  if (civicWanted_ + addressesWanted_ > 0) breach("a question of a place that never came");
  if (!pushes_.empty()) breach("a push that never came: " + pushes_.front()[0].value_or(""));
  if (!notifications_.empty()) breach("a notification that never came: " + notifications_.front().first);
}

std::string Rules::state() const {
  std::string text = std::to_string(clients_.size()) + " clients, " + std::to_string(tokens_) + " tokens";
  if (idle_) text += ", tick at " + std::to_string(idle_->latest.count());
  return text;
}

// ---- lives, and the idle rule ----

void Rules::begins() {
  isRunning_ = true;
  hasServed_ = false;
  lines_.clear();
}

void Rules::exits(int status) {
  if (status != 0) return breach("the helper left with status " + std::to_string(status));
  if (!heartbeats_.empty()) resolveHeartbeat();
  const Time now = world_.now();
  if (!idle_) {
    breach("the helper left while it was not idle: " + state());
  } else if (now < idle_->earliest || now > idle_->latest) {
    breach("the helper left at " + std::to_string(now.count()) + " and not at " +
           std::to_string(idle_->latest.count()));
  } else if (around_.hostsBaseband && around_.basebandIsBusy) {
    breach("the helper left while the baseband server was busy");
  }
  if (!clients_.empty()) breach("the helper left its clients");
  settles();
  wasKilled();
  undo_.reset();
}

void Rules::wasKilled() {
  isRunning_ = false;
  unsureRow_.reset();
  lines_.clear();
  pushes_.clear();
  notifications_.clear();
  granted_.clear();
  maybeGranted_.clear();
  clients_.clear();
  tokens_ = 0;
  idle_.reset();
  isAwaiting_ = false;
  civicWanted_ = 0;
  addressesWanted_ = 0;
  timeOuts_.clear();
  checks_.clear();
  toUpdate_.clear();
  expectedUrl_.clear();
  heldHeartbeat_ = 0;
  heartbeats_.clear();
}

void Rules::idleSince(Time earliest, Time latest) {
  if (tokens_ > 0 || !clients_.empty() || !isRunning_) return;
  if (!idle_) idle_ = Idle{earliest + kIdle, latest + kIdle};
}

void Rules::takeToken() {
  ++tokens_;
  cancelIdle();
}

void Rules::giveToken(Time earliest, Time latest) {
  --tokens_;
  idleSince(earliest, latest);
}

void Rules::timePasses() {
  const Time now = world_.now();
  while (!timeOuts_.empty() && timeOuts_.front().first <= now) {
    const bool isCivic = timeOuts_.front().second;
    timeOuts_.pop_front();
    if (!isAwaiting_) continue;
    isAwaiting_ = false;
    if (isCivic) {
      pushCivic({countryCode(kMainTasks), "", "", ""});
    } else {
      pushAddress("");
    }
  }
  if (!heartbeats_.empty() && now > heartbeats_.front().first) resolveHeartbeat();
  while (isRunning_ && idle_ && now > idle_->latest) {
    if (!around_.hostsBaseband || !around_.basebandIsBusy) {
      breach("the helper should have left at " + std::to_string(idle_->latest.count()));
      return;
    }
    idle_->earliest += kIdle;
    idle_->latest += kIdle;
  }
}

// ---- check-in ----

std::vector<KernelReturn> Rules::codesOf(const CheckIn& checkIn) const {
  const bool isKnown = granted_.contains(checkIn.process);
  const bool isLetIn = isKnown || (checkIn.isAlive && checkIn.isAllowed);
  const bool mayBeLetIn = isLetIn || maybeGranted_.contains(checkIn.process);
  std::vector<KernelReturn> codes;
  if (mayBeLetIn) codes.push_back(around_.outOfDescriptors || checkIn.portIsDead ? 5 : 0);
  if (!isLetIn) codes.push_back(35);
  // One that has just died may still be remembered.
  if (!isLetIn && !checkIn.isAlive && checkIn.portIsDead) codes.push_back(5);
  if (!checkIn.lacksMemory) return codes;
  codes.push_back(6);
  if (!isKnown) codes.push_back(35);
  if (mayBeLetIn) codes.push_back(5);
  return codes;
}

void Rules::isAnswered(const CheckIn& checkIn, int connection, KernelReturn code, bool isWatched) {
  if (code == 35) {
    maybeGranted_.erase(checkIn.process);
    return;
  }
  timePasses();
  if (!checkIn.lacksMemory) {
    granted_.insert(checkIn.process);
  } else if (checkIn.isAlive && checkIn.isAllowed && !granted_.contains(checkIn.process)) {
    maybeGranted_.insert(checkIn.process);
  }
  if (code == 0) {
    clients_.insert(connection);
    cancelIdle();
  } else if (checkIn.lacksMemory ? isWatched : !around_.outOfDescriptors) {
    // The port was dead: the countdown began anew when that was noticed.
    cancelIdle();
    idleSince(world_.now(), world_.now());
  }
}

void Rules::portDies(int connection) {
  timePasses();  // a token that came back before came back while there was a client
  if (clients_.erase(connection) > 0) idleSince(world_.now(), world_.now());
}

// ---- requests ----

Expected Rules::before(const Call& call) {
  switch (call.form) {
    case Call::Form::right:
      break;
    case Call::Form::unknownId:
      return status(-303);
    case Call::Form::wrongLength:
    case Call::Form::wrongType:
      return status(-300);
    default:
      return status(-304);
  }
  if (call.row >= 9 && call.row <= 17) filesBefore_ = files_;
  // Without memory it is known only afterwards.
  if (call.failsAt < 0) {
    hasServed_ = true;
    goesOn(call);
  }
  switch (call.row) {
    case 6:
      return setPreference(call);
    case 7:
      return copyPreference(call, "mhs1");
    case 8:
      return copyPreference(call, "mhs2");
    case 9:
      return replaceLink(call);
    case 10:
      return createLink(call);
    case 11:
      return removeFile(call);
    case 13:
      return status(0);
    case 14: {
      std::array<char, 16> mask{};
      std::snprintf(mask.data(), mask.size(), "%x", static_cast<unsigned>(call.value));
      info(kMain, std::string("Trying to see if update available for mask ") + mask.data());
      return status(0);
    }
    case 15:
      return copyFile(call);
    case 16:
      return copyCrashLogs(call);
    case 17:
      return moveBundle(call);
    case 18:
      bsdError(kMain, "server_BVMobileHelperRequestCountryCodeFromLocation ");
      return status(0);
    case 19: {
      Expected expected = status(0);
      expected.isRightText = [code = countryCode(kMain).substr(0, 64)](const std::string& text) {
        return text == code;
      };
      return expected;
    }
    case 20:
      expect(kMain, {false, 7, "server_BVMobileHelperRequestWanIPFromLocation"});
      return status(0);
    case 21:
      bsdError(kMain, "Enabling wireless radio manager logs: " + std::to_string(call.value));
      return status(0);
    case 22:
      if (around_.archiveFatal || call.workerEnd == WorkerEnd::beforeTheWork) {
        bsdError(kMain, "ArkCopier signaled fatal file error");
      }
      return flagged(around_.archiveResult == 0 && call.workerEnd != WorkerEnd::beforeTheWork);
    case 23:
      return loadPlist(call);
    case 24:
      return labels(call, true);
    case 25:
      return labels(call, false);
    case 26:
      return remap(call);
    default:
      return voicemail(call);
  }
}

// What goes on after the reply.
void Rules::goesOn(const Call& call) {
  switch (call.row) {
    case 13:
      heartbeats_.emplace_back(world_.now(), call.value != 0);
      return;
    case 14:
      takeToken();
      checks_.push_back(static_cast<std::uint32_t>(call.value));
      if (checks_.size() == 1) beginCheck();
      return;
    case 18:
      if (call.latitude == 0 && call.longitude == 0) {
        pushCivic({countryCode(kMainTasks), "", "", ""});
      } else {
        ++civicWanted_;
      }
      return;
    case 20:
      ++addressesWanted_;
      return;
    default:
      return;
  }
}

// ---- lack of memory ----

void Rules::becomesUnsure(const Call& call) { unsureRow_ = call.row; }

Expected Rules::withoutMemory(const Call& call, Expected expected, const Answer& answer) const {
  const auto codes = lackOfMemoryIn(call.row).codes;
  // Once requests are served, lack of memory ends the process here, or there is none.
  if (!mayEndTheProcess(call) || !hasServed_) {
    expected.codes.insert(expected.codes.end(), codes.begin(), codes.end());
  }
  const bool tellsByItsByte = (call.row >= 15 && call.row <= 17) || call.row == 22 || call.row == 26;
  if (tellsByItsByte && answer.flag == false) expected.flag = false;
  // The routine has one status.
  if (call.row == 5 && answer.text == "") {
    expected.isRightText = [](const std::string&) { return true; };
  }
  return expected;
}

void Rules::becomesSure(const Call& call, const Answer& answer, const Tree& disk) {
  unsureRow_.reset();
  hasServed_ = hasServed_ || answer.code != 6;
  if (answer.code == 0) goesOn(call);
  const bool isDone = answer.code == 0 && answer.flag != false;
  // What was done is told of as ever: a line takes no memory.
  if (isDone && !lines_[kMain].empty()) {
    breach("without memory, done without the line " + described(lines_[kMain].front()));
  }
  if (isDone) isAnswered();
  if (answer.code == 0 && call.row == 0) token_ = {cut(call.texts[0], 256, true)};
  if (answer.code == 0 && call.row == 1) {
    tokenOf(cut(call.texts[0], 256, true)) = {cut(call.texts[1], 256, true)};
  }
  if (isDone && call.row == 26) channels_ = {channels_.back()};
  if (undo_) (*undo_)();
  filesSettleOn(disk, true);
  lines_[kMain].clear();
}

// ---- the voicemail store ----

void Rules::change(Token& token, const std::string& value, const Call& call) {
  if (call.failsAt >= 0) {
    token.insert(value);
  } else if (call.workerEnd != WorkerEnd::beforeTheWork) {
    token = {value};
  }
}

Expected Rules::readToken(const Call& call, const std::function<Token&()>& token) {
  Expected expected = status(0);
  if (call.workerEnd != WorkerEnd::none) {
    error(kMain, "The voicemail store could not be read");
    expected.isRightText = [](const std::string& text) { return text.empty(); };
  } else {
    expected.isRightText = [token](const std::string& text) {
      if (!token().contains(text)) return false;
      token() = {text};  // now it is known which of them it is
      return true;
    };
  }
  return expected;
}

Expected Rules::voicemail(const Call& call) {
  std::vector<std::string> texts;
  for (const std::string& each : call.texts) texts.push_back(cut(each, 256, true));
  for (const std::string& each : texts) {
    if (!isUtf8(each)) return status(5);
  }
  Expected expected = status(0);
  int changes = 1;
  switch (call.row) {
    case 0:
      change(token_, texts[0], call);
      break;
    case 1:
      change(tokenOf(texts[0]), texts[1], call);
      break;
    case 2:
      change(token_, "", call);
      break;
    case 3:
      change(token_, "", call);
      for (auto& [key, token] : tokens2_) change(token, "", call);
      changes = 2;
      break;
    case 4:
      return readToken(call, [this, key = texts[0]]() -> Token& { return tokenOf(key); });
    case 5:
      return readToken(call, [this]() -> Token& { return token_; });
    default:
      expected.flag = around_.isSubscribed;
      return expected;
  }
  for (int i = 0; i < changes && call.workerEnd != WorkerEnd::none; ++i) {
    error(kMain, "The voicemail store could not be written");
  }
  return expected;
}

// ---- preferences ----

namespace {

bool namesAFile(const std::string& domain) {
  return !domain.empty() && domain != "." && domain != ".." && domain.find('/') == std::string::npos;
}

}  // namespace

Expected Rules::setPreference(const Call& call) {
  const std::string domain = cut(call.texts[0], 256, true);
  const std::string key = cut(call.texts[1], 256, true);
  if (!isUtf8(domain) || !isUtf8(key)) return status(5);
  PropertyList value;
  if (call.regions[0].size() != 1) {
    value = parsed(call.regions[0]);
    if (!value) return status(5);
  }
  if (!namesAFile(domain)) {
    expect(kMain, {false, 3, "Preferences", true});
    return status(0);
  }
  Domain& there = domains_[domain];
  there.mayHaveFile = true;
  Values& values = there.keys[key];
  if (values.empty()) values.emplace_back();
  Values both = values;
  both.push_back(value);
  undo_ = [this, domain, key, both] { domains_[domain].keys[key] = both; };
  values = {value};
  return status(0);
}

Expected Rules::copyPreference(const Call& call, const char* which) {
  const std::string domain = cut(call.texts[0], 256, true);
  const std::string key = cut(call.texts[1], 256, true);
  if (!isUtf8(domain) || !isUtf8(key)) return status(5);
  Expected expected = status(0);
  Values values{PropertyList()};
  if (const auto there = domains_.find(domain); namesAFile(domain) && there != domains_.end()) {
    if (const auto found = there->second.keys.find(key); found != there->second.keys.end()) {
      values = found->second;
    }
  }
  expected.isRightPayload = [this, values, domain, key, which](const std::string& payload) {
    const PropertyList value = payload.empty() ? PropertyList() : parsed(payload);
    if (payload.empty() ? std::none_of(values.begin(), values.end(), [](const auto& each) { return !each; })
                        : std::find(values.begin(), values.end(), value) == values.end() ||
                              !payload.starts_with("<?xml")) {
      return false;
    }
    // Now it is known which of them it is.
    if (values.size() > 1) domains_[domain].keys[key] = {value};
    std::deque<Line>& waiting = lines_[kMain];
    if (payload.empty() && !waiting.empty()) waiting.pop_front();
    return payload.empty() || isUnsure() ||
           lastBeginning_ == "VM_ALLOCATE " + std::to_string(payload.size()) + "l (" + which + ")";
  };
  const bool isThere = std::any_of(values.begin(), values.end(), [](const auto& each) { return !!each; });
  if (isThere) expect(kMain, {true, 3, "VM_ALLOCATE ", true});
  return expected;
}

// The file of a domain of root's.
Expected Rules::loadDomain(const std::map<std::string, Values>& keys) {
  Expected expected = status(0);
  // Without values there need not be a file.
  const bool mayLack = std::all_of(keys.begin(), keys.end(), [](const auto& each) {
    return std::find(each.second.begin(), each.second.end(), PropertyList()) != each.second.end();
  });
  if (mayLack) {
    expected.codes = {0, 9};
    error(kMain, "Could not create data representation of dictionary");
  }
  expected.isRightPayload = [this, keys, mayLack](const std::string& payload) {
    if (mayLack && !lines_[kMain].empty()) lines_[kMain].pop_front();
    const PropertyList all = parsed(payload);
    if (!all.is(PropertyList::Type::dictionary)) return false;
    std::size_t found = 0;
    for (const auto& [key, values] : keys) {
      const PropertyList value = all.find(key);
      if (std::find(values.begin(), values.end(), value) == values.end()) return false;
      if (value) ++found;
    }
    return found == all.size();
  };
  return expected;
}

Expected Rules::loadPlist(const Call& call) {
  const std::string path = cut(call.texts[0], 256, true);
  info(kMain, "Loading " + path + " as plist");
  const std::string folder = "/root/Library/Preferences/";
  if (path.starts_with(folder) && path.ends_with(".plist")) {
    const auto there = domains_.find(path.substr(folder.size(), path.size() - folder.size() - 6));
    if (there != domains_.end() && there->second.mayHaveFile) return loadDomain(there->second.keys);
  } else if (const auto found = files_.find(path); found != files_.end() && S_ISREG(found->second.mode)) {
    const PropertyList value = parsed(found->second.content);
    if (value.is(PropertyList::Type::dictionary)) {
      Expected expected = status(0);
      expected.isRightPayload = [value](const std::string& payload) { return parsed(payload) == value; };
      return expected;
    }
  }
  error(kMain, "Could not create data representation of dictionary");
  return status(9);
}

// ---- carrier files ----

bool Rules::exists(const std::string& path, bool* isDirectory) const {
  std::string at = path;
  while (at.size() > 1 && at.back() == '/') at.pop_back();
  for (int links = 0; links < 8; ++links) {
    const auto found = files_.find(at);
    if (found == files_.end()) return false;
    if (S_ISLNK(found->second.mode)) {
      at = found->second.content;
      continue;
    }
    if (isDirectory != nullptr) *isDirectory = S_ISDIR(found->second.mode);
    return true;
  }
  return false;
}

bool Rules::hasBelow(const std::string& folder) const {
  const auto next = files_.upper_bound(folder + "/");
  return next != files_.end() && next->first.starts_with(folder + "/");
}

bool Rules::makeFolders(const std::string& path) {
  bool isDirectory = false;
  if (exists(path, &isDirectory)) return isDirectory;
  if (files_.contains(path)) return false;  // a link to nothing
  const std::string parent = parentOf(path);
  if (!parent.empty() && !makeFolders(parent)) return false;
  files_[path] = {S_IFDIR | 0755, {}, 0, 0};
  return true;
}

bool Rules::isListed(const std::string& path) {
  const auto found = files_.find(path);
  if (found != files_.end() && (found->second.mode & 0xA000) == 0) return false;
  const auto all = listedPaths();
  if (std::find(all.begin(), all.end(), path) == all.end()) return false;
  info(kMain, path + " is within allowed path " + path);
  return true;
}

bool Rules::isAllowed(const std::string& path) {
  for (const std::string& folder : {kHomeBundles, kFixedBundles}) {
    if (path.starts_with(folder)) {
      info(kMain, "Allowing path " + path + " within " + folder);
      return true;
    }
  }
  if (isListed(path)) return true;
  error(kMain, "NOT Allowing path " + path + " as it isn't within the wild card directories:");
  error(kMain, kHomeBundles);
  error(kMain, kFixedBundles);
  const auto extension = path.find(".tcpk");
  return path.starts_with("/tmp") && extension != std::string::npos && extension + 5 == path.size();
}

bool Rules::placeLink(const std::string& path, const std::string& target) {
  bool isDirectory = false;
  if (!exists(parentOf(path), &isDirectory) || !isDirectory) return false;
  const auto found = files_.find(path);
  if (found != files_.end() && S_ISDIR(found->second.mode) && hasBelow(path)) return false;
  files_[path] = {S_IFLNK | 0777, target, 0, 0};
  return true;
}

Expected Rules::createLink(const Call& call) {
  return status(placeLink(cut(call.texts[1], 1024, true), cut(call.texts[0], 1024, true)) ? 0 : 5);
}

Expected Rules::replaceLink(const Call& call) {
  const std::string path = cut(call.texts[1], 1024, true);
  if (!isListed(path)) {
    error(kMain, "Cannot remove symlink: " + path);
    return status(8);
  }
  if (!placeLink(path, cut(call.texts[0], 1024, true))) return status(5);
  info(kMain, "linkpath: " + path + ", domain: " + cut(call.texts[2], 1024, true));
  return status(0);
}

Expected Rules::removeFile(const Call& call) {
  const std::string path = cut(call.texts[0], 1024, true);
  const std::string domain = cut(call.texts[1], 1024, true);
  if (!domain.empty()) bsdNotice(kMain, "Removing domain: " + domain);
  if (!isAllowed(path)) return status(8);
  const auto found = files_.find(path);
  if (found == files_.end() || (S_ISDIR(found->second.mode) && hasBelow(path))) return status(5);
  files_.erase(found);
  return status(0);
}

Expected Rules::copyFile(const Call& call) {
  const std::string from = cut(call.texts[0], 256, true);
  const std::string to = cut(call.texts[1], 256, true);
  const std::string name = cut(call.texts[2], 256, true);
  const std::string source = from + "/" + name;
  const std::string destination = to + "/" + name;
  bsdNotice(kMain, "'" + from + "', '" + to + "', '" + name + "'");
  if (!isAllowed(destination)) {
    bsdError(kMain, "Destination directory " + destination + " is not within the allowed directories");
    return flagged(false);
  }
  const auto fails = [&] {
    bsdError(kMain, "Failed to copy the file " + from + " to " + to);
    return flagged(false);
  };
  if (!exists(to) && !makeFolders(to)) return fails();
  if (!exists(source)) return fails();
  bool isFolder = false;
  const bool isThere = exists(destination, &isFolder);
  if (!isThere && files_.contains(destination)) return fails();  // a link to nothing is in the way
  files_[source].uid = files_[source].gid = 0;
  if (isFolder) {
    // Into the folder goes the copy, to the account the folder. Where a folder is in the copy's place, the
    // answer says so, and no line of the log.
    Item& copy = files_[destination + "/" + name];
    if (S_ISDIR(copy.mode)) return flagged(false);
    copy = files_[source];
  } else {
    files_[destination] = files_[source];
  }
  files_[destination].uid = files_[destination].gid = kMobile;
  return flagged(true);
}

// Everything below a folder, to a folder that is not there.
void Rules::copyBelow(const std::string& from, const std::string& to, bool move) {
  Tree copies;
  for (auto each = files_.lower_bound(from); each != files_.end();) {
    const std::string& path = each->first;
    if (path != from && !path.starts_with(from + "/")) {
      if (!path.starts_with(from)) break;
      ++each;
      continue;
    }
    copies[to + path.substr(from.size())] = each->second;
    each = move ? files_.erase(each) : std::next(each);
  }
  files_.merge(copies);
}

Expected Rules::copyCrashLogs(const Call& call) {
  const std::string source = cut(call.texts[0], 256, true);
  bsdNotice(kMain, "'" + source + "', '" + kCrashLogs + "'");
  bool isDirectory = false;
  if (!exists(source, &isDirectory)) {
    bsdNotice(kMain, "Failed to copy the directory " + source + " to " + kCrashLogs +
                         ". Error: " + std::to_string(-1));
    return flagged(false);
  }
  files_[source].uid = files_[source].gid = 0;
  const std::string destination = kCrashLogs + nameOf(source);
  bool isFolder = false;
  const bool isThere = exists(destination, &isFolder);
  unsureFiles_.insert(destination);
  if (!isThere) {
    copyBelow(source, destination, false);
  } else if (!isDirectory) {
    if (!isFolder) files_[destination] = files_[source];
  } else if (!isFolder) {
    files_.erase(destination);
    copyBelow(source, destination, false);
  } else {
    Tree copies;
    for (const auto& [path, item] : files_) {
      if (path.starts_with(source + "/")) copies[destination + path.substr(source.size())] = item;
    }
    for (const auto& [path, item] : copies) files_[path] = item;
  }
  // An empty folder is removed, in copy mode as well, where the copy was a merge.
  if (isDirectory && !hasBelow(source)) {
    if (isThere) files_.erase(source);
  }
  return flagged(true);
}

Expected Rules::moveBundle(const Call& call) {
  const std::string source = cut(call.texts[0], 256, true);
  const std::string to = cut(call.texts[1], 256, true);
  const std::string name = cut(call.texts[2], 256, true);
  const std::string destination = to + "/" + name;
  bsdNotice(kMain, "'" + source + "', '" + to + "'");
  if (!exists(to) && !makeFolders(to)) {
    expect(kMain, {true, 5, "Failed to create CarrierBundles Dir  to " + to + ". Error: ", true});
    return flagged(false);
  }
  bsdNotice(kMain, "'" + source + "', '" + to + "', '" + name + "'");
  if (!isAllowed(destination)) {
    bsdError(kMain, "Destination directory " + destination + " is not within the allowed directories");
    return flagged(false);
  }
  const auto fails = [&](int code) {
    expect(kMain,
           {true, 3,
            "Failed to move the directory " + source + " to " + to + ". Error: " + std::to_string(code)});
    return flagged(false);
  };
  if (!exists(source)) return fails(-1);
  for (auto& [path, item] : files_) {
    if (path == source || path.starts_with(source + "/")) item.uid = item.gid = 0;
  }
  if (files_.contains(destination)) return fails(EEXIST);
  bool isDirectory = false;
  if (!exists(to, &isDirectory) || !isDirectory) return fails(ENOTDIR);
  copyBelow(source, destination, true);
  return flagged(true);
}

// ---- labels and contacts ----

namespace {

std::optional<std::string> identifierOf(const std::string& key) {
  constexpr std::array<std::pair<const char*, const char*>, 6> table{{{"PRIMARY", "primary"},
                                                                      {"SECONDARY", "secondary"},
                                                                      {"PERSONAL", "personal"},
                                                                      {"BUSINESS", "business"},
                                                                      {"TRAVEL", "travel"},
                                                                      {"CELL_DATA", "data"}}};
  for (const auto& [name, identifier] : table) {
    if (key == std::string("USER_LABEL_") + name) {
      return std::string("com.norvale.subscription-label.") + identifier;
    }
  }
  return std::nullopt;
}

}  // namespace

std::vector<std::string> Rules::namesIn(const PropertyList& labels) {
  std::vector<std::string> names;
  for (std::size_t i = 0; i < labels.size(); ++i) {
    const auto text = labels.at(i).asString();
    if (!text) continue;
    if (const auto found = identifierOf(std::string(*text))) names.push_back(*found);
  }
  return names;
}

// From pairs of a key and a text, of which the key says whether the text counts.
std::vector<std::string> Rules::badgesIn(const PropertyList& labels) {
  std::vector<std::string> badges;
  for (std::size_t i = 0; i < labels.size(); i += 2) {
    const auto key = labels.at(i).asString();
    if (!key) {
      error(kMain, "invalid object in array - ignore the rest");
      break;
    }
    if (!key->empty()) {
      if (const auto found = identifierOf(std::string(*key))) badges.push_back(*found);
    } else if (i + 1 < labels.size()) {
      badges.emplace_back(labels.at(i + 1).asString().value_or("(not a text)"));
    }
  }
  return badges;
}

Expected Rules::labels(const Call& call, bool badges) {
  const std::string who = badges ? "CopyBadgeLabels" : "CopyLocalizedLabels";
  standard(kMain, who + (badges ? ", compiling badge labels." : ", compiling localized labels.") +
                      " labels len:" + std::to_string(call.regions[0].size()) +
                      ", languages len:" + std::to_string(call.regions[1].size()));
  std::array<PropertyList, 2> arrays;
  for (std::size_t i = 0; i < 2; ++i) {
    const std::string field = i == 0 ? "labels" : "languages";
    arrays[i] = parsed(call.regions[i]);
    if (!arrays[i]) {
      error(kMain, who + ", cannot build " + field + " from data");
      return status(5);
    }
    if (!arrays[i].is(PropertyList::Type::array)) {
      error(kMain, who + ", invalid type of '" + field + "' field");
      return status(5);
    }
  }
  std::vector<std::string> wanted = badges ? badgesIn(arrays[0]) : namesIn(arrays[0]);
  if (badges && wanted.empty()) {
    error(kMain, "no labels given");
    return status(5);
  }
  standard(kMain, badges ? "getLocalizedBadgeLabelsForUnlocalizedLabels, " + std::to_string(wanted.size()) +
                               " label(s)"
                         : "getLocalizedPredefinedLabels, " + std::to_string(arrays[0].size()) +
                               " label(s), " + std::to_string(arrays[1].size()) + " language(s)");
  // The labeler of this machine answers with what it was given, if that is a text.
  std::erase(wanted, "(not a text)");
  Expected expected = status(0);
  expected.isRightPayload = [wanted](const std::string& payload) {
    const PropertyList all = parsed(payload);
    if (!all.is(PropertyList::Type::array) || all.size() != wanted.size()) return false;
    for (std::size_t i = 0; i < wanted.size(); ++i) {
      if (all.at(i).asString() != wanted[i]) return false;
    }
    return true;
  };
  return expected;
}

Expected Rules::remap(const Call& call) {
  const std::string from = cut(call.texts[0], 64, false);
  const std::string to = cut(call.texts[1], 64, false);
  standard(kMain, "remapChannelIdentifier " + from + " -> " + to);
  if (!around_.contactsAreReachable) {
    error(kMain, "unable to create ContactsChannelManager");
    return flagged(true);
  }
  std::optional<std::string> failure = around_.contactsError;
  if (!isUtf8(from) || !isUtf8(to)) failure = "not UTF-8";
  if (!failure && call.workerEnd != WorkerEnd::beforeTheWork) {
    ContactChannels changed = channels_.front();
    for (auto& [contact, channel] : changed) {
      if (channel == from) channel = to;
    }
    if (call.failsAt < 0) channels_.clear();
    channels_.push_back(changed);
  }
  if (call.workerEnd != WorkerEnd::none) failure = "the contacts could not be reached";
  standard(kMain, std::string("remapChannelIdentifier result: ") + (failure ? "failure" : "success") + " : " +
                      failure.value_or("(none)"));
  return flagged(!failure);
}

void Rules::comparesWith(const ContactChannels& channels) {
  if (std::find(channels_.begin(), channels_.end(), channels) == channels_.end()) {
    breach("the contacts are bound to other channels");
  }
  channels_ = {channels};
}

// ---- location ----

std::string Rules::countryCode(const std::string& actor) {
  if (!around_.countryCode) bsdError(actor, "Didn't get valid country code from GeoService.");
  return around_.countryCode.value_or("");
}

void Rules::pushCivic(const std::vector<std::string>& texts) {
  if (around_.telephonyIsAbsent) {
    return bsdError(kGeo, "sendCivicInfoToQV to Brenvik failed, could not open QVServerConnection");
  }
  std::vector<std::optional<std::string>> push{"civic"};
  for (const std::string& each : texts) push.push_back(isUtf8(each) ? std::optional(each) : std::nullopt);
  pushes_.push_back(push);
  if (around_.telephonyError != 0) {
    bsdNotice(kGeo, "sendCivicInfoToQV failed civic info to Brenvik due to error: " +
                        std::to_string(around_.telephonyError));
  } else {
    bsdNotice(kGeo, "sendCivicInfoToQV sent civic info to Brenvik successfully");
  }
}

void Rules::pushAddress(const std::string& address) {
  if (around_.telephonyIsAbsent) {
    return error(kGeo, "sendWanIPToQV to Brenvik failed, could not open QVServerConnection");
  }
  pushes_.push_back({"address", isUtf8(address) ? std::optional(address) : std::nullopt});
  if (around_.telephonyError != 0) {
    error(kGeo,
          "sendWanIPToQV failed WAN IP to Brenvik due to error: " + std::to_string(around_.telephonyError));
  } else {
    standard(kGeo, "sendWanIPToQV sent WAN IP to Brenvik successfully");
  }
}

void Rules::geoSubmitted(bool isCivic) {
  timePasses();
  isAwaiting_ = true;
  if (--(isCivic ? civicWanted_ : addressesWanted_) < 0)
    breach("a question of a place that nobody asked for");
  timeOuts_.emplace_back(world_.now() + kGeoPatience, isCivic);
}

void Rules::geoAnswers(bool isCivic, const std::optional<MapItems>& items,
                       const std::optional<std::string>& ip, const std::optional<std::string>& failure) {
  timePasses();
  const bool wasAwaited = std::exchange(isAwaiting_, false);
  if (!isCivic) {
    if (!wasAwaited) return standard(kGeo, "_RequestWanIPFromLocation wasn't waiting for response from GEO");
    if (failure) {
      error(kGeo, "_RequestWanIPFromLocation error: (" + *failure + ")");
      return pushAddress("");
    }
    standard(kGeo, "_RequestWanIPFromLocation WAN IP: " + ip.value_or(""));
    return pushAddress(ip.value_or(""));
  }
  const std::string who = "_RequestCivicInfoFromLatitudeLongitude ";
  const std::string who2 = "_RequestCivicInfoLatitudeLongitude ";
  if (!wasAwaited) return bsdError(kGeo, who + "wasn't waiting for response from GEO");
  std::vector<std::string> found(4);
  if (failure) bsdError(kGeo, who + "error: (" + *failure + ")");
  if (failure || !items || items->empty()) {
    bsdError(kGeo, who + "didn't get any mapItems");
  } else {
    bsdNotice(kGeo, who + "mapItems: (" + std::to_string(items->size()) + ")");
    const auto& item = items->front();
    if (!item || !item->valid) {
      bsdError(kGeo, who2 + "NULL mapItem ");
    } else if (!item->address || !item->address->structuredAddress) {
      bsdError(kGeo, who2 + "mapItem didn't get a structured address");
    } else {
      const StructuredAddress& address = *item->address->structuredAddress;
      const std::array parts{
          std::pair("country code", &address.countryCode), std::pair("state", &address.administrativeArea),
          std::pair("city", &address.locality), std::pair("postal code", &address.postCode)};
      for (std::size_t i = 0; i < parts.size(); ++i) {
        if (!*parts[i].second) continue;
        bsdNotice(kGeo, who + parts[i].first + ": " + **parts[i].second);
        found[i] = **parts[i].second;
      }
    }
  }
  if (found[0].empty()) found[0] = countryCode(kGeo);
  pushCivic(found);
}

// ---- the heartbeat ----

void Rules::resolveHeartbeat() {
  while (!heartbeats_.empty()) {
    const auto [since, isOn] = heartbeats_.front();
    const Time now = world_.now();
    // A command waits for the probe before it, and the start of one for its own.
    if (!world_.isQuiet("com.norvale.otaheartbeat") &&
        now - since < 5s * static_cast<int>(heartbeats_.size())) {
      return;
    }
    heartbeats_.pop_front();
    if (isOn) {
      takeToken();
      heldHeartbeat_ = 1;
    } else if (std::exchange(heldHeartbeat_, 0) > 0) {
      giveToken(since, now);
    }
  }
}

// ---- the databases ----

void Rules::beginCheck() {
  info(kUpdater, "Reading local resource com.norvale.lasd");
  expectedUrl_ = "https://lasd.norvale.example/1/v3/lasd.plist";
  for (const int type : kOrder) {
    if ((checks_.front() & static_cast<unsigned>(type)) == 0) continue;
    PropertyList record;
    const auto& keys = domains_["com.norvale.lasd"].keys;
    if (const auto found = keys.find(nameOfType(type)); found != keys.end()) record = found->second.back();
    local_[type] = record.is(PropertyList::Type::dictionary) ? record : PropertyList();
  }
  info(kUpdater, "Fetching URL " + expectedUrl_);
}

void Rules::endCheck() {
  checks_.pop_front();
  giveToken(world_.now(), world_.now());
  if (!checks_.empty()) beginCheck();
}

void Rules::expectNotification(const std::string& name, const std::string& type) {
  if (around_.lasdListens) notifications_.emplace_back("com.norvale.lasd." + name, type);
}

void Rules::webSends(const std::string& url) {
  if (url != expectedUrl_) breach("a fetch of " + url + " instead of " + expectedUrl_);
}

void Rules::webAnswers(const std::string& url, const WebAnswer& answer) {
  timePasses();
  if (checks_.empty()) return breach("an answer without a check");
  const bool isGood = !answer.isNothing && answer.kind == WebErrorKind::none && answer.status == 200;
  if (answer.isNothing) {
    error(kUpdater, "Did not receive HTTP response!");
  } else if (isGood) {
    info(kUpdater, "URL retrieved " + url + ", size: " + std::to_string(answer.body.size()) + " ");
  } else {
    expect(kUpdater, {false, 3, "HTTP request failed for URL " + url + " with error ", true});
  }
  const bool hasBody = isGood && !answer.body.empty();
  if (!toUpdate_.empty()) {
    databaseEnds(hasBody ? installs(url, answer) : [&] {
      error(kUpdater, "Cannot download file " + url + ". Either Wifi is turned OFF or not Wifi attached");
      return false;
    }());
    return;
  }
  if (!hasBody) {
    error(kUpdater, "Could not fetch data from source " + url);
    expectNotification("UpdateFailed", "");
    return endCheck();
  }
  const Manifest& manifest = manifests[answer.body];
  wanted_.clear();
  if (!manifest.isDictionary) {
    error(kUpdater, "Could not create version dictionary from downloaded plist!");
  } else {
    compareManifest(manifest);
  }
  if (wanted_.empty()) {
    error(kUpdater, "No update required for any databases");
    expectNotification("NoUpdateRequired", "");
    return endCheck();
  }
  for (const int type : kOrder) {
    if (wanted_.contains(type)) toUpdate_.push_back(type);
  }
  nextDatabase();
}

void Rules::compareManifest(const Manifest& manifest) {
  wanted_.clear();
  for (const int type : {1, 2, 4, 8, 16}) {
    if ((checks_.front() & static_cast<unsigned>(type)) == 0) continue;
    const std::string name = nameOfType(type);
    const auto entry = manifest.entries.find(name);
    if (entry == manifest.entries.end() || !entry->second.isDictionary) {
      info(kUpdater, name + " db is not present locally, update required");
      continue;
    }
    const auto& server = entry->second.version;
    const PropertyList& record = local_[type];
    const auto local = record.find("Version").asString();
    if (!record || (!local && server)) {
      info(kUpdater, "We have don't have a previously downloaded " + name + " database, server has " +
                         server.value_or("(null)") + ", update required");
    } else if (local && server && sameVersion(*local, *server)) {
      info(kUpdater, name + " version " + std::string(*local) + " matches server version");
      continue;
    } else {
      info(kUpdater, "We have " + name + " version " + std::string(local.value_or("(null)")) +
                         ", server has " + server.value_or("(null)") + ", update required");
    }
    wanted_[type] = entry->second;
  }
}

void Rules::nextDatabase() {
  while (!toUpdate_.empty()) {
    const int type = toUpdate_.front();
    const std::string name = nameOfType(type);
    const auto& url = wanted_[type].url;
    if (!url || url->empty()) {
      error(kUpdater,
            !url ? "Could not find " + name + " database URL" : "URL for " + name + " database is empty");
      toUpdate_.pop_front();
      continue;
    }
    const auto folder = files_.find(kDatabases);
    if (folder == files_.end()) {
      filesBefore_ = files_;
      files_[kDatabases] = {S_IFDIR | 0755, {}, 0, 0};
    } else if (!S_ISDIR(folder->second.mode)) {
      error(kUpdater, "Cannot create " + kDatabases + " errno set to File exists");
      toUpdate_.pop_front();
      expectNotification("UpdateFailed", "");
      continue;
    }
    info(kUpdater, "Fetching URL " + *url);
    if (!url->starts_with("https://")) {
      error(kUpdater, "Cannot create HTTP request for URL " + *url);
      error(kUpdater, "Cannot download file " + *url + ". Either Wifi is turned OFF or not Wifi attached");
      toUpdate_.pop_front();
      expectNotification("UpdateFailed", "");
      continue;
    }
    expectedUrl_ = *url;
    return;
  }
  wanted_.clear();
  endCheck();
}

bool Rules::installs(const std::string& url, const WebAnswer& answer) {
  std::string name = url.substr(url.rfind('/') + 1);
  name.resize(std::min(name.size(), name.find(".gz")));
  const std::string final = kDatabases + "/" + name;
  const std::string temporary = final + ".tmp";
  info(kUpdater, "uncompressing to " + temporary);
  const auto fails = [&] {
    error(kUpdater, "Failed to commit the data to file for " + temporary);
    return false;
  };
  if (!answer.contentType) {
    error(kUpdater, "Cannot find Content-Type header in response!");
    return fails();
  }
  if (answer.contentType->find("gzip") == std::string::npos) {
    error(kUpdater,
          "Expected to find gzip in Content-Type header, found " + *answer.contentType + " instead");
    return fails();
  }
  if (!answer.body.starts_with("gz:")) {
    error(kUpdater, "Could not uncompress HTTP response to " + temporary + "!");
    filesBefore_ = files_;
    files_.erase(temporary);
    return fails();
  }
  filesBefore_ = files_;
  files_.erase(temporary);
  if (files_.contains(final)) info(kUpdater, "Removed old database " + final);
  info(kUpdater, "Moving " + temporary + " to " + final);
  files_[final] = {S_IFREG | 0644, answer.body.substr(3), 0, 0};
  const int type = toUpdate_.front();
  const Manifest::Entry& entry = wanted_[type];
  std::vector<std::pair<std::string, PropertyList>> record{{"ContentURL", PropertyList::string(*entry.url)}};
  if (entry.version) record.emplace_back("Version", PropertyList::string(*entry.version));
  Domain& domain = domains_["com.norvale.lasd"];
  domain.mayHaveFile = true;
  Values& values = domain.keys[nameOfType(type)];
  Values both = values.empty() ? Values{PropertyList()} : values;
  values = {PropertyList::dictionary(record)};
  both.push_back(values.front());
  undo_ = [this, type, both] { domains_["com.norvale.lasd"].keys[nameOfType(type)] = both; };
  info(kUpdater, std::string("Downloaded ") + nameOfType(type) + " database version " +
                     entry.version.value_or("(null)") + " successfully");
  return true;
}

void Rules::databaseEnds(bool ok) {
  const int type = toUpdate_.front();
  toUpdate_.pop_front();
  expectNotification(ok ? "UpdateAvailable" : "UpdateFailed", ok ? nameOfType(type) : "");
  nextDatabase();
}

// What a domain holds after a death: each key what it had, or what the request under way was to give it.
void Rules::settlesOn(const Tree& disk, const std::string& domain, Domain& there) {
  const auto found = disk.find("/root/Library/Preferences/" + domain + ".plist");
  const PropertyList all = found != disk.end() ? parsed(found->second.content) : PropertyList();
  if (found != disk.end() && !all.is(PropertyList::Type::dictionary)) {
    breach("after a death, the domain " + domain + " is not whole");
  }
  for (auto& [key, values] : there.keys) {
    const PropertyList value = all.find(key);
    if (std::find(values.begin(), values.end(), value) == values.end()) {
      breach("after a death, the key " + key + " of the domain " + domain + " has another value");
    }
    values = {value};
  }
}

void Rules::afterDeath(const Tree& disk, bool hadPower) {
  if (undo_) (*undo_)();
  for (auto& [domain, there] : domains_) settlesOn(disk, domain, there);
  filesSettleOn(disk, hadPower);
  unsureFiles_.clear();
}

// Whether this may be at the path after what may have ended early.
bool Rules::mayBeLeft(const std::string& path, const Item& left, bool hadPower) const {
  // A power cut may take back what was done to an owner or a mode, of which no answer promises more.
  const auto isSame = [hadPower](const Item& a, const Item& b) {
    return hadPower ? a == b : (a.mode & S_IFMT) == (b.mode & S_IFMT) && a.content == b.content;
  };
  const bool isUnsureOfIt =
      !hadPower && std::any_of(unsureFiles_.begin(), unsureFiles_.end(), [&](const auto& each) {
        return path == each || path.starts_with(each + "/");
      });
  if (isUnsureOfIt || isSame(left, itemIn(files_, path))) return true;
  if (!filesBefore_) return false;
  const Item before = itemIn(*filesBefore_, path);
  // What is copied or moved is given to root first.
  const Item given{before.mode, before.content, 0, 0};
  if (isSame(left, before) || isSame(left, given)) return true;
  // A database under way: the old one goes before the new one comes, and an unfinished one is left.
  return path.starts_with(kDatabases + "/") && (left.mode == 0 || path.ends_with(".tmp"));
}

// The files, after what may have ended early.
void Rules::filesSettleOn(const Tree& disk, bool hadPower) {
  for (auto each = files_.begin(); each != files_.end();) {
    each = isHidden(each->first) ? files_.erase(each) : std::next(each);
  }
  std::set<std::string> paths;
  for (const auto* tree : {&disk, static_cast<const Tree*>(&files_)}) {
    for (const auto& [path, item] : *tree) {
      if (!isHidden(path)) paths.insert(path);
    }
  }
  for (const std::string& path : paths) {
    const Item left = itemIn(disk, path);
    if (mayBeLeft(path, left, hadPower)) continue;
    breach("after an early end, the file " + path + " is \"" + left.content + "\" instead of \"" +
           itemIn(files_, path).content + "\"");
  }
  files_ = disk;
  isAnswered();
}

void Rules::comparesWith(const Tree& disk) {
  for (const auto& [path, item] : files_) {
    if (isHidden(path)) continue;
    const auto found = disk.find(path);
    if (found == disk.end()) {
      breach("the file " + path + " is missing");
    } else if (!(found->second == item)) {
      breach("the file " + path + " is \"" + found->second.content + "\" mode " +
             std::to_string(found->second.mode) + " of " + std::to_string(found->second.uid) +
             " instead of \"" + item.content + "\" mode " + std::to_string(item.mode) + " of " +
             std::to_string(item.uid));
    }
  }
  for (const auto& [path, item] : disk) {
    if (!isHidden(path) && !files_.contains(path)) breach("the file " + path + " should not be there");
  }
}

}  // namespace brenvik::simulation

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <sys/types.h>

#include <cstdint>
#include <deque>
#include <functional>
#include <map>
#include <optional>
#include <set>
#include <string>
#include <utility>
#include <vector>

#include "Disk.h"
#include "Services.h"
#include "Workers.h"
#include "World.h"
#include "interface/Wire.h"
#include "platform/geo/GeoService.h"
#include "platform/plist/PropertyList.h"

// What the helper has to do, said a second time and without looking at its code: which answer each request
// gets, which lines the log gets, what is pushed, which files there are, and when the process leaves.
namespace brenvik::simulation {

// A line of the log.
struct Line {
  bool isBsd = false;
  int level = 0;
  std::string text;
  bool isBeginning = false;  // any text that begins so
};

// A request: its row in the table of routines, and its arguments.
struct Call {
  std::size_t row = 0;
  std::vector<std::string> texts;
  std::vector<std::string> regions;
  std::int32_t value = 0;
  double latitude = 0;
  double longitude = 0;
  // What is wrong with the message.
  enum class Form { right, shorter, longer, complexFlag, wrongLength, wrongType, unknownId };
  Form form = Form::right;
  // The allocation that fails while it is served, counted from 0; none if it is negative.
  long failsAt = -1;
  // How the worker that it needs ends.
  WorkerEnd workerEnd = WorkerEnd::none;
};

// A check-in, as far as its answer follows from it.
struct CheckIn {
  std::pair<pid_t, std::uint32_t> process;
  bool isAlive = true;
  bool isAllowed = true;  // what can be found out of the living process lets it in
  bool portIsDead = false;
  bool lacksMemory = false;  // one allocation fails while it is served
};

// A reply, or what a reply must be.
struct Answer {
  KernelReturn code = 0;
  std::optional<bool> flag;
  std::optional<std::string> text;
  std::optional<std::string> payload;  // the bytes of the region; empty: none
};

struct Expected {
  std::vector<KernelReturn> codes;
  std::optional<bool> flag;
  std::function<bool(const std::string& text)> isRightText;
  std::function<bool(const std::string& payload)> isRightPayload;
};

// The update server's manifest.
struct Manifest {
  bool isDictionary = true;
  struct Entry {
    bool isDictionary = true;
    std::optional<std::string> version;
    std::optional<std::string> url;
  };
  std::map<std::string, Entry> entries;
  std::string body;
};

// What the rules have to know of the world around the helper.
struct Surroundings {
  std::optional<std::string> countryCode;
  bool telephonyIsAbsent = false;
  std::int32_t telephonyError = 0;
  bool lasdListens = true;
  bool hostsBaseband = false;
  bool basebandIsBusy = false;
  bool contactsAreReachable = true;
  std::optional<std::string> contactsError;
  bool isSubscribed = false;
  bool echoIsSilent = false;
  bool outOfDescriptors = false;
  int archiveResult = 0;
  std::optional<int> archiveFatal;
};

class Rules {
 public:
  Rules(World& world, const Surroundings& around, Tree files);

  // ---- the helper's life ----
  void begins();
  void exits(int status);
  void wasKilled();
  // After a death: what is left on the disk.
  void afterDeath(const Tree& disk, bool hadPower);
  // Whether the files are as they must be.
  void comparesWith(const Tree& disk);
  // Whether the contacts are bound as they must be.
  void comparesWith(const ContactChannels& channels);
  const ContactChannels& channels() const { return channels_.front(); }
  // Before anything else happens at this moment.
  void timePasses();
  // At a moment at which nothing is left to be done.
  void settles();

  // ---- check-in ----
  // The codes that it may get.
  std::vector<KernelReturn> codesOf(const CheckIn& checkIn) const;
  // `isWatched`: the helper watches the caller's port now.
  void isAnswered(const CheckIn& checkIn, int connection, KernelReturn code, bool isWatched);
  void processExits(std::pair<pid_t, std::uint32_t> process) {
    granted_.erase(process);
    maybeGranted_.erase(process);
  }
  void portDies(int connection);

  // ---- requests ----
  Expected before(const Call& call);
  // The reply of the last one has gone out: what it did must not be lost any more.
  void isAnswered() {
    undo_.reset();
    filesBefore_.reset();
  }
  // Between the two, memory is short: the request may fail, and lines may be missing; what it did is done or
  // not.
  void becomesUnsure(const Call& call);
  void becomesSure(const Call& call, const Answer& answer, const Tree& disk);
  // What its answer may be then.
  Expected withoutMemory(const Call& call, Expected expected, const Answer& answer) const;
  // Whether lack of memory may end the process in it.
  static bool mayEndTheProcess(const Call& call) noexcept { return call.row == 18 || call.row == 20; }
  bool isUnsure() const noexcept { return unsureRow_.has_value(); }

  // ---- what the helper does ----
  void logs(const std::string& actor, bool isBsd, int level, std::string text);
  void pushes(const std::string& what, const std::vector<std::optional<std::string>>& values);
  void notifies(const PropertyList& notification);
  void geoSubmitted(bool isCivic);
  void geoAnswers(bool isCivic, const std::optional<MapItems>& items, const std::optional<std::string>& ip,
                  const std::optional<std::string>& error);
  void webSends(const std::string& url);
  void webAnswers(const std::string& url, const WebAnswer& answer);

  // What was wrong so far; the first of it counts.
  void breach(const std::string& text) {
    if (!finding_) finding_ = text;
  }
  const std::optional<std::string>& finding() const noexcept { return finding_; }

  // The manifests that were ever served, by their bytes.
  std::map<std::string, Manifest> manifests;
  bool isRunning() const noexcept { return isRunning_; }
  std::string state() const;

 private:
  using Values = std::vector<PropertyList>;  // what a key may have, each as good as the other
  struct Domain {
    bool mayHaveFile = false;
    std::map<std::string, Values> keys;
  };

  void expect(const std::string& actor, Line line);
  void info(const std::string& actor, std::string text) { expect(actor, {false, 6, std::move(text)}); }
  void error(const std::string& actor, std::string text) { expect(actor, {false, 3, std::move(text)}); }
  void standard(const std::string& actor, std::string text) { expect(actor, {false, 5, std::move(text)}); }
  void bsdError(const std::string& actor, std::string text) { expect(actor, {true, 3, std::move(text)}); }
  void bsdNotice(const std::string& actor, std::string text) { expect(actor, {true, 5, std::move(text)}); }

  // The idle rule.
  void cancelIdle() { idle_.reset(); }
  void idleSince(Time earliest, Time latest);
  void takeToken();
  void giveToken(Time earliest, Time latest);

  void settlesOn(const Tree& disk, const std::string& domain, Domain& there);

  // The routines, by their rows.
  bool mayBeLeft(const std::string& path, const Item& left, bool hadPower) const;
  void filesSettleOn(const Tree& disk, bool hadPower);

  void goesOn(const Call& call);
  Expected voicemail(const Call& call);
  Expected setPreference(const Call& call);
  Expected copyPreference(const Call& call, const char* which);
  Expected loadPlist(const Call& call);
  Expected loadDomain(const std::map<std::string, Values>& keys);
  Expected replaceLink(const Call& call);
  Expected createLink(const Call& call);
  Expected removeFile(const Call& call);
  Expected copyFile(const Call& call);
  Expected copyCrashLogs(const Call& call);
  Expected moveBundle(const Call& call);
  Expected labels(const Call& call, bool badges);
  static std::vector<std::string> namesIn(const PropertyList& labels);
  std::vector<std::string> badgesIn(const PropertyList& labels);
  Expected remap(const Call& call);

  bool isListed(const std::string& path);
  bool isAllowed(const std::string& path);
  bool exists(const std::string& path, bool* isDirectory = nullptr) const;
  bool hasBelow(const std::string& folder) const;
  bool makeFolders(const std::string& path);
  bool placeLink(const std::string& path, const std::string& target);
  void copyBelow(const std::string& from, const std::string& to, bool move);

  // The databases.
  void beginCheck();
  void endCheck();
  void compareManifest(const Manifest& manifest);
  void nextDatabase();
  void databaseArrives(const std::string& url, const WebAnswer& answer);
  bool installs(const std::string& url, const WebAnswer& answer);
  void databaseEnds(bool ok);
  void expectNotification(const std::string& name, const std::string& type);

  void resolveHeartbeat();
  void pushCivic(const std::vector<std::string>& texts);
  void pushAddress(const std::string& address);
  std::string countryCode(const std::string& actor);

  World& world_;
  const Surroundings& around_;
  std::optional<std::string> finding_;
  bool isRunning_ = false;
  bool hasServed_ = false;  // a request, in this life
  std::optional<std::size_t> unsureRow_;

  std::map<std::string, std::deque<Line>> lines_;  // that must come, by the thread
  std::string lastBeginning_;                      // the last line of which the rules know the beginning
  std::deque<std::vector<std::optional<std::string>>> pushes_;
  std::deque<std::pair<std::string, std::string>> notifications_;

  std::set<std::pair<pid_t, std::uint32_t>> granted_;
  std::set<std::pair<pid_t, std::uint32_t>> maybeGranted_;  // remembered, unless memory was lacking
  std::set<int> clients_;
  int tokens_ = 0;
  struct Idle {
    Time earliest;
    Time latest;
  };
  std::optional<Idle> idle_;  // the next tick

  std::map<std::string, Domain> domains_;
  // What a token may be, each as good as the other; none is as an empty one.
  using Token = std::set<std::string>;
  static void change(Token& token, const std::string& value, const Call& call);
  Expected readToken(const Call& call, const std::function<Token&()>& token);
  Token& tokenOf(const std::string& key) { return tokens2_.try_emplace(key, Token{""}).first->second; }
  Token token_{""};
  std::map<std::string, Token> tokens2_;
  // What the contacts may be bound to.
  std::vector<ContactChannels> channels_{{{1, "a"}, {2, "token"}, {3, "a"}, {4, "\xE2\x82\xAC"}}};
  Tree files_;
  std::set<std::string> unsureFiles_;  // whose copies need not have got to the disk

  bool isAwaiting_ = false;
  int civicWanted_ = 0;  // questions that the geo service has not got yet
  int addressesWanted_ = 0;
  std::deque<std::pair<Time, bool>> timeOuts_;  // when, and whether of a civic request

  std::deque<std::uint32_t> checks_;  // masks; the first one runs
  std::map<int, PropertyList> local_;
  std::map<int, Manifest::Entry> wanted_;
  std::deque<int> toUpdate_;
  std::string expectedUrl_;

  int heldHeartbeat_ = 0;
  std::deque<std::pair<Time, bool>> heartbeats_;  // commands that wait for a probe
  // What the request under way may have left undone if the helper dies.
  std::optional<std::function<void()>> undo_;
  std::optional<Tree> filesBefore_;
};

// Field texts as the routines see them.
std::string cut(const std::string& field, std::size_t size, bool isTerminated);
bool isUtf8(const std::string& text);

}  // namespace brenvik::simulation

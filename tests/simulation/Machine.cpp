// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "Machine.h"

#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <cstring>
#include <exception>
#include <limits>
#include <set>
#include <span>

#include "helper/core/Composition.h"
#include "platform/base/fakes/FailingAllocations.h"
#include "platform/files/linux/LinuxFileManager.h"
#include "platform/log/LogContext.h"
#include "platform/plist/PropertyListCodec.h"
#include "platform/preferences/linux/FilePreferences.h"

namespace brenvik::simulation {
namespace {

using namespace std::chrono_literals;

bool isSubscribedNow = false;

class Subscription final : public VisualVoicemailLibrary {
 public:
  SubscriptionQuery lookUpSubscriptionQuery() noexcept override {
    return [] { return isSubscribedNow; };
  }
};

Item folder(uid_t owner = 0, mode_t mode = 0755) { return {S_IFDIR | mode, {}, owner, owner}; }
Item file(std::string content, uid_t owner = 0, mode_t mode = 0644) {
  return {S_IFREG | mode, std::move(content), owner, owner};
}

constexpr uid_t kMobile = 501;

Tree firstTree() {
  const auto xml = [](const PropertyList& value) {
    return *serializePropertyList(value, PropertyListFormat::xml);
  };
  return {{"/root", folder(0, 0700)},
          {"/tmp", folder(0, 01777)},
          {"/tmp/a.tcpk", file("a package")},
          {"/var", folder()},
          {"/var/mobile", folder(kMobile)},
          {"/var/mobile/Library", folder(kMobile)},
          {"/var/mobile/Library/Preferences", folder(kMobile)},
          {"/var/mobile/Library/Carrier Bundles", folder(kMobile)},
          {"/var/mobile/Library/Logs", folder(kMobile)},
          {"/var/mobile/Library/Logs/CrashReporter", folder(kMobile)},
          {"/var/mobile/info.plist",
           file(xml(PropertyList::dictionary({{"a", PropertyList::string("text")}})), kMobile)},
          {"/var/mobile/list.plist", file(xml(PropertyList::array({PropertyList::boolean(true)})), kMobile)},
          {"/var/mobile/noise", file("neither this nor that", kMobile)},
          {"/private", folder()},
          {"/private/var", folder()},
          {"/private/var/mobile", folder()},
          {"/private/var/mobile/Library", folder()},
          {"/private/var/mobile/Library/Preferences", folder()},
          {"/stage", folder()},
          {"/stage/one", file("one")},
          {"/stage/two", file("two", kMobile, 0600)},
          {"/stage/crash", folder()},
          {"/stage/crash/x.ips", file("x")},
          {"/stage/crash/y.ips", file("y", kMobile)}};
}

}  // namespace

// ---- one life of the helper ----

class Machine::Platform final : public RequestPlatform {
 public:
  explicit Platform(Machine& machine) : machine_(machine) {}
  Roles roles() override;
  std::vector<StatusReport::Worker> workers() const override { return {{"network"}, {"stores"}}; }
  void shutDown() noexcept override {}

 private:
  Machine& machine_;
  FilePreferences preferences_{[] {
    return FilePreferences::Places{"/root", "/var/lib/any", "0123456789abcdef0123456789abcdef"};
  }};
  LinuxFileManager files_;
  Subscription subscription_;
};

class Machine::Life {
 public:
  explicit Life(Machine& machine)
      : queues(machine.world),
        loop(machine.world),
        bootstrap(ports),
        sources(machine.world, ports),
        mobile(machine.accounts_) {}
  SimulatedQueues queues;
  SimulatedRunLoop loop;
  FakePortSpace ports;
  HeapRegions regions;
  FakeBootstrap bootstrap;
  SimulatedPortSources sources;
  ManualGeoService geo;
  MobileUser mobile;
  PortServerRegistry registry;
  GeoRequestState location;
  CellularHeartbeat heartbeat;
  std::shared_ptr<LASDUpdater> lasd = std::make_shared<LASDUpdater>();
  std::size_t civicSeen = 0;
  std::size_t addressesSeen = 0;
  // The questions of each that the network worker still has.
  std::set<std::size_t> civicWaiting;
  std::set<std::size_t> addressesWaiting;
};

RequestPlatform::Roles Machine::Platform::roles() {
  return {.preferences = preferences_,
          .files = files_,
          .archives = machine_.archives_.factory(),
          .radio = machine_.radio_,
          .labeler = machine_.labeler_,
          .contacts = machine_.contacts_,
          .web = machine_.web,
          .gunzip = machine_.gunzip_,
          .messagePorts = machine_.messagePorts_,
          .echoNetwork = machine_.echo,
          .voicemail = machine_.voicemail_,
          .visualVoicemail = subscription_,
          .geo = machine_.life_->geo,
          .telephony = machine_.telephony_};
}

Machine::Machine(std::uint64_t seed, std::function<void(const std::string&)> trace)
    : world(seed),
      rules(world, around, firstTree()),
      trace_(std::move(trace)),
      sinkBefore_(setLogSink(this)) {
  Disk::shared().restore(firstTree());
  accounts_.accounts["mobile"] = {AccountIds{kMobile, kMobile}, "/var/mobile"};
  world.afterEachStep = [this] { observe(); };
  world.mayWait = [this](std::string_view label) {
    return label == "LASDUpdater" ||
           (label == "com.norvale.otaheartbeat" && echo.far == SimulatedEcho::Far::isSilent);
  };
  web.onSend = [this](const std::string& url) { rules.webSends(url); };
  web.onAnswer = [this](const std::string& url, const WebAnswer& answer) {
    this->trace("the web answers " + url + " with " + std::to_string(static_cast<int>(answer.kind)) + "/" +
                std::to_string(answer.status));
    rules.webAnswers(url, answer);
  };
  web.onBreach = [this](const std::string& text) { rules.breach(text); };
  security_.holds = [this](const AuditToken& token) { return heldBy(token); };
  contacts_.channels = rules.channels();
  echo.dies = [this] {
    const bool isOver = !world.isKilled() && world.random().oneIn(80);
    if (isOver) networkWorkerDies();
    return isOver;
  };
  echo.onSend = [this](unsigned interface, std::span<const std::byte> message) {
    if (message.size() != 48 || message[0] != std::byte{8}) rules.breach("an echo request of another form");
    if ((interface == 7) != echo.hasCellular) rules.breach("an echo over another interface");
  };
}

Machine::~Machine() {
  Disk::shared().stopCounting();
  setLogSink(sinkBefore_);
}

void Machine::trace(const std::string& text) {
  if (trace_ && !isTrial_) trace_(std::to_string(world.now().count()) + " " + text);
}

void Machine::live() {
  ++counts.lives;
  trace("the helper starts");
  life_ = std::make_unique<Life>(*this);
  baseband_.hosts = around.hostsBaseband;
  surroundingsChange();
  world.beginLife();
  rules.begins();
  const std::vector<ServiceMessage> waiting(waiting_.begin(), waiting_.end());
  waiting_.clear();
  for (const ServiceMessage& each : waiting) {
    world.postToLoop([this, each] { serve(each); });
  }
  const auto now = [this] { return world.now(); };
  const HelperPlatform platform{
      .loop = life_->loop,
      .queues = life_->queues,
      .security = security_,
      .ports = life_->ports,
      .regions = life_->regions,
      .sources = life_->sources,
      .bootstrap = life_->bootstrap,
      .baseband = baseband_,
      .serviceManager = serviceManager_,
      .makeRequestPlatform = [this](MobileUser&) { return std::make_unique<Platform>(*this); },
      .version = "simulated",
      .serviceSocket = "simulated",
      .now = now,
      .refusalClock = now};
  const HelperState state{.lasd = *life_->lasd,
                          .heartbeat = life_->heartbeat,
                          .location = life_->location,
                          .registry = life_->registry,
                          .mobile = [this]() -> MobileUser& { return life_->mobile; }};
  life_->queues.isAlive = [this](pid_t pid, std::uint32_t version) {
    return std::any_of(processes.begin(), processes.end(), [&](const Process& each) {
      return each.isAlive && each.key() == std::pair(pid, version);
    });
  };
  bool wasKilled = false;
  try {
    const int status = runComposed(platform, state);
    if (world.isKilled()) {
      wasKilled = true;
    } else {
      trace("the helper leaves with " + std::to_string(status));
      rules.exits(status);
    }
  } catch (const Killed&) {
    wasKilled = true;
  }
  if (wasKilled) {
    ++counts.deaths;
    rules.wasKilled();
    // What it seemed to send after its death was never sent.
    pushesSeen_ = telephony_.pushes.size();
    notificationsSeen_ = messagePorts_.count();
  }
  if (!wasKilled) lookForLeaks(*life_);
  life_->lasd->shutDown();
  life_->heartbeat.shutDown();
  life_.reset();
  world.endLife();
  pendingCalls_ = 0;
  // Whoever had come as far as to a reply sees the end of his channel.
  for (auto& [id, connection] : connections) {
    if (connection.watched != kNullPort) connection = {.process = connection.process, .isOpen = false};
  }
  if (wasKilled) {
    const bool hadPower = std::exchange(disaster_, Disaster::none) != Disaster::powerCut;
    Disk::shared().restore(*remains_);
    rules.afterDeath(*remains_, hadPower);
    remains_.reset();
  }
}

void Machine::lookForLeaks(Life& life) {
  const auto leaks = [this](const std::string& what, std::size_t count) {
    if (count != 0) rules.breach("left behind: " + std::to_string(count) + " " + what);
  };
  leaks("receive rights", life.ports.receiveRights.size());
  leaks("send rights", life.ports.sendRights.size());
  leaks("drops of rights that were not there", static_cast<std::size_t>(life.ports.failedDrops));
  leaks("names of ports in the registry", life.registry.size());
  const auto isStillNamed = [](const auto& each) {
    return LogCallers::shared().find(each.second.port) != nullptr;
  };
  leaks("callers that the log names",
        static_cast<std::size_t>(std::count_if(connections.begin(), connections.end(), isStillNamed)));
  leaks("regions", life.regions.live());
  leaks("watches of processes", life.queues.watched());
  leaks("sources", life.sources.livingSources());
  leaks("timers", static_cast<std::size_t>(life.loop.timers));
  leaks("tickets", static_cast<std::size_t>(life.geo.ticketsAlive));
  leaks("connections to the telephony daemon", static_cast<std::size_t>(telephony_.connectionsOpen));
  leaks("archive copiers", static_cast<std::size_t>(archives_.living));
  leaks("echo sockets", static_cast<std::size_t>(echo.openSockets));
  if (pendingCalls_ != 0) rules.breach("the helper left with requests that it has not answered");
}

void Machine::runUntil(Time end) {
  bool isOver = false;
  world.clock.schedule(end - world.now(), [&isOver] { isOver = true; });
  for (;;) {
    if (!waiting_.empty()) {
      live();
    } else if (isOver || !world.step(false)) {
      break;
    }
    if (rules.finding()) throw Finding{*rules.finding()};
  }
}

void Machine::surroundingsChange() {
  telephony_.absent = around.telephonyIsAbsent;
  telephony_.result = telephonyResult(kPosixErrorDomain, around.telephonyError);
  messagePorts_.nobodyListens = !around.lasdListens;
  baseband_.busy = around.basebandIsBusy;
  archives_.result = around.archiveResult;
  archives_.fatalError = around.archiveFatal;
  contacts_.isReachable = around.contactsAreReachable;
  contacts_.failWith = around.contactsError;
  isSubscribedNow = around.isSubscribed;
  if (life_ != nullptr) life_->geo.countryCode = around.countryCode;
}

// ---- what happens to the helper ----

void Machine::observeQuestions(Life& life) {
  for (; life.civicSeen < life.geo.reverseGeocodes.size(); ++life.civicSeen) {
    rules.geoSubmitted(true);
    life.civicWaiting.insert(life.civicSeen);
    const GeoAnswer answer = geoAnswer();
    if (!answer.delay) continue;
    world.clock.schedule(*answer.delay, [this, index = life.civicSeen, answer, born = counts.lives] {
      if (life_ != nullptr && counts.lives == born && !world.isKilled()) answerCivic(index, answer);
    });
  }
  for (; life.addressesSeen < life.geo.geoIps.size(); ++life.addressesSeen) {
    rules.geoSubmitted(false);
    life.addressesWaiting.insert(life.addressesSeen);
    const GeoAnswer answer = geoAnswer();
    if (!answer.delay) continue;
    world.clock.schedule(*answer.delay, [this, index = life.addressesSeen, answer, born = counts.lives] {
      if (life_ != nullptr && counts.lives == born && !world.isKilled()) answerAddress(index, answer);
    });
  }
}

void Machine::observe() {
  if (life_ != nullptr && !world.isKilled()) observeQuestions(*life_);
  for (; pushesSeen_ < telephony_.pushes.size(); ++pushesSeen_) {
    const auto& push = telephony_.pushes[pushesSeen_];
    trace("a push of " + push.what);
    if (!world.isKilled()) rules.pushes(push.what, push.values);
  }
  if (notificationsSeen_ < messagePorts_.count()) observeNotifications();
  if (rules.finding()) throw Finding{*rules.finding()};
}

void Machine::answerCivic(std::size_t index, const GeoAnswer& answer) {
  if (life_->civicWaiting.erase(index) == 0) return;
  rules.geoAnswers(true, answer.error ? std::nullopt : answer.items, std::nullopt, answer.error);
  auto& question = life_->geo.reverseGeocodes[index];
  if (answer.error) {
    question.fail(*answer.error);
  } else {
    question.answer(answer.items);
  }
}

void Machine::answerAddress(std::size_t index, const GeoAnswer& answer) {
  if (life_->addressesWaiting.erase(index) == 0) return;
  rules.geoAnswers(false, std::nullopt, answer.address, answer.error);
  auto& question = life_->geo.geoIps[index];
  if (answer.error) {
    question.fail(*answer.error);
  } else {
    question.answer(answer.address.value_or(""));
  }
}

void Machine::networkWorkerDies() {
  if (life_ == nullptr || world.isKilled()) return;
  trace("the network worker dies");
  ++web.workersDied;
  ++echo.workersDied;
  world.endWaits();
  // Noticed a moment later, when what goes on now is done: the rules know no order within one moment.
  world.clock.schedule(1us + world.random().upTo(1ms), [this, born = counts.lives] {
    if (life_ == nullptr || counts.lives != born || world.isKilled()) return;
    GeoAnswer none;
    none.error = "the network worker is not available";
    while (!life_->civicWaiting.empty()) answerCivic(*life_->civicWaiting.begin(), none);
    while (!life_->addressesWaiting.empty()) answerAddress(*life_->addressesWaiting.begin(), none);
  });
}

void Machine::observeNotifications() {
  const auto messages = messagePorts_.messages();
  for (; notificationsSeen_ < messages.size(); ++notificationsSeen_) {
    const auto& message = messages[notificationsSeen_];
    trace("a notification");
    if (message.port != "com.norvale.Brenvik.lasd" || message.id != 0)
      rules.breach("a message to another port");
    if (!world.isKilled()) rules.notifies(parsePropertyList(message.data));
  }
}

void Machine::log(bool isBsd, int level, std::string_view line) {
  if (world.isKilled()) return;
  const FailingAllocations::Pause pause;
  trace(world.actor() + (isBsd ? " bsd/" : " unified/") + std::to_string(level) + " " + std::string(line));
  rules.logs(world.actor(), isBsd, level, std::string(line));
}

void Machine::unified(LogLevel level, std::string_view line, const LogPlace&, const MessageId&) noexcept {
  log(false, static_cast<int>(level), line);
}
void Machine::bsd(SyslogPriority priority, std::string_view line, const MessageId&) noexcept {
  log(true, static_cast<int>(priority), line);
}

void Machine::bringAbout(Disaster disaster, long atChange) {
  if (life_ == nullptr) return;
  disaster_ = disaster;
  trace("a disaster is near");
  if (atChange == 0) return strike();
  Disk::shared().countDown(atChange, [this] { strike(); });
}

void Machine::strike() {
  if (life_ == nullptr || world.isKilled() || disaster_ == Disaster::none) return;
  trace(disaster_ == Disaster::powerCut ? "the power goes" : "the helper is killed");
  remains_ =
      disaster_ == Disaster::powerCut ? Disk::shared().afterPowerCut(world.random()) : Disk::shared().read();
  world.kill();
}

// ---- processes and their messages ----

std::optional<SecurityTask::Answer> Machine::heldBy(const AuditToken& token) const {
  const auto found = std::find_if(processes.begin(), processes.end(), [&](const Process& each) {
    return each.isAlive && each.key() == std::pair(token.pid(), token.pidVersion());
  });
  if (found == processes.end()) return std::nullopt;
  switch (found->holds) {
    case Process::Holds::nothing:
      break;
    case Process::Holds::yes:
      return SecurityTask::Answer{PropertyList::boolean(true)};
    case Process::Holds::no:
      return SecurityTask::Answer{PropertyList::boolean(false)};
    case Process::Holds::text:
      return SecurityTask::Answer{PropertyList::string("true")};
    case Process::Holds::number:
      return SecurityTask::Answer{PropertyList::integer(1)};
    case Process::Holds::unreadable:
      return SecurityTask::Answer{PropertyList::boolean(true), true};
  }
  return SecurityTask::Answer{};
}

std::size_t Machine::spawn(uid_t uid, Process::Holds holds) {
  Process process;
  // Ids are used again: there are few, so that a new process often has the id of an old one.
  lastPid_ = lastPid_ >= 108 ? 101 : lastPid_ + 1;
  for (const Process& each : processes) {
    if (each.isAlive && each.token.pid() == lastPid_) return processes.size() - 1;
  }
  process.token.words = {0xFFFFFFFF, uid,
                         uid,        uid,
                         uid,        static_cast<std::uint32_t>(lastPid_),
                         0,          static_cast<std::uint32_t>(processes.size() + 1)};
  process.holds = holds;
  processes.push_back(process);
  trace("process " + std::to_string(processes.size() - 1) + " has the id " + std::to_string(lastPid_));
  return processes.size() - 1;
}

void Machine::exec(std::size_t process, Process::Holds holds) {
  if (!processes[process].isAlive) return;
  processes[process].holds = holds;
}

void Machine::exits(std::size_t index) {
  Process& process = processes[index];
  if (!process.isAlive) return;
  trace("process " + std::to_string(index) + " exits");
  process.isAlive = false;
  for (const int each : process.connections) close(each);
  if (life_ != nullptr && !world.isKilled()) {
    rules.processExits(process.key());
    life_->queues.processExits(process.token.pid(), process.token.pidVersion());
  }
}

void Machine::checkIn(std::size_t process, CheckInForm form, const CheckInWhims& whims) {
  if (!processes[process].isAlive) return;
  const int id = ++lastConnection_;
  connections[id].process = process;
  processes[process].connections.push_back(id);
  const ServiceMessage message{process, id, form, 4792174, whims};
  if (life_ != nullptr && !world.isKilled()) {
    world.postToLoop([this, message] { serve(message); });
  } else {
    waiting_.push_back(message);
  }
  if (whims.diesAtOnce) close(id);
}

void Machine::close(int id) {
  Connection& connection = connections[id];
  if (!std::exchange(connection.isOpen, false)) return;
  trace("connection " + std::to_string(id) + " closes");
  if (life_ == nullptr || world.isKilled() || connection.watched == kNullPort) return;
  // What it has sent is served before; the world keeps the order.
  world.postToLoop([this, id] { rules.portDies(id); });
  life_->sources.portDies(connection.watched);
}

void Machine::call(int id, const Call& call) {
  const Connection& connection = connections[id];
  if (!connection.isOpen || connection.port == kNullPort || life_ == nullptr || world.isKilled()) return;
  ++pendingCalls_;
  world.postToLoop([this, id, call] {
    --pendingCalls_;
    serve(id, call);
  });
}

// ---- the transport ----

Answer Machine::dispatch(PortName port, std::vector<std::byte>& bytes, std::uint32_t size,
                         const MessageTrailer& trailer, long failsAt, Outcome* outcome) {
  const auto source = life_->sources.sourceOf(port);
  *outcome = Outcome::accepted;
  if (source == nullptr) {
    rules.breach("nobody serves the port " + std::to_string(port));
    return {};
  }
  alignas(16) std::array<std::byte, 512> replyBytes{};
  Reply reply(replyBytes.data());
  const Request request(bytes.data(), size, &trailer);
  *outcome = Outcome::refused;
  try {
    // The first request makes what serves them all.
    const FailingAllocations failing(failsAt < 0 ? std::numeric_limits<long>::max() : failsAt,
                                     FailingAllocations::HowMany::one);
    const auto handler = source->table.find(request.header().id);
    if (handler == nullptr) {
      reply.setStatus(mig::badId);
    } else {
      *outcome = handler(source->table.context(), request, reply);
    }
  } catch (const std::bad_alloc&) {
    reply.setStatus(kern::resourceShortage);
  }
  Answer answer;
  const std::uint32_t replySize = reply.header().size;
  if ((reply.header().bits & kComplexBit) == 0) {
    answer.code = reply.as<StatusReply>().returnCode;
    if (replySize == sizeof(IntegerReply)) answer.flag = reply.as<IntegerReply>().result[0] != 0;
    if (replySize == sizeof(String64Reply))
      answer.text = cut(std::string(reply.as<String64Reply>().text, 64), 64, false);
    if (replySize == sizeof(String256Reply)) {
      answer.text = cut(std::string(reply.as<String256Reply>().text, 256), 256, false);
    }
  } else if (replySize == sizeof(OutOfLineReply)) {
    const auto& message = reply.as<OutOfLineReply>();
    auto* const address = reinterpret_cast<void*>(message.payload.address);
    if (message.payload.size != message.byteCount)
      rules.breach("a region of another size than the reply says");
    answer.payload = std::string(static_cast<const char*>(address), message.byteCount);
    if (address != nullptr) life_->regions.deallocate(address, message.byteCount);
  } else if (replySize == sizeof(CheckInReply)) {
    answer.text = std::to_string(reply.as<CheckInReply>().servicePort.name);
  }
  return answer;
}

namespace {

// What goes wrong meanwhile, for the trace.
std::string shown(long failsAt, WorkerEnd end) {
  if (failsAt >= 0) return ", without its allocation " + std::to_string(failsAt);
  if (end == WorkerEnd::none) return {};
  return end == WorkerEnd::beforeTheWork ? ", whose worker dies" : ", whose worker dies after its work";
}

// A buffer of a message, large enough for every one and for what a wrong size claims.
std::vector<std::byte> buffer() { return std::vector<std::byte>(4096); }

template <class Message>
Message& in(std::vector<std::byte>& bytes) {
  return *reinterpret_cast<Message*>(bytes.data());
}

}  // namespace

void Machine::serve(const ServiceMessage& message) {
  Connection& connection = connections[message.connection];
  const Process& process = processes[message.process];
  ++counts.checkIns;
  auto bytes = buffer();
  auto& request = in<CheckInRequest>(bytes);
  request.header = {kComplexBit | kReplyDisposition, sizeof request, 1, 0, 0, message.id};
  request.descriptorCount = 1;
  const PortName port = life_->ports.adoptSendRight();
  connection.watched = port;
  if (!connection.isOpen) life_->sources.portDies(port);
  request.clientPort = {port, 0, 0, kDispositionMoveSend, kPortDescriptorType};
  MessageTrailer trailer{};
  trailer.size = sizeof trailer;
  std::memcpy(trailer.auditToken, process.token.words.data(), sizeof trailer.auditToken);
  std::uint32_t size = sizeof request;
  std::vector<KernelReturn> codes;
  switch (message.form) {
    case CheckInForm::right:
      break;
    case CheckInForm::notComplex:
      request.header.bits &= ~kComplexBit;
      codes = {-304};
      break;
    case CheckInForm::twoDescriptors:
      request.descriptorCount = 2;
      codes = {-304};
      break;
    case CheckInForm::shorter:
      size -= 4;
      codes = {-304};
      break;
    case CheckInForm::copySend:
      request.clientPort.disposition = kDispositionCopySend;
      codes = {-300};
      break;
    case CheckInForm::wrongType:
      request.clientPort.type = kOutOfLineDescriptorType;
      codes = {-300};
      break;
    case CheckInForm::trailerType:
      trailer.type = 1;
      codes = {-309};
      break;
    case CheckInForm::shortTrailer:
      trailer.size = kMinimalTrailerSize;
      codes = {-309};
      break;
  }
  if (message.id != 4792174) codes = {-303};
  const bool isForm = !codes.empty();
  const bool isKnownToWorker = message.whims.callerWorker == WorkerEnd::none;
  const CheckIn checkIn{.process = process.key(),
                        .isAlive = process.isAlive,
                        .isAllowed = process.holds == Process::Holds::yes && isKnownToWorker,
                        .portIsDead = !connection.isOpen,
                        .lacksMemory = message.whims.failsAt >= 0};
  if (!isForm) codes = rules.codesOf(checkIn);
  PortName service = kNullPort;
  for (const auto& [name, count] : life_->ports.receiveRights) {
    service = service == kNullPort ? name : std::min(service, name);
  }
  request.header.localPort = service;
  life_->sources.refuses = around.outOfDescriptors;
  security_.end = message.whims.callerWorker;
  Outcome outcome{};
  const Answer answer = dispatch(service, bytes, size, trailer, message.whims.failsAt, &outcome);
  life_->sources.refuses = false;
  security_.end = WorkerEnd::none;
  if (outcome == Outcome::refused) (void)life_->ports.deallocateSendRight(port);
  trace("check-in of process " + std::to_string(message.process) + ", connection " +
        std::to_string(message.connection) + shown(message.whims.failsAt, message.whims.callerWorker) + ": " +
        std::to_string(answer.code));
  if (std::find(codes.begin(), codes.end(), answer.code) == codes.end()) {
    rules.breach("a check-in is answered with " + std::to_string(answer.code) + " instead of " +
                 std::to_string(codes.front()));
  }
  if (!isForm) rules.isAnswered(checkIn, message.connection, answer.code, life_->sources.isWatched(port));
  if (answer.code != 0) {
    connection.watched = kNullPort;
    connection.isOpen = false;
  } else {
    connection.port = static_cast<PortName>(std::stoul(answer.text.value_or("0")));
  }
}

namespace {

// Writes the request; returns the size that it claims to have.
std::uint32_t write(const Call& call, PortName port, std::vector<std::byte>& bytes) {
  const RoutineFacts& facts = kRequestRoutines[call.row];
  auto& header = in<MessageHeader>(bytes);
  header = {kReplyDisposition, facts.requestSize, 1, port, 0, facts.id};
  std::size_t at = facts.descriptors == 0 ? 32 : facts.descriptors == 1 ? 52 : 76;
  if (facts.descriptors > 0) {
    header.bits |= kComplexBit;
    const auto put = [&](std::size_t offset, std::uint32_t value) {
      std::memcpy(bytes.data() + offset, &value, sizeof value);
    };
    put(kDescriptorCountOffset, facts.descriptors);
    for (std::uint32_t i = 0; i < facts.descriptors; ++i) {
      OutOfLineDescriptor descriptor{};
      descriptor.address = reinterpret_cast<std::uint64_t>(call.regions[i].data());
      descriptor.size = static_cast<std::uint32_t>(call.regions[i].size());
      descriptor.type = call.form == Call::Form::wrongType ? 0 : kOutOfLineDescriptorType;
      std::memcpy(bytes.data() + kDescriptorsOffset + i * sizeof descriptor, &descriptor, sizeof descriptor);
      put(facts.lengthsOffset + 4 * i, descriptor.size + (call.form == Call::Form::wrongLength ? 1 : 0));
    }
  }
  const std::size_t field = call.texts.empty()      ? 0
                            : facts.descriptors > 0 ? 256
                                                    : (facts.requestSize - 32) / call.texts.size();
  for (const std::string& each : call.texts) {
    each.copy(reinterpret_cast<char*>(bytes.data()) + at, field);
    at += field;
  }
  if (facts.requestSize == sizeof(IntegerRequest)) in<IntegerRequest>(bytes).value = call.value;
  if (facts.requestSize == sizeof(CoordinateRequest)) {
    in<CoordinateRequest>(bytes).latitude = call.latitude;
    in<CoordinateRequest>(bytes).longitude = call.longitude;
  }
  std::uint32_t size = facts.requestSize;
  if (call.form == Call::Form::shorter) --size;
  if (call.form == Call::Form::longer) ++size;
  if (call.form == Call::Form::complexFlag) header.bits ^= kComplexBit;
  if (call.form == Call::Form::unknownId) header.id = kFirstRequestId + 27;
  return size;
}

}  // namespace

void Machine::serve(int id, const Call& call) {
  if (world.isKilled()) return;
  const Connection& connection = connections[id];
  const RoutineFacts& facts = kRequestRoutines[call.row];
  ++counts.calls;
  auto bytes = buffer();
  const std::uint32_t size = write(call, connection.port, bytes);

  rules.timePasses();
  const Expected expected = rules.before(call);
  Outcome outcome{};
  const MessageTrailer trailer{};
  trace("call of " + std::string(facts.name) + " (" + std::to_string(call.value) + ") on connection " +
        std::to_string(id) + shown(call.failsAt, call.workerEnd));
  if (call.failsAt >= 0) rules.becomesUnsure(call);
  if (call.failsAt >= 0 && Rules::mayEndTheProcess(call) && wouldEndIn([&] {
        auto copy = bytes;
        (void)dispatch(connection.port, copy, size, trailer, call.failsAt, &outcome);
      })) {
    bringAbout(Disaster::killed, 0);
    return;
  }
  voicemail_.end = contacts_.end = archives_.end = call.workerEnd;
  const Answer answer = dispatch(connection.port, bytes, size, trailer, call.failsAt, &outcome);
  voicemail_.end = contacts_.end = archives_.end = WorkerEnd::none;
  if (world.isKilled()) return;
  trace("  " + std::to_string(answer.code) + " " + (answer.flag ? (*answer.flag ? "yes" : "no") : "") + " " +
        answer.text.value_or("") + " " + answer.payload.value_or(""));
  if (rules.isUnsure()) {
    check(call, rules.withoutMemory(call, expected, answer), answer);
    rules.becomesSure(call, answer, Disk::shared().read());
  } else {
    check(call, expected, answer);
    rules.isAnswered();
    if (call.row >= 9 && call.row <= 17) rules.comparesWith(Disk::shared().read());
  }
  if (call.row == 26) rules.comparesWith(contacts_.channels);
}

bool Machine::wouldEndIn(const std::function<void()>& work) {
  if (!FailingAllocations::kWork) return false;
  constexpr int kEnded = 86;
  const pid_t child = ::fork();
  if (child == 0) {
    isTrial_ = true;
    (void)std::set_terminate([] { ::_exit(kEnded); });
    work();
    ::_exit(0);
  }
  int status = 0;
  if (child < 0 || ::waitpid(child, &status, 0) != child || !WIFEXITED(status)) {
    throw Finding{"a request cannot be tried in another process, or dies there otherwise"};
  }
  return WEXITSTATUS(status) == kEnded;
}

void Machine::check(const Call& call, const Expected& expected, const Answer& answer) {
  const std::string who(kRequestRoutines[call.row].name);
  if (std::find(expected.codes.begin(), expected.codes.end(), answer.code) == expected.codes.end()) {
    return rules.breach(who + " is answered with " + std::to_string(answer.code) + " instead of " +
                        std::to_string(expected.codes.front()));
  }
  if (answer.code != 0) return;
  if (expected.flag != answer.flag) rules.breach(who + " is answered with the wrong yes or no");
  if (static_cast<bool>(expected.isRightText) != answer.text.has_value() ||
      static_cast<bool>(expected.isRightPayload) != answer.payload.has_value()) {
    return rules.breach(who + " is answered in another form");
  }
  if (expected.isRightText && !expected.isRightText(*answer.text)) {
    rules.breach(who + " is answered with \"" + *answer.text + "\"");
  }
  if (expected.isRightPayload && !expected.isRightPayload(*answer.payload)) {
    rules.breach(who + " is answered with the region " + *answer.payload);
  }
}

}  // namespace brenvik::simulation

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
//
// Whole sessions: the input is a script of what several clients, the system around the helper and time do.
// The server, its ports, the routine table and all areas are the real ones, over real sockets; what lies
// behind the areas are fakes, and time is manual. After every step it is checked that each request got
// exactly the answer that the protocol promises, that the server counts its clients right, keeps no region,
// and stops exactly when it has been idle for long enough.
#include <sys/socket.h>
#include <sys/stat.h>
#include <unistd.h>

#include <array>
#include <chrono>
#include <cstring>
#include <deque>
#include <filesystem>
#include <memory>
#include <optional>
#include <span>
#include <string>
#include <utility>
#include <vector>

#include "helper/location/GeoRequestState.h"
#include "helper/requests/RequestTable.h"
#include "platform/base/fakes/FuzzInput.h"
#include "platform/contacts/fakes/InMemoryContacts.h"
#include "platform/datagram/Datagram.h"
#include "platform/datagram/LocalSocket.h"
#include "platform/datagram/SealedMemory.h"
#include "platform/geo/fakes/ManualGeoService.h"
#include "platform/ipc/fakes/AbstractBootstrap.h"
#include "platform/ipc/linux/SystemPortSources.h"
#include "platform/labeler/linux/CatalogueLabeler.h"
#include "platform/log/fakes/NoLog.h"
#include "platform/messageport/fakes/RecordingMessagePorts.h"
#include "platform/net/fakes/FakeEchoNetwork.h"
#include "platform/preferences/fakes/InMemoryPreferences.h"
#include "platform/radio/fakes/FakeRadioManager.h"
#include "platform/runloop/fakes/ManualRunLoop.h"
#include "platform/runloop/linux/SystemQueues.h"
#include "platform/telephony/fakes/RecordingTelephonyDaemon.h"
#include "platform/voicemail/fakes/InMemoryVoicemailStore.h"

namespace {

using namespace brenvik;
using namespace std::chrono_literals;

constexpr std::size_t kClients = 4;
constexpr int kSteps = 32;

// Descriptors of the real loop, timers of manual time.
class MixedLoop final : public RunLoop {
 public:
  MixedLoop(RunLoop& descriptors, RunLoop& timers) : descriptors_(descriptors), timers_(timers) {}
  RunResult run(std::chrono::duration<double> timeOut, ReturnAfterSource returnAfterSource) override {
    return descriptors_.run(timeOut, returnAfterSource);
  }
  void stop() noexcept override { descriptors_.stop(); }
  std::unique_ptr<DescriptorSource> addDescriptor(int fd, Interest interest,
                                                  DescriptorHandler handler) override {
    return descriptors_.addDescriptor(fd, interest, std::move(handler));
  }
  std::unique_ptr<LoopSource> addTimer(std::chrono::nanoseconds first, std::chrono::nanoseconds interval,
                                       std::function<void()> handler, std::function<void()> failed) override {
    return timers_.addTimer(first, interval, std::move(handler), std::move(failed));
  }

 private:
  RunLoop& descriptors_;
  RunLoop& timers_;
};

// A file system whose every answer the input chooses.
class AnyFileSystem final : public FileSystemInterface {
 public:
  explicit AnyFileSystem(FuzzInput& input) : input_(input) {}
  int moveItem(const std::string&, const std::string&) noexcept override { return code(); }
  int moveItemWithOwner(const std::string&, const std::string&, uid_t, gid_t) noexcept override {
    return code();
  }
  int moveDirectory(const std::string&, const std::string&) noexcept override { return code(); }
  int copyItem(const std::string&, const std::string&) noexcept override { return code(); }
  int copyFileIntoDirectory(const std::string&, const std::string&, const std::string&) noexcept override {
    return code();
  }
  int setPermissions(const std::string&, mode_t, bool) noexcept override { return code(); }
  int setOwner(const std::string&, uid_t, gid_t, bool) noexcept override { return code(); }
  int createDirectory(const std::string&, mode_t, bool) noexcept override { return code(); }
  int createDirectoryWithOwner(const std::string&, mode_t, const std::string&, const std::string&,
                               bool) noexcept override {
    return code();
  }
  bool itemExists(const std::string&) noexcept override { return input_.flag(); }
  int listDirectory(const std::string&, std::vector<std::string>* entries, bool) noexcept override {
    entries->assign(input_.below(4), std::string(input_.text()));
    return code();
  }
  int findEntry(const std::string& directory, const std::string& prefix,
                std::string* path) noexcept override {
    *path = directory + "/" + prefix;
    return code();
  }
  int removeItem(const std::string&) noexcept override { return code(); }
  std::string baseName(const std::string& path) noexcept override { return path; }
  std::string directoryName(const std::string& path) noexcept override { return path; }
  std::string resolvePath(const std::string& path) noexcept override { return input_.flag() ? path : ""; }
  std::string readLink(const std::string&) noexcept override { return std::string(input_.text()); }
  PropertyList readDictionary(const std::string&) noexcept override { return {}; }
  std::optional<std::string> readData(const std::string&) noexcept override { return std::nullopt; }
  bool writeDictionary(const std::string&, const PropertyList&) noexcept override { return input_.flag(); }
  bool writePropertyList(const std::string&, const PropertyList&, PropertyListFormat) noexcept override {
    return input_.flag();
  }
  bool writeData(const std::string&, const std::string*) noexcept override { return input_.flag(); }
  bool isSymbolicLink(const std::string&) noexcept override { return input_.flag(); }
  int createSymbolicLink(const std::string&, const std::string&) noexcept override { return code(); }
  bool isDirectory(const std::string&) noexcept override { return input_.flag(); }
  bool createEmptyFile(const std::string&) noexcept override { return input_.flag(); }
  int placeLink(const std::string&, const std::string&) noexcept override { return code(); }
  int removeEntry(const std::string&) noexcept override { return code(); }
  int copyFileAndGive(const std::string&, const std::string&, const std::string&, uid_t, gid_t,
                      bool* given) noexcept override {
    *given = input_.flag();
    return code();
  }

 private:
  int code() noexcept {
    static constexpr std::array kCodes{0, 0, 0, kUnexplained, kPosixFailure, ENOENT, EEXIST, ENOSPC};
    return input_.oneOf(kCodes);
  }
  FuzzInput& input_;
};

class NoArchives final : public ArchiveCopier {
 public:
  explicit NoArchives(FuzzInput& input) : input_(input) {}
  void setFileErrorHandler(std::function<int(const ArchiveFileError&)> handler) override {
    onFileError_ = std::move(handler);
  }
  void setFatalErrorHandler(std::function<void(int)> handler) override { onFatalError_ = std::move(handler); }
  int copy(const std::string&, const std::string&, const PropertyList&) noexcept override {
    if (input_.flag() && onFileError_) (void)onFileError_({std::string(input_.text()), EPERM});
    if (input_.flag() && onFatalError_) onFatalError_(ENOSPC);
    return input_.flag() ? 0 : EIO;
  }

 private:
  FuzzInput& input_;
  std::function<int(const ArchiveFileError&)> onFileError_;
  std::function<void(int)> onFatalError_;
};

// A web whose answers are there at once, since the fetcher waits for them on this very thread.
class ImmediateWeb final : public WebClient {
 public:
  explicit ImmediateWeb(FuzzInput& input) : input_(input) {}
  std::shared_ptr<WebSession> makeSession() override { return std::make_shared<Session>(); }
  std::shared_ptr<WebRequest> makeRequest(WebRequestType, const std::string&, const HeaderMap&,
                                          std::shared_ptr<WebSession>) override {
    return input_.byte() % 8 == 7 ? nullptr : std::make_shared<Request>(*this);
  }
  std::string manifest;  // the body of the next answers

 private:
  struct Session final : WebSession {
    void setCellularAllowed(bool) noexcept override {}
  };
  class Request final : public WebRequest {
   public:
    explicit Request(ImmediateWeb& web) : web_(web) {}
    void setCallbackQueue(std::shared_ptr<WorkQueue>) override {}
    void setCompletion(Completion completion) override { completion_ = std::move(completion); }
    void setTimeLimit(std::chrono::milliseconds) noexcept override {}
    void setLargestBody(std::uint64_t) noexcept override {}
    void cancel() noexcept override {}
    void send(std::vector<std::byte>) override {
      auto response = std::make_shared<WebResponse>();
      const std::uint8_t how = web_.input_.byte();
      response->errorKind = (how & 7) == 7 ? WebErrorKind::timedOut : WebErrorKind::none;
      response->statusCode = (how & 0x38) == 0x38 ? 302 : 200;
      response->body.append(std::as_bytes(std::span(web_.manifest)));
      if ((how & 0x40) == 0) response->headers.emplace("Content-Type", "application/gzip");
      completion_((how & 0x80) != 0 ? nullptr : response);
    }

   private:
    ImmediateWeb& web_;
    Completion completion_;
  };
  FuzzInput& input_;
};

class EmptyGunzip final : public Gunzip {
 public:
  explicit EmptyGunzip(FuzzInput& input) : input_(input) {}
  GunzipOutcome gunzipInto(const GunzipInput&, int, std::uint64_t, std::uint64_t) noexcept override {
    return {input_.flag() ? GunzipResult::damaged : GunzipResult::whole, 0, 0};
  }

 private:
  FuzzInput& input_;
};

class NoVisualVoicemail final : public VisualVoicemailLibrary {
 public:
  SubscriptionQuery lookUpSubscriptionQuery() noexcept override { return nullptr; }
};

// In memory where there is such a place, and gone with the process.
struct Folder {
  std::string path = ::access("/dev/shm", W_OK) == 0 ? "/dev/shm/session-XXXXXX" : "/tmp/session-XXXXXX";
  Folder() { require(::mkdtemp(path.data()) != nullptr); }
  ~Folder() { std::filesystem::remove_all(path); }
};

// What is made once for all inputs, because it costs system calls and keeps nothing.
struct Machine {
  NoLog log;
  std::unique_ptr<SystemRunLoop> loop = SystemRunLoop::make();
  SystemPortSpace ports;
  SystemRegions regions;
  SystemPortSources sources{ports, regions, SystemPortSources::Refusals::unlimited};
  AbstractBootstrap bootstrap{ports};
  CatalogueLabeler labeler;
  unsigned sessions = 0;
  Machine() { setLogSink(&log); }
};

// One client as the input plays it.
struct Client {
  UniqueFd connection;  // to the service; invalid: none
  UniqueFd life;        // the other end is the helper's; while it is open, an admitted client lives
  UniqueFd channel;     // of an admitted client
  std::deque<std::uint32_t> awaited;  // reply ports of requests that were not answered yet, in order
};

class Session {
 public:
  Session(Machine& machine, const Folder& folder, FuzzInput& input) : machine_(machine), input_(input) {
    lasd_->configure({.queues = queues_,
                      .web = web_,
                      .gunzip = gunzip_,
                      .preferences = preferences_,
                      .messagePorts = messagePorts_,
                      .directory = folder.path,
                      .now = [this] { return clock_.now(); }});
    heartbeat_.configure({.queues = queues_, .network = echoes_});
    server_ = CreateServer(platform_, "service", table_);
    require(server_ != nullptr);
  }
  ~Session() {
    lasd_->shutDown();
    heartbeat_.shutDown();
    server_.reset();
    clients_ = {};
    settle();
    // Waiting for the closing thread costs more than a session does, so it may lag a little behind.
    if (++machine_.sessions % 16 == 0) settleWithClosing();
  }

  void run() {
    for (int step = 0; step < kSteps && !input_.isEmpty(); ++step) {
      perform();
      settle();
      check();
    }
    // Everybody leaves. What still keeps the server is its own.
    for (Client& client : clients_) leave(client);
    settle();
    check();
    require(server_->facts().clients == 0);
  }

 private:
  void perform() {
    Client& client = clients_[input_.below(kClients)];
    switch (input_.byte() % 16) {
      case 0:
      case 1:
        checkIn(client);
        break;
      case 2:
        leave(client);
        break;
      case 3:
        advance(std::array{1ms, 250ms, 2000ms, 9999ms, 10'000ms, 30'000ms}[input_.below(6)]);
        break;
      case 4:
        runQueues();
        break;
      case 5:
        answerGeo();
        break;
      case 6:
        changeWorld();
        break;
      case 7:
        sendAnything(client);
        break;
      default:
        request(client);
        break;
    }
  }

  // ---- clients ----

  void connect(Client& client) {
    if (client.connection.isValid()) return;
    client.connection = makeSocket(Blocking::no);
    require(connectSocket(client.connection.get(), machine_.bootstrap.address) == 0);
  }

  void checkIn(Client& client) {
    if (client.channel.isValid()) return;
    connect(client);
    UniqueFd theirs;
    require(makeSocketPair(&client.life, &theirs) == 0);
    CheckInRequest message{};
    message.header = {kComplexBit | kReplyDisposition, sizeof message, 0x77, 0, 0, kCheckInRoutine.id};
    message.descriptorCount = 1;
    message.clientPort.disposition = kDispositionMoveSend;
    message.clientPort.type = kPortDescriptorType;
    const std::uint8_t how = input_.byte();
    isAdmitted_ = (how & 1) != 0 || (how & 2) != 0;
    std::vector<std::byte> bytes(std::as_bytes(std::span(&message, 1)).begin(),
                                 std::as_bytes(std::span(&message, 1)).end());
    if ((how & 0x1C) == 0x1C) patch(bytes);
    const int right = theirs.get();
    const std::array parts{iovecOf(bytes)};
    if (sendDatagram(client.connection.get(), parts, std::span(&right, (how & 0x60) == 0x60 ? 0 : 1)) != 0) {
      forget(client);  // closed for too many malformed messages, or to make room
      return;
    }
    theirs.reset();
    if ((how & 0x80) != 0) client.life.reset();  // gone before it is answered
    settle();

    ReceivedDatagram received;
    std::array<UniqueFd, 2> rights;
    std::array<std::byte, 1024> answer;
    bool isAnswered = receive(client.connection, answer, rights, &received);
    if (!isAnswered) {
      // A message with foreign descriptors is dropped on the closing thread, and answered then.
      settleWithClosing();
      isAnswered = receive(client.connection, answer, rights, &received);
    }
    if (!isAnswered) {
      if (replyPortOf(bytes) != 0 && received.length == 0 && isOpen(client.connection))
        require(bytes.size() < sizeof(MessageHeader));
      client.life.reset();
      settle();
      return;
    }
    const auto& header = *reinterpret_cast<const MessageHeader*>(answer.data());
    require(header.localPort == replyPortOf(bytes) && header.replyPort == 0);
    if ((header.bits & kComplexBit) == 0) {
      require(received.length == sizeof(StatusReply) && received.descriptorCount == 0);
      client.life.reset();
      settle();
      return;
    }
    require(received.length == sizeof(CheckInReply) && received.descriptorCount == 1);
    require(isAdmitted_);
    if (client.life.isValid()) client.channel = std::move(rights[0]);
  }

  void leave(Client& client) {
    client.life.reset();
    forget(client);
  }
  // Without a life the helper must have let go of the client, too.
  static void forget(Client& client) {
    client.life.reset();
    client.channel.reset();
    client.connection.reset();
    client.awaited.clear();
  }

  void request(Client& client) {
    const RoutineFacts& routine = input_.oneOf(kRequestRoutines);
    std::vector<std::byte> bytes(routine.requestSize);
    const std::uint8_t how = input_.byte();
    MessageHeader header{kReplyDisposition, routine.requestSize, 0, 0, 0, routine.id};
    if (routine.descriptors != 0) header.bits |= kComplexBit;
    if ((how & 3) != 3) header.replyPort = ++lastReplyPort_;
    std::memcpy(bytes.data(), &header, sizeof header);
    UniqueFd memory[2];
    std::vector<int> descriptors;
    if (routine.descriptors == 0) {
      fillBody(bytes);
    } else {
      addRegions(routine, bytes, memory, descriptors, (how & 4) != 0);
    }
    if ((how & 0x38) == 0x38) patch(bytes);
    send(client, bytes, descriptors);
  }

  // Texts, numbers and an NDR record: what a simple request holds.
  void fillBody(std::vector<std::byte>& bytes) {
    constexpr std::size_t kBody = sizeof(MessageHeader) + sizeof(NdrRecord);
    if (bytes.size() <= kBody) return;
    std::memcpy(bytes.data() + sizeof(MessageHeader), &kNdrRecord, sizeof kNdrRecord);
    const std::size_t body = bytes.size() - kBody;
    const std::size_t field = body % 1024 == 0 ? 1024 : body % 256 == 0 ? 256 : body == 128 ? 64 : body;
    for (std::size_t at = kBody; at < bytes.size(); at += field) {
      const std::string value = field >= 64 ? text() : std::string(input_.text());
      std::memcpy(bytes.data() + at, value.data(), std::min(value.size(), field));
    }
  }

  std::string text() {
    static constexpr std::array<std::string_view, 16> kTexts{
        "",
        "/mobile/Library/Preferences/com.norvale.carrier.plist",
        "/mobile/Library/Carrier Bundles/a",
        "/private/var/mobile/Library/Carrier Bundles/a",
        "/mobile/Library/Carrier Bundle.bundle",
        "/tmp/a.tcpk",
        "/tmp/../etc/a.tcpk",
        "..",
        "com.example.one",
        "com.norvale.lasd",
        "key",
        "\xC3\xA9t\xC3\xA9",
        "\xFF\xFE",
        "name",
        "/",
        "a/b",
    };
    const std::size_t which = input_.below(kTexts.size() + 1);
    std::string result(which < kTexts.size() ? kTexts[which] : input_.text(2));
    if (input_.byte() % 16 == 15) result += input_.text();
    return result;
  }

  // A small value of any kind; arrays and dictionaries are not deep.
  PropertyList value(int depth = 3) {
    switch (input_.byte() % (depth > 0 ? 8 : 6)) {
      case 0:
        return PropertyList::string(text());
      case 1:
        return PropertyList::boolean(input_.flag());
      case 2:
        return PropertyList::integer(static_cast<std::int64_t>(input_.number(8)));
      case 3:
        return PropertyList::string(
            std::array{"gsm", "PRIMARY", "de", "en-US", "", "Version"}[input_.below(6)]);
      case 4:
      case 5:
        return PropertyList::string(std::string(input_.text()));
      case 6: {
        std::vector<PropertyList> elements(input_.below(6));
        for (PropertyList& each : elements) {
          each = value(depth - 1);
          if (!each) return {};
        }
        return PropertyList::array(elements);
      }
      default: {
        static constexpr std::array kKeys{"gsm",   "umts",    "cdma",       "lte",
                                          "scdma", "Version", "ContentURL", "key"};
        std::vector<std::pair<std::string, PropertyList>> entries;
        for (std::size_t count = input_.below(5); count > 0; --count) {
          PropertyList one = value(depth - 1);
          if (one) entries.emplace_back(input_.oneOf(kKeys), std::move(one));
        }
        return PropertyList::dictionary(std::move(entries));
      }
    }
  }
  std::string serialized() {
    const std::uint8_t how = input_.byte();
    if (how % 8 == 7) return std::string(input_.text(2));
    return serializePropertyList(value(), how % 2 == 0 ? PropertyListFormat::binary : PropertyListFormat::xml)
        .value_or("");
  }

  void addRegions(const RoutineFacts& routine, std::vector<std::byte>& bytes, UniqueFd (&memory)[2],
                  std::vector<int>& descriptors, bool inLine) {
    const std::uint32_t count = routine.descriptors;
    std::memcpy(bytes.data() + kDescriptorCountOffset, &count, sizeof count);
    if (routine.id == kFirstRequestId + 6) {  // the one with texts beside its region
      for (const std::size_t at :
           {offsetof(SetPreferenceValueRequest, domain), offsetof(SetPreferenceValueRequest, key)}) {
        const std::string value = text();
        std::memcpy(bytes.data() + at, value.data(), std::min(value.size(), std::size_t{256}));
      }
    }
    for (std::uint32_t i = 0; i < count; ++i) {
      const std::string content = serialized();
      OutOfLineDescriptor descriptor{};
      descriptor.type = kOutOfLineDescriptorType;
      descriptor.copy = kVirtualCopy;
      descriptor.size = static_cast<std::uint32_t>(content.size());
      const auto contentBytes = std::as_bytes(std::span(content));
      const std::size_t offset = regionOffsetAfter(bytes.size());
      if (inLine && !content.empty() && offset + content.size() <= kLargestDatagram) {
        descriptor.address = offset;
        bytes.resize(offset);
        bytes.insert(bytes.end(), contentBytes.begin(), contentBytes.end());
      } else if (!content.empty()) {
        memory[i] = makeSealedMemory("session", contentBytes);
        descriptors.push_back(memory[i].get());
      }
      std::memcpy(bytes.data() + kDescriptorsOffset + i * sizeof descriptor, &descriptor, sizeof descriptor);
      std::memcpy(bytes.data() + routine.lengthsOffset + 4 * i, &descriptor.size, 4);
    }
  }

  // Changes, cuts or lengthens a message.
  void patch(std::vector<std::byte>& bytes) {
    switch (input_.byte() % 8) {
      case 0:
        bytes.resize(std::min(bytes.size(), 1 + static_cast<std::size_t>(input_.number(2))));
        break;
      case 1:
        bytes.resize(std::min<std::size_t>(kLargestDatagram, bytes.size() + input_.byte()));
        break;
      default: {
        const std::size_t at = input_.number(2) % bytes.size();
        const auto with = input_.bytes(1 + input_.below(8));
        std::memcpy(bytes.data() + at, with.data(), std::min(with.size(), bytes.size() - at));
      }
    }
  }

  void sendAnything(Client& client) {
    const auto some = input_.bytes(1 + input_.number(1));
    if (some.empty()) return;
    UniqueFd memory;
    std::vector<int> descriptors;
    if (input_.flag()) {
      memory = makeSealedMemory("session", some);
      descriptors.push_back(memory.get());
    }
    send(client, {some.begin(), some.end()}, descriptors);
  }

  void send(Client& client, const std::vector<std::byte>& bytes, std::span<const int> descriptors) {
    if (!client.channel.isValid() || bytes.empty()) return;
    const std::array parts{iovecOf(bytes)};
    require(sendDatagram(client.channel.get(), parts, descriptors) == 0);
    if (const std::uint32_t port = replyPortOf(bytes); port != 0) client.awaited.push_back(port);
    settle();
    takeAnswers(client);
    require(client.awaited.empty());
  }

  static std::uint32_t replyPortOf(std::span<const std::byte> bytes) {
    std::uint32_t port = 0;
    if (bytes.size() >= sizeof(MessageHeader))
      std::memcpy(&port, bytes.data() + offsetof(MessageHeader, replyPort), sizeof port);
    return port;
  }

  // False when nothing came.
  static bool receive(const UniqueFd& from, std::span<std::byte> room, std::span<UniqueFd> rights,
                      ReceivedDatagram* received) {
    const iovec part{room.data(), room.size()};
    ControlRoom<2> control;
    const int error =
        receiveDatagram(from.get(), std::span(&part, 1), control.bytes, rights, MSG_DONTWAIT, received);
    return error == 0 && received->length > 0;
  }
  static bool isOpen(const UniqueFd& socket) {
    std::byte byte;
    return ::recv(socket.get(), &byte, 1, MSG_DONTWAIT | MSG_PEEK) < 0 && errno == EAGAIN;
  }

  // Each answer is that of the oldest request that has none, and of a form of the protocol.
  void takeAnswers(Client& client) {
    static std::vector<std::byte> room(kLargestDatagram);
    ReceivedDatagram received;
    for (std::array<UniqueFd, 2> rights; receive(client.channel, room, rights, &received); rights = {}) {
      require(received.length >= sizeof(StatusReply) && !client.awaited.empty());
      MessageHeader header;
      std::memcpy(&header, room.data(), sizeof header);
      require(header.localPort == client.awaited.front() && header.replyPort == 0);
      require((header.bits & 0x1F) == kReplyDisposition && header.size <= received.length);
      client.awaited.pop_front();
      if ((header.bits & kComplexBit) == 0) {
        require(received.length <= sizeof(String256Reply) && received.descriptorCount == 0);
        continue;
      }
      OutOfLineReply reply;
      require(received.length >= sizeof reply);
      std::memcpy(&reply, room.data(), sizeof reply);
      require(reply.descriptorCount == 1 && reply.payload.size == reply.byteCount);
      const bool isInLine = reply.payload.address != 0;
      require(received.descriptorCount == (!isInLine && reply.byteCount != 0 ? 1 : 0));
      if (isInLine) require(reply.payload.address + reply.byteCount == received.length);
    }
  }

  // ---- the world ----

  void advance(std::chrono::nanoseconds by) {
    const bool wasCounting = server_->isCountingDown();
    const auto facts = server_->facts();
    clock_.advance(by);
    if (wasCounting && facts.leavesIn && by >= *facts.leavesIn) require(server_->isStopped());
    if (!wasCounting && !server_->isCountingDown()) require(server_->isStopped() == wasStopped_);
    wasStopped_ = server_->isStopped();
  }

  void runQueues() {
    bool ran = true;
    for (int round = 0; ran && round < 100; ++round) {
      ran = queues_.main().runReady() + queues_.global().runReady() > 0;
      for (std::size_t i = 0; i < queues_.serial.size(); ++i) {
        const auto queue = queues_.serial[i];
        ran = queue->runReady() > 0 || ran;
      }
    }
    // Queues that nobody but the list holds, as fetchers leave behind, are gone.
    std::erase_if(queues_.serial, [](const auto& queue) { return queue.use_count() == 1; });
  }

  void answerGeo() {
    const std::uint8_t how = input_.byte();
    if ((how & 1) != 0 && !geo_.reverseGeocodes.empty()) {
      auto question = std::move(geo_.reverseGeocodes.front());
      geo_.reverseGeocodes.pop_front();
      if ((how & 2) != 0) return question.fail(std::string(input_.text()));
      MapItems items;
      for (std::size_t i = 0; i < (how >> 2 & 3U); ++i) {
        StructuredAddress address{.countryCode = part(), .administrativeArea = part(), .locality = part()};
        MapItem item{.valid = input_.flag(), .address = GeoAddress{address}};
        items.emplace_back(item);
      }
      question.answer(std::move(items));
    } else if (!geo_.geoIps.empty()) {
      auto question = std::move(geo_.geoIps.front());
      geo_.geoIps.pop_front();
      if ((how & 2) != 0) return question.fail(std::string(input_.text()));
      question.answer(std::string(input_.text()));
    }
  }
  std::optional<std::string> part() {
    return input_.flag() ? std::optional(std::string(input_.text())) : std::nullopt;
  }

  void changeWorld() {
    const std::uint8_t how = input_.byte();
    const bool on = (how & 0x80) != 0;
    switch (how & 0x0F) {
      case 0:
        preferences_.disk().setFull(on);
        break;
      case 1:
        contacts_.isReachable = on;
        break;
      case 2:
        contacts_.exhausted = on;
        break;
      case 3:
        telephony_.absent = on;
        break;
      case 4:
        telephony_.speaksOutOfTurn = on;
        break;
      case 5:
        voicemailStore_.exhausted = on;
        break;
      case 6:
        echoes_.refuseSockets = on;
        break;
      case 7:
        messagePorts_.nobodyListens = on;
        break;
      case 8:
        web_.manifest = serialized();
        break;
      case 9:
        geo_.countryCode = part();
        break;
      case 10: {
        const auto datagram = input_.bytes(input_.number(1));
        echoes_.arrivals.push_back({std::chrono::microseconds(how), {datagram.begin(), datagram.end()}, 0});
        break;
      }
      case 11:
        echoes_.isWithoutMemory = on;
        break;
      case 12:
        preferences_.operationsWithMemory = on ? static_cast<int>(input_.below(4)) : -1;
        break;
      default:
        echoes_.cellularIndex = on ? 7 : 0;
        break;
    }
  }

  // ---- after each step ----

  // The loop serves what is ready.
  void settle() {
    while (machine_.loop->run(std::chrono::seconds(0), ReturnAfterSource::yes) == RunResult::handledSource) {
    }
  }
  // The same after the descriptors of others were closed, which happens on a thread.
  void settleWithClosing() {
    settle();
    machine_.ports.closing().drain();
    settle();
  }

  void check() {
    std::size_t living = 0;
    for (const Client& client : clients_) {
      if (client.channel.isValid()) ++living;
    }
    const ServerFacts facts = server_->facts();
    require(facts.clients == living);
    require(machine_.regions.live() == 0);
    if (living != 0 || server_->busyMask() != 0) require(!server_->isCountingDown());
    if (server_->isStopped() != wasStopped_) require(server_->isCountingDown());
    wasStopped_ = server_->isStopped();
  }

  Machine& machine_;
  FuzzInput& input_;
  ManualClock clock_;
  ManualRunLoop timers_{clock_};
  MixedLoop loop_{*machine_.loop, timers_};
  ManualWorkQueues queues_{clock_};

  InMemoryPreferences preferences_;
  InMemoryVoicemailStore voicemailStore_;
  InMemoryContacts contacts_;
  ManualGeoService geo_;
  RecordingTelephonyDaemon telephony_;
  RecordingMessagePorts messagePorts_;
  FakeEchoNetwork echoes_;
  FakeRadioManager radioManager_;
  NoVisualVoicemail visualVoicemail_;
  ImmediateWeb web_{input_};
  EmptyGunzip gunzip_{input_};
  GeoRequestState geoState_;

  PathPolicy policy_{[] { return MobileAccount{"/mobile", 501, 501}; }};
  PreferenceTransfer preferenceTransfer_{preferences_, machine_.regions, [this](const char*) {
                                           return input_.flag() ? value() : PropertyList();
                                         }};
  CarrierOperations carrier_{[this] { return std::make_unique<AnyFileSystem>(input_); },
                             [this] { return std::make_unique<NoArchives>(input_); }, policy_, preferences_,
                             [] {
                               return MobileAccount{"/mobile", 501, 501};
                             }};
  VoicemailOperations voicemail_{voicemailStore_, visualVoicemail_};
  LocationRoutines location_{queues_, geo_, telephony_, geoState_};
  RadioLogging radio_{radioManager_};
  LabelRoutines labels_{machine_.labeler, machine_.regions};
  ChannelRemap remap_{contacts_};
  std::shared_ptr<LASDUpdater> lasd_ = std::make_shared<LASDUpdater>();
  CellularHeartbeat heartbeat_;
  PortServerRegistry registry_;
  RequestAreas areas_{
      registry_, preferenceTransfer_, carrier_, voicemail_, location_, radio_, labels_, remap_,
      *lasd_,    heartbeat_};
  const RequestTable<RequestAreas> table_{std::function<RequestAreas*()>([this] { return &areas_; })};
  bool isAdmitted_ = false;
  const ServerPlatform platform_{
      .ports = machine_.ports,
      .bootstrap = machine_.bootstrap,
      .sources = machine_.sources,
      .loop = loop_,
      .hasEntitlement = [this](const char*, const AuditToken&) { return isAdmitted_; },
      .registry = registry_,
      .now = [this] { return clock_.now(); }};
  std::unique_ptr<ServerContext> server_;

  std::array<Client, kClients> clients_;
  std::uint32_t lastReplyPort_ = 0;
  bool wasStopped_ = false;
};

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  static auto& machine = *new Machine;  // until the end: a closing thread may still use it
  static const Folder folder;
  FuzzInput input(data, size);
  const std::size_t portsBefore = machine.ports.size();
  { Session(machine, folder, input).run(); }
  require(machine.ports.size() == portsBefore && machine.regions.live() == 0);
  return 0;
}

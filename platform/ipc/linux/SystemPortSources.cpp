// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/ipc/linux/SystemPortSources.h"

#include <fcntl.h>
#include <poll.h>
#include <sys/socket.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <chrono>
#include <cstring>
#include <new>
#include <optional>
#include <unordered_map>
#include <utility>
#include <vector>

#include "platform/datagram/LocalSocket.h"
#include "platform/ipc/linux/BacklogGuess.h"
#include "platform/ipc/linux/ConnectionBooks.h"
#include "platform/ipc/linux/MessageTrailerBuilder.h"
#include "platform/ipc/linux/RefusalLimit.h"
#include "platform/log/Log.h"

namespace brenvik {
namespace {

// Messages taken from one channel in a row before the others get their turn.
constexpr int kMessageBudget = 8;

// How long those messages may keep the others waiting: a thousand usual ones take that long. Some
// take long by themselves, like a large property list, and eight of those would add up.
constexpr std::chrono::milliseconds kLongestTurn{20};

// Connections accepted in a row; the next wake-up goes on.
constexpr int kAcceptBudget = 16;

// What a look at a caller takes at most: folders and files of /proc and of the entitlements, and the new
// port.
constexpr std::size_t kReservedDescriptors = 8;

// How soon what waits for descriptors, room in the closing line or an account's limit is looked at again.
constexpr std::chrono::milliseconds kTick = RefusalLimit::kOneMoreEvery;

// A reply for which the kernel has no memory is tried again, about a second in all.
constexpr std::chrono::milliseconds kRetryPause{10};
constexpr int kMaxRetries = 100;

constexpr std::size_t kLargestReply = 512;
static_assert(kLargestReply >= kRequestLargestReply && kLargestReply >= kCheckInLargestMessage);

// A finished reply: bytes, and what travels with them.
struct OutgoingReply {
  alignas(16) std::array<std::byte, kLargestReply> bytes;
  std::size_t size = 0;
  void* region = nullptr;  // in line, behind the message
  std::size_t regionLength = 0;
  SystemPortSpace::SharedFd right;
  UniqueFd memfd;
};

enum class Sent { done, channelFull, noMemory, failed };

Sent sendReply(int fd, OutgoingReply& reply) noexcept {
  iovec datagram{reply.bytes.data(), reply.size};
  if (reply.region != nullptr) {
    // One piece: a second costs the kernel as much as the rest of the call.
    static_assert(sizeof(OutOfLineReply) == SystemRegions::kRoomForMessage);
    datagram.iov_base = static_cast<std::byte*>(reply.region) - SystemRegions::kRoomForMessage;
    datagram.iov_len = SystemRegions::kRoomForMessage + reply.regionLength;
    std::memcpy(datagram.iov_base, reply.bytes.data(), SystemRegions::kRoomForMessage);
  }
  const int passed = reply.right != nullptr ? reply.right->get() : reply.memfd.get();
  const std::span<const int> descriptors(&passed, passed < 0 ? 0 : 1);
  switch (sendDatagram(fd, std::span(&datagram, 1), descriptors)) {
    case 0:
      return Sent::done;
    case EAGAIN:
      return Sent::channelFull;
    // Not a full channel: that one becomes writable when there is room, this one says it is all the time.
    case ENOBUFS:
    case ENOMEM:
      return Sent::noMemory;
    default:  // ETOOMANYREFS: too many descriptors on their way already
      return Sent::failed;
  }
}

// The time that a channel's turn takes. The clock is read only where a turn may have more than one message.
class TurnClock {
 public:
  void start() noexcept { began_ = std::chrono::steady_clock::now(); }
  // After a message. Without start() the first one counts for nothing.
  bool isOver() noexcept {
    const auto now = std::chrono::steady_clock::now();
    if (!began_) began_ = now;
    return now - *began_ >= kLongestTurn;
  }

 private:
  std::optional<std::chrono::steady_clock::time_point> began_;
};

class Channel;

// What a channel needs of the source it belongs to.
class ChannelOwner {
 public:
  virtual ~ChannelOwner() = default;
  virtual const RoutineTable& table() const noexcept = 0;
  virtual WantTrailer wantTrailer() const noexcept = 0;
  virtual PortName port() const noexcept = 0;
  virtual std::uint32_t nextSequence() noexcept = 0;
  virtual void admitted(Channel& channel) noexcept = 0;

  // Of a door, whose channels' other ends are strangers: what they send is looked at before it is taken.
  enum class IsDoor { no, yes };

  // Whether the channel's next message may be looked at; if not, the owner resumes the channel
  // later.
  virtual bool mayBeRead(Channel&) noexcept { return true; }
  // The same. Around the handler: makes sure that it finds descriptors. False: there are none, and it must
  // not be asked.
  virtual bool beginService(Channel&) noexcept { return true; }
  // The same. Before the answer. True when the channel is to be closed after it.
  virtual bool endService(Channel&, KernelReturn) noexcept { return false; }
  // Has the channel's next message dropped elsewhere and resumes the channel then. False when that cannot be
  // done.
  virtual bool discardMessage(Channel&) noexcept { return false; }

  // The channel has ended; the owner may destroy it (its own frame keeps it alive until it returns).
  virtual void ended(Channel& channel) noexcept = 0;
};

// One connected socket and the messages on it.
class Channel : public std::enable_shared_from_this<Channel>, public ConnectionBooks::Entry {
 public:
  // `account`, `peer`: of the process that made the connection, when the owner is a door.
  Channel(ChannelOwner& owner, ChannelOwner::IsDoor isDoor, SystemPortSpace& ports, SystemRegions& regions,
          IncomingMessage& incoming, SystemPortSpace::SharedFd fd, uid_t account = ClosingLine::kClients,
          pid_t peer = 0) noexcept
      : Entry(account),
        owner_(&owner),
        isDoor_(isDoor == ChannelOwner::IsDoor::yes),
        ports_(ports),
        regions_(regions),
        incoming_(incoming),
        fd_(std::move(fd)),
        peer_(peer) {}
  ~Channel() { close(); }
  Channel(const Channel&) = delete;
  Channel& operator=(const Channel&) = delete;

  bool addTo(RunLoop& loop) {
    loop_ = &loop;
    source_ =
        loop.addDescriptor(fd_->get(), Interest::reading, [this](Readiness readiness) { ready(readiness); });
    return source_ != nullptr;
  }

  // Stops reading, and listening to anything the peer does. Every channel that was paused is resumed or
  // closed.
  void pause() noexcept { source_.reset(); }
  void resume() noexcept {
    if (owner_ == nullptr || source_ != nullptr) return;
    if (endsOnResume_) return end();
    isLimited_ = false;
    try {
      if (addTo(*loop_)) return;
    } catch (const std::bad_alloc&) {
      // As without a source.
    }
    end();
  }
  bool isLimited() const noexcept { return isLimited_; }
  const SystemPortSpace::SharedFd& descriptor() const noexcept { return fd_; }

  // Ends the channel without telling the owner.
  void close() noexcept {
    owner_ = nullptr;
    source_.reset();
    retry_.reset();
    if (pending_ != nullptr) finish(*pending_);
    pending_.reset();
    fd_.reset();
  }

  void ready(Readiness readiness) noexcept {
    const auto keptAlive = shared_from_this();
    if (pending_ != nullptr && !sendPending(readiness)) return;
    backlog_.turnBegins(std::chrono::steady_clock::now);
    TurnClock clock;
    if (backlog_.isLikely()) clock.start();
    for (int taken = 0; taken < kMessageBudget && pending_ == nullptr && owner_ != nullptr; ++taken) {
      if (!takeOne(readiness) || clock.isOver()) break;
    }
    if (source_ == nullptr) return;  // paused, or ended
    backlog_.turnEnds(std::chrono::steady_clock::now);
    if (owner_ != nullptr && pending_ == nullptr && readiness.isOver() && !readiness.isReadable) {
      end();  // nothing left to read, and nobody left to answer
    }
  }

 private:
  void end() noexcept {
    ChannelOwner* const owner = owner_;
    close();
    if (owner != nullptr) owner->ended(*this);
  }

  // Ends the channel after a reply that could not be sent: others may hold the socket, too, and whoever waits
  // for that reply must see that it will not come.
  void giveUp() noexcept {
    if (fd_ != nullptr) (void)::shutdown(fd_->get(), SHUT_RDWR);
    end();
  }

  // Takes a message and serves it. True when one more may be taken in this turn.
  bool takeOne(Readiness readiness) noexcept {
    if (isDoor_ && !owner_->mayBeRead(*this)) {
      // Who has gone does not wait for an answer, nor keep the place of one who does.
      isLimited_ = !readiness.isOver();
      isLimited_ ? pause() : end();
      return false;
    }
    const auto received = isDoor_ ? incoming_.peek(fd_->get(), account()) : incoming_.receive(fd_->get());
    if (received == IncomingMessage::Received::endOfChannel) end();
    if (received == IncomingMessage::Received::nothing) backlog_.foundNothing();
    if (received != IncomingMessage::Received::message) return false;
    const bool answerWanted = incoming_.hasHeader() && incoming_.header().replyPort != kNullPort;
    serve();
    // A client that waits for its answer sends nothing meanwhile.
    return source_ != nullptr && (!answerWanted || (!isDoor_ && backlog_.isLikely()));
  }

  // Sends the reply that waited. True when the channel may be read again.
  bool sendPending(Readiness readiness) noexcept {
    const Sent sent = sendReply(fd_->get(), *pending_);
    const bool waitsOn = sent == Sent::channelFull || (sent == Sent::noMemory && --retriesLeft_ > 0);
    if (waitsOn && !readiness.isOver() && waitToSend(sent)) return false;
    finish(*pending_);
    pending_.reset();
    retry_.reset();
    if (sent == Sent::done && source_->setInterest(Interest::reading)) return true;
    giveUp();
    return false;
  }

  // Waits for what the reply needs. False when that is impossible.
  bool waitToSend(Sent sent) noexcept {
    if (sent != Sent::noMemory) {
      retry_.reset();
      return source_->setInterest(Interest::writing);
    }
    if (!source_->setInterest(Interest::none)) return false;
    if (retry_ != nullptr) return true;
    try {
      retry_ = loop_->addTimer(
          kRetryPause, kRetryPause, [this] { ready({}); }, [this] { giveUp(); });
    } catch (const std::bad_alloc&) {
      return false;
    }
    return retry_ != nullptr;
  }

  void serve() noexcept;
  void discard() noexcept;
  Outcome serveInto(Reply& reply, std::byte* bytes) noexcept;
  void answer(OutgoingReply& reply, bool wanted) noexcept;
  bool attach(OutgoingReply& reply) noexcept;
  void finish(OutgoingReply& reply) noexcept {
    if (reply.region != nullptr) regions_.deallocate(reply.region, reply.regionLength);
    reply.region = nullptr;
    reply.memfd.reset();
    reply.right.reset();
  }

  ChannelOwner* owner_;  // null once the channel has ended
  const bool isDoor_;    // whether the owner is one
  SystemPortSpace& ports_;
  SystemRegions& regions_;
  IncomingMessage& incoming_;
  SystemPortSpace::SharedFd fd_;
  const pid_t peer_;
  RunLoop* loop_ = nullptr;
  std::unique_ptr<DescriptorSource> source_;
  BacklogGuess backlog_;
  std::unique_ptr<OutgoingReply> pending_;
  std::unique_ptr<LoopSource> retry_;  // while the kernel has no memory for the reply
  int retriesLeft_ = 0;
  bool endsOnResume_ = false;
  bool isLimited_ = false;  // paused by mayBeRead
};

// Serves the message, as far as its form allows. Rights and regions are the message's own until it is
// released.
Outcome Channel::serveInto(Reply& reply, std::byte* bytes) noexcept {
  const auto refuse = [&reply](KernelReturn code) {
    reply.setStatus(code);
    return Outcome::refused;
  };
  RoutineTable::Handler handler = nullptr;
  if (isDoor_) {
    // The form first: what a stranger sends along is looked at when it belongs to a message that is known.
    if (const KernelReturn code = incoming_.checkForm(); code != kern::success) return refuse(code);
    handler = owner_->table().find(incoming_.header().id);
    if (handler == nullptr) return refuse(mig::badId);
  }
  if (const KernelReturn code = incoming_.unpack(owner_->port()); code != kern::success) return refuse(code);
  if (handler == nullptr) handler = owner_->table().find(incoming_.header().id);
  if (handler == nullptr) return refuse(mig::badId);
  if (isDoor_ && !owner_->beginService(*this)) return refuse(kern::resourceShortage);
  const bool wantsTrailer = owner_->wantTrailer() == WantTrailer::yes && incoming_.sender();
  if (wantsTrailer && pinPeer(fd_->get(), peer_, incoming_.sender()->pid) == PeerPin::refused) {
    return refuse(kern::invalidSecurity);
  }
  const MessageTrailer trailer =
      wantsTrailer ? buildTrailer(*incoming_.sender(), owner_->nextSequence()) : minimalTrailer();
  try {
    return handler(owner_->table().context(), Request(incoming_.bytes(), incoming_.header().size, &trailer),
                   reply);
  } catch (...) {
    // Memory ran out in a routine: this request fails, the process goes on.
    std::memset(bytes, 0, kRequestLargestReply);
    return refuse(kern::resourceShortage);
  }
}

void Channel::serve() noexcept {
  if (!incoming_.hasHeader()) {  // dropped without an answer
    const bool isTaken = !isDoor_ || incoming_.take(fd_->get());
    incoming_.release(false);
    return isTaken ? void() : discard();
  }

  OutgoingReply out;
  std::memset(out.bytes.data(), 0, kRequestLargestReply);
  Reply reply(out.bytes.data());
  const Outcome outcome = serveInto(reply, out.bytes.data());
  const MessageHeader request = incoming_.header();
  const KernelReturn code =
      (reply.header().bits & kComplexBit) != 0 ? kern::success : reply.as<StatusReply>().returnCode;
  const bool isTaken = !isDoor_ || owner_ == nullptr || incoming_.take(fd_->get());
  if (owner_ != nullptr && outcome == Outcome::accepted) owner_->admitted(*this);
  if (isDoor_ && owner_ != nullptr) endsOnResume_ = owner_->endService(*this, code);

  out.size = reply.header().size;
  reply.header().replyPort = kNullPort;
  reply.header().localPort = request.replyPort;
  reply.header().id = static_cast<std::int32_t>(static_cast<std::uint32_t>(request.id) +
                                                static_cast<std::uint32_t>(kReplyIdOffset));
  answer(out, request.replyPort != kNullPort && owner_ != nullptr);
  // Only now: a routine's region or right is good until its reply is on its way.
  incoming_.release(outcome == Outcome::accepted);
  if (!isDoor_ || owner_ == nullptr) return;
  if (!isTaken) return discard();
  if (endsOnResume_) end();
}

// Answered, and still in the socket: it is dropped where nobody waits for that.
void Channel::discard() noexcept {
  // A reply that waits would wait in vain, for the channel is not listened to.
  endsOnResume_ = endsOnResume_ || pending_ != nullptr;
  pause();
  if (!owner_->discardMessage(*this)) end();
}

// Turns the names and addresses of the reply into what travels. False when the kernel refused a descriptor.
bool Channel::attach(OutgoingReply& reply) noexcept {
  auto& header = *reinterpret_cast<MessageHeader*>(reply.bytes.data());
  if ((header.bits & kComplexBit) == 0) return true;
  // Only two forms of reply are complex, and both have one descriptor.
  auto& descriptor = reinterpret_cast<OutOfLineReply*>(reply.bytes.data())->payload;
  if (descriptor.type == kPortDescriptorType) {
    auto& port = reinterpret_cast<CheckInReply*>(reply.bytes.data())->servicePort;
    reply.right = ports_.sendEnd(port.name);
    // The copy on its way is all that is needed: two descriptors a client, not three.
    ports_.sendRightHasLeft(port.name);
    port.name = kNullPort;  // names mean nothing to another process
    return reply.right != nullptr;
  }
  if (descriptor.size == 0) return true;
  void* const region = reinterpret_cast<void*>(descriptor.address);
  if (descriptor.size <= SystemRegions::kLongestInLine) {
    static_assert(sizeof(OutOfLineReply) % 8 == 0, "the region follows the message 8-byte aligned");
    descriptor.address = sizeof(OutOfLineReply);
    reply.region = region;
    reply.regionLength = descriptor.size;
    return true;
  }
  descriptor.address = 0;
  reply.memfd = regions_.sealIntoDescriptor(region, descriptor.size);
  return reply.memfd.isValid();
}

void Channel::answer(OutgoingReply& reply, bool wanted) noexcept {
  if (!attach(reply)) {
    const MessageHeader header = *reinterpret_cast<const MessageHeader*>(reply.bytes.data());
    std::memset(reply.bytes.data(), 0, kRequestLargestReply);
    Reply status(reply.bytes.data());
    status.setStatus(kern::resourceShortage);
    status.header().localPort = header.localPort;
    status.header().id = header.id;
    reply.size = sizeof(StatusReply);
  }
  if (!wanted) return finish(reply);
  const Sent sent = sendReply(fd_->get(), reply);
  if (sent == Sent::done) return finish(reply);
  if (sent == Sent::failed) {
    finish(reply);
    return giveUp();
  }
  retriesLeft_ = kMaxRetries;
  pending_.reset(new (std::nothrow) OutgoingReply(std::move(reply)));
  if (pending_ == nullptr || !waitToSend(sent)) {
    if (pending_ == nullptr) finish(reply);
    giveUp();
  }
}

// Serves one connected socket: a client's receive port.
class PortSource final : public RoutineSource, private ChannelOwner {
 public:
  PortSource(PortName port, const RoutineTable& table, WantTrailer trailer) noexcept
      : port_(port), table_(table), trailer_(trailer) {}
  ~PortSource() override { invalidate(); }

  void setChannel(SystemPortSpace& ports, SystemRegions& regions, IncomingMessage& incoming,
                  SystemPortSpace::SharedFd fd) {
    channel_ = std::make_shared<Channel>(static_cast<ChannelOwner&>(*this), IsDoor::no, ports, regions,
                                         incoming, std::move(fd));
  }
  bool addTo(RunLoop& loop) noexcept override {
    try {
      return channel_ != nullptr && channel_->addTo(loop);
    } catch (const std::bad_alloc&) {
      return false;
    }
  }
  void invalidate() noexcept override {
    if (channel_ != nullptr) channel_->close();
    channel_.reset();
  }

 private:
  const RoutineTable& table() const noexcept override { return table_; }
  WantTrailer wantTrailer() const noexcept override { return trailer_; }
  PortName port() const noexcept override { return port_; }
  std::uint32_t nextSequence() noexcept override { return sequence_++; }
  void admitted(Channel&) noexcept override {}
  // The client has shut the channel, yet the port lives until the port it is watched by dies.
  void ended(Channel&) noexcept override { channel_.reset(); }

  const PortName port_;
  const RoutineTable& table_;
  const WantTrailer trailer_;
  std::uint32_t sequence_ = 0;
  std::shared_ptr<Channel> channel_;
};

// Serves a listening socket and the connections made to it: the door.
class ServiceSource final : public RoutineSource, private ChannelOwner {
 public:
  ServiceSource(PortName port, const RoutineTable& table, WantTrailer trailer, SystemPortSpace& ports,
                SystemRegions& regions, IncomingMessage& incoming, SystemPortSpace::SharedFd listening,
                std::unique_ptr<HeldAddresses::Entry> address, SystemPortSources::Refusals limits) noexcept
      : port_(port),
        table_(table),
        trailer_(trailer),
        ports_(ports),
        regions_(regions),
        incoming_(incoming),
        listening_(std::move(listening)),
        address_(std::move(address)),
        limits_(limits) {}
  ~ServiceSource() override { invalidate(); }

  bool addTo(RunLoop& loop) noexcept override {
    try {
      loop_ = &loop;
      (void)keepReserve();
      source_ =
          loop.addDescriptor(listening_->get(), Interest::reading, [this](Readiness) { acceptReady(); });
      return source_ != nullptr;
    } catch (const std::bad_alloc&) {
      return false;
    }
  }
  void invalidate() noexcept override {
    source_.reset();
    discardedSource_.reset();
    tick_.reset();
    discarding_.clear();
    reserve_ = {};
    for (const auto& [raw, channel] : std::exchange(channels_, {})) {
      books_.remove(*channel);
      channel->close();
    }
  }

 private:
  const RoutineTable& table() const noexcept override { return table_; }
  WantTrailer wantTrailer() const noexcept override { return trailer_; }
  PortName port() const noexcept override { return port_; }
  std::uint32_t nextSequence() noexcept override { return sequence_++; }
  void admitted(Channel& channel) noexcept override {
    books_.admit(channel);
    drop(books_.overdueAdmitted());
  }
  void ended(Channel& channel) noexcept override {
    books_.remove(channel);
    channels_.erase(&channel);
  }

  bool mayBeRead(Channel& channel) noexcept override {
    if (refusals_.allows(channel.account(), std::chrono::steady_clock::now())) return true;
    hasLimited_ = true;
    return !startTicking();  // without a timer nobody would resume it
  }

  // The handler gets the reserve, so that it never takes a lack of descriptors for an answer.
  bool beginService(Channel& channel) noexcept override {
    while (!keepReserve()) {
      ConnectionBooks::Entry* const oldest = books_.oldestStranger();
      if (oldest == &channel || !drop(oldest)) return false;
    }
    reserve_ = {};
    return true;
  }

  bool endService(Channel& channel, KernelReturn code) noexcept override {
    if (code == kern::invalidSecurity && limits_ == SystemPortSources::Refusals::limited) {
      refusals_.refused(channel.account(), std::chrono::steady_clock::now());
    }
    if (code != kern::resourceShortage) {
      (void)keepReserve();
      return false;
    }
    reserve_ = {};  // the first line of a log takes a descriptor, too
    logUnified(LogLevel::error, "out of descriptors or memory: a check-in was refused");
    return true;
  }

  bool discardMessage(Channel& channel) noexcept override {
    try {
      const std::uint64_t token = ++lastToken_;
      discarding_.emplace(token, channel.weak_from_this());
      reserve_ = {};  // the first one takes a descriptor
      const bool isInLine = ports_.closing().discardMessage(channel.descriptor(), channel.account(), token);
      if (isInLine && discardedSource_ == nullptr) {
        discardedSource_ = loop_->addDescriptor(ports_.closing().readable(), Interest::reading,
                                                [this](Readiness) { resumeDiscarded(); });
      }
      (void)keepReserve();
      if (isInLine && discardedSource_ != nullptr) return true;
      discarding_.erase(token);
      return false;
    } catch (const std::bad_alloc&) {
      return false;
    }
  }

  void resumeDiscarded() {
    for (const std::uint64_t token : ports_.closing().takeDiscarded()) {
      const auto entry = discarding_.extract(token);
      if (entry.empty()) continue;
      if (const auto channel = entry.mapped().lock()) channel->resume();
    }
  }

  void acceptReady() noexcept {
    const bool isOpen = acceptWaiting();
    if (source_ == nullptr) return;  // invalidated by what it served
    if (!keepReserve() || !isOpen) pauseAccepting();
  }

  // Any descriptor will do: what counts is its place. All or nothing; false when there are too few.
  bool keepReserve() noexcept {
    for (UniqueFd& place : reserve_) {
      if (!place.isValid()) place.reset(::fcntl(listening_->get(), F_DUPFD_CLOEXEC, 0));
      if (!place.isValid()) return false;
    }
    return true;
  }

  // False when nobody can be let in now.
  bool acceptWaiting() noexcept {
    for (int i = 0; i < kAcceptBudget && source_ != nullptr; ++i) {
      // A stranger can leave two things to be closed, a message and what it carries. While that many find no
      // room in the line, nobody is let in: what is there could be neither kept nor closed.
      if (!ports_.closing().hasRoomFor(2 * (books_.strangers() + 1))) {
        if (!std::exchange(isFullTold_, true)) {
          logUnified(LogLevel::error,
                     "too many descriptors of refused callers wait to be closed: new clients wait");
        }
        return false;
      }
      isFullTold_ = false;
      UniqueFd connection(::accept4(listening_->get(), nullptr, nullptr, SOCK_CLOEXEC));
      if (connection.isValid()) {
        try {
          serve(std::move(connection));
        } catch (const std::bad_alloc&) {
          // The connection is closed, which tells its client to try again.
        }
        continue;
      }
      if (errno == EINTR || errno == ECONNABORTED) continue;
      if (errno != EMFILE && errno != ENFILE) return true;
      // The kernel looks for a descriptor before it looks whether anybody waits.
      pollfd waiting{listening_->get(), POLLIN, 0};
      if (::poll(&waiting, 1, 0) == 0) return true;
      // A stranger gives its place up, or else the reserve does: then this one gets an answer at least.
      if (drop(books_.oldestStranger())) continue;
      if (!reserve_.front().isValid()) return false;
      reserve_ = {};
    }
    return true;
  }

  // The connection at the head of the queue would wake us for ever.
  void pauseAccepting() noexcept {
    isAcceptingPaused_ = startTicking() && source_->setInterest(Interest::none);
  }

  void serve(UniqueFd connection) {
    // A connection made before the listening socket asked for credentials (a client that started this
    // process) has not taken that over on every kernel.
    if (trailer_ == WantTrailer::yes) (void)askForCredentials(connection.get());
    const ucred peer = peerOf(connection.get()).value_or(ucred{});
    const auto channel =
        std::make_shared<Channel>(static_cast<ChannelOwner&>(*this), IsDoor::yes, ports_, regions_, incoming_,
                                  ports_.share(std::move(connection), peer.uid), peer.uid, peer.pid);
    if (!channel->addTo(*loop_)) return;
    channels_.emplace(channel.get(), channel);
    try {
      books_.add(*channel);
    } catch (const std::bad_alloc&) {
      channels_.erase(channel.get());
      throw;
    }
    drop(books_.overdueAfter(*channel));
    // Its check-in is most often there already, and then needs no wake-up of its own.
    channel->ready({.isReadable = true});
  }

  // Closes a connection, if there is one to be closed.
  bool drop(ConnectionBooks::Entry* entry) noexcept {
    if (entry == nullptr) return false;
    const auto found = channels_.find(static_cast<Channel*>(entry));
    const std::shared_ptr<Channel> channel = found->second;
    ended(*channel);
    channel->close();
    return true;
  }

  bool startTicking() noexcept {
    if (tick_ != nullptr) return true;
    try {
      tick_ = loop_->addTimer(
          kTick, kTick, [this] { tick(); }, [] {});
    } catch (const std::bad_alloc&) {
      return false;
    }
    return tick_ != nullptr;
  }

  // Looks again at what waits; it waits on, and is looked at with the next tick, when it must.
  void tick() {
    const auto self = std::move(tick_);  // the handler that runs
    if (std::exchange(hasLimited_, false)) {
      // One after the other, without memory: resuming may end the channel, and then its entry goes.
      for (auto entry = channels_.begin(); entry != channels_.end();) {
        if (!entry->second->isLimited()) {
          ++entry;
          continue;
        }
        const std::shared_ptr<Channel> channel = entry->second;
        channel->resume();
        entry = channels_.begin();
      }
    }
    if (std::exchange(isAcceptingPaused_, false)) {
      (void)source_->setInterest(Interest::reading);
      acceptReady();
    }
  }

  const PortName port_;
  const RoutineTable& table_;
  const WantTrailer trailer_;
  SystemPortSpace& ports_;
  SystemRegions& regions_;
  IncomingMessage& incoming_;
  const SystemPortSpace::SharedFd listening_;
  const std::unique_ptr<HeldAddresses::Entry> address_;  // of the service's ends of all connections
  std::array<UniqueFd, kReservedDescriptors> reserve_;
  RunLoop* loop_ = nullptr;
  std::unique_ptr<DescriptorSource> source_;
  std::unique_ptr<DescriptorSource> discardedSource_;
  std::unique_ptr<LoopSource> tick_;  // while something waits for it
  bool hasLimited_ = false;
  bool isFullTold_ = false;
  bool isAcceptingPaused_ = false;
  const SystemPortSources::Refusals limits_;
  RefusalLimit refusals_;
  ConnectionBooks books_;
  std::unordered_map<Channel*, std::shared_ptr<Channel>> channels_;
  std::unordered_map<std::uint64_t, std::weak_ptr<Channel>> discarding_;
  std::uint64_t lastToken_ = 0;
  std::uint32_t sequence_ = 0;
};

// Keeps its own hold on the send right: the name may be freed while the watch still waits for the hang-up.
class SocketDeathWatch final : public DeathWatch {
 public:
  SocketDeathWatch(PortName port, SystemPortSpace::SharedFd end,
                   std::unique_ptr<HeldAddresses::Entry> address) noexcept
      : port_(port), end_(std::move(end)), address_(std::move(address)) {}

  bool addTo(RunLoop& loop) {
    source_ = loop.addDescriptor(end_->get(), Interest::none, [this](Readiness readiness) {
      if (readiness.isOver()) died();
    });
    return source_ != nullptr;
  }
  PortName port() const noexcept override { return port_; }
  bool isValid() const noexcept override {
    if (source_ == nullptr) return false;
    pollfd state{end_->get(), 0, 0};
    return ::poll(&state, 1, 0) == 0;
  }
  void setInvalidationCallback(std::function<void(DeathWatch&)> callback) noexcept override {
    callback_ = std::move(callback);
  }
  void invalidate() noexcept override { source_.reset(); }

 private:
  void died() {
    source_.reset();
    if (auto callback = std::exchange(callback_, {})) callback(*this);
  }
  const PortName port_;
  const SystemPortSpace::SharedFd end_;
  const std::unique_ptr<HeldAddresses::Entry> address_;
  std::function<void(DeathWatch&)> callback_;
  std::unique_ptr<DescriptorSource> source_;
};

}  // namespace

SystemPortSources::SystemPortSources(SystemPortSpace& ports, SystemRegions& regions, Refusals refusals)
    : ports_(ports), regions_(regions), refusals_(refusals), incoming_(ports) {}

SystemPortSources::~SystemPortSources() = default;

std::shared_ptr<RoutineSource> SystemPortSources::makeRoutineSource(PortName port, const RoutineTable& table,
                                                                    WantTrailer trailer) noexcept {
  auto end = ports_.receiveEnd(port);
  if (end == nullptr) return nullptr;
  try {
    if (ports_.isService(port)) {
      auto address = held_->add(end->get());
      return std::make_shared<ServiceSource>(port, table, trailer, ports_, regions_, incoming_,
                                             std::move(end), std::move(address), refusals_);
    }
    auto source = std::make_shared<PortSource>(port, table, trailer);
    source->setChannel(ports_, regions_, incoming_, std::move(end));
    return source;
  } catch (const std::bad_alloc&) {
    return nullptr;
  }
}

std::shared_ptr<DeathWatch> SystemPortSources::makeDeathWatch(PortName port, RunLoop& loop) noexcept {
  auto end = ports_.sendEnd(port);
  if (end == nullptr) return nullptr;
  try {
    if (held_->hasOtherEndOf(end->get())) return nullptr;
    auto address = held_->add(end->get());
    auto watch = std::make_shared<SocketDeathWatch>(port, std::move(end), std::move(address));
    if (!watch->addTo(loop)) return nullptr;
    return watch;
  } catch (const std::bad_alloc&) {
    return nullptr;
  }
}

}  // namespace brenvik

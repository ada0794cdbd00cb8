// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/ipc/linux/SystemPortSources.h"

#include <fcntl.h>
#include <poll.h>
#include <sys/epoll.h>
#include <sys/socket.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <cstring>
#include <list>
#include <new>
#include <vector>

#include "platform/ipc/linux/MessageTrailerBuilder.h"
#include "platform/log/Log.h"

namespace brenvik {
namespace {

// Messages taken from one channel in a row before the others get their turn.
constexpr int kMessageBudget = 8;

// Connections accepted in a row; the next wake-up goes on.
constexpr int kAcceptBudget = 16;

// Connections without a check-in: a client sends its check-in at once, so few are ever waiting. What one
// account may hold is below the total, so that it cannot crowd out the others.
constexpr std::size_t kMostUnadmitted = 128;
constexpr std::size_t kMostUnadmittedOfOneAccount = 64;

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

enum class Sent { done, channelFull, failed };

ssize_t sendOnce(int fd, OutgoingReply& reply) noexcept {
  constexpr int kFlags = MSG_DONTWAIT | MSG_NOSIGNAL;
  const int passed =
      reply.memfd.isValid() ? reply.memfd.get() : (reply.right != nullptr ? reply.right->get() : -1);
  if (passed < 0) {
    if (reply.region == nullptr) return ::send(fd, reply.bytes.data(), reply.size, kFlags);
    // One piece: a second costs the kernel as much as the rest of the call.
    static_assert(sizeof(OutOfLineReply) == SystemRegions::kRoomForMessage);
    auto* const datagram = static_cast<std::byte*>(reply.region) - SystemRegions::kRoomForMessage;
    std::memcpy(datagram, reply.bytes.data(), SystemRegions::kRoomForMessage);
    return ::send(fd, datagram, SystemRegions::kRoomForMessage + reply.regionLength, kFlags);
  }
  iovec io{reply.bytes.data(), reply.size};
  msghdr message{};
  message.msg_iov = &io;
  message.msg_iovlen = 1;
  alignas(cmsghdr) std::array<char, CMSG_SPACE(sizeof(int))> control{};
  message.msg_control = control.data();
  message.msg_controllen = control.size();
  cmsghdr* const item = CMSG_FIRSTHDR(&message);
  item->cmsg_level = SOL_SOCKET;
  item->cmsg_type = SCM_RIGHTS;
  item->cmsg_len = CMSG_LEN(sizeof(int));
  std::memcpy(CMSG_DATA(item), &passed, sizeof passed);
  return ::sendmsg(fd, &message, kFlags);
}

Sent sendReply(int fd, OutgoingReply& reply) noexcept {
  ssize_t sent = 0;
  do {
    sent = sendOnce(fd, reply);
  } while (sent < 0 && errno == EINTR);
  if (sent >= 0) return Sent::done;
  // ENOBUFS and ENOMEM pass as a full channel does; ETOOMANYREFS: too many descriptors on their way already.
  return errno == EAGAIN || errno == EWOULDBLOCK || errno == ENOBUFS || errno == ENOMEM ? Sent::channelFull
                                                                                        : Sent::failed;
}

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
  // The channel has ended; the owner may destroy it (its own frame keeps it alive until it returns).
  virtual void ended(Channel& channel) noexcept = 0;
};

// One connected socket and the messages on it.
class Channel : public std::enable_shared_from_this<Channel> {
 public:
  Channel(ChannelOwner& owner, SystemPortSpace& ports, SystemRegions& regions, IncomingMessage& incoming,
          SystemPortSpace::SharedFd fd) noexcept
      : owner_(&owner), ports_(ports), regions_(regions), incoming_(incoming), fd_(std::move(fd)) {}
  ~Channel() { close(); }
  Channel(const Channel&) = delete;
  Channel& operator=(const Channel&) = delete;

  bool addTo(RunLoop& loop) {
    source_ = loop.addDescriptor(fd_->get(), EPOLLIN, [this](std::uint32_t events) { ready(events); });
    return source_ != nullptr;
  }

  // Ends the channel without telling the owner.
  void close() noexcept {
    owner_ = nullptr;
    source_.reset();
    if (pending_ != nullptr) finish(*pending_);
    pending_.reset();
    fd_.reset();
  }

  void ready(std::uint32_t events) noexcept {
    const auto keptAlive = shared_from_this();
    if (pending_ != nullptr && !resume(events)) return;
    for (int taken = 0; taken < kMessageBudget && pending_ == nullptr && owner_ != nullptr; ++taken) {
      const auto received = incoming_.receive(fd_->get());
      if (received == IncomingMessage::Received::endOfChannel) return end();
      if (received == IncomingMessage::Received::nothing) break;
      const bool answerWanted = incoming_.hasHeader() && incoming_.header().replyPort != kNullPort;
      serve();
      // Who waits for an answer sends nothing meanwhile: looking once more would cost a system call for
      // nothing.
      if (answerWanted) break;
    }
    if (owner_ != nullptr && pending_ == nullptr && (events & (EPOLLHUP | EPOLLERR)) != 0 &&
        (events & EPOLLIN) == 0) {
      end();  // nothing left to read, and nobody left to answer
    }
  }

  bool isAdmitted = false;
  // Of the process that made the connection.
  uid_t account = 0;
  pid_t peer = 0;

 private:
  void end() noexcept {
    ChannelOwner* const owner = owner_;
    close();
    if (owner != nullptr) owner->ended(*this);
  }

  // Sends the reply that waited. True when the channel may be read again.
  bool resume(std::uint32_t events) noexcept {
    const Sent sent = sendReply(fd_->get(), *pending_);
    if (sent == Sent::channelFull && (events & (EPOLLHUP | EPOLLERR)) == 0) return false;
    finish(*pending_);
    pending_.reset();
    if (sent == Sent::done && source_->setEvents(EPOLLIN)) return true;
    end();
    return false;
  }

  void serve() noexcept;
  KernelReturn refusal() const noexcept;
  void answer(OutgoingReply& reply, bool wanted) noexcept;
  bool attach(OutgoingReply& reply) noexcept;
  void finish(OutgoingReply& reply) noexcept {
    if (reply.region != nullptr) regions_.deallocate(reply.region, reply.regionLength);
    reply.region = nullptr;
    reply.memfd.reset();
    reply.right.reset();
  }

  ChannelOwner* owner_;  // null once the channel has ended
  SystemPortSpace& ports_;
  SystemRegions& regions_;
  IncomingMessage& incoming_;
  SystemPortSpace::SharedFd fd_;
  std::unique_ptr<DescriptorSource> source_;
  std::unique_ptr<OutgoingReply> pending_;
};

void Channel::serve() noexcept {
  if (!incoming_.hasHeader()) return incoming_.release(false);  // dropped without an answer

  const KernelReturn unpacked = incoming_.unpack(owner_->port());
  const MessageHeader request = incoming_.header();
  OutgoingReply out;
  std::memset(out.bytes.data(), 0, kRequestLargestReply);
  Reply reply(out.bytes.data());
  Outcome outcome = Outcome::refused;

  const RoutineTable::Handler handler =
      unpacked == kern::success ? owner_->table().find(request.id) : nullptr;
  if (unpacked != kern::success) {
    reply.setStatus(unpacked);
  } else if (handler == nullptr) {
    reply.setStatus(mig::badId);
  } else if (owner_->wantTrailer() == WantTrailer::yes && incoming_.sender() &&
             pinPeer(fd_->get(), peer, incoming_.sender()->pid) == PeerPin::refused) {
    reply.setStatus(kern::invalidSecurity);
  } else {
    const MessageTrailer trailer = owner_->wantTrailer() == WantTrailer::yes && incoming_.sender()
                                       ? buildTrailer(*incoming_.sender(), owner_->nextSequence())
                                       : minimalTrailer();
    try {
      outcome = handler(owner_->table().context(), Request(incoming_.bytes(), request.size, &trailer), reply);
    } catch (...) {
      // Memory ran out in a routine: this request fails, the process goes on.
      std::memset(out.bytes.data(), 0, kRequestLargestReply);
      reply.setStatus(kern::resourceShortage);
      outcome = Outcome::refused;
    }
    if (owner_ != nullptr && outcome == Outcome::accepted) owner_->admitted(*this);
  }

  out.size = reply.header().size;
  reply.header().replyPort = kNullPort;
  reply.header().localPort = request.replyPort;
  reply.header().id = static_cast<std::int32_t>(static_cast<std::uint32_t>(request.id) +
                                                static_cast<std::uint32_t>(kReplyIdOffset));
  answer(out, request.replyPort != kNullPort && owner_ != nullptr);
  // Only now: a routine's region or right is good until its reply is on its way.
  incoming_.release(outcome == Outcome::accepted);
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
  switch (sendReply(fd_->get(), reply)) {
    case Sent::done:
      return finish(reply);
    case Sent::failed:
      finish(reply);
      return end();
    case Sent::channelFull:
      break;
  }
  pending_.reset(new (std::nothrow) OutgoingReply(std::move(reply)));
  if (pending_ == nullptr || !source_->setEvents(EPOLLOUT)) {
    if (pending_ == nullptr) finish(reply);
    end();
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
    channel_ =
        std::make_shared<Channel>(static_cast<ChannelOwner&>(*this), ports, regions, incoming, std::move(fd));
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

// Serves a listening socket and the connections made to it.
class ServiceSource final : public RoutineSource, private ChannelOwner {
 public:
  ServiceSource(PortName port, const RoutineTable& table, WantTrailer trailer, SystemPortSpace& ports,
                SystemRegions& regions, IncomingMessage& incoming,
                SystemPortSpace::SharedFd listening) noexcept
      : port_(port),
        table_(table),
        trailer_(trailer),
        ports_(ports),
        regions_(regions),
        incoming_(incoming),
        listening_(std::move(listening)) {}
  ~ServiceSource() override { invalidate(); }

  bool addTo(RunLoop& loop) noexcept override {
    try {
      loop_ = &loop;
      keepSpare();
      source_ = loop.addDescriptor(listening_->get(), EPOLLIN, [this](std::uint32_t) { acceptReady(); });
      return source_ != nullptr;
    } catch (const std::bad_alloc&) {
      return false;
    }
  }
  void invalidate() noexcept override {
    source_.reset();
    spare_.reset();
    for (const auto& channel : channels_) channel->close();
    channels_.clear();
  }

 private:
  const RoutineTable& table() const noexcept override { return table_; }
  WantTrailer wantTrailer() const noexcept override { return trailer_; }
  PortName port() const noexcept override { return port_; }
  std::uint32_t nextSequence() noexcept override { return sequence_++; }
  void admitted(Channel& channel) noexcept override { channel.isAdmitted = true; }
  void ended(Channel& channel) noexcept override {
    channels_.remove_if(
        [&channel](const std::shared_ptr<Channel>& other) { return other.get() == &channel; });
  }

  void acceptReady() noexcept {
    acceptWaiting();
    keepSpare();
  }

  // Any descriptor will do: what counts is its place.
  void keepSpare() noexcept {
    if (!spare_.isValid()) spare_.reset(::fcntl(listening_->get(), F_DUPFD_CLOEXEC, 0));
  }

  void acceptWaiting() noexcept {
    for (int i = 0; i < kAcceptBudget; ++i) {
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
      if (errno != EMFILE && errno != ENFILE) return;
      makeRoom();
    }
  }

  // Out of descriptors: the connection at the head of the queue would wake us for ever. An idle connection is
  // given up for it, or the spare descriptor takes it, only to close it.
  void makeRoom() noexcept {
    if (closeOldestOfBusiestAccount(1)) return;
    spare_.reset();
    const UniqueFd refused(::accept4(listening_->get(), nullptr, nullptr, SOCK_CLOEXEC));
    logUnified(LogLevel::error, "out of descriptors: a connection was closed unserved");
  }

  void serve(UniqueFd connection) {
    // A connection made before the listening socket asked for credentials (a client that started this
    // process) has not taken that over on every kernel.
    const int on = 1;
    if (trailer_ == WantTrailer::yes) {
      (void)::setsockopt(connection.get(), SOL_SOCKET, SO_PASSCRED, &on, sizeof on);
    }
    ucred peer{};
    socklen_t size = sizeof peer;
    (void)::getsockopt(connection.get(), SOL_SOCKET, SO_PEERCRED, &peer, &size);
    const auto channel =
        std::make_shared<Channel>(static_cast<ChannelOwner&>(*this), ports_, regions_, incoming_,
                                  std::make_shared<const UniqueFd>(std::move(connection)));
    channel->account = peer.uid;
    channel->peer = peer.pid;
    if (!channel->addTo(*loop_)) return;
    channels_.push_back(channel);
    const auto unadmitted = [](const std::shared_ptr<Channel>& other) { return !other->isAdmitted; };
    const auto sameAccount = [&](const std::shared_ptr<Channel>& other) {
      return !other->isAdmitted && other->account == peer.uid;
    };
    if (static_cast<std::size_t>(std::count_if(channels_.begin(), channels_.end(), sameAccount)) >
            kMostUnadmittedOfOneAccount ||
        static_cast<std::size_t>(std::count_if(channels_.begin(), channels_.end(), unadmitted)) >
            kMostUnadmitted) {
      (void)closeOldestOfBusiestAccount(2);
    }
    // Its check-in is most often there already, and then needs no wake-up of its own.
    channel->ready(EPOLLIN);
  }

  // Of the account with most connections that have not checked in, closes the oldest. False when no account
  // has at least `atLeast` of them.
  bool closeOldestOfBusiestAccount(std::size_t atLeast) noexcept {
    std::shared_ptr<Channel> oldest;
    std::size_t most = 0;
    for (const auto& candidate : channels_) {
      if (candidate->isAdmitted) continue;
      const auto count = static_cast<std::size_t>(
          std::count_if(channels_.begin(), channels_.end(), [&](const std::shared_ptr<Channel>& other) {
            return !other->isAdmitted && other->account == candidate->account;
          }));
      if (count > most) {
        most = count;
        oldest = candidate;
      }
    }
    if (oldest == nullptr || most < atLeast) return false;
    channels_.remove(oldest);
    oldest->close();
    return true;
  }

  const PortName port_;
  const RoutineTable& table_;
  const WantTrailer trailer_;
  SystemPortSpace& ports_;
  SystemRegions& regions_;
  IncomingMessage& incoming_;
  const SystemPortSpace::SharedFd listening_;
  UniqueFd spare_;
  RunLoop* loop_ = nullptr;
  std::unique_ptr<DescriptorSource> source_;
  std::list<std::shared_ptr<Channel>> channels_;  // oldest first
  std::uint32_t sequence_ = 0;
};

// Keeps its own hold on the send right: the name may be freed while the watch still waits for the hang-up.
class SocketDeathWatch final : public DeathWatch {
 public:
  SocketDeathWatch(PortName port, SystemPortSpace::SharedFd end, void* info) noexcept
      : port_(port), end_(std::move(end)), info_(info) {}

  bool addTo(RunLoop& loop) {
    source_ = loop.addDescriptor(end_->get(), 0, [this](std::uint32_t events) {
      if ((events & (EPOLLHUP | EPOLLERR)) != 0) died();
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
  void* info() const noexcept override { return info_; }

 private:
  void died() {
    source_.reset();
    if (auto callback = std::exchange(callback_, {})) callback(*this);
  }
  const PortName port_;
  const SystemPortSpace::SharedFd end_;
  void* const info_;
  std::function<void(DeathWatch&)> callback_;
  std::unique_ptr<DescriptorSource> source_;
};

}  // namespace

SystemPortSources::SystemPortSources(SystemPortSpace& ports, SystemRegions& regions)
    : ports_(ports), regions_(regions), incoming_(std::make_unique<IncomingMessage>(ports)) {}

SystemPortSources::~SystemPortSources() = default;

std::shared_ptr<RoutineSource> SystemPortSources::makeRoutineSource(PortName port, const RoutineTable& table,
                                                                    WantTrailer trailer) noexcept {
  auto end = ports_.receiveEnd(port);
  if (end == nullptr) return nullptr;
  try {
    if (ports_.isService(port)) {
      return std::make_shared<ServiceSource>(port, table, trailer, ports_, regions_, *incoming_,
                                             std::move(end));
    }
    auto source = std::make_shared<PortSource>(port, table, trailer);
    source->setChannel(ports_, regions_, *incoming_, std::move(end));
    return source;
  } catch (const std::bad_alloc&) {
    return nullptr;
  }
}

std::shared_ptr<DeathWatch> SystemPortSources::makeDeathWatch(PortName port, RunLoop& loop,
                                                              void* info) noexcept {
  auto end = ports_.sendEnd(port);
  if (end == nullptr) return nullptr;
  try {
    auto watch = std::make_shared<SocketDeathWatch>(port, std::move(end), info);
    if (!watch->addTo(loop)) return nullptr;
    return watch;
  } catch (const std::bad_alloc&) {
    return nullptr;
  }
}

}  // namespace brenvik

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "client/Listener.h"

#include <fcntl.h>
#include <sys/epoll.h>
#include <sys/inotify.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <utility>

#include "interface/Messages.h"
#include "interface/TelephonyMessages.h"
#include "platform/datagram/Datagram.h"
#include "platform/datagram/LocalSocket.h"

namespace brenvik::client {
namespace {

constexpr int kBacklog = 16;

// How many connections and broken messages are still dealt with when the time is over already, so that
// neither a flood nor a time-out of 0 makes the other useless.
constexpr int kMaxOvertime = 64;

// Events of the services carry 0 and 1, those of a connection its index and this.
constexpr std::uint64_t kFirstConnectionKey = 2;
constexpr std::uint64_t kNamesKey = UINT64_MAX;
constexpr std::uint64_t kTurnedAwayKey = UINT64_MAX - 1;

template <class Message>
Message readAs(std::span<const std::byte> datagram) noexcept {
  Message message;
  std::memcpy(&message, datagram.data(), sizeof message);
  return message;
}

// False with errno set. What is there already stays as it is. Precondition: a socket's path can begin so.
bool makeDirectories(const char* path) noexcept {
  char copy[sizeof(sockaddr_un::sun_path)] = {};
  const std::size_t length = ::strnlen(path, sizeof copy - 1);
  std::memcpy(copy, path, length);
  for (std::size_t i = 1; i <= length; ++i) {
    if (copy[i] != '/' && copy[i] != '\0') continue;
    const char ended = std::exchange(copy[i], '\0');
    if (::mkdir(copy, 0755) != 0 && errno != EEXIST) return false;
    copy[i] = ended;
  }
  return true;
}

template <class Reply>
bool sendReply(int socket, const Reply& reply) noexcept {
  const std::array parts{iovecOf(std::as_bytes(std::span(&reply, 1)))};
  // A peer that does not read its answers does not get to hold us up.
  return sendDatagram(socket, parts) == 0;
}

MessageHeader replyHeader(std::uint32_t size, PortName replyPort, std::int32_t requestId) noexcept {
  return {kReplyDisposition, size, kNullPort, replyPort, 0, requestId + kReplyIdOffset};
}

}  // namespace

bool ServiceSocket::adopt(int descriptor) noexcept {
  const int flags = ::fcntl(descriptor, F_GETFL);
  if (flags < 0 || ::fcntl(descriptor, F_SETFL, flags | O_NONBLOCK) != 0 ||
      ::fcntl(descriptor, F_SETFD, FD_CLOEXEC) != 0) {
    return false;
  }
  socket_.reset(descriptor);
  return true;
}

ServiceSocket::~ServiceSocket() { (void)release(); }

UniqueFd ServiceSocket::release() noexcept {
  if (socket_.isValid() && isNamed()) ::unlink(address_.sun_path);
  return std::move(socket_);
}

bool ServiceSocket::isNamed() const noexcept {
  struct stat facts {};
  return address_.sun_path[0] != '\0' && ::lstat(address_.sun_path, &facts) == 0 && facts.st_dev == device_ &&
         facts.st_ino == inode_;
}

std::int32_t ServiceSocket::listenAt(const char* directory, const char* name) noexcept {
  const auto address = socketAddress(directory, name);
  if (!address) return BVMH_ERROR_INVALID_ARGUMENT;
  if (!makeDirectories(directory)) return BVMH_ERROR_SYSTEM;
  const char* const path = address->sun_path;

  UniqueFd socket = makeSocket(Blocking::no);
  if (!socket.isValid()) return BVMH_ERROR_SYSTEM;
  if (bindSocket(socket.get(), *address) != 0) {
    if (errno != EADDRINUSE) return BVMH_ERROR_SYSTEM;
    // Somebody's file: a live owner takes the connection, a dead one's refuses it.
    const UniqueFd probe = makeSocket(Blocking::no);
    if (!probe.isValid()) return BVMH_ERROR_SYSTEM;
    if (connectSocket(probe.get(), *address) == 0 || errno != ECONNREFUSED) return BVMH_ERROR_NAME_IN_USE;
    if (::unlink(path) != 0 && errno != ENOENT) return BVMH_ERROR_SYSTEM;
    if (bindSocket(socket.get(), *address) != 0)
      return errno == EADDRINUSE ? BVMH_ERROR_NAME_IN_USE : BVMH_ERROR_SYSTEM;
  }
  struct stat facts {};
  // Anyone may connect, whatever the umask; who may speak is decided by the credentials of the connection.
  if (::lstat(path, &facts) != 0 || ::chmod(path, 0666) != 0 || ::listen(socket.get(), kBacklog) != 0) {
    const int error = errno;
    ::unlink(path);
    errno = error;
    return BVMH_ERROR_SYSTEM;
  }
  socket_ = std::move(socket);
  address_ = *address;
  device_ = facts.st_dev;
  inode_ = facts.st_ino;
  return BVMH_OK;
}

Listener::~Listener() {
  for (ServiceSocket& each : services_) {
    if (UniqueFd socket = each.release(); socket.isValid()) turnedAway_.closeListening(std::move(socket));
  }
}

std::int32_t Listener::systemFailure() noexcept {
  systemError_ = errno;
  return BVMH_ERROR_SYSTEM;
}

std::int32_t Listener::prepare() noexcept {
  systemError_ = 0;
  if (!buffer_.ensure()) return BVMH_ERROR_NO_MEMORY;
  poll_.reset(::epoll_create1(EPOLL_CLOEXEC));
  if (!poll_.isValid() || !turnedAway_.prepare()) return systemFailure();
  epoll_event event{};
  event.events = EPOLLIN;
  event.data.u64 = kTurnedAwayKey;
  return ::epoll_ctl(poll_.get(), EPOLL_CTL_ADD, turnedAway_.readable(), &event) == 0 ? BVMH_OK
                                                                                      : systemFailure();
}

std::int32_t Listener::watch(Service service) noexcept {
  epoll_event event{};
  event.events = EPOLLIN;
  event.data.u64 = static_cast<std::uint64_t>(service);
  const int socket = services_[static_cast<std::size_t>(service)].get();
  return ::epoll_ctl(poll_.get(), EPOLL_CTL_ADD, socket, &event) == 0 ? BVMH_OK : systemFailure();
}

void Listener::setAccepting(bool isAccepting) noexcept {
  if (isAccepting_ == isAccepting) return;
  isAccepting_ = isAccepting;
  for (const Service service : {Service::pushes, Service::notifications}) {
    epoll_event event{};
    event.events = isAccepting ? std::uint32_t{EPOLLIN} : 0U;
    event.data.u64 = static_cast<std::uint64_t>(service);
    const int socket = services_[static_cast<std::size_t>(service)].get();
    if (socket >= 0) (void)::epoll_ctl(poll_.get(), EPOLL_CTL_MOD, socket, &event);
  }
}

std::int32_t Listener::open(int pushes, int notifications) noexcept {
  for (const int each : {pushes, notifications}) {
    if (each != -1 && !isLocalSocket(each, Listening::yes)) return BVMH_ERROR_INVALID_ARGUMENT;
  }
  if (pushes == notifications) return BVMH_ERROR_INVALID_ARGUMENT;
  std::int32_t code = prepare();
  for (const auto& [service, socket] :
       {std::pair(Service::pushes, pushes), std::pair(Service::notifications, notifications)}) {
    if (code != BVMH_OK || socket == -1) continue;
    code = services_[static_cast<std::size_t>(service)].adopt(socket) ? watch(service) : systemFailure();
  }
  if (code != BVMH_OK) {
    for (ServiceSocket& each : services_) each.giveBack();
  }
  return code;
}

std::int32_t Listener::open(const char* directory, unsigned services) noexcept {
  if (const std::int32_t code = prepare(); code != BVMH_OK) return code;
  struct Named {
    unsigned bit;
    Service service;
    const char* name;
  };
  for (const Named& each : {Named{BVMH_PUSHES, Service::pushes, kTelephonyServiceName},
                            Named{BVMH_NOTIFICATIONS, Service::notifications, kNotificationServiceName}}) {
    if ((services & each.bit) == 0) continue;
    ServiceSocket& socket = services_[static_cast<std::size_t>(each.service)];
    const std::int32_t code = socket.listenAt(directory, each.name);
    if (code == BVMH_ERROR_SYSTEM) return systemFailure();
    if (code != BVMH_OK) return code;
    if (const std::int32_t watched = watch(each.service); watched != BVMH_OK) return watched;
  }
  watchNames();
  return BVMH_OK;
}

// Without it, a name that is lost is not noticed, and all else works.
void Listener::watchNames() noexcept {
  names_.reset(::inotify_init1(IN_CLOEXEC | IN_NONBLOCK));
  if (!names_.isValid()) return;
  for (const ServiceSocket& each : services_) {
    // A file that is removed while somebody has it open changes its attributes, its number of links.
    if (each.path()[0] != '\0')
      ::inotify_add_watch(names_.get(), each.path(),
                          IN_ATTRIB | IN_MOVE_SELF | IN_DELETE_SELF | IN_DONT_FOLLOW);
  }
  epoll_event event{};
  event.events = EPOLLIN;
  event.data.u64 = kNamesKey;
  if (::epoll_ctl(poll_.get(), EPOLL_CTL_ADD, names_.get(), &event) != 0) names_.reset();
}

bool Listener::hasLostName() noexcept {
  alignas(inotify_event) std::array<char, 1024> events;
  // Only that something happened counts; the file itself is looked at.
  while (::read(names_.get(), events.data(), events.size()) > 0) {
  }
  bool isNew = false;
  for (std::size_t i = 0; i < services_.size(); ++i) {
    const bool isLost = services_[i].path()[0] != '\0' && !services_[i].isNamed();
    isNew = isNew || (isLost && !hasLostName_[i]);
    hasLostName_[i] = isLost;
  }
  return isNew;
}

std::int32_t Listener::accept(Service service) noexcept {
  // Too much of strangers' waits to be closed: the next one's could be neither kept nor closed.
  if (!turnedAway_.hasRoom()) {
    setAccepting(false);
    return BVMH_OK;
  }
  UniqueFd socket(::accept4(services_[static_cast<std::size_t>(service)].get(), nullptr, nullptr,
                            SOCK_CLOEXEC | SOCK_NONBLOCK));
  if (!socket.isValid()) {
    const bool isOver = errno == EAGAIN || errno == EINTR || errno == ECONNABORTED;
    return isOver ? BVMH_OK : systemFailure();
  }
  const auto peer = peerOf(socket.get());
  if (!peer || (peer->uid != 0 && peer->uid != ::geteuid() && peer->uid != allowedUid_)) {
    turnedAway_.close(std::move(socket));
    return BVMH_OK;
  }
  // All places taken: the oldest connection has had its time.
  const auto place = std::min_element(
      connections_.begin(), connections_.end(), [](const Connection& a, const Connection& b) {
        return (a.socket.isValid() ? a.serial : 0) < (b.socket.isValid() ? b.serial : 0);
      });
  *place = Connection{std::move(socket), service, ++lastSerial_, peer->uid, peer->pid};
  epoll_event event{};
  event.events = EPOLLIN;
  event.data.u64 = kFirstConnectionKey + static_cast<std::uint64_t>(place - connections_.begin());
  if (::epoll_ctl(poll_.get(), EPOLL_CTL_ADD, place->socket.get(), &event) != 0) {
    const std::int32_t code = systemFailure();
    *place = Connection{};
    return code;
  }
  return BVMH_OK;
}

std::int32_t Listener::next(Deadline deadline, bvmh_event* event) noexcept {
  *event = bvmh_event{};
  systemError_ = 0;
  for (int overtime = 0;; overtime += deadline.hasPassed() ? 1 : 0) {
    if (overtime > kMaxOvertime) return BVMH_ERROR_TIMED_OUT;
    epoll_event ready{};
    const int count = ::epoll_wait(poll_.get(), &ready, 1, deadline.millisecondsForPoll());
    if (count < 0 && errno != EINTR) return systemFailure();
    if (count <= 0) {
      if (deadline.hasPassed()) return BVMH_ERROR_TIMED_OUT;
      continue;
    }
    std::int32_t code = BVMH_OK;
    if (serve(ready.data.u64, event, &code)) return code;
  }
}

bool Listener::serve(std::uint64_t key, bvmh_event* event, std::int32_t* code) noexcept {
  if (key == kNamesKey) {
    *code = BVMH_ERROR_NAME_LOST;
    return hasLostName();
  }
  if (key == kTurnedAwayKey) {
    turnedAway_.wasTold();
    setAccepting(true);
    return false;
  }
  if (key < kFirstConnectionKey) {
    *code = accept(static_cast<Service>(key));
    return *code != BVMH_OK;
  }
  return read(connections_[key - kFirstConnectionKey], event, code);
}

bool Listener::read(Connection& connection, bvmh_event* event, std::int32_t* code) noexcept {
  if (!buffer_.ensure()) {
    *code = BVMH_ERROR_NO_MEMORY;
    return true;
  }
  const Deadline now = Deadline::in(std::chrono::milliseconds(0));
  switch (receiveMessage(connection.socket.get(), buffer_.bytes(), now, Waiting::byPoll, &incoming_)) {
    case Io::done:
      break;
    case Io::timedOut:
      return false;
    default:
      connection = Connection{};
      return false;
  }
  const bool isForCaller =
      incoming_.length >= sizeof(MessageHeader) &&
      (connection.service == Service::pushes ? readPush(connection, event, code)
                                             : readNotification(connection, event, code));
  incoming_ = Incoming{};
  if (isForCaller) {
    event->sender_uid = connection.uid;
    event->sender_pid = connection.pid;
  }
  return isForCaller;
}

void Listener::refuse(const Connection& connection, const MessageHeader& request,
                      KernelReturn code) noexcept {
  if (request.replyPort == kNullPort) return;
  StatusReply reply{};
  reply.header = replyHeader(sizeof reply, request.replyPort, request.id);
  reply.ndr = kNdrRecord;
  reply.returnCode = code;
  (void)sendReply(connection.socket.get(), reply);  // a sender that has gone wants no answer
}

bool Listener::readPush(const Connection& connection, bvmh_event* event, std::int32_t* code) noexcept {
  const std::span<const std::byte> datagram = buffer_.bytes().first(incoming_.length);
  const auto header = readAs<MessageHeader>(datagram);
  const auto refused = [&](KernelReturn refusal) {
    refuse(connection, header, refusal);
    return false;
  };
  if (incoming_.isCut) return refused(mig::badArguments);
  if (header.id != kSetCivicInfoMessageId && header.id != kSetLocalRoutableAddressMessageId)
    return refused(mig::badId);
  if ((header.bits & kComplexBit) == 0 || datagram.size() < sizeof(TelephonyPushMessage))
    return refused(mig::badArguments);
  const auto request = readAs<TelephonyPushMessage>(datagram);
  if (request.descriptorCount != 1) return refused(mig::badArguments);
  if (request.values.type != kOutOfLineDescriptorType) return refused(mig::typeError);
  const auto place = placeOfRegion(datagram, sizeof request, incoming_);
  if (!place) return refused(mig::badArguments);
  bvmh_region region{};
  const std::int32_t taken = takeRegion(*place, buffer_, incoming_, &region);
  if (taken == BVMH_ERROR_PROTOCOL) return refused(mig::badArguments);
  if (taken != BVMH_OK) {
    *code = taken;
    return true;
  }
  event->kind = header.id == kSetCivicInfoMessageId ? BVMH_EVENT_CIVIC_INFO : BVMH_EVENT_LOCAL_ADDRESS;
  event->payload = region;
  event->wants_reply = header.replyPort != kNullPort;
  event->connection = connection.serial;
  event->reply_port = header.replyPort;
  event->message_id = header.id;
  return true;
}

bool Listener::readNotification(const Connection& connection, bvmh_event* event,
                                std::int32_t* code) noexcept {
  const auto header = readAs<MessageHeader>(buffer_.bytes());
  if (header.id != kNotificationMessageId || incoming_.isCut || incoming_.descriptorCount != 0) {
    refuse(connection, header, header.id != kNotificationMessageId ? mig::badId : mig::badArguments);
    return false;
  }
  RegionPlace place;
  place.size = static_cast<std::uint32_t>(incoming_.length - sizeof header);
  place.offset = sizeof header;
  *code = takeRegion(place, buffer_, incoming_, &event->payload);
  event->kind = BVMH_EVENT_NOTIFICATION;
  return true;
}

std::int32_t Listener::reply(const bvmh_event& event, std::int32_t domain, std::int32_t code) noexcept {
  if (!event.wants_reply) return BVMH_ERROR_INVALID_ARGUMENT;
  const auto connection = std::find_if(connections_.begin(), connections_.end(), [&](const Connection& each) {
    return each.socket.isValid() && each.serial == event.connection;
  });
  if (connection == connections_.end()) return BVMH_ERROR_NO_LONGER_THERE;
  TelephonyPushReply reply{};
  reply.header = replyHeader(sizeof reply, event.reply_port, event.message_id);
  reply.ndr = kNdrRecord;
  reply.returnCode = code;
  reply.result = std::uint64_t{static_cast<std::uint32_t>(code)} << 32 | static_cast<std::uint32_t>(domain);
  return sendReply(connection->socket.get(), reply) ? BVMH_OK : BVMH_ERROR_NO_LONGER_THERE;
}

}  // namespace brenvik::client

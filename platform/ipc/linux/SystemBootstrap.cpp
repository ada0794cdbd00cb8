// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/ipc/linux/SystemBootstrap.h"

#include <fcntl.h>
#include <grp.h>
#include <poll.h>
#include <sys/file.h>
#include <sys/ioctl.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <cstring>
#include <filesystem>
#include <optional>
#include <system_error>
#include <thread>
#include <vector>

#include "platform/datagram/LocalSocket.h"
#include "platform/ipc/linux/ServiceManagerSocket.h"
#include "platform/log/Log.h"

namespace brenvik {
namespace {

// Two instances that start together settle who is first under a lock; the loser waits about as long as a
// start takes, not for ever.
constexpr int kLockTries = 100;
constexpr std::chrono::milliseconds kLockPause{10};

// Another process than our child; its number may have been given to a new process, which then counts.
bool hasEnded(pid_t process) noexcept {
  const UniqueFd handle(static_cast<int>(::syscall(SYS_pidfd_open, process, 0U)));
  if (!handle.isValid()) return errno == ESRCH;
  pollfd ending{handle.get(), POLLIN, 0};
  return ::poll(&ending, 1, 0) > 0;
}

enum class Listener { none, alive, ended };

// Who listens behind a socket file. Only a refusal says that nobody does: a full backlog, another kind of
// socket and a probe that cannot be made at all leave the file where it is.
Listener listenerAt(const sockaddr_un& address) noexcept {
  const UniqueFd probe = makeSocket(Blocking::no);
  if (connectSocket(probe.get(), address) != 0) {
    return errno == ECONNREFUSED || errno == ENOENT ? Listener::none : Listener::alive;
  }
  const auto peer = peerOf(probe.get());
  // 0: a process that this one's namespace does not show
  return peer && peer->pid != 0 && hasEnded(peer->pid) ? Listener::ended : Listener::alive;
}

// A process that is killed while it makes a child leaves that child with copies of its descriptors until the
// child becomes another program: nobody serves the socket then, and it is closed in a moment.
bool isServed(const sockaddr_un& address) noexcept {
  for (int i = 0; i < kLockTries; ++i) {
    const Listener listener = listenerAt(address);
    if (listener != Listener::ended) return listener == Listener::alive;
    std::this_thread::sleep_for(kLockPause);
  }
  return true;  // whoever has it now keeps it
}

// The group's number; root's when there is no such group. Nothing when that cannot be found out.
std::optional<gid_t> numberOf(const std::string& group) {
  for (std::vector<char> room(1024);; room.resize(2 * room.size())) {
    struct group entry {};
    struct group* found = nullptr;
    const int error = ::getgrnam_r(group.c_str(), &entry, room.data(), room.size(), &found);
    if (found != nullptr) return found->gr_gid;
    switch (error) {
      case ERANGE:  // a group with many members
        continue;
      case 0:
      case ENOENT:
      case ESRCH:
        return gid_t{0};
      default:
        errno = error;
        return std::nullopt;
    }
  }
}

bool lockWithin(int fd) noexcept {
  for (int i = 0; i < kLockTries; ++i) {
    if (::flock(fd, LOCK_EX | LOCK_NB) == 0) return true;
    if (errno != EWOULDBLOCK && errno != EINTR) return false;
    std::this_thread::sleep_for(kLockPause);
  }
  return false;
}

}  // namespace

// Nobody but its owner may connect before this: bind(2) leaves out what the umask does, and the umask is 022.
bool SystemBootstrap::openToGroup(const std::string& path) const {
  if (::geteuid() == 0) {
    const auto group = numberOf(group_);
    if (!group) return false;
    if (::lchown(path.c_str(), 0, *group) != 0) {
      // A number that this process's user namespace has not is no group, either.
      if (errno != EINVAL || ::lchown(path.c_str(), 0, 0) != 0) return false;
    }
  }
  return ::chmod(path.c_str(), 0660) == 0;
}

UniqueFd SystemBootstrap::listenAt(const std::string& path, const char* serviceName) {
  const auto address = socketAddress(path);
  if (!address) {
    logUnified(LogLevel::error, "%s: the path is too long for a socket", path.c_str());
    return {};
  }

  std::error_code error;
  std::filesystem::create_directories(directory_, error);
  const std::string lockPath = directory_ + "/." + serviceName + ".lock";
  const UniqueFd lock(::open(lockPath.c_str(), O_RDWR | O_CREAT | O_CLOEXEC | O_NOFOLLOW, 0600));
  if (!lock.isValid() || !lockWithin(lock.get())) {
    logUnified(LogLevel::error, "cannot lock %s: %s", lockPath.c_str(), std::strerror(errno));
    return {};
  }

  struct stat status {};
  if (::lstat(path.c_str(), &status) == 0) {
    if (!S_ISSOCK(status.st_mode)) {
      logUnified(LogLevel::error, "%s is not a socket, and stays as it is", path.c_str());
      return {};
    }
    if (isServed(*address)) {
      logUnified(LogLevel::error, "another process already serves %s", path.c_str());
      return {};
    }
    ::unlink(path.c_str());
  }

  UniqueFd socket = makeSocket(Blocking::yes);
  if (!socket.isValid() || bindSocket(socket.get(), *address) != 0 || !openToGroup(path) ||
      ::listen(socket.get(), SOMAXCONN) != 0) {
    logUnified(LogLevel::error, "cannot listen at %s: %s", path.c_str(), std::strerror(errno));
    return {};
  }
  return socket;
}

KernelReturn SystemBootstrap::checkIn(const char* serviceName, PortName* receiveRight) noexcept {
  *receiveRight = kNullPort;
  try {
    std::string path;
    UniqueFd socket = takeServiceManagerSocket(serviceName);
    if (!socket.isValid()) {
      path = directory_ + "/" + serviceName;
      socket = listenAt(path, serviceName);
    }
    if (!socket.isValid()) return kern::noAccess;
    // Before the first accept: a message that is already there would otherwise come without credentials.
    if (!askForCredentials(socket.get())) return kern::failure;
    const int on = 1;
    if (::ioctl(socket.get(), FIONBIO, &on) != 0) return kern::failure;
    *receiveRight = ports_.adoptService(std::move(socket), std::move(path));
    return *receiveRight == kNullPort ? kern::resourceShortage : kern::success;
  } catch (const std::bad_alloc&) {
    return kern::resourceShortage;
  }
}

}  // namespace brenvik

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/ipc/linux/StatusSocket.h"

#include <sys/socket.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <new>
#include <utility>

#include "interface/status/Status.h"
#include "platform/datagram/LocalSocket.h"
#include "platform/log/Log.h"

namespace brenvik {
namespace {

// Who asks once waits in no queue; more of them wait in the kernel's, or try again.
constexpr int kBacklog = 16;

// Connections taken in a row, and after a pause: at most 80 a second once there is one, whoever asks.
constexpr int kBudget = 4;
constexpr std::chrono::milliseconds kPause = RefusalLimit::kOneMoreEvery;

// The closing line is the door's before it is anybody else's.
constexpr std::size_t kRoomForTheDoor = ClosingLine::kCapacity * 3 / 4;

}  // namespace

std::unique_ptr<StatusSocket> StatusSocket::make(SystemPortSpace& ports, RunLoop& loop,
                                                 const std::string& servicePath,
                                                 std::function<std::string()> answer, Now now) {
  std::unique_ptr<StatusSocket> made(new StatusSocket(
      ports, loop, servicePath + std::string(kStatusSocketSuffix), std::move(answer), std::move(now)));
  if (made->listen(servicePath)) return made;
  logUnified(LogLevel::info, "no status at %s: %s", made->path_.c_str(), std::strerror(errno));
  return nullptr;
}

StatusSocket::StatusSocket(SystemPortSpace& ports, RunLoop& loop, std::string path,
                           std::function<std::string()> answer, Now now)
    : ports_(ports), loop_(loop), path_(std::move(path)), answer_(std::move(answer)), now_(std::move(now)) {}

// errno says what failed.
bool StatusSocket::listen(const std::string& servicePath) {
  const auto address = socketAddress(path_);
  if (!address) {
    errno = ENAMETOOLONG;
    return false;
  }
  struct stat facts {};
  if (::lstat(path_.c_str(), &facts) == 0) {
    if (!S_ISSOCK(facts.st_mode)) {
      errno = EEXIST;
      return false;
    }
    // Of a helper that was killed: another one that lives would hold the service socket.
    if (::unlink(path_.c_str()) != 0) return false;
  }
  UniqueFd socket = makeSocket(Blocking::no);
  if (!socket.isValid() || bindSocket(socket.get(), *address) != 0) return false;
  if (::lstat(path_.c_str(), &facts) == 0) inode_ = facts.st_ino;
  // Closing it drops what was sent over connections that nobody has accepted.
  listening_ = ports_.shareForeign(std::move(socket), ClosingLine::kClients);
  // Nobody but its owner may connect before this: bind(2) leaves out what the umask does, and the umask is
  // 022.
  if (::geteuid() == 0) {
    const bool isServiceThere = ::stat(servicePath.c_str(), &facts) == 0;
    if (::lchown(path_.c_str(), 0, isServiceThere ? facts.st_gid : 0) != 0) return false;
  }
  if (::chmod(path_.c_str(), 0660) != 0 || ::listen(listening_->get(), kBacklog) != 0) return false;
  source_ = loop_.addDescriptor(listening_->get(), Interest::reading, [this](Readiness) { acceptReady(); });
  return source_ != nullptr;
}

StatusSocket::~StatusSocket() {
  source_.reset();
  struct stat facts {};
  // Another instance may have put its own socket there since.
  if (inode_ != 0 && ::lstat(path_.c_str(), &facts) == 0 && facts.st_ino == inode_) ::unlink(path_.c_str());
}

void StatusSocket::acceptReady() {
  for (int i = 0; i < kBudget; ++i) {
    // A connection can leave a message that only the line may close.
    if (!ports_.closing().hasRoomFor(kRoomForTheDoor)) return pause();
    if (!acceptOne()) return;
  }
  pause();
}

// False when there is nobody, or accepting pauses.
bool StatusSocket::acceptOne() {
  UniqueFd connection(::accept4(listening_->get(), nullptr, nullptr, SOCK_CLOEXEC));
  if (!connection.isValid()) {
    if (errno == EINTR || errno == ECONNABORTED) return true;
    // The head of the queue would wake us for ever.
    if (errno != EAGAIN && errno != EWOULDBLOCK) pause();
    return false;
  }
  if (tell(std::move(connection))) return true;
  pause();
  return false;
}

// False when the account has asked too often.
bool StatusSocket::tell(UniqueFd connection) {
  const ucred peer = peerOf(connection.get()).value_or(ucred{});
  // From here on what the peer may have sent is closed where nobody waits for it.
  const auto shared = ports_.share(std::move(connection), peer.uid);
  if (!limit_.allows(peer.uid, now_())) return false;
  limit_.refused(peer.uid, now_());  // counts what is answered here
  const std::string text = answer_();
  // It fits: nothing was sent before. Whoever does not read keeps it, and this process has forgotten it.
  (void)::send(shared->get(), text.data(), text.size(), MSG_DONTWAIT | MSG_NOSIGNAL);
  return true;
}

void StatusSocket::pause() {
  tick_ = loop_.addTimer(
      kPause, std::chrono::nanoseconds(0),
      [this] {
        (void)source_->setInterest(Interest::reading);
        acceptReady();
      },
      [] {});
  if (tick_ != nullptr) (void)source_->setInterest(Interest::none);
}

}  // namespace brenvik

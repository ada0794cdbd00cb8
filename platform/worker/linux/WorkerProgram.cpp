// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/worker/linux/WorkerProgram.h"

#include <limits.h>
#include <poll.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <csignal>
#include <new>
#include <utility>

#include "platform/base/ErrorText.h"
#include "platform/base/Spawn.h"
#include "platform/datagram/LocalSocket.h"
#include "platform/log/Log.h"

namespace brenvik {
namespace {

using std::chrono::milliseconds;

// A process that waits in the kernel for somebody's file system outlives its SIGKILL. With so many of them,
// no further worker is started.
constexpr std::size_t kMaxDying = 8;
// How long a worker that was killed, or has closed its end, is waited for, on the caller's thread: a hundred
// times what it takes.
constexpr milliseconds kToBeReaped{20};
// A worker leaves as soon as its connection hangs up, in about a millisecond.
constexpr milliseconds kToLeave{250};

bool hasHungUp(const WorkerChannel& channel, milliseconds patience) noexcept {
  pollfd waited{channel.descriptor(), 0, 0};
  return ::poll(&waited, 1, static_cast<int>(patience.count())) > 0 && (waited.revents & POLLHUP) != 0;
}

}  // namespace

std::vector<std::string> workerProgramFolders() {
  std::vector<std::string> folders;
  std::array<char, PATH_MAX> program{};
  const auto size = ::readlink("/proc/self/exe", program.data(), program.size() - 1);
  if (size > 0) {
    const std::string path(program.data(), static_cast<std::size_t>(size));
    folders.push_back(path.substr(0, path.rfind('/')));
  }
  folders.emplace_back(BRENVIK_WORKER_DIRECTORY);
  return folders;
}

WorkerProgram::WorkerProgram(Description description, std::function<Clock::time_point()> now)
    : description_(std::move(description)), now_(std::move(now)) {
  dying_.reserve(kMaxDying);
}

WorkerProgram::~WorkerProgram() { endWorker(kToLeave); }

bool WorkerProgram::mayLog() noexcept {
  if (isSilent_) return false;
  const auto now = now_();
  if (linesPaidUntil_ > now + (kLinesInARow - 1) * kOneMoreLineEvery) return false;
  linesPaidUntil_ = std::max(linesPaidUntil_, now) + kOneMoreLineEvery;
  return true;
}

WorkerResult WorkerProgram::open(std::uint32_t work, WorkerChannel* channel) noexcept {
  channel->close();
  if (!WorkerChannel::hasRoomToDistrust()) {
    const std::lock_guard lock(mutex_);
    if (mayLog())
      logUnified(LogLevel::error, "%s is not asked: too much of what workers sent cannot be closed",
                 description_.program.c_str());
    return WorkerResult::unavailable;
  }
  WorkerChannel ours;
  WorkerChannel theirs;
  if (const WorkerResult made = WorkerChannel::makePair(&ours, &theirs); made != WorkerResult::done)
    return made;
  try {
    WorkerMessage message;
    message.kind = work;
    message.descriptors.push_back(theirs.release());
    const std::lock_guard lock(mutex_);
    for (int attempt = 0; attempt < 2; ++attempt) {
      if (!connection_.isOpen()) {
        if (const WorkerResult reached = reach(); reached != WorkerResult::done) return reached;
      }
      const WorkerResult sent = connection_.send(message);
      if (sent == WorkerResult::done) {
        ours.setGeneration(generation_);
        ours.distrust();
        *channel = std::move(ours);
        return WorkerResult::done;
      }
      if (sent != WorkerResult::closed) return sent;
      if (mayLog()) logUnified(LogLevel::error, "%s has died", description_.program.c_str());
      endWorker(kToBeReaped);
    }
    return WorkerResult::unavailable;
  } catch (const std::bad_alloc&) {
    return WorkerResult::outOfMemory;
  }
}

void WorkerProgram::start() noexcept {
  if (!WorkerChannel::hasRoomToDistrust()) return;
  const std::lock_guard lock(mutex_);
  if (connection_.isOpen()) return;
  isSilent_ = true;
  try {
    (void)reach();
  } catch (const std::bad_alloc&) {  // open() tells
  }
  isSilent_ = false;
}

bool WorkerProgram::isRunning() const noexcept {
  const std::unique_lock lock(mutex_, std::try_to_lock);
  return !lock.owns_lock() || (connection_.isOpen() && !hasHungUp(connection_, milliseconds(0)));
}

void WorkerProgram::giveUp(WorkerChannel* channel) noexcept {
  WorkerChannel given = std::move(*channel);
  const std::lock_guard lock(mutex_);
  if (!given.isOpen() || given.generation() != generation_ || !connection_.isOpen()) return;
  // A process that ends closes one descriptor after the other. One that lives keeps its main connection.
  const milliseconds patience = hasHungUp(given, milliseconds(0)) ? kToBeReaped : milliseconds(0);
  const bool hasDied = hasHungUp(connection_, patience);
  if (mayLog()) {
    if (hasDied)
      logUnified(LogLevel::error, "%s has died", description_.program.c_str());
    else
      logUnified(LogLevel::error, "%s does not answer as it should, and is ended",
                 description_.program.c_str());
  }
  endWorker(milliseconds(0));
}

// Hangs up; a child that is still there after that time is killed.
void WorkerProgram::endWorker(milliseconds mayTake) noexcept {
  connection_.close();
  Child child = std::exchange(child_, {});
  if (child.pid <= 0 || isReaped(child, mayTake)) return;
  (void)::kill(child.pid, SIGKILL);  // its number is its own until it is reaped
  if (isReaped(child, kToBeReaped)) return;
  dying_.push_back(std::move(child));
}

bool WorkerProgram::isReaped(const Child& child, milliseconds patience) noexcept {
  pollfd gone{child.process.get(), POLLIN, 0};
  if (child.process.isValid() && patience.count() > 0)
    (void)::poll(&gone, 1, static_cast<int>(patience.count()));
  const pid_t reaped = ::waitpid(child.pid, nullptr, WNOHANG);
  return reaped == child.pid || (reaped < 0 && errno == ECHILD);
}

WorkerResult WorkerProgram::reach() {
  std::erase_if(dying_, [](const Child& child) { return isReaped(child, milliseconds(0)); });
  WorkerResult reached = connectToService();
  if (reached == WorkerResult::closed) reached = startChild();
  if (reached != WorkerResult::done) return reached;
  connection_.distrust();
  ++generation_;
  return reached;
}

// `closed` when nobody listens.
WorkerResult WorkerProgram::connectToService() {
  const auto address = socketAddress(description_.bootstrap, description_.service);
  if (!address) return WorkerResult::closed;
  UniqueFd socket = makeSocket(Blocking::no);
  if (!socket.isValid()) return WorkerResult::outOfMemory;
  int error = 0;
  if (connectSocket(socket.get(), *address) != 0) {
    error = errno;
    if ((error == ENOENT || error == ECONNREFUSED) && !description_.isOnlyService)
      return WorkerResult::closed;
  } else {
    const auto peer = peerOf(socket.get());
    if (!peer) error = errno;
    // Whoever listens was root's service manager; its folder is root's anyway.
    if (peer && peer->uid != 0 && peer->uid != ::geteuid()) error = EACCES;
  }
  if (error != 0) {
    if (mayLog())
      logUnified(LogLevel::error, "cannot connect to %s: %s", address->sun_path, describeError(error));
    return WorkerResult::unavailable;
  }
  connection_ = WorkerChannel(std::move(socket));
  return WorkerResult::done;
}

WorkerResult WorkerProgram::startChild() {
  WorkerChannel ours;
  WorkerChannel theirs;
  if (const WorkerResult made = WorkerChannel::makePair(&ours, &theirs); made != WorkerResult::done)
    return made;
  int error = EAGAIN;
  if (dying_.size() < kMaxDying) {
    for (const std::string& folder :
         description_.folders.empty() ? workerProgramFolders() : description_.folders) {
      error = startProgram(folder + "/" + description_.program, theirs.descriptor());
      if (error == 0) {
        connection_ = std::move(ours);
        return WorkerResult::done;
      }
      if (error != ENOENT && error != ENOTDIR) break;
    }
  }
  if (mayLog())
    logUnified(LogLevel::error, "cannot start %s: %s", description_.program.c_str(), describeError(error));
  return error == ENOMEM || error == EMFILE || error == ENFILE ? WorkerResult::outOfMemory
                                                               : WorkerResult::unavailable;
}

// With its end of the connection as standard input, and no other descriptor of this process than standard
// error. That may be a terminal, so the worker has a session of its own: whoever has a terminal as its
// session's can type into it. Nor has it this process's folder, to which it could not walk by itself.
int WorkerProgram::startProgram(const std::string& path, int theirs) {
  Spawn spawn;
  spawn.give(theirs, STDIN_FILENO);
  spawn.giveNothing(STDOUT_FILENO);
  spawn.enterFolder("/");
  spawn.startSession();
  std::string name = description_.program;
  char* const arguments[] = {name.data(), nullptr};
  char* const environment[] = {nullptr};
  pid_t pid = -1;
  if (const int error = spawn.start(path.c_str(), arguments, environment, &pid); error != 0) return error;
  child_.pid = pid;
  child_.process.reset(static_cast<int>(::syscall(SYS_pidfd_open, pid, 0)));
  return 0;
}

}  // namespace brenvik

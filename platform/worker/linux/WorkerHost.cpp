// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/worker/linux/WorkerHost.h"

#include <fcntl.h>
#include <poll.h>
#include <sys/ioctl.h>
#include <unistd.h>

#include <cerrno>
#include <csignal>
#include <new>
#include <utility>
#include <vector>

#include "platform/base/Environment.h"
#include "platform/datagram/LocalSocket.h"
#include "platform/ipc/linux/ServiceManagerSocket.h"
#include "platform/log/Log.h"

namespace brenvik {
namespace {

using Clock = std::chrono::steady_clock;

bool isRoots(int connection) noexcept {
  const auto peer = peerOf(connection);
  return peer && peer->uid == 0;
}

// Standard input, which is taken away, when the helper has put its connection there.
UniqueFd takeInheritedConnection() noexcept {
  if (!isChannelSocket(STDIN_FILENO)) return {};
  UniqueFd connection(::fcntl(STDIN_FILENO, F_DUPFD_CLOEXEC, STDERR_FILENO + 1));
  if (!connection.isValid()) return {};
  const UniqueFd nothing(::open("/dev/null", O_RDWR | O_CLOEXEC));
  if (!nothing.isValid() || ::dup2(nothing.get(), STDIN_FILENO) < 0) return {};
  return connection;
}

class Connections {
 public:
  explicit Connections(const WorkerHost::Serve& serve) : serve_(serve) {}

  bool isEmpty() const noexcept { return channels_.empty(); }
  void add(WorkerChannel connection) { channels_.push_back(std::move(connection)); }

  // Serves what comes on them and on the listening socket, which may be invalid, until the last has hung up.
  // False when nothing can be waited for.
  bool run(const UniqueFd& listening) {
    do {
      std::vector<pollfd> waited;
      for (const WorkerChannel& channel : channels_) waited.push_back({channel.descriptor(), POLLIN, 0});
      // One that is full of connections leaves the others in the socket.
      if (listening.isValid() && channels_.size() < WorkerHost::kMaxConnections)
        waited.push_back({listening.get(), POLLIN, 0});
      if (waited.empty()) return false;
      if (::poll(waited.data(), waited.size(), -1) < 0) {
        if (errno == EINTR) continue;
        return false;
      }
      for (std::size_t i = channels_.size(); i-- > 0;) {
        if (waited[i].revents != 0 && !take(channels_[i]))
          channels_.erase(channels_.begin() + static_cast<std::ptrdiff_t>(i));
      }
      if (listening.isValid() && waited.back().fd == listening.get() && waited.back().revents != 0)
        accept(listening);
    } while (!channels_.empty());
    return true;
  }

 private:
  void accept(const UniqueFd& listening) {
    UniqueFd connection(::accept4(listening.get(), nullptr, nullptr, SOCK_CLOEXEC));
    if (connection.isValid() && isRoots(connection.get())) add(WorkerChannel(std::move(connection)));
  }

  // False when the connection is over.
  bool take(WorkerChannel& connection) {
    WorkerMessage message;
    const WorkerResult result = connection.receive(&message, Clock::now());
    if (result == WorkerResult::closed) return false;
    if (result != WorkerResult::done || message.descriptors.size() != 1 || !message.payload.empty() ||
        !isChannelSocket(message.descriptors[0].get())) {
      return true;  // the channel that it may have been about is closed with the message
    }
    try {
      serve_(message.kind, WorkerChannel(std::move(message.descriptors[0])));
    } catch (const std::bad_alloc&) {  // the channel is closed
    }
    return true;
  }

  const WorkerHost::Serve& serve_;
  std::vector<WorkerChannel> channels_;
};

}  // namespace

void WorkerHost::serveConnection(WorkerChannel connection, const Serve& serve) noexcept {
  try {
    Connections connections(serve);
    connections.add(std::move(connection));
    (void)connections.run({});
  } catch (const std::bad_alloc&) {  // the connection closes
  }
}

int WorkerHost::run(const Description& description, const Serve& serve) noexcept {
  clearEnvironmentExcept({"LISTEN_PID", "LISTEN_FDS", "LISTEN_FDNAMES"});
  (void)std::signal(SIGPIPE, SIG_IGN);
  (void)std::signal(SIGXFSZ, SIG_IGN);
  try {
    const UniqueFd listening = takeServiceManagerSocket(description.service.c_str());
    UniqueFd connection = listening.isValid() ? UniqueFd() : takeInheritedConnection();
    if (!listening.isValid() && !connection.isValid()) {
      logUnified(LogLevel::error, "%s is a service for the helper, which starts it",
                 description.service.c_str());
      return 1;
    }
    const int on = 1;
    if (listening.isValid())
      (void)::ioctl(listening.get(), FIONBIO, &on);  // one that went away is not waited for
    if (const char* const why = giveUpRights(description.rights); why != nullptr) {
      logUnified(LogLevel::error, "%s does not run: %s", description.service.c_str(), why);
      return 1;
    }
    Connections connections(serve);
    if (connection.isValid()) connections.add(WorkerChannel(std::move(connection)));
    while (connections.run(listening) && description.staysForTheNext) {
    }
    return 0;
  } catch (const std::bad_alloc&) {
    return 1;
  }
}

}  // namespace brenvik

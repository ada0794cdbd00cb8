// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
// A worker for tests. What it does with a channel is the sort of work; each runs on a thread of its own.
#include <fcntl.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <unistd.h>

#include <cerrno>
#include <filesystem>
#include <fstream>
#include <string>
#include <thread>
#include <utility>

#include "platform/datagram/SealedMemory.h"
#include "platform/log/linux/SystemLog.h"
#include "platform/worker/WorkerFields.h"
#include "platform/worker/linux/WorkerHost.h"
#include "testing/Works.h"

namespace brenvik {
namespace {

constexpr auto kForEver = std::chrono::steady_clock::time_point::max();

std::string statusLine(const std::string& name) {
  std::ifstream status("/proc/self/status");
  for (std::string line; std::getline(status, line);) {
    if (!line.starts_with(name + ":")) continue;
    const auto first = line.find_first_not_of(" \t", name.size() + 1);
    return first == std::string::npos ? std::string() : line.substr(first);
  }
  return {};
}

std::uint32_t openDescriptors() {
  std::uint32_t count = 0;
  for (int fd = 0; fd < 1024; ++fd) {
    if (::fcntl(fd, F_GETFD) >= 0) ++count;
  }
  return count;
}

// 0: there is such a socket.
std::uint32_t socketError(int family) {
  const UniqueFd socket(::socket(family, SOCK_DGRAM | SOCK_CLOEXEC, 0));
  return socket.isValid() ? 0 : static_cast<std::uint32_t>(errno);
}

void report(WorkerChannel& channel) {
  rlimit descriptors{};
  (void)::getrlimit(RLIMIT_NOFILE, &descriptors);
  std::uint32_t variables = 0;
  for (char** each = environ; each != nullptr && *each != nullptr; ++each) ++variables;
  WorkerMessage message;
  message.payload = FieldWriter()
                        .u32(::getuid())
                        .u32(::getgid())
                        .text(statusLine("Groups"))
                        .text(statusLine("CapPrm"))
                        .text(statusLine("NoNewPrivs"))
                        .u32(openDescriptors())
                        .u32(variables)
                        .u64(descriptors.rlim_max)
                        .u32(socketError(AF_INET))
                        .u32(socketError(AF_NETLINK))
                        .u32(socketError(AF_UNIX))
                        .boolean(::getsid(0) == ::getpid())
                        .text(std::filesystem::current_path().string())
                        .take();
  (void)channel.send(message);
}

void sendMemory(WorkerChannel& channel, bool isSealed) {
  WorkerMessage message;
  message.descriptors.push_back(makeSealableMemory("answer"));
  const std::string text(100'000, 'x');
  if (::write(message.descriptors[0].get(), text.data(), text.size()) != static_cast<ssize_t>(text.size()))
    return;
  if (isSealed && !sealMemory(message.descriptors[0].get())) return;
  (void)channel.send(message);
}

void work(std::uint32_t kind, WorkerChannel channel) {
  WorkerMessage message;
  switch (static_cast<WorkForTests>(kind)) {
    case WorkForTests::echo:
      while (channel.receive(&message, kForEver) == WorkerResult::done &&
             channel.send(message) == WorkerResult::done) {
      }
      return;
    case WorkForTests::die:
      (void)channel.receive(&message, kForEver);
      ::_exit(9);
    case WorkForTests::hang:
      for (;;) ::pause();
    case WorkForTests::report:
      return report(channel);
    case WorkForTests::sealedMemory:
      return sendMemory(channel, true);
    case WorkForTests::openMemory:
      return sendMemory(channel, false);
  }
}

}  // namespace
}  // namespace brenvik

int main() {
  brenvik::SystemLog log("worker-for-tests");
  brenvik::setLogSink(&log);
  const int status = brenvik::WorkerHost::run(
      {.service = "org.test.worker",
       .rights = {.accounts = {}, .otherwise = 65534, .keptCapabilities = {}, .isLocalOnly = true}},
      [](std::uint32_t kind, brenvik::WorkerChannel channel) {
        std::thread(brenvik::work, kind, std::move(channel)).detach();
      });
  ::_exit(status);
}

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/geo/linux/HostResolver.h"

#include <poll.h>
#include <sys/eventfd.h>

#include <atomic>
#include <cstring>
#include <memory>
#include <mutex>
#include <new>
#include <system_error>
#include <thread>
#include <utility>

#include "platform/base/UniqueFd.h"

namespace brenvik {
namespace {

std::vector<SocketAddress> addressesOf(const HostAndPort& server, int flags) {
  addrinfo hints{};
  hints.ai_family = AF_UNSPEC;
  hints.ai_socktype = SOCK_DGRAM;
  hints.ai_flags = flags | AI_NUMERICSERV;
  addrinfo* list = nullptr;
  if (::getaddrinfo(server.host.c_str(), server.port.c_str(), &hints, &list) != 0) return {};
  const std::unique_ptr<addrinfo, decltype(&::freeaddrinfo)> owned(list, ::freeaddrinfo);
  std::vector<SocketAddress> found;
  for (const addrinfo* entry = list; entry != nullptr; entry = entry->ai_next) {
    SocketAddress address;
    if (entry->ai_addrlen > sizeof address.storage) continue;
    std::memcpy(&address.storage, entry->ai_addr, entry->ai_addrlen);
    address.size = entry->ai_addrlen;
    found.push_back(address);
  }
  return found;
}

// A look-up under way, shared by the thread that does it and the threads that wait for it.
struct LookUp {
  HostAndPort server;
  UniqueFd finished{::eventfd(0, EFD_CLOEXEC)};  // readable, and stays so, when it is done
  std::mutex mutex;
  std::vector<SocketAddress> found;
  std::atomic<bool> done{false};
};

std::mutex presentMutex;
std::weak_ptr<LookUp>& present() {
  // Never destroyed: the thread left behind may still be using it when the process exits.
  static auto* const lookUp = new std::weak_ptr<LookUp>;
  return *lookUp;
}

std::shared_ptr<LookUp> startOrJoin(const HostAndPort& server) {
  const std::lock_guard lock(presentMutex);
  if (auto running = present().lock(); running != nullptr && !running->done.load()) {
    const bool same = running->server.host == server.host && running->server.port == server.port;
    return same ? running : nullptr;
  }
  auto lookUp = std::make_shared<LookUp>();
  lookUp->server = server;
  if (!lookUp->finished.isValid()) return nullptr;
  try {
    std::thread([lookUp] {
      try {
        auto found = addressesOf(lookUp->server, 0);
        const std::lock_guard resultLock(lookUp->mutex);
        lookUp->found = std::move(found);
      } catch (const std::bad_alloc&) {
        // Found nothing.
      }
      lookUp->done.store(true);
      (void)::eventfd_write(lookUp->finished.get(), 1);  // its count is far from full
    }).detach();
  } catch (const std::system_error&) {
    return nullptr;
  }
  present() = lookUp;
  return lookUp;
}

}  // namespace

HostAndPort splitHostAndPort(const std::string& text, const char* defaultPort) {
  if (text.starts_with('[')) {
    const auto end = text.find(']');
    if (end != std::string::npos) {
      const bool withPort = text.size() > end + 2 && text[end + 1] == ':';
      return {text.substr(1, end - 1), withPort ? text.substr(end + 2) : defaultPort};
    }
  }
  const auto colon = text.find(':');
  // With more than one colon it is a bare IPv6 address.
  if (colon == std::string::npos || text.find(':', colon + 1) != std::string::npos)
    return {text, defaultPort};
  return {text.substr(0, colon), text.substr(colon + 1)};
}

std::vector<SocketAddress> resolveUdp(const HostAndPort& server, std::chrono::milliseconds patience,
                                      int stopFd) {
  if (auto numeric = addressesOf(server, AI_NUMERICHOST); !numeric.empty()) return numeric;
  const auto lookUp = startOrJoin(server);
  if (lookUp == nullptr) return {};
  const auto deadline = std::chrono::steady_clock::now() + patience;
  for (;;) {
    const auto left =
        std::chrono::ceil<std::chrono::milliseconds>(deadline - std::chrono::steady_clock::now());
    if (left.count() <= 0) return {};
    pollfd entries[] = {{lookUp->finished.get(), POLLIN, 0}, {stopFd, POLLIN, 0}};
    if (::poll(entries, 2, static_cast<int>(left.count())) < 0) continue;
    if (entries[1].revents != 0) return {};
    if (entries[0].revents == 0) continue;
    const std::lock_guard lock(lookUp->mutex);
    return lookUp->found;
  }
}

}  // namespace brenvik

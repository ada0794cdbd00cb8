// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/geo/linux/UdpStunNetwork.h"

#include <arpa/inet.h>
#include <gtest/gtest.h>
#include <netinet/in.h>
#include <sys/eventfd.h>
#include <sys/socket.h>
#include <sys/syscall.h>
#include <sys/time.h>
#include <unistd.h>

#include <algorithm>
#include <thread>

#include "platform/base/fakes/FailingCalls.h"
#include "platform/geo/linux/HostResolver.h"
#include "platform/geo/linux/StunTransaction.h"
#include "platform/log/fakes/RecordingLog.h"

extern "C" ssize_t send(int socket, const void* bytes, size_t size, int flags) {
  if (brenvik::FailingCall::failsNow("send")) return -1;
  return ::syscall(SYS_sendto, socket, bytes, size, flags, nullptr, 0);
}

namespace brenvik {
namespace {

using namespace std::chrono_literals;

constexpr StunTransactionId kId{std::byte{7}};

// A UDP socket on the loopback, at a port the system chose.
class Server {
 public:
  explicit Server(int family = AF_INET) : socket_(::socket(family, SOCK_DGRAM | SOCK_CLOEXEC, 0)) {
    constexpr timeval kPatience{30, 0};  // a request that never comes is a failure, not a test without end
    EXPECT_EQ(::setsockopt(socket_.get(), SOL_SOCKET, SO_RCVTIMEO, &kPatience, sizeof kPatience), 0);
    sockaddr_storage address{};
    address.ss_family = static_cast<sa_family_t>(family);
    if (family == AF_INET) {
      reinterpret_cast<sockaddr_in&>(address).sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    } else {
      reinterpret_cast<sockaddr_in6&>(address).sin6_addr = in6addr_loopback;
    }
    socklen_t size = family == AF_INET ? sizeof(sockaddr_in) : sizeof(sockaddr_in6);
    bound = ::bind(socket_.get(), reinterpret_cast<sockaddr*>(&address), size) == 0;
    if (!bound) return;
    size = sizeof address;
    EXPECT_EQ(::getsockname(socket_.get(), reinterpret_cast<sockaddr*>(&address), &size), 0);
    const in_port_t port = family == AF_INET ? reinterpret_cast<sockaddr_in&>(address).sin_port
                                             : reinterpret_cast<sockaddr_in6&>(address).sin6_port;
    name = (family == AF_INET ? "127.0.0.1:" : "[::1]:") + std::to_string(ntohs(port));
  }
  // To everybody else the port is closed now: a socket that is connected, here to itself, hears one peer
  // only. Its number is not free, so nobody else's server can turn up there.
  void refuse() {
    sockaddr_storage own{};
    socklen_t size = sizeof own;
    ASSERT_EQ(::getsockname(socket_.get(), reinterpret_cast<sockaddr*>(&own), &size), 0);
    ASSERT_EQ(::connect(socket_.get(), reinterpret_cast<const sockaddr*>(&own), size), 0);
  }
  // Takes one request, and sends what `answers` makes of it and of its sender's address (as in the answer,
  // xor'ed).
  void serveOne(
      const std::function<void(const std::vector<std::byte>& request, const sockaddr_storage& from,
                               const std::function<void(const std::vector<std::byte>&)>& send)>& answer) {
    std::vector<std::byte> request(2000);
    sockaddr_storage from{};
    socklen_t size = sizeof from;
    const ssize_t got = ::recvfrom(socket_.get(), request.data(), request.size(), 0,
                                   reinterpret_cast<sockaddr*>(&from), &size);
    ASSERT_EQ(got, 20);
    request.resize(20);
    answer(request, from, [&](const std::vector<std::byte>& bytes) {
      EXPECT_EQ(
          ::sendto(socket_.get(), bytes.data(), bytes.size(), 0, reinterpret_cast<sockaddr*>(&from), size),
          static_cast<ssize_t>(bytes.size()));
    });
  }

  bool bound = false;
  std::string name;

 private:
  UniqueFd socket_;
};

// A success response that says where the request came from.
std::vector<std::byte> answerTo(const std::vector<std::byte>& request, const sockaddr_storage& from) {
  std::vector<std::byte> answer = request;
  answer[0] = answer[1] = std::byte{1};
  const bool ipv4 = from.ss_family == AF_INET;
  const std::byte* address =
      ipv4 ? reinterpret_cast<const std::byte*>(&reinterpret_cast<const sockaddr_in&>(from).sin_addr)
           : reinterpret_cast<const std::byte*>(&reinterpret_cast<const sockaddr_in6&>(from).sin6_addr);
  const std::size_t length = ipv4 ? 4 : 16;
  answer[3] = static_cast<std::byte>(8 + length);
  for (const std::size_t byte :
       {std::size_t{0}, std::size_t{0x20}, std::size_t{0}, 4 + length, std::size_t{0},
        std::size_t{ipv4 ? 1U : 2U}, std::size_t{1}, std::size_t{2}}) {
    answer.push_back(static_cast<std::byte>(byte));
  }
  for (std::size_t i = 0; i < length; ++i) answer.push_back(address[i] ^ request[4 + i]);
  return answer;
}

class UdpStunNetworkTest : public testing::Test {
 protected:
  StunOutcome ask(const std::string& server) {
    UdpStunNetwork network(server, stop.get());
    return runStunTransaction(network, kId);
  }
  static std::string problemOf(const StunOutcome& outcome) {
    EXPECT_FALSE(outcome.address);
    return outcome.error ? outcome.error->description : "none";
  }
  UniqueFd stop{::eventfd(0, EFD_CLOEXEC)};
  RecordingLog log;
};

TEST_F(UdpStunNetworkTest, LearnsItsIpv4Address) {
  Server server;
  std::thread serving([&] {
    server.serveOne(
        [](const auto& request, const auto& from, const auto& send) { send(answerTo(request, from)); });
  });
  EXPECT_EQ(ask(server.name).address, "127.0.0.1");
  serving.join();
}

TEST_F(UdpStunNetworkTest, LearnsItsIpv6Address) {
  Server server(AF_INET6);
  if (!server.bound) GTEST_SKIP() << "no IPv6 here";
  std::thread serving([&] {
    server.serveOne(
        [](const auto& request, const auto& from, const auto& send) { send(answerTo(request, from)); });
  });
  EXPECT_EQ(ask(server.name).address, "::1");
  serving.join();
}

TEST_F(UdpStunNetworkTest, LiesBeforeTheAnswerAreIgnored) {
  Server server;
  std::thread serving([&] {
    server.serveOne([](const auto& request, const auto& from, const auto& send) {
      auto lie = answerTo(request, from);
      lie[10] ^= std::byte{1};
      send(lie);
      send({});
      send(std::vector<std::byte>(1500));
      send(answerTo(request, from));
    });
  });
  EXPECT_EQ(ask(server.name).address, "127.0.0.1");
  serving.join();
  EXPECT_EQ(log.entries().size(), 1U);
}

TEST_F(UdpStunNetworkTest, ASecondSendingReachesAServerThatMissedTheFirst) {
  Server server;
  std::thread serving([&] {
    server.serveOne([](const auto&, const auto&, const auto&) {});
    server.serveOne(
        [](const auto& request, const auto& from, const auto& send) { send(answerTo(request, from)); });
  });
  const auto before = std::chrono::steady_clock::now();
  EXPECT_EQ(ask(server.name).address, "127.0.0.1");
  EXPECT_GE(std::chrono::steady_clock::now() - before, 250ms);
  serving.join();
}

TEST_F(UdpStunNetworkTest, APortWhereNobodyListensEndsItAtOnce) {
  Server server;
  server.refuse();
  EXPECT_EQ(problemOf(ask(server.name)), "the STUN server cannot be reached");
}

TEST_F(UdpStunNetworkTest, ASendingWithoutRoomInTheQueueIsLikeADatagramLost) {
  for (const int error : {EAGAIN, ENOBUFS, EINTR}) {
    Server server;
    std::thread serving([&] {
      server.serveOne(
          [](const auto& request, const auto& from, const auto& send) { send(answerTo(request, from)); });
    });
    const FailingCall full("send", error);
    EXPECT_EQ(ask(server.name).address, "127.0.0.1") << error;
    EXPECT_EQ(full.failures(), 1);
    serving.join();
  }
}

TEST_F(UdpStunNetworkTest, ASendingThatFailsOtherwiseEndsIt) {
  Server server;  // would hear a second one
  const FailingCall refused("send", EPERM);
  EXPECT_EQ(problemOf(ask(server.name)), "the STUN server cannot be reached");
}

TEST_F(UdpStunNetworkTest, AHostNobodyHasEndsIt) {
  EXPECT_EQ(problemOf(ask(":3478")), "the name of the STUN server cannot be resolved");
  EXPECT_EQ(problemOf(ask("127.0.0.1:port")), "the name of the STUN server cannot be resolved");
}

TEST_F(UdpStunNetworkTest, StoppingEndsTheWaiting) {
  Server server;  // never answers
  std::thread stopping([&] {
    server.serveOne([](const auto&, const auto&, const auto&) {});
    EXPECT_EQ(::eventfd_write(stop.get(), 1), 0);
  });
  EXPECT_EQ(problemOf(ask(server.name)), "the geo service is stopping");
  stopping.join();
}

TEST(HostResolverTest, SplitsHostAndPort) {
  const auto split = [](const char* text) {
    const auto parts = splitHostAndPort(text, "3478");
    return parts.host + "|" + parts.port;
  };
  EXPECT_EQ(split("stun.example"), "stun.example|3478");
  EXPECT_EQ(split("stun.example:19302"), "stun.example|19302");
  EXPECT_EQ(split("192.0.2.1:1"), "192.0.2.1|1");
  EXPECT_EQ(split("[2001:db8::1]"), "2001:db8::1|3478");
  EXPECT_EQ(split("[2001:db8::1]:5"), "2001:db8::1|5");
  EXPECT_EQ(split("2001:db8::1"), "2001:db8::1|3478");
  EXPECT_EQ(split(""), "|3478");
  EXPECT_EQ(split("[broken"), "[broken|3478");
}

TEST(HostResolverTest, FindsTheLoopbackByName) {
  const auto found = resolveUdp({"localhost", "3478"}, 20s, -1);
  ASSERT_FALSE(found.empty());
  for (const auto& address : found) {
    if (address.storage.ss_family != AF_INET) continue;
    EXPECT_EQ(reinterpret_cast<const sockaddr_in&>(address.storage).sin_addr.s_addr, htonl(INADDR_LOOPBACK));
    EXPECT_EQ(reinterpret_cast<const sockaddr_in&>(address.storage).sin_port, htons(3478));
  }
}

TEST(HostResolverTest, WithoutPatienceOnlyNumbersAreResolved) {
  EXPECT_EQ(resolveUdp({"127.0.0.1", "1"}, 0s, -1).size(), 1U);
  EXPECT_TRUE(resolveUdp({"localhost", "1"}, -1s, -1).empty());
  // The look-up that was not waited for is joined, so that it is in no other's way.
  EXPECT_FALSE(resolveUdp({"localhost", "1"}, 20s, -1).empty());
}

TEST(HostResolverTest, StoppingEndsTheWaitingForAName) {
  const UniqueFd stop(::eventfd(1, EFD_CLOEXEC));
  EXPECT_TRUE(resolveUdp({"localhost", "2"}, 20s, stop.get()).empty());
  EXPECT_FALSE(resolveUdp({"localhost", "2"}, 20s, -1).empty());
}

}  // namespace
}  // namespace brenvik

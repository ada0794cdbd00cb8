// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/telephony/linux/ChannelTelephonyDaemon.h"

#include <gtest/gtest.h>
#include <poll.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/un.h>
#include <unistd.h>

#include <array>
#include <atomic>
#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <filesystem>
#include <thread>

#include "interface/TelephonyMessages.h"
#include "platform/base/UniqueFd.h"
#include "platform/datagram/Datagram.h"
#include "platform/plist/PropertyListCodec.h"

namespace {
constinit thread_local bool clockStands = false;
constinit thread_local bool waitingToSendFails = false;
}  // namespace

extern "C" int clock_gettime(clockid_t clock, timespec* time) noexcept {
  if (clockStands) {
    *time = {1000, 0};
    return 0;
  }
  return static_cast<int>(::syscall(SYS_clock_gettime, clock, time));
}

extern "C" int poll(pollfd* entries, nfds_t count, int time) {
  // The compiler takes what poll(2) writes for what it never reads.
  const pollfd* const volatile first = entries;
  if (waitingToSendFails && (first->events & POLLOUT) != 0) {
    errno = ENOMEM;
    return -1;
  }
  return static_cast<int>(::syscall(SYS_poll, entries, count, time));
}

namespace brenvik {
namespace {

using namespace std::chrono_literals;
using std::chrono::milliseconds;
using Clock = std::chrono::steady_clock;

// The daemon's side: a listening socket in a bootstrap directory of its own.
class BrenvikService {
 public:
  BrenvikService() {
    std::string name = (std::filesystem::temp_directory_path() / "brenvik-telephony-XXXXXX").string();
    if (::mkdtemp(name.data()) == nullptr) std::abort();
    directory = name;
  }
  ~BrenvikService() { std::filesystem::remove_all(directory); }

  void listen(int backlog = 4) {
    listening_ = UniqueFd(::socket(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC, 0));
    const sockaddr_un address = ownAddress();
    ::unlink(address.sun_path);
    ASSERT_EQ(::bind(listening_.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address), 0);
    ASSERT_EQ(::listen(listening_.get(), backlog), 0);
  }
  // Connections that nobody accepts, as many as there is room for.
  std::vector<UniqueFd> fillBacklog() {
    std::vector<UniqueFd> waiting;
    const sockaddr_un address = ownAddress();
    for (;;) {
      UniqueFd channel(::socket(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC | SOCK_NONBLOCK, 0));
      if (::connect(channel.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address) != 0) {
        EXPECT_EQ(errno, EAGAIN);
        return waiting;
      }
      waiting.push_back(std::move(channel));
    }
  }
  void close() { listening_.reset(); }  // the socket file stays
  UniqueFd accept() { return UniqueFd(::accept4(listening_.get(), nullptr, nullptr, SOCK_CLOEXEC)); }

  std::string directory;

 private:
  sockaddr_un ownAddress() const {
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    std::strcpy(address.sun_path, (directory + "/com.norvale.brenvik").c_str());
    return address;
  }
  UniqueFd listening_;
};

struct Received {
  std::vector<char> datagram;
  TelephonyPushMessage message() const {
    TelephonyPushMessage copy{};
    std::memcpy(&copy, datagram.data(), std::min(sizeof copy, datagram.size()));
    return copy;
  }
  PropertyList values() const {
    const auto first = message().values.address;
    if (first > datagram.size()) return {};
    return parsePropertyList(std::as_bytes(std::span(datagram)).subspan(first));
  }
};

Received receive(const UniqueFd& channel) {
  std::vector<char> bytes(kLargestDatagram + 1);
  const ssize_t size = ::recv(channel.get(), bytes.data(), bytes.size(), 0);
  bytes.resize(size > 0 ? static_cast<std::size_t>(size) : 0);
  return {bytes};
}

TelephonyPushReply replyTo(const Received& request, KernelReturn returnCode = 0, std::uint64_t result = 0) {
  TelephonyPushReply reply{};
  reply.header.bits = kReplyDisposition;
  reply.header.size = sizeof reply;
  reply.header.localPort = request.message().header.replyPort;
  reply.header.id = request.message().header.id + kReplyIdOffset;
  reply.ndr = kNdrRecord;
  reply.returnCode = returnCode;
  reply.result = result;
  return reply;
}

void sendBytes(const UniqueFd& channel, const void* bytes, std::size_t size) {
  EXPECT_EQ(::send(channel.get(), bytes, size, MSG_NOSIGNAL), static_cast<ssize_t>(size));
}
void sendReply(const UniqueFd& channel, const TelephonyPushReply& reply) {
  sendBytes(channel, &reply, sizeof reply);
}

class ChannelTelephonyDaemonTest : public testing::Test {
 protected:
  // Pushes an address while `serve` plays the daemon on the accepted channel.
  TelephonyResult pushAddress(std::function<void(UniqueFd)> serve, milliseconds patience = 60s) {
    service.listen();
    ChannelTelephonyDaemon daemon(service.directory, patience);
    daemon.addIdentifierException("BrenvikMobileHelper");
    std::thread brenvik([&] { serve(service.accept()); });
    auto connection = daemon.create([this] { ++callbacks; });
    // With little patience, a busy machine may be too late to connect.
    for (int i = 0; i < 100 && connection == nullptr && patience < 60s; ++i) {
      connection = daemon.create([this] { ++callbacks; });
    }
    EXPECT_NE(connection, nullptr);
    const TelephonyResult result = connection->setLocalRoutableAddress("198.51.100.7");
    connection.reset();
    brenvik.join();
    return result;
  }
  BrenvikService service;
  int callbacks = 0;
};

TEST_F(ChannelTelephonyDaemonTest, CivicInfoTravelsAsOneComplexMessageWithItsRegionInLine) {
  service.listen();
  ChannelTelephonyDaemon daemon(service.directory, 60s);
  daemon.addIdentifierException("BrenvikMobileHelper");
  Received request;
  std::thread brenvik([&] {
    const UniqueFd channel = service.accept();
    request = receive(channel);
    sendReply(channel, replyTo(request));
  });
  auto connection = daemon.create({});
  ASSERT_NE(connection, nullptr);
  EXPECT_EQ(connection->setCivicInfoBasedOnCurrentLocation("NO", "", "Tromsø", std::nullopt), 0U);
  brenvik.join();

  const auto message = request.message();
  EXPECT_EQ(message.header.bits, 0x80000012U);
  EXPECT_EQ(message.header.size, 52U);
  EXPECT_NE(message.header.replyPort, 0U);
  EXPECT_EQ(message.header.localPort, 0U);
  EXPECT_EQ(message.header.voucher, 0U);
  EXPECT_EQ(message.header.id, 9100001);
  EXPECT_EQ(message.descriptorCount, 1U);
  EXPECT_EQ(std::uint64_t{message.values.address}, 56U);
  EXPECT_EQ(message.values.type, 1U);
  EXPECT_EQ(message.values.size, request.datagram.size() - 56);
  EXPECT_EQ(std::memcmp(&message.ndr, &kNdrRecord, 8), 0);
  EXPECT_EQ(std::string(request.datagram.data() + 56, 8), "bplist00");
  const auto expected = PropertyList::dictionary(
      {{"Client", PropertyList::array({PropertyList::string("BrenvikMobileHelper")})},
       {"CountryCode", PropertyList::string("NO")},
       {"State", PropertyList::string("")},
       {"City", PropertyList::string("Tromsø")}});
  EXPECT_EQ(request.values(), expected) << "an absent value has no key, an empty one has";
}

TEST_F(ChannelTelephonyDaemonTest, TheAddressTravelsUnderItsOwnId) {
  Received request;
  EXPECT_EQ(pushAddress([&](UniqueFd channel) {
              request = receive(channel);
              sendReply(channel, replyTo(request));
            }),
            0U);
  EXPECT_EQ(request.message().header.id, 9100002);
  EXPECT_EQ(request.values().find("Address").asString(), "198.51.100.7");
  EXPECT_EQ(request.values().size(), 2U);
  EXPECT_EQ(callbacks, 0);
}

TEST_F(ChannelTelephonyDaemonTest, TheClientIsNamedOnceHoweverManyPushesThereWere) {
  service.listen();
  ChannelTelephonyDaemon daemon(service.directory, 60s);
  std::vector<Received> requests;
  std::thread brenvik([&] {
    for (int i = 0; i < 3; ++i) {
      const UniqueFd channel = service.accept();
      requests.push_back(receive(channel));
      sendReply(channel, replyTo(requests.back()));
    }
  });
  for (int i = 0; i < 3; ++i) {
    daemon.addIdentifierException("BrenvikMobileHelper");
    EXPECT_EQ(daemon.create({})->setLocalRoutableAddress(std::nullopt), 0U);
  }
  brenvik.join();
  const auto client = requests.back().values().find("Client");
  ASSERT_EQ(client.size(), 1U);
  EXPECT_EQ(client.at(0).asString(), "BrenvikMobileHelper");
  EXPECT_FALSE(requests.back().values().find("Address"));
}

TEST_F(ChannelTelephonyDaemonTest, TheResultIsTheDaemonsOwn) {
  const auto result = pushAddress([](UniqueFd channel) {
    const auto request = receive(channel);
    sendReply(channel, replyTo(request, 0, telephonyResult(7, 42)));
  });
  EXPECT_EQ(errorCodeOf(result), 42);
  EXPECT_EQ(result & 0xFFFFFFFF, 7U);
}

TEST_F(ChannelTelephonyDaemonTest, AReturnCodeIsTheErrorCodeWhateverTheResultSays) {
  EXPECT_EQ(errorCodeOf(pushAddress([](UniqueFd channel) {
              const auto request = receive(channel);
              sendReply(channel, replyTo(request, 35, telephonyResult(7, 42)));
            })),
            35);
}

TEST_F(ChannelTelephonyDaemonTest, ABareStatusIsARefusalWithItsCode) {
  EXPECT_EQ(errorCodeOf(pushAddress([](UniqueFd channel) {
              const auto request = receive(channel);
              const auto reply = replyTo(request, mig::badId);
              sendBytes(channel, &reply, 36);
            })),
            -303);
}

TEST_F(ChannelTelephonyDaemonTest, ABareStatusOfSuccessIsNoAnswer) {
  EXPECT_EQ(errorCodeOf(pushAddress([](UniqueFd channel) {
              const auto request = receive(channel);
              const auto reply = replyTo(request);
              sendBytes(channel, &reply, 36);
            })),
            EPROTO);
}

TEST_F(ChannelTelephonyDaemonTest, WhatAnswersNothingGoesToTheCallbackAndTheReplyIsStillAwaited) {
  EXPECT_EQ(pushAddress([](UniqueFd channel) {
              const auto request = receive(channel);
              auto wrongId = replyTo(request);
              ++wrongId.header.id;
              sendReply(channel, wrongId);
              auto wrongNumber = replyTo(request);
              ++wrongNumber.header.localPort;
              sendReply(channel, wrongNumber);
              std::array<char, 4096> long_{};
              const auto cutToFit = replyTo(request);
              std::memcpy(long_.data(), &cutToFit, sizeof cutToFit);
              sendBytes(channel, long_.data(), long_.size());
              sendBytes(channel, &wrongId, 1);
              sendReply(channel, replyTo(request));
            }),
            0U);
  EXPECT_EQ(callbacks, 4);
}

TEST_F(ChannelTelephonyDaemonTest, DescriptorsNobodyAskedForAreNotKept) {
  const auto open = [] {
    return std::distance(std::filesystem::directory_iterator("/proc/self/fd"),
                         std::filesystem::directory_iterator());
  };
  const auto before = open();
  pushAddress([](UniqueFd channel) {
    const auto request = receive(channel);
    const auto reply = replyTo(request);
    const std::array parts{iovecOf(std::as_bytes(std::span(&reply, 1)))};
    const std::array passed{channel.get()};
    EXPECT_EQ(sendDatagram(channel.get(), parts, passed), 0);
  });
  EXPECT_EQ(open(), before + 1) << "the test's own listening socket";
}

TEST_F(ChannelTelephonyDaemonTest, AChannelThatClosesFirstIsABrokenPipe) {
  EXPECT_EQ(errorCodeOf(pushAddress([](UniqueFd channel) { receive(channel); })), EPIPE);
}

TEST_F(ChannelTelephonyDaemonTest, AChannelClosedBeforeThePushIsABrokenPipe) {
  service.listen();
  ChannelTelephonyDaemon daemon(service.directory, 60s);
  auto connection = daemon.create({});
  ASSERT_NE(connection, nullptr);
  service.accept().reset();
  EXPECT_EQ(connection->setLocalRoutableAddress("198.51.100.7"), telephonyResult(kPosixErrorDomain, EPIPE));
}

TEST_F(ChannelTelephonyDaemonTest, ADaemonThatDoesNotAnswerCostsNoMoreThanThePatience) {
  const auto before = Clock::now();
  UniqueFd kept;
  EXPECT_EQ(pushAddress([&](UniqueFd channel) { kept = std::move(channel); }, 50ms),
            telephonyResult(kPosixErrorDomain, ETIMEDOUT));
  EXPECT_GE(Clock::now() - before, 50ms);
}

TEST_F(ChannelTelephonyDaemonTest, APushThatCouldNotBeSentHasNoAnswerWhateverTheDaemonSays) {
  constexpr int kAnswers = 64;
  service.listen();
  ChannelTelephonyDaemon daemon(service.directory, 60s);
  UniqueFd channel;
  std::thread brenvik([&] {
    channel = service.accept();
    // All answers at once, and nothing is read any more.
    const TelephonyPushReply reply = replyTo(receive(channel));
    for (int i = 0; i < kAnswers; ++i) sendReply(channel, reply);
  });
  const auto connection = daemon.create({});
  int pushes = 0;
  TelephonyResult result = 0;
  if (connection != nullptr) {
    waitingToSendFails = true;
    for (; result == 0 && pushes < kAnswers; ++pushes)
      result = connection->setLocalRoutableAddress(std::string(60'000, 'x'));
  }
  waitingToSendFails = false;
  brenvik.join();
  ASSERT_NE(connection, nullptr);
  EXPECT_EQ(result, telephonyResult(kPosixErrorDomain, ENOMEM));
  EXPECT_LT(pushes, kAnswers);
}

TEST_F(ChannelTelephonyDaemonTest, WithNoTimeLeftNobodyIsConnectedTo) {
  service.listen();
  ChannelTelephonyDaemon daemon(service.directory, 0s);
  clockStands = true;
  const auto connection = daemon.create({});
  clockStands = false;
  EXPECT_EQ(connection, nullptr);
}

TEST_F(ChannelTelephonyDaemonTest, ADaemonThatTalksWithoutEndIsCutOffAllTheSame) {
  // On a busy machine it may begin to talk only when a short patience is over; then a longer one is needed.
  for (milliseconds patience = 50ms; callbacks == 0; patience *= 4) {
    ASSERT_LT(patience, 20s) << "it was never heard";
    EXPECT_EQ(errorCodeOf(pushAddress(
                  [](UniqueFd channel) {
                    const char noise = 'x';
                    while (::send(channel.get(), &noise, 1, MSG_NOSIGNAL) == 1) {
                    }
                  },
                  patience)),
              ETIMEDOUT);
  }
}

TEST_F(ChannelTelephonyDaemonTest, PatienceIsOneSecond) { EXPECT_EQ(kTelephonyPatience, 1s); }

TEST_F(ChannelTelephonyDaemonTest, AnAbsentDaemonGivesNoConnection) {
  ChannelTelephonyDaemon daemon(service.directory);
  EXPECT_EQ(daemon.create({}), nullptr);
}

TEST_F(ChannelTelephonyDaemonTest, AStaleSocketFileGivesNoConnection) {
  service.listen();
  ChannelTelephonyDaemon daemon(service.directory);
  service.close();
  EXPECT_EQ(daemon.create({}), nullptr);
}

TEST_F(ChannelTelephonyDaemonTest, APathLongerThanASocketAddressGivesNoConnection) {
  ChannelTelephonyDaemon daemon("/" + std::string(200, 'x'));
  EXPECT_EQ(daemon.create({}), nullptr);
}

TEST_F(ChannelTelephonyDaemonTest, ADaemonThatAcceptsNobodyCostsNoMoreThanThePatience) {
  service.listen(0);
  ChannelTelephonyDaemon daemon(service.directory, 50ms);
  const auto waiting = service.fillBacklog();
  const auto before = Clock::now();
  EXPECT_EQ(daemon.create({}), nullptr);
  EXPECT_GE(Clock::now() - before, 50ms);
}

TEST_F(ChannelTelephonyDaemonTest, CivicInfoOf65000BytesFitsADatagram) {
  service.listen();
  ChannelTelephonyDaemon daemon(service.directory, 60s);
  daemon.addIdentifierException("BrenvikMobileHelper");
  Received request;
  std::thread brenvik([&] {
    const UniqueFd channel = service.accept();
    request = receive(channel);
    sendReply(channel, replyTo(request));
  });
  const std::string state(32'495, 's');
  const std::string city(32'495, 'c');
  EXPECT_EQ(daemon.create({})->setCivicInfoBasedOnCurrentLocation("NO", state, city, "01234567"), 0U);
  brenvik.join();
  EXPECT_EQ(request.values().find("State").asString(), state);
  EXPECT_EQ(request.values().find("City").asString(), city);
}

TEST_F(ChannelTelephonyDaemonTest, APushThatFitsNoDatagramIsRefusedHere) {
  service.listen();
  ChannelTelephonyDaemon daemon(service.directory, 60s);
  EXPECT_EQ(errorCodeOf(daemon.create({})->setLocalRoutableAddress(std::string(70000, 'x'))), EMSGSIZE);
}

TEST_F(ChannelTelephonyDaemonTest, ConnectionsFromManyThreadsAreIndependent) {
  service.listen(64);
  ChannelTelephonyDaemon daemon(service.directory, 60s);
  std::thread brenvik([&] {
    for (int i = 0; i < 32; ++i) {
      const UniqueFd channel = service.accept();
      const auto request = receive(channel);
      sendReply(channel, replyTo(request));
    }
  });
  std::vector<std::thread> callers;
  std::atomic<int> failures = 0;
  for (int i = 0; i < 4; ++i) {
    callers.emplace_back([&] {
      for (int push = 0; push < 8; ++push) {
        daemon.addIdentifierException("BrenvikMobileHelper");
        if (daemon.create({})->setLocalRoutableAddress("198.51.100.7") != 0) ++failures;
      }
    });
  }
  for (auto& caller : callers) caller.join();
  brenvik.join();
  EXPECT_EQ(failures, 0);
}

}  // namespace
}  // namespace brenvik

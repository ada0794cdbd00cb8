// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include <dirent.h>
#include <dlfcn.h>
#include <fcntl.h>
#include <grp.h>
#include <gtest/gtest.h>
#include <malloc.h>
#include <poll.h>
#include <pthread.h>
#include <sched.h>
#include <sys/file.h>
#include <sys/mman.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <chrono>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <functional>
#include <iostream>
#include <string>
#include <vector>

#include "platform/base/fakes/FailingAllocations.h"
#include "platform/base/fakes/FailingCalls.h"
#include "platform/datagram/Datagram.h"
#include "platform/ipc/linux/BacklogGuess.h"
#include "platform/ipc/linux/MessageTrailerBuilder.h"
#include "platform/ipc/linux/SystemBootstrap.h"
#include "platform/ipc/linux/SystemPortSources.h"
#include "platform/log/fakes/RecordingLog.h"
#include "platform/runloop/fakes/ManualRunLoop.h"
#include "platform/runloop/linux/SystemQueues.h"

namespace brenvik {
namespace {

using namespace std::chrono_literals;

std::function<void()> beforeLocking;  // what happens before a file is locked

// How far the clock goes with each look at it; negative: it is the system's.
constinit std::chrono::nanoseconds clockStep{-1};
constinit std::chrono::nanoseconds steppedTime{};

constinit thread_local int pauses = 0;          // of this thread
constinit thread_local int looksAtSockets = 0;  // by this thread

}  // namespace
}  // namespace brenvik

extern "C" int flock(int fd, int operation) noexcept {
  if (brenvik::beforeLocking != nullptr) brenvik::beforeLocking();
  return static_cast<int>(::syscall(SYS_flock, fd, operation));
}

extern "C" int clock_gettime(clockid_t clock, timespec* time) noexcept {
  using brenvik::clockStep, brenvik::steppedTime;
  if (clockStep.count() < 0) return static_cast<int>(::syscall(SYS_clock_gettime, clock, time));
  steppedTime += clockStep;
  *time = {steppedTime.count() / 1'000'000'000, steppedTime.count() % 1'000'000'000};
  return 0;
}

extern "C" int nanosleep(const timespec* time, timespec* left) {
  ++brenvik::pauses;
  return static_cast<int>(::syscall(SYS_nanosleep, time, left));
}

extern "C" ssize_t recvmsg(int fd, msghdr* message, int flags) {
  ++brenvik::looksAtSockets;
  return ::syscall(SYS_recvmsg, fd, message, flags);
}

extern "C" int accept4(int fd, sockaddr* address, socklen_t* size, int flags) {
  if (brenvik::FailingCall::failsNow("accept4")) return -1;
  return static_cast<int>(::syscall(SYS_accept4, fd, address, size, flags));
}

// Fails for the closing line, which then makes no thread.
extern "C" int pthread_attr_init(pthread_attr_t* attributes) noexcept {
  if (brenvik::FailingCall::failsNow("pthread_attr_init")) return ENOMEM;
  static const auto real =
      reinterpret_cast<int (*)(pthread_attr_t*)>(::dlsym(RTLD_NEXT, "pthread_attr_init"));
  return real(attributes);
}

extern "C" ssize_t send(int fd, const void* bytes, size_t size, int flags) {
  if (brenvik::FailingCall::failsNow("send")) return -1;
  return ::sendto(fd, bytes, size, flags, nullptr, 0);
}

namespace brenvik {
namespace {

std::size_t openDescriptors() {
  std::size_t count = 0;
  DIR* const directory = ::opendir("/proc/self/fd");
  while (::readdir(directory) != nullptr) ++count;
  ::closedir(directory);
  return count;
}

// A datagram under construction, and what goes with it.
struct Datagram {
  std::vector<std::byte> bytes;
  std::vector<int> fds;

  template <class Value>
  Datagram& add(const Value& value) {
    const auto* const raw = reinterpret_cast<const std::byte*>(&value);
    bytes.insert(bytes.end(), raw, raw + sizeof value);
    return *this;
  }
  Datagram& text(std::string_view text) {
    const auto* const raw = reinterpret_cast<const std::byte*>(text.data());
    bytes.insert(bytes.end(), raw, raw + text.size());
    return *this;
  }
  Datagram& padTo(std::size_t size) {
    bytes.resize(size);
    return *this;
  }
};

constexpr std::int32_t kEcho = 100;  // complex or not; the reply is a status of the regions' bytes summed up
constexpr std::int32_t kRegion =
    101;  // replies with a region of as many bytes as the request's u32 at 32 says
constexpr std::int32_t kKeepRight = 102;  // takes the right over; status 0
constexpr std::int32_t kRefuse = 103;     // refuses with 5
constexpr std::int32_t kThrow = 104;      // memory runs out in the routine
constexpr std::int32_t kGiveRight = 105;  // a check-in reply with the right that `given` names

Datagram message(std::int32_t id, std::uint32_t bits = kReplyDisposition, std::uint32_t size = 24,
                 PortName replyPort = 77) {
  return Datagram().add(MessageHeader{bits, size, replyPort, 0, 0, id});
}
Datagram complexMessage(std::int32_t id, std::uint32_t count, std::uint32_t size) {
  return message(id, kComplexBit | kReplyDisposition, size).add(count);
}
OutOfLineDescriptor region(std::uint64_t address, std::uint32_t size) {
  return {address, 0, 1, 0, kOutOfLineDescriptorType, size};
}
PortDescriptor right() { return {0, 0, 0, kDispositionMoveSend, kPortDescriptorType}; }

class TestTable final : public RoutineTable {
 public:
  explicit TestTable(SystemRegions& regions) : regions_(regions) {}
  Handler find(std::int32_t id) const noexcept override {
    return id >= kEcho && id <= kGiveRight ? &handle : nullptr;
  }
  void* context() const noexcept override { return const_cast<TestTable*>(this); }

  int served = 0;
  std::vector<PortName> names;
  std::vector<std::uint32_t> sizes;
  MessageTrailer trailer{};
  PortName arrivedOn = 0;
  PortName given = 0;
  KernelReturn refuseWith = kern::failure;
  std::function<void()> whileServing;
  std::function<void(void*, std::uint32_t)> whenAllocated;  // a region of a reply

 private:
  static Outcome handle(void* context, const Request& request, Reply& reply) {
    auto& self = *static_cast<TestTable*>(context);
    ++self.served;
    self.arrivedOn = request.localPort();
    self.sizes.push_back(request.size());
    self.trailer = MessageTrailer{};
    std::memcpy(&self.trailer, &request.trailer(),
                std::min<std::size_t>(request.trailer().size, sizeof self.trailer));
    if (self.whileServing) self.whileServing();
    std::int32_t sum = 0;
    if (request.isComplex()) {
      std::size_t at = kDescriptorsOffset;
      for (std::uint32_t i = 0; i < request.descriptorCount(); ++i) {
        if (request.at<std::uint8_t>(at + 11) == kPortDescriptorType) {
          self.names.push_back(request.at<PortDescriptor>(at).name);
          at += sizeof(PortDescriptor);
          continue;
        }
        const auto& descriptor = request.at<OutOfLineDescriptor>(at);
        const auto* const bytes = reinterpret_cast<const unsigned char*>(descriptor.address);
        for (std::uint32_t k = 0; k < descriptor.size; ++k) sum += bytes[k];
        at += sizeof(OutOfLineDescriptor);
      }
    }
    switch (request.header().id) {
      case kRegion: {
        const auto length = request.at<std::uint32_t>(32);
        void* address = nullptr;
        if (self.regions_.allocate(&address, length) != kern::success) break;
        std::fill_n(static_cast<char*>(address), length, 'r');
        if (self.whenAllocated) self.whenAllocated(address, length);
        auto& out = reply.as<OutOfLineReply>();
        out.header.bits = kReplyDisposition | kComplexBit;
        out.header.size = sizeof out;
        out.descriptorCount = 1;
        out.payload = {reinterpret_cast<std::uint64_t>(address), 1, 1, 0, kOutOfLineDescriptorType, length};
        out.byteCount = length;
        return Outcome::accepted;
      }
      case kGiveRight: {
        auto& out = reply.as<CheckInReply>();
        out.header.voucher = 9;
        out.header.bits = kReplyDisposition | kComplexBit;
        out.header.size = sizeof out;
        out.descriptorCount = 1;
        out.servicePort = {self.given, 0, 0, kDispositionCopySend, kPortDescriptorType};
        return Outcome::accepted;
      }
      case kKeepRight:
        reply.setStatus(0);
        return Outcome::accepted;
      case kRefuse:
        reply.setStatus(self.refuseWith);
        return Outcome::refused;
      case kThrow:
        reply.header().voucher = 9;
        throw std::bad_alloc();
      default:
        reply.setStatus(sum);
        return Outcome::accepted;
    }
    reply.setStatus(kern::resourceShortage);
    return Outcome::refused;
  }
  SystemRegions& regions_;
};

class PortsTest : public testing::Test {
 protected:
  void SetUp() override {
    ASSERT_NE(loop, nullptr);
    ASSERT_EQ(ports.allocateReceiveRight(&port), kern::success);
    ASSERT_EQ(ports.insertSendRight(port), kern::success);
    source = sources.makeRoutineSource(port, table, WantTrailer::no);
    ASSERT_TRUE(source->addTo(*loop));
    client = UniqueFd(::fcntl(ports.sendEnd(port)->get(), F_DUPFD_CLOEXEC, 0));
  }

  static bool sendTo(int fd, const Datagram& datagram) {
    const std::array parts{iovecOf(datagram.bytes)};
    return sendDatagram(fd, parts, datagram.fds) == 0;
  }
  // Serves what is ready, and no more.
  void pump() {
    while (loop->run(0s, ReturnAfterSource::yes) == RunResult::handledSource) {
    }
  }
  struct Answer {
    std::vector<std::byte> bytes;
    std::vector<UniqueFd> fds;
    const MessageHeader& header() const { return *reinterpret_cast<const MessageHeader*>(bytes.data()); }
    KernelReturn code() const {
      EXPECT_EQ(bytes.size(), 36U);
      return reinterpret_cast<const StatusReply*>(bytes.data())->returnCode;
    }
  };
  static std::optional<Answer> receiveFrom(int fd) {
    Answer answer;
    answer.bytes.resize(kLargestDatagram);
    answer.fds.resize(4);
    const iovec room{answer.bytes.data(), answer.bytes.size()};
    ControlRoom<4> control;
    ReceivedDatagram received;
    if (receiveDatagram(fd, std::span(&room, 1), control.bytes, answer.fds, MSG_DONTWAIT, &received) != 0 ||
        received.length == 0) {
      return std::nullopt;
    }
    answer.bytes.resize(received.length);
    answer.fds.resize(received.descriptorCount);
    return answer;
  }
  std::optional<Answer> exchange(const Datagram& datagram) {
    EXPECT_TRUE(sendTo(client.get(), datagram));
    pump();
    return receiveFrom(client.get());
  }
  KernelReturn codeOf(const Datagram& datagram) {
    const auto answer = exchange(datagram);
    if (!answer) {
      ADD_FAILURE() << "no answer";
      return 0;
    }
    return answer->code();
  }
  static UniqueFd memfd(std::string_view content, int seals = F_SEAL_SHRINK | F_SEAL_GROW | F_SEAL_WRITE) {
    UniqueFd fd(::memfd_create("test", MFD_CLOEXEC | MFD_ALLOW_SEALING));
    EXPECT_EQ(::write(fd.get(), content.data(), content.size()), static_cast<ssize_t>(content.size()));
    if (seals != 0) {
      EXPECT_EQ(::fcntl(fd.get(), F_ADD_SEALS, seals), 0);
    }
    return fd;
  }
  static std::pair<UniqueFd, UniqueFd> pair(int type = SOCK_SEQPACKET) {
    std::array<int, 2> ends{};
    EXPECT_EQ(::socketpair(AF_UNIX, type | SOCK_CLOEXEC, 0, ends.data()), 0);
    return {UniqueFd(ends[0]), UniqueFd(ends[1])};
  }

  // Makes it again and again, with one allocation failing each time, until none does. How often it was not
  // made.
  static int refusalsOf(const std::function<bool()>& make) {
    int refused = 0;
    for (long first = 0;; ++first) {
      const FailingAllocations noMemory(first, FailingAllocations::HowMany::one);
      const bool isMade = make();
      if (FailingAllocations::failures() == 0) {
        EXPECT_TRUE(isMade);
        return refused;
      }
      if (!isMade) ++refused;
    }
  }
  // A new source's way onto the loop.
  bool addNewSource(PortName served) {
    std::shared_ptr<RoutineSource> made;
    {
      const FailingAllocations::Pause pause;
      made = sources.makeRoutineSource(served, table, WantTrailer::no);
    }
    return made->addTo(*loop);
  }

  RecordingLog log;
  std::unique_ptr<SystemRunLoop> loop = SystemRunLoop::make();
  SystemPortSpace ports;
  SystemRegions regions;
  SystemPortSources sources{ports, regions};
  TestTable table{regions};
  PortName port = kNullPort;
  std::shared_ptr<RoutineSource> source;
  UniqueFd client;
};

// ---- names and rights ----

TEST_F(PortsTest, NamesAreNeverNullOrDeadAndAFreedOneIsNotHandedOutAgainSoon) {
  std::vector<PortName> seen;
  for (int i = 0; i < 1000; ++i) {
    PortName name = kNullPort;
    ASSERT_EQ(ports.allocateReceiveRight(&name), kern::success);
    EXPECT_TRUE(isUsablePort(name));
    EXPECT_EQ(std::count(seen.begin(), seen.end(), name), 0);
    seen.push_back(name);
    EXPECT_EQ(ports.dropReceiveRight(name), kern::success);
  }
}

TEST_F(PortsTest, RightsThatAreNotThereAreRefused) {
  EXPECT_EQ(ports.dropReceiveRight(kNullPort), kern::invalidName);
  EXPECT_EQ(ports.deallocateSendRight(kDeadPort), kern::invalidName);
  EXPECT_EQ(ports.insertSendRight(0x7777), kern::invalidName);
  PortName name = kNullPort;
  ASSERT_EQ(ports.allocateReceiveRight(&name), kern::success);
  EXPECT_EQ(ports.deallocateSendRight(name), kern::invalidRight);
  EXPECT_EQ(ports.dropReceiveRight(name), kern::success);
  EXPECT_EQ(ports.dropReceiveRight(name), kern::invalidName);
}

TEST_F(PortsTest, ReferencesOfASendRightAreCounted) {
  EXPECT_EQ(ports.insertSendRight(port), kern::success);
  EXPECT_EQ(ports.deallocateSendRight(port), kern::success);
  EXPECT_NE(ports.sendEnd(port), nullptr);
  EXPECT_EQ(ports.deallocateSendRight(port), kern::success);
  EXPECT_EQ(ports.sendEnd(port), nullptr);
}

TEST_F(PortsTest, EveryDescriptorIsCloseOnExec) {
  const auto answer = exchange(complexMessage(kKeepRight, 0, 28));
  ASSERT_TRUE(answer);
  EXPECT_TRUE(::fcntl(ports.receiveEnd(port)->get(), F_GETFD) & FD_CLOEXEC);
  EXPECT_TRUE(::fcntl(ports.sendEnd(port)->get(), F_GETFD) & FD_CLOEXEC);
  auto [kept, sent] = pair();
  Datagram request = complexMessage(kKeepRight, 1, 40).add(right());
  request.fds = {sent.get()};
  EXPECT_EQ(codeOf(request), 0);
  EXPECT_TRUE(::fcntl(ports.sendEnd(table.names.back())->get(), F_GETFD) & FD_CLOEXEC);
}

// ---- requests and replies ----

TEST_F(PortsTest, AReplyGoesBackOverTheChannelWithTheRequestsReplyPortAndItsIdPlus100) {
  const auto answer = exchange(message(kEcho, 18, 24, 0xABCD));
  ASSERT_TRUE(answer);
  EXPECT_EQ(answer->header().bits, 18U);
  EXPECT_EQ(answer->header().size, 36U);
  EXPECT_EQ(answer->header().replyPort, 0U);
  EXPECT_EQ(answer->header().localPort, 0xABCDU);
  EXPECT_EQ(answer->header().voucher, 0U);
  EXPECT_EQ(answer->header().id, kEcho + 100);
  EXPECT_EQ(table.arrivedOn, port);
}

TEST_F(PortsTest, ARequestWithoutReplyPortIsServedAndNotAnswered) {
  EXPECT_FALSE(exchange(message(kEcho, 0, 24, 0)));
  EXPECT_EQ(table.served, 1);
  EXPECT_FALSE(exchange(message(999, 0, 24, 0)));
  EXPECT_FALSE(exchange(message(kRegion, 0, 24, 0).padTo(40)));
  EXPECT_EQ(regions.live(), 0U);
}

TEST_F(PortsTest, AnUnknownIdIsAnsweredWithMinus303) {
  EXPECT_EQ(codeOf(message(99)), -303);
  EXPECT_EQ(codeOf(message(INT32_MAX)), -303) << "the reply's id wraps";
  EXPECT_EQ(table.served, 0);
}

TEST_F(PortsTest, WithoutInLineRegionsTheSizeIsTheDatagramsOwnWhateverTheSenderWrote) {
  for (const std::uint32_t written : {0U, 1U, 24U, 65536U, 0xFFFFFFFFU}) {
    codeOf(message(kEcho, 18, written).padTo(60));
    EXPECT_EQ(table.sizes.back(), 60U);
  }
}

TEST_F(PortsTest, AMessageShorterThanAHeaderIsDroppedInSilenceAndItsDescriptorsAreClosed) {
  const std::size_t before = openDescriptors();
  for (std::size_t size = 1; size < 24; ++size) {
    Datagram datagram;
    datagram.padTo(size);
    datagram.fds = {client.get()};
    EXPECT_FALSE(exchange(datagram)) << size;
  }
  ports.closing().drain();
  EXPECT_EQ(openDescriptors(), before);
  EXPECT_EQ(codeOf(message(kEcho)), 0) << "the channel goes on";
  ASSERT_TRUE(sendTo(client.get(), Datagram().padTo(5)));
  EXPECT_EQ(codeOf(message(kEcho)), 0) << "the next message was not dropped with it";
}

TEST_F(PortsTest, ADatagramOfMoreThan65536BytesIsRefused) {
  EXPECT_EQ(codeOf(message(kEcho).padTo(65536)), 0);
  EXPECT_EQ(codeOf(message(kEcho).padTo(65537)), -304);
  EXPECT_EQ(table.served, 1);
}

TEST_F(PortsTest, WhenMemoryRunsOutInARoutineTheRequestFailsAndTheProcessGoesOn) {
  const auto answer = exchange(message(kThrow));
  ASSERT_TRUE(answer);
  EXPECT_EQ(answer->code(), kern::resourceShortage);
  EXPECT_EQ(answer->header().voucher, 0U) << "what the routine had written is gone";
  EXPECT_EQ(codeOf(message(kEcho)), 0);
}

TEST_F(PortsTest, AMessageNobodyAskedATrailerForHasTypeAndSizeOnly) {
  codeOf(message(kEcho));
  EXPECT_EQ(table.trailer.type, 0U);
  EXPECT_EQ(table.trailer.size, 8U);
}

TEST_F(PortsTest, ATrailerNamesTheSenderOnlyWhereItWasAskedForAndTheKernelTells) {
  for (const auto wanted : {WantTrailer::yes, WantTrailer::no}) {
    for (const bool isTold : {false, true}) {
      const int on = isTold ? 1 : 0;
      ASSERT_EQ(::setsockopt(ports.receiveEnd(port)->get(), SOL_SOCKET, SO_PASSCRED, &on, sizeof on), 0);
      source->invalidate();
      source = sources.makeRoutineSource(port, table, wanted);
      ASSERT_TRUE(source->addTo(*loop));
      ASSERT_TRUE(sendTo(client.get(), message(kEcho)));
      pump();
      ASSERT_TRUE(receiveFrom(client.get()));
      if (wanted == WantTrailer::yes && isTold) continue;  // a client's channel has no peer to compare with
      EXPECT_EQ(table.trailer.size, 8U);
      EXPECT_EQ(table.trailer.auditToken[5], 0U);
    }
  }
}

TEST_F(PortsTest, ASourceThatWasInvalidatedServesNeverAgain) {
  source->invalidate();
  EXPECT_FALSE(source->addTo(*loop));
  source->invalidate();
  EXPECT_FALSE(exchange(message(kEcho)));
  EXPECT_EQ(table.served, 0);
}

TEST_F(PortsTest, ARoutineMayDestroyTheSourceThatCalledIt) {
  table.whileServing = [&] { source.reset(); };
  EXPECT_FALSE(exchange(message(kRegion).add(kNdrRecord).add(100U)));
  EXPECT_EQ(regions.live(), 0U);
  ASSERT_TRUE(sendTo(client.get(), message(kEcho)));
  pump();
  EXPECT_EQ(table.served, 1);
}

TEST_F(PortsTest, WithoutMemoryForASourceOrAWatchThereIsNone) {
  if (!FailingAllocations::kWork) GTEST_SKIP() << "operator new belongs to the sanitizer";
  source->invalidate();
  auto [theirs, ours] = pair();
  const PortName watched = ports.adoptSendRight(std::move(ours));
  const std::size_t before = openDescriptors();
  const auto makeSource = [&] { return sources.makeRoutineSource(port, table, WantTrailer::no) != nullptr; };
  EXPECT_GE(refusalsOf(makeSource), 2);
  EXPECT_GE(refusalsOf([&] { return addNewSource(port); }), 1);
  EXPECT_GE(refusalsOf([&] { return sources.makeDeathWatch(watched, *loop) != nullptr; }), 2);
  EXPECT_EQ(openDescriptors(), before);
}

TEST_F(PortsTest, ADescriptorWithTheNumber0TravelsLikeEveryOther) {
  const UniqueFd standardInput(::fcntl(0, F_DUPFD_CLOEXEC, 3));
  if (!standardInput.isValid()) GTEST_SKIP() << "there is no standard input";
  ::close(0);
  const auto answer = exchange(message(kRegion).add(kNdrRecord).add(100000U));  // takes the lowest number
  ASSERT_EQ(::dup2(standardInput.get(), 0), 0);
  ASSERT_TRUE(answer);
  EXPECT_EQ(answer->fds.size(), 1U);
}

// ---- regions of requests ----

TEST_F(PortsTest, RegionsTravelInLineInDescriptorOrder) {
  Datagram datagram = complexMessage(kEcho, 2, 60).add(region(64, 3)).add(region(72, 2)).text("\x01\x02\x03");
  datagram.bytes.resize(60);
  datagram.padTo(64).text("\x01\x02\x03").padTo(72).text("\x10\x20");
  EXPECT_EQ(codeOf(datagram), 1 + 2 + 3 + 0x10 + 0x20);
  EXPECT_EQ(table.sizes.back(), 60U);
}

TEST_F(PortsTest, RegionsTravelAsSealedMemfds) {
  const UniqueFd first = memfd("\x01\x02\x03");
  const UniqueFd second = memfd("\x04\x05\x06");
  Datagram datagram = complexMessage(kEcho, 2, 60).add(region(0, 3)).add(region(0, 2));
  datagram.fds = {first.get(), second.get()};
  const std::size_t before = openDescriptors();
  EXPECT_EQ(codeOf(datagram), 1 + 2 + 3 + 4 + 5);
  EXPECT_EQ(openDescriptors(), before);
}

// What every kernel allows for memory that is sealed against writing: a shared mapping is refused before 6.7.
TEST_F(PortsTest, ASealedMemfdIsMappedPrivatelyForReadingUntilTheReplyIsSent) {
  const UniqueFd sealed = memfd("\x01");
  Datagram datagram = complexMessage(kEcho, 1, 44).add(region(0, 1));
  datagram.fds = {sealed.get()};
  const auto protection = [] {
    std::ifstream mappings("/proc/self/maps");
    for (std::string line; std::getline(mappings, line);) {
      if (line.find("/memfd:test") != std::string::npos) return line.substr(line.find(' ') + 1, 4);
    }
    return std::string("not mapped");
  };
  std::string whileServing;
  table.whileServing = [&] { whileServing = protection(); };
  EXPECT_EQ(codeOf(datagram), 1);
  EXPECT_EQ(whileServing, "r--p");
  EXPECT_EQ(protection(), "not mapped");
}

TEST_F(PortsTest, BothWaysMayMixAndAnEmptyRegionCarriesNothing) {
  const UniqueFd sealed = memfd("\x05");
  Datagram datagram = complexMessage(kEcho, 3, 76)
                          .add(region(0, 1))
                          .add(region(80, 1))
                          .add(region(0xDEAD, 0))
                          .padTo(80)
                          .text("\x07");
  datagram.fds = {sealed.get()};
  EXPECT_EQ(codeOf(datagram), 12);
}

TEST_F(PortsTest, ARegionThatNoCorrectSenderMakesIsRefused) {
  struct Case {
    const char* what;
    Datagram datagram;
  };
  const auto inLine = [](std::uint64_t address, std::uint32_t size, std::uint32_t messageSize,
                         std::size_t length) {
    return complexMessage(kEcho, 1, messageSize).add(region(address, size)).padTo(length);
  };
  std::vector<Case> cases;
  cases.push_back({"outside the datagram", inLine(48, 9, 44, 56)});
  cases.push_back({"beginning behind the datagram's end", inLine(48, 8, 44, 44)});
  cases.push_back({"far outside", inLine(0x4000000000000000, 8, 44, 56)});
  cases.push_back({"wrapping around", inLine(0xFFFFFFFFFFFFFFF8, 0xFFFFFFFF, 44, 56)});
  cases.push_back({"unaligned", inLine(45, 8, 44, 53)});
  cases.push_back({"not where the size says", inLine(56, 8, 44, 64)});
  cases.push_back({"inside the message", inLine(24, 8, 44, 44)});
  cases.push_back({"the size beyond the datagram", inLine(48, 8, 60, 56)});
  cases.push_back({"the size before the descriptor's end", inLine(40, 8, 40, 48)});
  cases.push_back({"the size within the header", inLine(24, 8, 20, 44)});
  cases.push_back({"bytes after the last region", inLine(48, 8, 44, 57)});
  cases.push_back(
      {"out of order", complexMessage(kEcho, 2, 60).add(region(72, 8)).add(region(64, 8)).padTo(80)});
  cases.push_back(
      {"overlapping", complexMessage(kEcho, 2, 60).add(region(64, 9)).add(region(72, 8)).padTo(80)});
  cases.push_back(
      {"the second unaligned", complexMessage(kEcho, 2, 60).add(region(64, 3)).add(region(67, 3)).padTo(70)});
  for (const Case& one : cases) EXPECT_EQ(codeOf(one.datagram), -304) << one.what;
  EXPECT_EQ(table.served, 0);
}

TEST_F(PortsTest, AMemfdMustBeSealedAndAsLongAsItSays) {
  const std::size_t before = openDescriptors();
  const auto refused = [&](const UniqueFd& fd, std::uint32_t size) {
    Datagram datagram = complexMessage(kEcho, 1, 44).add(region(0, size));
    datagram.fds = {fd.get()};
    EXPECT_EQ(codeOf(datagram), -304);
  };
  refused(memfd("abc", 0), 3);
  refused(memfd("abc", F_SEAL_SHRINK | F_SEAL_GROW), 3);
  refused(memfd("abc", F_SEAL_GROW | F_SEAL_WRITE), 3);
  refused(memfd("abc", F_SEAL_SHRINK | F_SEAL_WRITE), 3);
  refused(memfd("abc"), 4);
  refused(UniqueFd(::open("/dev/zero", O_RDONLY | O_CLOEXEC)), 3);
  refused(std::move(pair().first), 3);
  EXPECT_EQ(table.served, 0);
  ports.closing().drain();
  EXPECT_EQ(openDescriptors(), before);
}

// Its mapping is a multiple of a huge page long, and could not be taken away by the region's own length.
TEST_F(PortsTest, SealedMemoryOfHugePagesIsNoRegion) {
  const UniqueFd huge(::memfd_create("test", MFD_CLOEXEC | MFD_ALLOW_SEALING | MFD_HUGETLB));
  if (!huge.isValid() || ::ftruncate(huge.get(), off_t{1} << 30) != 0) GTEST_SKIP() << "no huge pages here";
  ASSERT_EQ(::fcntl(huge.get(), F_ADD_SEALS, F_SEAL_SHRINK | F_SEAL_GROW | F_SEAL_WRITE), 0);
  Datagram datagram = complexMessage(kEcho, 1, 44).add(region(0, 3));
  datagram.fds = {huge.get()};
  EXPECT_EQ(codeOf(datagram), -304);
}

TEST_F(PortsTest, MoreOrFewerDescriptorsThanTheWalkAsksForAreRefusedAndClosed) {
  const UniqueFd sealed = memfd("abc");
  const std::size_t before = openDescriptors();
  Datagram simple = message(kEcho);
  simple.fds = {sealed.get()};
  EXPECT_EQ(codeOf(simple), -304);
  Datagram none = complexMessage(kEcho, 1, 44).add(region(0, 3));
  EXPECT_EQ(codeOf(none), -304);
  Datagram two = none;
  two.fds = {sealed.get(), sealed.get()};
  EXPECT_EQ(codeOf(two), -304);
  Datagram many = none;
  many.fds.assign(253, sealed.get());
  EXPECT_EQ(codeOf(many), -304);
  ports.closing().drain();
  EXPECT_EQ(openDescriptors(), before);
  EXPECT_EQ(table.served, 0);
}

TEST_F(PortsTest, TheWalkEndsAtAnUnknownTypeAndAtADescriptorThatIsCutOff) {
  OutOfLineDescriptor odd = region(0, 0);
  odd.type = 9;
  EXPECT_EQ(codeOf(message(98, kComplexBit | 18).add(1U).add(odd)), -303) << "well formed, and unknown";
  Datagram cut = message(98, kComplexBit | 18).add(2U).add(right());
  cut.padTo(51);  // one byte short of a second port descriptor
  auto [kept, sent] = pair();
  cut.fds = {sent.get()};
  EXPECT_EQ(codeOf(cut), -303);
  EXPECT_EQ(codeOf(message(98, kComplexBit | 18)), -303) << "complex, without room for a count";
}

// ---- rights of requests ----

TEST_F(PortsTest, ARightMustBeASeqpacketSocketOfTheUnixFamilyThatDoesNotListen) {
  const std::size_t before = openDescriptors();
  const auto refused = [&](const UniqueFd& fd) {
    Datagram datagram = complexMessage(kKeepRight, 1, 40).add(right());
    datagram.fds = {fd.get()};
    EXPECT_EQ(codeOf(datagram), -304);
  };
  UniqueFd listening(::socket(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC, 0));
  const sockaddr_un anyName{AF_UNIX, {}};
  ASSERT_EQ(::bind(listening.get(), reinterpret_cast<const sockaddr*>(&anyName), sizeof anyName.sun_family),
            0);
  ASSERT_EQ(::listen(listening.get(), 1), 0);
  refused(listening);
  listening.reset();
  refused(std::move(pair(SOCK_STREAM).first));
  refused(std::move(pair(SOCK_DGRAM).first));
  refused(UniqueFd(::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0)));
  refused(UniqueFd(::open("/dev/null", O_RDONLY | O_CLOEXEC)));
  refused(memfd("x"));
  EXPECT_EQ(table.served, 0);
  ports.closing().drain();
  EXPECT_EQ(openDescriptors(), before);
  EXPECT_EQ(ports.size(), 1U);
}

TEST_F(PortsTest, ARightThatTheRoutineTookOverIsKeptAndOneOfARefusedRequestIsReleased) {
  auto [kept, sent] = pair();
  Datagram datagram = complexMessage(kKeepRight, 1, 40).add(right());
  datagram.fds = {sent.get()};
  EXPECT_EQ(codeOf(datagram), 0);
  EXPECT_NE(ports.sendEnd(table.names.at(0)), nullptr);
  datagram = complexMessage(kRefuse, 1, 40).add(right());
  datagram.fds = {sent.get()};
  EXPECT_EQ(codeOf(datagram), 5);
  EXPECT_EQ(ports.sendEnd(table.names.at(1)), nullptr);
  datagram = complexMessage(99, 1, 40).add(right());
  datagram.fds = {sent.get()};
  EXPECT_EQ(codeOf(datagram), -303);
  EXPECT_EQ(ports.size(), 2U);
  sent.reset();
  ports.deallocateSendRight(table.names.at(0));
  ports.closing().drain();
  pollfd hungUp{kept.get(), POLLIN, 0};
  EXPECT_EQ(::poll(&hungUp, 1, 0), 1) << "nobody holds the other end any more";
}

TEST_F(PortsTest, ACheckInReplyCarriesACopyOfTheSendRight) {
  PortName other = kNullPort;
  ASSERT_EQ(ports.allocateReceiveRight(&other), kern::success);
  ASSERT_EQ(ports.insertSendRight(other), kern::success);
  table.given = other;
  const auto answer = exchange(message(kGiveRight));
  ASSERT_TRUE(answer);
  const auto& reply = *reinterpret_cast<const CheckInReply*>(answer->bytes.data());
  EXPECT_EQ(reply.servicePort.name, 0U);
  EXPECT_EQ(reply.servicePort.disposition, 19);
  ASSERT_EQ(answer->fds.size(), 1U);
  EXPECT_EQ(ports.sendEnd(other), nullptr) << "the helper keeps the name alone";
  EXPECT_EQ(ports.deallocateSendRight(other), kern::success);
  EXPECT_EQ(ports.insertSendRight(other), kern::invalidRight);
  const auto second = sources.makeRoutineSource(other, table, WantTrailer::no);
  ASSERT_TRUE(second->addTo(*loop));
  ASSERT_TRUE(sendTo(answer->fds[0].get(), message(kEcho)));
  pump();
  EXPECT_EQ(table.arrivedOn, other);
}

TEST_F(PortsTest, ACheckInWhoseRightIsNotThereIsAnsweredWith6AndThatAlone) {
  table.given = 0x4242;
  const auto answer = exchange(message(kGiveRight, 18, 24, 0xABCD));
  ASSERT_TRUE(answer);
  EXPECT_EQ(answer->code(), kern::resourceShortage);
  EXPECT_TRUE(answer->fds.empty());
  EXPECT_EQ(answer->header().bits, 18U);
  EXPECT_EQ(answer->header().size, 36U);
  EXPECT_EQ(answer->header().localPort, 0xABCDU);
  EXPECT_EQ(answer->header().voucher, 0U) << "what the routine had written is gone";
  EXPECT_EQ(answer->header().id, kGiveRight + 100);
}

// ---- regions of replies ----

TEST_F(PortsTest, ARegionThatFitsTheDatagramTravelsInLineAndALargerOneAsASealedMemfd) {
  for (const std::uint32_t length : {1U, 5U, 4096U, 65480U, 65481U, 200000U}) {
    const auto answer = exchange(message(kRegion).add(kNdrRecord).add(length));
    ASSERT_TRUE(answer);
    const auto& reply = *reinterpret_cast<const OutOfLineReply*>(answer->bytes.data());
    EXPECT_EQ(reply.header.size, 56U);
    EXPECT_EQ(reply.payload.size, length);
    if (length <= 65480) {
      EXPECT_EQ(std::uint64_t{reply.payload.address}, 56U);
      EXPECT_EQ(answer->bytes.size(), 56 + length);
      EXPECT_EQ(answer->bytes.back(), std::byte{'r'});
      EXPECT_TRUE(answer->fds.empty());
    } else {
      EXPECT_EQ(std::uint64_t{reply.payload.address}, 0U);
      ASSERT_EQ(answer->fds.size(), 1U);
      const int seals = ::fcntl(answer->fds[0].get(), F_GET_SEALS);
      EXPECT_EQ(seals & (F_SEAL_SHRINK | F_SEAL_GROW | F_SEAL_WRITE),
                F_SEAL_SHRINK | F_SEAL_GROW | F_SEAL_WRITE);
      struct stat status {};
      ::fstat(answer->fds[0].get(), &status);
      EXPECT_EQ(status.st_size, length);
    }
    EXPECT_EQ(regions.live(), 0U);
  }
}

TEST_F(PortsTest, ARegionThatCannotBeSealedIsNotSentAndNothingOfItIsLeft) {
  void* twin = nullptr;
  // The kernel seals nothing that can be written through another mapping.
  table.whenAllocated = [&](void* address, std::uint32_t length) {
    twin = ::mremap(address, 0, length, MREMAP_MAYMOVE);
    ASSERT_NE(twin, MAP_FAILED);
  };
  const std::size_t before = openDescriptors();
  EXPECT_EQ(codeOf(message(kRegion).add(kNdrRecord).add(100000U)), kern::resourceShortage);
  EXPECT_EQ(openDescriptors(), before);
  EXPECT_EQ(regions.live(), 0U);
  ::munmap(twin, 100000);
}

TEST_F(PortsTest, AnEmptyRegionHasAddressAndSizeZero) {
  const auto answer = exchange(message(kRegion).add(kNdrRecord).add(0U));
  ASSERT_TRUE(answer);
  EXPECT_EQ(answer->bytes.size(), 56U);
  EXPECT_EQ(std::uint64_t{reinterpret_cast<const OutOfLineReply*>(answer->bytes.data())->payload.address},
            0U);
}

TEST_F(PortsTest, AFullChannelDelaysItsOwnRepliesOnlyAndIsNotReadUntilTheyHaveGoneOut) {
  const Datagram large = message(kRegion).add(kNdrRecord).add(60000U);
  int sent = 0;
  int before = -1;
  while (table.served != before) {  // until the helper stops reading
    before = table.served;
    ASSERT_TRUE(sendTo(client.get(), large));
    ++sent;
    pump();
  }
  EXPECT_LT(table.served, sent);

  PortName other = kNullPort;
  ASSERT_EQ(ports.allocateReceiveRight(&other), kern::success);
  ASSERT_EQ(ports.insertSendRight(other), kern::success);
  const auto second = sources.makeRoutineSource(other, table, WantTrailer::no);
  ASSERT_TRUE(second->addTo(*loop));
  const auto otherEnd = ports.sendEnd(other);
  ASSERT_TRUE(sendTo(otherEnd->get(), message(kEcho)));
  pump();
  EXPECT_TRUE(receiveFrom(otherEnd->get())) << "others are served meanwhile";

  int answers = 0;
  while (const auto answer = receiveFrom(client.get())) {
    EXPECT_EQ(answer->bytes.size(), 60056U);
    ++answers;
    pump();
  }
  EXPECT_EQ(answers, sent) << "every reply came in the end";
  EXPECT_EQ(regions.live(), 0U);
}

TEST_F(PortsTest, AReplyForWhichTheKernelHasNoMemoryGoesOutLaterAndNobodySpinsMeanwhile) {
  for (const int error : {ENOBUFS, ENOMEM}) {
    const auto began = std::chrono::steady_clock::now();
    {
      const FailingCall noMemory("send", error, 1, FailingCall::HowOften::always);  // after the request
      ASSERT_TRUE(sendTo(client.get(), message(kEcho)));
      for (int look = 0; look < 20; ++look) (void)loop->run(0s, ReturnAfterSource::yes);
      EXPECT_FALSE(receiveFrom(client.get()));
      EXPECT_GE(noMemory.failures(), 1);
      EXPECT_LE(noMemory.failures(), 1 + (std::chrono::steady_clock::now() - began) / 10ms)
          << "the channel has room all the time, and is not asked all the time";
    }
    EXPECT_EQ(loop->run(10s, ReturnAfterSource::yes), RunResult::handledSource);
    const auto answer = receiveFrom(client.get());
    ASSERT_TRUE(answer);
    EXPECT_EQ(answer->code(), 0);
    EXPECT_EQ(codeOf(message(kEcho)), 0) << "the channel is read again";
  }
}

TEST_F(PortsTest, AReplyForWhichTheKernelNeverHasMemoryEndsItsChannelAfterASecond) {
  ASSERT_EQ(ports.deallocateSendRight(port), kern::success);  // the client's copy is the only one
  const FailingCall noMemory("send", ENOMEM, 1, FailingCall::HowOften::always);  // after the request
  EXPECT_FALSE(exchange(message(kRegion).add(kNdrRecord).add(100U)));
  EXPECT_EQ(regions.live(), 1U);
  while (regions.live() > 0) ASSERT_EQ(loop->run(10s, ReturnAfterSource::yes), RunResult::handledSource);
  EXPECT_EQ(noMemory.failures(), 1 + 100);
}

// A client whose channel is served by a loop that the test plays.
class PlayedLoopTest : public PortsTest {
 protected:
  static constexpr auto kReadable = Readiness{.isReadable = true};
  static constexpr auto kWritable = Readiness{.isWritable = true};

  void SetUp() override { ASSERT_NO_FATAL_FAILURE(addClient()); }
  // Another one, in the place of the one before.
  void addClient() {
    ASSERT_EQ(ports.allocateReceiveRight(&port), kern::success);
    ASSERT_EQ(ports.insertSendRight(port), kern::success);
    fd = ports.receiveEnd(port)->get();
    client = UniqueFd(::fcntl(ports.sendEnd(port)->get(), F_DUPFD_CLOEXEC, 0));
    served = sources.makeRoutineSource(port, table, WantTrailer::no);
    ASSERT_TRUE(served->addTo(played));
  }
  void askForRegion() { ASSERT_TRUE(sendTo(client.get(), message(kRegion).add(kNdrRecord).add(1000U))); }
  // Until no reply fits any more.
  void fillChannel() const {
    const std::array<char, 4096> bytes{};
    while (::sendto(fd, bytes.data(), bytes.size(), MSG_DONTWAIT, nullptr, 0) > 0) {
    }
  }
  // The answer behind what filled the channel.
  std::optional<Answer> takeAnswer() const {
    std::optional<Answer> answer;
    do {
      answer = receiveFrom(client.get());
    } while (answer && answer->bytes.size() == 4096);
    return answer;
  }
  bool hasEnded() const { return !played.interestIn(fd); }

  ManualClock clock;
  ManualRunLoop played{clock};
  std::shared_ptr<RoutineSource> served;
  int fd = -1;
};

TEST_F(PlayedLoopTest, AReplyWaitsForMemoryWithATimerAndForRoomWithoutOneWhicheverItNeedsFirst) {
  for (const bool needsMemoryFirst : {true, false}) {
    if (!needsMemoryFirst) fillChannel();
    askForRegion();
    if (needsMemoryFirst) {
      const FailingCall noMemory("send", ENOMEM);
      played.makeReady(fd, kReadable);
      EXPECT_EQ(played.timers(), 1U);
      EXPECT_EQ(played.interestIn(fd), Interest::none);
      fillChannel();
    }
    for (int look = 0; look < 2; ++look) {
      if (needsMemoryFirst && look == 0) {
        clock.advance(10ms);
      } else {
        played.makeReady(fd, look == 0 ? kReadable : kWritable);
      }
      EXPECT_EQ(played.timers(), 0U);
      EXPECT_EQ(played.interestIn(fd), Interest::writing);
      EXPECT_EQ(regions.live(), 1U);
    }
    EXPECT_FALSE(takeAnswer());
    for (int look = 0; look < 2 && !needsMemoryFirst; ++look) {
      const FailingCall noMemory("send", ENOBUFS);
      played.makeReady(fd, kWritable);
      EXPECT_EQ(played.timers(), 1U);
      EXPECT_EQ(played.interestIn(fd), Interest::none);
    }
    needsMemoryFirst ? void(played.makeReady(fd, kWritable)) : clock.advance(10ms);
    EXPECT_EQ(played.timers(), 0U);
    EXPECT_EQ(played.interestIn(fd), Interest::reading);
    EXPECT_EQ(regions.live(), 0U);
    const auto answer = takeAnswer();
    ASSERT_TRUE(answer);
    EXPECT_EQ(answer->bytes.size(), 56U + 1000U);
  }
}

TEST_F(PlayedLoopTest, AReplyForWhichThereIsNoMemoryIsTriedEvery10MillisecondsForASecond) {
  askForRegion();
  const FailingCall noMemory("send", ENOMEM, 0, FailingCall::HowOften::always);
  played.makeReady(fd, kReadable);
  clock.advance(10ms - 1ns);
  EXPECT_EQ(noMemory.failures(), 1);
  clock.advance(1ns);
  EXPECT_EQ(noMemory.failures(), 2);
  clock.advance(990ms - 1ns);
  EXPECT_FALSE(hasEnded());
  EXPECT_EQ(regions.live(), 1U);
  clock.advance(1ns);
  EXPECT_TRUE(hasEnded());
  EXPECT_EQ(noMemory.failures(), 1 + 100);
  EXPECT_EQ(regions.live(), 0U);
}

TEST_F(PlayedLoopTest, ASourceThatTheLoopCannotWatchIsNotServed) {
  played.refuseDescriptors = true;
  const auto refused = sources.makeRoutineSource(port, table, WantTrailer::no);
  EXPECT_FALSE(refused->addTo(played));
  EXPECT_EQ(sources.makeDeathWatch(port, played), nullptr);
}

TEST_F(PlayedLoopTest, AReplyThatCannotBeSentEndsItsChannelAndNothingOfItIsLeft) {
  for (const int error : {EPIPE, ECONNRESET, ETOOMANYREFS}) {
    askForRegion();
    const FailingCall failing("send", error, 0, FailingCall::HowOften::always);
    played.makeReady(fd, kReadable);
    EXPECT_EQ(failing.failures(), 1);
    EXPECT_TRUE(hasEnded()) << error;
    EXPECT_EQ(regions.live(), 0U);
    EXPECT_EQ(played.timers(), 0U);
    EXPECT_FALSE(receiveFrom(client.get()));
    ASSERT_NO_FATAL_FAILURE(addClient());
  }
}

TEST_F(PlayedLoopTest, AClientWhoseReplyCannotBeSentSeesTheEndOfItsChannelAndDoesNotWaitForever) {
  const auto seesTheEnd = [&] {
    char byte = 0;
    return ::recv(client.get(), &byte, 1, MSG_DONTWAIT) == 0;
  };
  {
    askForRegion();
    const FailingCall tooMany("send", ETOOMANYREFS);
    played.makeReady(fd, kReadable);
  }
  EXPECT_TRUE(seesTheEnd()) << "at once";

  ASSERT_NO_FATAL_FAILURE(addClient());
  askForRegion();
  {
    const FailingCall noMemory("send", ENOMEM, 0, FailingCall::HowOften::always);
    played.makeReady(fd, kReadable);
    EXPECT_FALSE(seesTheEnd());
    for (int i = 0; i < 200; ++i) clock.advance(10ms);
  }
  EXPECT_TRUE(seesTheEnd()) << "after all tries";

  ASSERT_NO_FATAL_FAILURE(addClient());
  played.refuseTimers = true;
  askForRegion();
  {
    const FailingCall noMemory("send", ENOMEM);
    played.makeReady(fd, kReadable);
  }
  EXPECT_TRUE(seesTheEnd()) << "without a timer to try again";
}

TEST_F(PlayedLoopTest, AReplyThatWaitedAndCannotBeSentThenEndsItsChannel) {
  for (const bool waitsForMemory : {true, false}) {
    if (!waitsForMemory) fillChannel();
    askForRegion();
    {
      const FailingCall noMemory("send", waitsForMemory ? ENOMEM : EAGAIN);
      played.makeReady(fd, kReadable);
    }
    EXPECT_EQ(regions.live(), 1U);
    const FailingCall failing("send", EPIPE);
    waitsForMemory ? clock.advance(10ms) : void(played.makeReady(fd, kWritable));
    EXPECT_EQ(failing.failures(), 1);
    EXPECT_TRUE(hasEnded());
    EXPECT_EQ(regions.live(), 0U);
    EXPECT_EQ(played.timers(), 0U);
    ASSERT_NO_FATAL_FAILURE(addClient());
  }
}

TEST_F(PlayedLoopTest, AReplyDoesNotWaitForAClientThatHasGone) {
  for (const auto gone : {Readiness{.hasHungUp = true}, Readiness{.hasFailed = true}}) {
    for (const int error : {EAGAIN, ENOMEM}) {
      askForRegion();
      const FailingCall failing("send", error, 0, FailingCall::HowOften::always);
      played.makeReady(fd, kReadable);
      EXPECT_EQ(regions.live(), 1U);
      EXPECT_FALSE(hasEnded());
      played.makeReady(fd, gone);
      EXPECT_TRUE(hasEnded()) << error;
      EXPECT_EQ(regions.live(), 0U);
      EXPECT_EQ(played.timers(), 0U);
      ASSERT_NO_FATAL_FAILURE(addClient());
    }
  }
}

TEST_F(PlayedLoopTest, AReplyThatNothingCouldTryAgainEndsItsChannelAtOnceOrWhenThatShows) {
  for (const bool isSeenLater : {false, true}) {
    played.refuseTimers = !isSeenLater;
    played.failTimersLater = isSeenLater;
    askForRegion();
    const FailingCall noMemory("send", ENOMEM);
    played.makeReady(fd, kReadable);
    EXPECT_EQ(hasEnded(), !isSeenLater);
    EXPECT_EQ(regions.live(), isSeenLater ? 1U : 0U);
    clock.advance(0ms);
    EXPECT_TRUE(hasEnded());
    EXPECT_EQ(regions.live(), 0U);
    ASSERT_NO_FATAL_FAILURE(addClient());
  }
}

TEST_F(PlayedLoopTest, WithoutMemoryForAReplyToWaitInItsChannelEndsAndNothingOfItIsLeft) {
  if (!FailingAllocations::kWork) GTEST_SKIP() << "operator new belongs to the sanitizer";
  for (const int error : {EAGAIN, ENOMEM}) {
    int ended = 0;
    for (long first = 0;; ++first) {
      askForRegion();
      long failures = 0;
      {
        const FailingCall failing("send", error);
        const FailingAllocations noMemory(first, FailingAllocations::HowMany::one);
        played.makeReady(fd, kReadable);
        failures = FailingAllocations::failures();
      }
      const bool waits = error == EAGAIN ? played.interestIn(fd) == Interest::writing
                                         : played.interestIn(fd) == Interest::none && played.timers() == 1;
      if (waits) {
        error == EAGAIN ? void(played.makeReady(fd, kWritable)) : clock.advance(10ms);
        EXPECT_TRUE(receiveFrom(client.get())) << first;
      } else {
        ++ended;
        EXPECT_TRUE(hasEnded()) << first;
        EXPECT_FALSE(receiveFrom(client.get())) << first;
      }
      EXPECT_EQ(regions.live(), 0U) << first;
      EXPECT_EQ(played.timers(), 0U) << first;
      if (failures == 0) break;
      ASSERT_NO_FATAL_FAILURE(addClient());
    }
    EXPECT_GE(ended, 1) << error;
  }
}

TEST_F(PlayedLoopTest, AChannelThatIsOverEndsOnceNothingIsLeftToRead) {
  for (const auto gone : {Readiness{.hasHungUp = true}, Readiness{.hasFailed = true}}) {
    ASSERT_TRUE(sendTo(client.get(), message(kEcho)));
    table.served = 0;
    auto readable = gone;
    readable.isReadable = true;
    played.makeReady(fd, readable);
    EXPECT_EQ(table.served, 1) << "what it sent before is served";
    EXPECT_FALSE(hasEnded());
    played.makeReady(fd, gone);
    EXPECT_TRUE(hasEnded());
    EXPECT_FALSE(served->addTo(played)) << "there is nothing left to serve";
    ASSERT_NO_FATAL_FAILURE(addClient());
  }
}

TEST_F(PlayedLoopTest, ALookThatFindsNothingIsTheLastOfItsTurn) {
  const auto looksOfATurn = [&] {
    const int before = looksAtSockets;
    played.makeReady(fd, kReadable);
    return looksAtSockets - before;
  };
  EXPECT_EQ(looksOfATurn(), 1);
  ASSERT_TRUE(sendTo(client.get(), message(kEcho)));
  EXPECT_EQ(looksOfATurn(), 1) << "who waits for an answer has sent no more";
  ASSERT_TRUE(sendTo(client.get(), message(kEcho, 0, 24, 0)));
  EXPECT_EQ(looksOfATurn(), 2) << "who waits for none may have";
}

TEST_F(PortsTest, InvalidatingASourceReleasesTheReplyThatWaited) {
  const Datagram large = message(kRegion).add(kNdrRecord).add(60000U);
  // Until one waits; how many go before is up to the system's buffers.
  for (int i = 0; i < 10'000 && regions.live() == 0; ++i) {
    ASSERT_TRUE(sendTo(client.get(), large));
    pump();
  }
  EXPECT_EQ(regions.live(), 1U);
  source->invalidate();
  EXPECT_EQ(regions.live(), 0U);
}

TEST_F(PortsTest, NoMoreThanABudgetOfOneClientsMessagesIsTakenBeforeTheOthersGetTheirTurn) {
  PortName other = kNullPort;
  ASSERT_EQ(ports.allocateReceiveRight(&other), kern::success);
  ASSERT_EQ(ports.insertSendRight(other), kern::success);
  const auto second = sources.makeRoutineSource(other, table, WantTrailer::no);
  ASSERT_TRUE(second->addTo(*loop));
  for (int i = 0; i < 100; ++i) ASSERT_TRUE(sendTo(client.get(), message(kEcho, 0, 24, 0)));
  const auto otherEnd = ports.sendEnd(other);
  ASSERT_TRUE(sendTo(otherEnd->get(), message(kEcho)));
  loop->run(0s, ReturnAfterSource::yes);
  EXPECT_LE(table.served, 9);
  loop->run(0s, ReturnAfterSource::yes);
  EXPECT_LE(table.served, 17);
  EXPECT_TRUE(receiveFrom(otherEnd->get())) << "the other client did not wait for a hundred messages";
  pump();
  EXPECT_EQ(table.served, 101);
}

// A client that has sent many requests before it looks for answers.
class BusyClientTest : public PortsTest {
 protected:
  static constexpr int kRequests = 128;

  ~BusyClientTest() override { clockStep = std::chrono::nanoseconds(-1); }

  // How many turns of the loop it takes to answer them.
  int turnsForRequestsThatWait() {
    for (int i = 0; i < kRequests; ++i) EXPECT_TRUE(sendTo(client.get(), message(kEcho)));
    int turns = 0;
    while (loop->run(0s, ReturnAfterSource::yes) == RunResult::handledSource) ++turns;
    for (int i = 0; i < kRequests; ++i) EXPECT_TRUE(receiveFrom(client.get()));
    return turns;
  }
};

TEST_F(BusyClientTest, RequestsThatWaitCostNoTurnOfTheLoopEach) {
  clockStep = 0ns;
  EXPECT_LE(turnsForRequestsThatWait(), 32);
}

TEST_F(BusyClientTest, RequestsForWhichTheLoopHadToWaitCostATurnEach) {
  clockStep = BacklogGuess::kAtOnce;
  EXPECT_EQ(turnsForRequestsThatWait(), kRequests);
}

TEST_F(BusyClientTest, ItsRequestsCostAnotherClientNoMoreThanABudget) {
  PortName other = kNullPort;
  ASSERT_EQ(ports.allocateReceiveRight(&other), kern::success);
  ASSERT_EQ(ports.insertSendRight(other), kern::success);
  const auto second = sources.makeRoutineSource(other, table, WantTrailer::no);
  ASSERT_TRUE(second->addTo(*loop));
  const auto otherEnd = ports.sendEnd(other);
  clockStep = 0ns;
  ASSERT_LE(turnsForRequestsThatWait(), 32);
  // One of its turns is timed, and the next takes as many as it may.
  for (int i = 0; i < kRequests; ++i) ASSERT_TRUE(sendTo(client.get(), message(kEcho)));
  int served = 0;
  do {
    served = table.served;
    loop->run(0s, ReturnAfterSource::yes);
  } while (table.served == served + 1);
  ASSERT_EQ(table.served, served + 8);
  ASSERT_TRUE(sendTo(otherEnd->get(), message(kEcho)));
  served = table.served;
  for (int turn = 0; turn < 2; ++turn) loop->run(0s, ReturnAfterSource::yes);
  EXPECT_LE(table.served, served + 9);
  EXPECT_TRUE(receiveFrom(otherEnd->get()));
  pump();
  EXPECT_EQ(table.served, 2 * kRequests + 1);
}

TEST_F(BusyClientTest, RequestsThatTakeLongCostAnotherClientOneOfThem) {
  clockStep = 0ns;
  ASSERT_LE(turnsForRequestsThatWait(), 32);
  table.whileServing = [] { steppedTime += 20ms; };
  for (int i = 0; i < 2 * 8 + 1; ++i) ASSERT_TRUE(sendTo(client.get(), message(kEcho)));
  for (int turn = 0; turn < 2 * 8 + 1; ++turn) {
    const int served = table.served;
    loop->run(0s, ReturnAfterSource::yes);
    EXPECT_EQ(table.served, served + 1) << turn;
  }
}

TEST_F(BusyClientTest, ATurnEndsAfter20MillisecondsAndNotBefore) {
  clockStep = 0ns;
  ASSERT_LE(turnsForRequestsThatWait(), 32);
  for (int i = 0; i < 8 + 3; ++i) ASSERT_TRUE(sendTo(client.get(), message(kEcho)));
  int served = 0;
  do {  // one of its turns is timed
    served = table.served;
    loop->run(0s, ReturnAfterSource::yes);
  } while (table.served == served + 1 && served < kRequests + 8);
  for (int i = 0; i < 16; ++i) ASSERT_TRUE(sendTo(client.get(), message(kEcho)));
  served = table.served;
  int asked = 0;
  table.whileServing = [&] { steppedTime += ++asked == 1 ? 20ms - 1ns : 1ns; };
  loop->run(0s, ReturnAfterSource::yes);
  EXPECT_EQ(table.served, served + 2);
}

TEST_F(BusyClientTest, ALookInVainIsTheLastUntilRequestsWaitAgain) {
  clockStep = 0ns;
  ASSERT_LE(turnsForRequestsThatWait(), 32);
  clockStep = BacklogGuess::kAtOnce;  // whatever comes now, the loop had to wait for
  const auto looksForOneMore = [&] {
    const int before = looksAtSockets;
    EXPECT_TRUE(sendTo(client.get(), message(kEcho)));
    loop->run(0s, ReturnAfterSource::yes);
    return looksAtSockets - before;
  };
  EXPECT_LE(looksForOneMore(), 2) << "the second is in vain";
  for (int i = 0; i < 20; ++i) EXPECT_EQ(looksForOneMore(), 1) << i;
}

TEST_F(BusyClientTest, OneWayRequestsThatTakeLongCostAnotherClientTwoOfThem) {
  clockStep = 0ns;
  table.whileServing = [] { steppedTime += 30ms; };
  for (int i = 0; i < 16; ++i) ASSERT_TRUE(sendTo(client.get(), message(kEcho, 0, 24, 0)));
  loop->run(0s, ReturnAfterSource::yes);
  EXPECT_EQ(table.served, 2);
  pump();
  EXPECT_EQ(table.served, 16);
}

TEST_F(PortsTest, AClientThatShutsItsChannelIsReadNoMoreAndWakesNobody) {
  ASSERT_EQ(::shutdown(client.get(), SHUT_RDWR), 0);
  pump();
  EXPECT_EQ(loop->run(0s, ReturnAfterSource::yes), RunResult::timedOut);
}

TEST_F(PortsTest, ARoutineMayInvalidateTheSourceThatCalledIt) {
  table.whileServing = [&] { source->invalidate(); };
  EXPECT_FALSE(exchange(message(kRegion).add(kNdrRecord).add(100U)));
  EXPECT_EQ(regions.live(), 0U);
}

// ---- death watch ----

TEST_F(PortsTest, DeathOfThePortIsToldOnce) {
  auto [theirs, ours] = pair();
  const PortName name = ports.adoptSendRight(std::move(ours));
  const auto watch = sources.makeDeathWatch(name, *loop);
  ASSERT_NE(watch, nullptr);
  int told = 0;
  watch->setInvalidationCallback([&](DeathWatch& dead) {
    EXPECT_EQ(dead.port(), name);
    EXPECT_FALSE(dead.isValid());
    ++told;
  });
  EXPECT_TRUE(watch->isValid());
  ASSERT_EQ(::send(theirs.get(), "noise", 5, 0), 5);
  pump();
  EXPECT_EQ(told, 0) << "what the port says is not its death";
  theirs.reset();
  EXPECT_FALSE(watch->isValid()) << "dead as soon as the kernel says so";
  pump();
  EXPECT_EQ(told, 1);
}

TEST_F(PortsTest, APortThatDiedBeforeItWasWatchedIsToldAfterTheCallbackIsSetAndAfterItsNameIsFreed) {
  auto [theirs, ours] = pair();
  theirs.reset();
  const PortName name = ports.adoptSendRight(std::move(ours));
  const auto watch = sources.makeDeathWatch(name, *loop);
  EXPECT_FALSE(watch->isValid());
  int told = 0;
  watch->setInvalidationCallback([&](DeathWatch&) { ++told; });
  EXPECT_EQ(ports.deallocateSendRight(name), kern::success);
  pump();
  EXPECT_EQ(told, 1);
}

TEST_F(PortsTest, DeathIsToldWhereTheSameRightWasGivenTwiceAndRefusedOnce) {
  auto [theirs, ours] = pair();
  UniqueFd again(::fcntl(ours.get(), F_DUPFD_CLOEXEC, 0));
  const auto watch = sources.makeDeathWatch(ports.adoptSendRight(std::move(ours)), *loop);
  ASSERT_EQ(ports.deallocateSendRight(ports.adoptSendRight(std::move(again))), kern::success);
  int told = 0;
  watch->setInvalidationCallback([&](DeathWatch&) { ++told; });
  pump();
  EXPECT_TRUE(watch->isValid());
  EXPECT_EQ(told, 0);
  theirs.reset();
  pump();
  EXPECT_EQ(told, 1);
}

TEST_F(PortsTest, ARightThatIsGivenUpStaysOpenForOthersWhoHoldTheSameSocket) {
  auto [theirs, ours] = pair();
  const UniqueFd kept(::fcntl(ours.get(), F_DUPFD_CLOEXEC, 0));
  ASSERT_EQ(ports.deallocateSendRight(ports.adoptSendRight(std::move(ours))), kern::success);
  ports.closing().drain();
  ASSERT_EQ(::send(theirs.get(), "a", 1, MSG_NOSIGNAL), 1);
  char letter = 0;
  EXPECT_EQ(::recv(kept.get(), &letter, 1, MSG_DONTWAIT), 1);
  ASSERT_EQ(::send(kept.get(), "b", 1, MSG_NOSIGNAL), 1);
  EXPECT_EQ(::recv(theirs.get(), &letter, 1, MSG_DONTWAIT), 1);
}

TEST_F(PortsTest, TwoEndsOfOnePairAreNotBothWatchedWhoeverNamedThem) {
  for (const bool isNamedBefore : {false, true}) {
    auto [one, other] = pair();
    const sockaddr_un own{AF_UNIX, "\0brenvik-test-held-end"};
    if (isNamedBefore) {
      ASSERT_EQ(::bind(one.get(), reinterpret_cast<const sockaddr*>(&own), sizeof own), 0);
    }
    const UniqueFd again(::fcntl(one.get(), F_DUPFD_CLOEXEC, 0));
    const PortName first = ports.adoptSendRight(std::move(one));
    const PortName second = ports.adoptSendRight(std::move(other));
    auto watch = sources.makeDeathWatch(first, *loop);
    ASSERT_NE(watch, nullptr);
    EXPECT_EQ(sources.makeDeathWatch(second, *loop), nullptr) << "each would keep the other alive";
    const PortName same = ports.adoptSendRight(UniqueFd(::fcntl(again.get(), F_DUPFD_CLOEXEC, 0)));
    EXPECT_NE(sources.makeDeathWatch(same, *loop), nullptr) << "the same end twice does no harm";
    watch.reset();
    EXPECT_NE(sources.makeDeathWatch(second, *loop), nullptr) << "nothing of a watch that is gone is left";
  }
}

TEST_F(PortsTest, AnInvalidatedWatchTellsNothing) {
  auto [theirs, ours] = pair();
  const auto watch = sources.makeDeathWatch(ports.adoptSendRight(std::move(ours)), *loop);
  watch->setInvalidationCallback([](DeathWatch&) { ADD_FAILURE(); });
  watch->invalidate();
  theirs.reset();
  pump();
  EXPECT_FALSE(watch->isValid());
}

TEST_F(PortsTest, AWatchOrSourceOnANameWithoutItsRightIsRefused) {
  EXPECT_EQ(sources.makeDeathWatch(0x4242, *loop), nullptr);
  EXPECT_EQ(sources.makeRoutineSource(0x4242, table, WantTrailer::no), nullptr);
}

// ---- the service port ----

class ServiceTest : public PortsTest {
 protected:
  void SetUp() override {
    PortsTest::SetUp();
    std::string name = (std::filesystem::temp_directory_path() / "brenvik-ports-XXXXXX").string();
    ASSERT_NE(::mkdtemp(name.data()), nullptr);
    root = name;
    directory = root;
  }
  void TearDown() override { std::filesystem::remove_all(root); }

  std::string path() const { return directory + "/service"; }
  void listen() {
    ASSERT_EQ(bootstrap().checkIn("service", &service), kern::success);
    serviceSource = sources.makeRoutineSource(service, table, WantTrailer::yes);
    ASSERT_TRUE(serviceSource->addTo(*loop));
  }
  SystemBootstrap bootstrap() { return {ports, directory, group}; }
  UniqueFd connect() {
    UniqueFd fd(::socket(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC | SOCK_NONBLOCK, 0));
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    std::strcpy(address.sun_path, path().c_str());
    if (::connect(fd.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address) != 0) fd.reset();
    return fd;
  }
  static bool isClosed(const UniqueFd& fd) {
    char byte = 0;
    return ::recv(fd.get(), &byte, 1, MSG_DONTWAIT | MSG_PEEK) == 0;
  }
  // Also where the other end left a message unread, which takes the place of the end of file.
  static bool hasHungUp(const UniqueFd& fd) {
    pollfd state{fd.get(), 0, 0};
    return ::poll(&state, 1, 0) == 1;
  }

  std::string root;       // of all that a test makes
  std::string directory;  // where the bootstrap makes sockets
  std::string group = "nogroup";
  PortName service = kNullPort;
  std::shared_ptr<RoutineSource> serviceSource;
};

TEST_F(ServiceTest, TheSocketFileIsMadeForTheGroupAndGoesWithTheRight) {
  directory += "/a/b";
  listen();
  struct stat status {};
  ASSERT_EQ(::stat(directory.c_str(), &status), 0);
  EXPECT_EQ(status.st_mode & 07777, 0755U);
  ASSERT_EQ(::stat(path().c_str(), &status), 0);
  EXPECT_EQ(status.st_mode & 07777, 0660U);
  if (::geteuid() == 0) {
    EXPECT_EQ(status.st_uid, 0U);
    EXPECT_EQ(status.st_gid, ::getgrnam("nogroup")->gr_gid);
  }
  serviceSource->invalidate();
  EXPECT_EQ(ports.dropReceiveRight(service), kern::success);
  EXPECT_NE(::stat(path().c_str(), &status), 0);
}

TEST_F(ServiceTest, WithoutTheGroupTheSocketFileIsForRootsAlone) {
  group = "no-such-group";
  listen();
  struct stat status {};
  ASSERT_EQ(::stat(path().c_str(), &status), 0);
  EXPECT_EQ(status.st_mode & 07777, 0660U);
  EXPECT_EQ(status.st_gid, ::getegid());
}

TEST_F(ServiceTest, InANamespaceWithoutTheGroupTheSocketFileIsForRootsAlone) {
  const uid_t uid = ::geteuid();
  const gid_t gid = ::getegid();
  const pid_t child = ::fork();
  ASSERT_GE(child, 0);
  if (child == 0) {
    if (::unshare(CLONE_NEWUSER) != 0) ::_exit(77);
    std::ofstream("/proc/self/setgroups") << "deny";
    std::ofstream("/proc/self/uid_map") << "0 " << uid << " 1";
    std::ofstream("/proc/self/gid_map") << "0 " << gid << " 1";
    listen();
    struct stat status {};
    const bool good = ::stat(path().c_str(), &status) == 0 && (status.st_mode & 07777) == 0660U &&
                      status.st_uid == 0 && status.st_gid == 0;
    ::_exit(good && !HasFailure() ? 0 : 1);
  }
  int status = -1;
  ASSERT_EQ(::waitpid(child, &status, 0), child);
  if (WIFEXITED(status) && WEXITSTATUS(status) == 77) GTEST_SKIP() << "no user namespaces to be had";
  EXPECT_EQ(status, 0);
}

TEST_F(ServiceTest, AStaleSocketFileIsReplaced) {
  {
    const UniqueFd dead(::socket(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC, 0));
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    std::strcpy(address.sun_path, path().c_str());
    ASSERT_EQ(::bind(dead.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address), 0);
  }
  listen();
  EXPECT_TRUE(connect().isValid());
}

TEST_F(ServiceTest, ANameThatALiveProcessHoldsIsRefusedAndSaidWhy) {
  listen();
  pauses = 0;
  PortName second = kNullPort;
  EXPECT_EQ(bootstrap().checkIn("service", &second), kern::noAccess);
  EXPECT_EQ(second, kNullPort);
  EXPECT_EQ(log.entries().back(),
            RecordingLog::unifiedLine(LogLevel::error, "another process already serves " + path()));
  EXPECT_EQ(pauses, 0) << "who is alive need not be waited for";
  EXPECT_TRUE(connect().isValid()) << "the first is not disturbed";
}

TEST_F(ServiceTest, ASocketThatAChildOfAKilledProcessStillHoldsIsReplacedOnceTheChildLetsGo) {
  const pid_t killed = ::fork();
  ASSERT_GE(killed, 0);
  if (killed == 0) {
    const UniqueFd inherited(::socket(AF_UNIX, SOCK_SEQPACKET, 0));
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    std::strcpy(address.sun_path, path().c_str());
    if (::bind(inherited.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address) != 0 ||
        ::listen(inherited.get(), 8) != 0) {
      ::_exit(1);
    }
    if (::fork() == 0) (void)::accept(inherited.get(), nullptr, nullptr);  // until somebody has looked
    ::_exit(0);
  }
  int status = -1;
  ASSERT_EQ(::waitpid(killed, &status, 0), killed);
  ASSERT_EQ(status, 0);
  listen();
  EXPECT_TRUE(connect().isValid());
}

TEST_F(ServiceTest, WhoeverStartsAtTheSameTimeWaitsForTheOtherToBeDone) {
  const UniqueFd lock(::open((directory + "/.service.lock").c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0600));
  ASSERT_EQ(::flock(lock.get(), LOCK_EX), 0);
  int tries = 0;
  beforeLocking = [&] {
    if (++tries == 3) ::syscall(SYS_flock, lock.get(), LOCK_UN);  // the other is done
  };
  listen();
  beforeLocking = nullptr;
  EXPECT_EQ(tries, 3);
  EXPECT_TRUE(connect().isValid());
}

TEST_F(ServiceTest, AFolderThatCannotBeMadeIsSaid) {
  ASSERT_TRUE(UniqueFd(::creat((directory + "/file").c_str(), 0600)).isValid());
  directory += "/file/below";
  PortName name = kNullPort;
  EXPECT_EQ(bootstrap().checkIn("service", &name), kern::noAccess);
  EXPECT_EQ(log.entries().back(),
            RecordingLog::unifiedLine(LogLevel::error,
                                      "cannot lock " + directory + "/.service.lock: Not a directory"));
}

TEST_F(ServiceTest, AFileThatIsNoSocketIsLeftAlone) {
  std::filesystem::create_directory(path());
  PortName name = kNullPort;
  EXPECT_EQ(bootstrap().checkIn("service", &name), kern::noAccess);
  EXPECT_TRUE(std::filesystem::is_directory(path()));
  EXPECT_EQ(log.entries(), std::vector{RecordingLog::unifiedLine(
                               LogLevel::error, path() + " is not a socket, and stays as it is")});
}

TEST_F(ServiceTest, APathTooLongForASocketIsRefused) {
  directory += "/" + std::string(120, 'x');
  PortName name = kNullPort;
  EXPECT_EQ(bootstrap().checkIn("service", &name), kern::noAccess);
  EXPECT_EQ(log.entries(), std::vector{RecordingLog::unifiedLine(
                               LogLevel::error, path() + ": the path is too long for a socket")});
}

TEST_F(ServiceTest, ALockThatCannotBeTakenIsRefusedAndSaidWhy) {
  const std::string lock = directory + "/.service.lock";
  std::filesystem::create_directory(lock);
  PortName name = kNullPort;
  EXPECT_EQ(bootstrap().checkIn("service", &name), kern::noAccess);
  EXPECT_FALSE(std::filesystem::exists(path()));
  EXPECT_EQ(log.entries(), std::vector{RecordingLog::unifiedLine(
                               LogLevel::error, "cannot lock " + lock + ": Is a directory")});
}

TEST_F(ServiceTest, ASocketThatCannotBeMadeIsSaidWhy) {
  const std::size_t open = openDescriptors();
  rlimit before{};
  ASSERT_EQ(::getrlimit(RLIMIT_NOFILE, &before), 0);
  const UniqueFd next(::fcntl(client.get(), F_DUPFD_CLOEXEC, 0));
  // One place is left, and the lock takes it.
  UniqueFd place(::fcntl(client.get(), F_DUPFD_CLOEXEC, 0));
  const rlimit tight{static_cast<rlim_t>(place.get()) + 1, before.rlim_max};
  place.reset();
  ASSERT_EQ(::setrlimit(RLIMIT_NOFILE, &tight), 0);
  PortName name = kNullPort;
  EXPECT_EQ(bootstrap().checkIn("service", &name), kern::noAccess);
  ASSERT_EQ(::setrlimit(RLIMIT_NOFILE, &before), 0);
  EXPECT_EQ(log.entries(), std::vector{RecordingLog::unifiedLine(
                               LogLevel::error, "cannot listen at " + path() + ": Too many open files")});
  EXPECT_EQ(openDescriptors(), open + 1);
}

TEST_F(ServiceTest, AnotherInstancesSocketFileIsNotRemovedAtTheEnd) {
  listen();
  ::unlink(path().c_str());
  std::filesystem::create_directory(path());
  serviceSource->invalidate();
  EXPECT_EQ(ports.dropReceiveRight(service), kern::success);
  EXPECT_TRUE(std::filesystem::exists(path()));
}

// What a service manager hands over, in a process of its own: the descriptors have fixed places there.
class HandedOverTest : public ServiceTest {
 protected:
  struct Given {
    int type = SOCK_SEQPACKET;
    bool listens = true;
  };
  static constexpr int kUntouched = -2;

  // Exits with 0 when the bootstrap took descriptor `taken`, with 1 when it made a socket of its own, and
  // with 2 when a descriptor stayed open that should not (or did not, when they are to be left untouched), or
  // a variable was left to programs started later. Standard error has what was logged.
  [[noreturn]] void checkIn(const std::vector<Given>& given, const char* names, int taken,
                            int pid = ::getpid(), const char* count = nullptr) {
    ::unlink(path().c_str());
    for (std::size_t i = 0; i < given.size(); ++i) {
      const int fd = ::socket(AF_UNIX, given[i].type, 0);
      sockaddr_un address{};
      address.sun_family = AF_UNIX;
      std::strcpy(address.sun_path, (directory + "/given" + std::to_string(i)).c_str());
      ::unlink(address.sun_path);
      if (::bind(fd, reinterpret_cast<const sockaddr*>(&address), sizeof address) != 0) ::_exit(3);
      if (given[i].listens && ::listen(fd, 1) != 0) ::_exit(3);
      // Out of the way of the places, then into them: what stands there is not needed here.
      const int high = ::fcntl(fd, F_DUPFD, 100);
      ::close(fd);
      places_.push_back(high);
    }
    for (std::size_t i = 0; i < places_.size(); ++i) ::dup2(places_[i], 3 + static_cast<int>(i));
    for (const int high : places_) ::close(high);
    const int end = 3 + static_cast<int>(given.size());
    for (int fd = end; fd < 100; ++fd) ::close(fd);
    ::setenv("LISTEN_PID", std::to_string(pid).c_str(), 1);
    ::setenv("LISTEN_FDS", count != nullptr ? count : std::to_string(given.size()).c_str(), 1);
    if (names != nullptr) ::setenv("LISTEN_FDNAMES", names, 1);
    PortName name = kNullPort;
    if (bootstrap().checkIn("service", &name) != kern::success) ::_exit(3);
    for (const auto& entry : log.entries()) std::cerr << testing::PrintToString(entry) << '\n';
    for (int fd = 3; fd < end; ++fd) {
      const int flags = ::fcntl(fd, F_GETFD);
      const bool isRight = taken == kUntouched ? flags == 0
                           : fd == taken       ? flags == FD_CLOEXEC
                                               : flags == -1 || isOurOwn(fd);
      if (!isRight) ::_exit(2);
    }
    if (pid == ::getpid() && (std::getenv("LISTEN_PID") != nullptr || std::getenv("LISTEN_FDS") != nullptr ||
                              std::getenv("LISTEN_FDNAMES") != nullptr)) {
      ::_exit(2);
    }
    ::_exit(std::filesystem::exists(path()) ? 1 : 0);
  }

  static std::string passedOver(const std::string& name) {
    return testing::PrintToString(RecordingLog::unifiedLine(
               LogLevel::error, "passed over a listening descriptor named \"" + name + "\"")) +
           '\n';
  }

 private:
  // The socket that the bootstrap made may have got the place of one that it closed.
  bool isOurOwn(int fd) const {
    sockaddr_un address{};
    socklen_t size = sizeof address;
    return ::getsockname(fd, reinterpret_cast<sockaddr*>(&address), &size) == 0 && path() == address.sun_path;
  }
  std::vector<int> places_;
};

TEST_F(HandedOverTest, TheListeningDescriptorOfTheServicesNameIsTakenAndTheOthersAreClosed) {
  EXPECT_EXIT(checkIn({{}}, "service", 3), testing::ExitedWithCode(0), testing::Eq(""));
  EXPECT_EXIT(checkIn({{}, {}, {}}, "other:service:service", 4), testing::ExitedWithCode(0),
              testing::Eq(passedOver("other") + passedOver("service")));
}

TEST_F(HandedOverTest, WithoutOneOfItsNameTheServiceMakesItsOwnSocket) {
  for (const char* const name : {"servic", "services", ""}) {
    EXPECT_EXIT(checkIn({{}}, name, -1), testing::ExitedWithCode(1), testing::Eq(passedOver(name)));
  }
  EXPECT_EXIT(checkIn({{}}, nullptr, -1), testing::ExitedWithCode(1), testing::Eq(passedOver("")));
  EXPECT_EXIT(checkIn({{}, {}}, "other", -1), testing::ExitedWithCode(1),
              testing::Eq(passedOver("other") + passedOver("")));
}

TEST_F(HandedOverTest, ADescriptorThatListensNotOrNotForDatagramsInOrderIsNotTaken) {
  const std::string line =
      testing::PrintToString(RecordingLog::unifiedLine(
          LogLevel::error, "the descriptor named \"service\" is no listening SOCK_SEQPACKET socket")) +
      '\n';
  EXPECT_EXIT(checkIn({{.type = SOCK_SEQPACKET, .listens = false}}, "service", -1),
              testing::ExitedWithCode(1), testing::Eq(line));
  EXPECT_EXIT(checkIn({{.type = SOCK_STREAM}}, "service", -1), testing::ExitedWithCode(1), testing::Eq(line));
}

TEST_F(HandedOverTest, WhatIsMeantForAnotherProcessIsLeftAlone) {
  EXPECT_EXIT(checkIn({{}}, "service", kUntouched, ::getppid()), testing::ExitedWithCode(1), testing::Eq(""));
}

TEST_F(HandedOverTest, ACountThatIsNoneOrTooLargeEndsAtTheDescriptorsThereAre) {
  EXPECT_EXIT(checkIn({{}}, "service:", 3, ::getpid(), "2147483647"), testing::ExitedWithCode(0),
              testing::Eq(""));
  for (const char* const count : {"", "0", "-1", "1x", " 1", "99999999999"}) {
    EXPECT_EXIT(checkIn({{}}, "service", kUntouched, ::getpid(), count), testing::ExitedWithCode(1),
                testing::Eq(""))
        << count;
  }
}

// Takes every descriptor that this process may have, and gives `count` back.
class DescriptorShortage {
 public:
  explicit DescriptorShortage(std::size_t count) {
    ::getrlimit(RLIMIT_NOFILE, &before_);
    const rlimit tight{std::min<rlim_t>(before_.rlim_max, 256), before_.rlim_max};
    ::setrlimit(RLIMIT_NOFILE, &tight);
    for (;;) {
      UniqueFd filler(::dup(0));
      if (!filler.isValid()) break;
      fillers_.push_back(std::move(filler));
    }
    giveBack(count);
  }
  ~DescriptorShortage() { ::setrlimit(RLIMIT_NOFILE, &before_); }
  DescriptorShortage(const DescriptorShortage&) = delete;
  DescriptorShortage& operator=(const DescriptorShortage&) = delete;
  void giveBack(std::size_t count) { fillers_.resize(fillers_.size() - count); }

 private:
  rlimit before_{};
  std::vector<UniqueFd> fillers_;
};

TEST_F(ServiceTest, MessagesOfTheServicePortCarryTheKernelsWordOnTheirSender) {
  listen();
  const UniqueFd connection = connect();
  ASSERT_TRUE(sendTo(connection.get(), message(kEcho)));
  ASSERT_TRUE(sendTo(connection.get(), message(kEcho)));
  pump();
  EXPECT_EQ(table.served, 2);
  EXPECT_EQ(table.trailer.type, 0U);
  EXPECT_EQ(table.trailer.size, 52U);
  EXPECT_EQ(table.trailer.sequence, 1U);
  EXPECT_EQ(table.trailer.senderUid, ::getuid());
  EXPECT_EQ(table.trailer.senderGid, ::getgid());
  EXPECT_EQ(table.trailer.auditToken[1], ::getuid());
  EXPECT_EQ(table.trailer.auditToken[5], static_cast<std::uint32_t>(::getpid()));
  EXPECT_EQ(table.trailer.auditToken[6], static_cast<std::uint32_t>(::getsid(0)));
  EXPECT_NE(table.trailer.auditToken[7], 0U);
}

TEST_F(ServiceTest, AMessageOfAnotherProcessThanTheConnectionsIsRefusedWith35WhereTheKernelCanTell) {
  listen();
  const UniqueFd connection = connect();
  if (pinPeer(connection.get(), ::getpid(), ::getpid()) == PeerPin::unsupported) {
    GTEST_SKIP() << "this kernel has no SO_PEERPIDFD (Linux 6.5)";
  }
  const pid_t child = ::fork();
  if (child == 0) ::_exit(sendTo(connection.get(), message(kEcho)) ? 0 : 1);
  int status = 0;
  ASSERT_EQ(::waitpid(child, &status, 0), child);
  pump();
  const auto answer = receiveFrom(connection.get());
  ASSERT_TRUE(answer);
  EXPECT_EQ(answer->code(), 35);
  EXPECT_EQ(table.served, 0);
  ASSERT_TRUE(sendTo(connection.get(), message(kEcho)));
  pump();
  EXPECT_EQ(table.served, 1) << "the connection's own process is heard";
}

TEST_F(ServiceTest, AConnectionWhosePeerIsGoneIsRefusedWhereTheKernelCanTell) {
  listen();
  const UniqueFd probe = connect();
  if (pinPeer(probe.get(), ::getpid(), ::getpid()) == PeerPin::unsupported) {
    GTEST_SKIP() << "this kernel has no SO_PEERPIDFD (Linux 6.5)";
  }
  const pid_t child = ::fork();
  if (child == 0) {
    const UniqueFd connection = connect();
    ::_exit(sendTo(connection.get(), message(kEcho)) ? 0 : 1);
  }
  int status = 0;
  ASSERT_EQ(::waitpid(child, &status, 0), child);
  ASSERT_EQ(status, 0);
  pump();
  EXPECT_EQ(table.served, 0);
}

TEST_F(ServiceTest, ConnectionsThatNeverCheckInAreLimitedAndTheOldestGoesFirst) {
  listen();
  std::vector<UniqueFd> connections;
  for (int i = 0; i < 80; ++i) {
    connections.push_back(connect());
    pump();
  }
  EXPECT_TRUE(isClosed(connections.front()));
  EXPECT_FALSE(isClosed(connections.back()));
  EXPECT_EQ(std::count_if(connections.begin(), connections.end(), isClosed), 80 - 64);
  ASSERT_TRUE(sendTo(connections.back().get(), message(kEcho)));
  pump();
  EXPECT_TRUE(receiveFrom(connections.back().get()));
}

TEST_F(ServiceTest, WhoHasGoneWithoutCheckingInIsNotCounted) {
  listen();
  const UniqueFd first = connect();
  pump();
  for (int i = 0; i < 100; ++i) {
    (void)connect();
    pump();
  }
  EXPECT_FALSE(isClosed(first));
}

TEST_F(ServiceTest, ARoutineMayInvalidateTheServiceThatCalledIt) {
  listen();
  const UniqueFd connection = connect();
  const UniqueFd another = connect();
  auto [kept, sent] = pair();
  Datagram checkIn = complexMessage(kKeepRight, 1, 40).add(right());
  checkIn.fds = {sent.get()};
  ASSERT_TRUE(sendTo(connection.get(), checkIn));
  sent.reset();
  table.whileServing = [&] { serviceSource->invalidate(); };
  pump();
  EXPECT_EQ(table.served, 1);
  EXPECT_FALSE(receiveFrom(connection.get()));
  EXPECT_TRUE(hasHungUp(connection));
  ASSERT_TRUE(sendTo(another.get(), message(kEcho)));
  pump();
  EXPECT_EQ(table.served, 1) << "nobody else is served";
  ASSERT_EQ(ports.deallocateSendRight(table.names.at(0)), kern::success) << "the routine had taken it over";
  ports.closing().drain();
  pollfd hungUp{kept.get(), POLLIN, 0};
  EXPECT_EQ(::poll(&hungUp, 1, 0), 1) << "none is left";
}

TEST_F(ServiceTest, ARoutineMayDestroyTheServiceThatCalledIt) {
  listen();
  const UniqueFd connection = connect();
  const UniqueFd another = connect();
  pump();
  ASSERT_TRUE(sendTo(connection.get(), message(kEcho)));
  ASSERT_TRUE(sendTo(another.get(), message(kEcho)));
  table.whileServing = [&] { serviceSource.reset(); };
  pump();
  EXPECT_EQ(table.served, 1);
  EXPECT_TRUE(hasHungUp(connection));
  EXPECT_TRUE(hasHungUp(another));
}

TEST_F(ServiceTest, WhoWasRefusedIsNotCountedAmongTheClients) {
  listen();
  const UniqueFd admitted = connect();
  ASSERT_TRUE(sendTo(admitted.get(), message(kEcho)));
  pump();
  ASSERT_TRUE(receiveFrom(admitted.get()));
  std::vector<UniqueFd> refused;
  for (int i = 0; i < 70; ++i) {
    refused.push_back(connect());
    ASSERT_TRUE(sendTo(refused.back().get(), message(i % 2 == 0 ? kRefuse : kThrow - 100)));
    pump();
    ASSERT_TRUE(receiveFrom(refused.back().get()));
  }
  EXPECT_FALSE(isClosed(admitted));
  EXPECT_EQ(std::count_if(refused.begin(), refused.end(), isClosed), 70 - 64) << "they are strangers still";
}

TEST_F(ServiceTest, AServiceKeepsItsReserveWhileItServesAndGivesItBackAtItsEnd) {
  ASSERT_EQ(bootstrap().checkIn("service", &service), kern::success);
  const std::size_t before = openDescriptors();
  serviceSource = sources.makeRoutineSource(service, table, WantTrailer::yes);
  ASSERT_TRUE(serviceSource->addTo(*loop));
  EXPECT_EQ(openDescriptors(), before + 8);
  UniqueFd connection = connect();
  Datagram two = message(kEcho);
  two.fds.assign(2, client.get());
  for (int i = 0; i < 3; ++i) {
    ASSERT_TRUE(sendTo(connection.get(), message(kEcho)));
    pump();
    ASSERT_TRUE(receiveFrom(connection.get()));
    EXPECT_EQ(openDescriptors(), before + 8 + 2) << "both ends of the connection";
  }
  ASSERT_TRUE(sendTo(connection.get(), two));
  pump();
  ports.closing().drain();
  pump();
  EXPECT_EQ(openDescriptors(), before + 8 + 2 + 1) << "what tells of dropped messages";
  serviceSource->invalidate();
  connection.reset();
  ports.closing().drain();
  EXPECT_EQ(openDescriptors(), before + 1);
}

TEST_F(ServiceTest, AStrangersMessageShorterThanAHeaderIsDroppedInSilenceWithWhatItCarries) {
  listen();
  const UniqueFd connection = connect();
  auto [kept, sent] = pair();
  for (const std::size_t count : {std::size_t{0}, std::size_t{1}, std::size_t{2}}) {
    Datagram datagram;
    datagram.padTo(23);
    datagram.fds.assign(count, sent.get());
    ASSERT_TRUE(sendTo(connection.get(), datagram));
    ASSERT_TRUE(sendTo(connection.get(), message(kEcho)));
    pump();
    std::optional<Answer> answer;
    while (!(answer = receiveFrom(connection.get()))) {
      ASSERT_EQ(loop->run(10s, ReturnAfterSource::yes), RunResult::handledSource) << count;
    }
    EXPECT_EQ(answer->code(), 0);
    EXPECT_FALSE(receiveFrom(connection.get())) << "the short one is not answered";
  }
  sent.reset();
  ports.closing().drain();
  pollfd hungUp{kept.get(), POLLIN, 0};
  EXPECT_EQ(::poll(&hungUp, 1, 0), 1) << "none is kept";
}

// The channel is not listened to while its message is dropped.
TEST_F(ServiceTest, AStrangerWhoseMessageIsDroppedElsewhereAndWhoseAnswerDoesNotFitIsGivenUp) {
  listen();
  const UniqueFd connection = connect();
  Datagram request = complexMessage(kKeepRight, 1, 40).add(right());
  request.fds.assign(2, client.get());
  ASSERT_TRUE(sendTo(connection.get(), request));
  {
    const FailingCall full("send", EAGAIN);
    pump();
    EXPECT_EQ(full.failures(), 1);
  }
  while (!isClosed(connection)) {
    ASSERT_EQ(loop->run(10s, ReturnAfterSource::yes), RunResult::handledSource);
  }
}

TEST_F(ServiceTest, AConnectionThatFailsWhileItIsLetInKeepsNobodyElseWaiting) {
  listen();
  for (const int error : {EINTR, ECONNABORTED}) {
    const UniqueFd connection = connect();
    ASSERT_TRUE(sendTo(connection.get(), message(kEcho)));
    const FailingCall aborted("accept4", error);
    loop->run(0s, ReturnAfterSource::yes);
    EXPECT_EQ(aborted.failures(), 1);
    EXPECT_TRUE(receiveFrom(connection.get())) << error;
  }
}

TEST_F(ServiceTest, ASystemOutOfDescriptorsIsLikeAProcessOutOfThem) {
  listen();
  const UniqueFd silent = connect();
  pump();
  const UniqueFd connection = connect();
  ASSERT_TRUE(sendTo(connection.get(), message(kEcho)));
  const FailingCall full("accept4", ENFILE);
  pump();
  EXPECT_TRUE(isClosed(silent)) << "a stranger gives its place up";
  EXPECT_TRUE(receiveFrom(connection.get()));
}

TEST_F(ServiceTest, TheFirstMessageThatIsDroppedElsewhereFindsADescriptorForThat) {
  listen();
  const UniqueFd connection = connect();
  pump();
  Datagram request = complexMessage(kKeepRight, 1, 40).add(right());
  request.fds.assign(2, client.get());
  ASSERT_TRUE(sendTo(connection.get(), request));
  {
    const FailingCall noThread("pthread_attr_init", ENOMEM, 0, FailingCall::HowOften::always);
    const DescriptorShortage shortage(1);  // for what is looked at of the message, and not closed yet
    pump();
    const auto answer = receiveFrom(connection.get());
    ASSERT_TRUE(answer);
    EXPECT_EQ(answer->code(), -304);
    EXPECT_FALSE(hasHungUp(connection));
  }
  ports.closing().close(UniqueFd(::fcntl(client.get(), F_DUPFD_CLOEXEC, 0)),
                        ::getuid());  // makes the thread
  ASSERT_TRUE(sendTo(connection.get(), message(kEcho)));
  std::optional<Answer> answer;
  while (!(answer = receiveFrom(connection.get()))) {
    ASSERT_EQ(loop->run(10s, ReturnAfterSource::yes), RunResult::handledSource);
  }
  EXPECT_EQ(answer->code(), 0);
}

TEST_F(ServiceTest, WithoutMemoryForAServiceThereIsNone) {
  if (!FailingAllocations::kWork) GTEST_SKIP() << "operator new belongs to the sanitizer";
  ASSERT_EQ(bootstrap().checkIn("service", &service), kern::success);
  const std::size_t before = openDescriptors();
  EXPECT_GE(
      refusalsOf([&] { return sources.makeRoutineSource(service, table, WantTrailer::yes) != nullptr; }), 2);
  EXPECT_GE(refusalsOf([&] { return addNewSource(service); }), 1);
  EXPECT_EQ(openDescriptors(), before);
}

TEST_F(ServiceTest, WithoutMemoryForAConnectionItIsClosedAndNothingOfItIsLeft) {
  if (!FailingAllocations::kWork) GTEST_SKIP() << "operator new belongs to the sanitizer";
  listen();
  {
    const UniqueFd first = connect();
    pump();
  }
  pump();
  ports.closing().drain();
  const std::size_t before = openDescriptors();
  int closed = 0;
  long failures = 0;
  for (long at = 0; at == 0 || failures > 0; ++at) {
    const UniqueFd connection = connect();
    {
      const FailingAllocations noMemory(at, FailingAllocations::HowMany::one);
      (void)loop->run(0s, ReturnAfterSource::yes);
      failures = FailingAllocations::failures();
    }
    pump();
    if (isClosed(connection)) {
      ++closed;
      ports.closing().drain();
      EXPECT_EQ(openDescriptors(), before + 1) << at;
      continue;
    }
    EXPECT_EQ(failures, 0) << at << ": whoever is let in is counted";
    ASSERT_TRUE(sendTo(connection.get(), message(kEcho)));
    pump();
    EXPECT_TRUE(receiveFrom(connection.get())) << at;
    serviceSource->invalidate();
    serviceSource = sources.makeRoutineSource(service, table, WantTrailer::yes);
    ASSERT_TRUE(serviceSource->addTo(*loop));
  }
  EXPECT_GE(closed, 3);
}

TEST_F(ServiceTest, AConnectionFromBeforeTheServiceAskedForCredentialsNamesItsSenderAfterwards) {
  UniqueFd listening(::socket(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC | SOCK_NONBLOCK, 0));
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  std::strcpy(address.sun_path, path().c_str());
  ASSERT_EQ(::bind(listening.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address), 0);
  ASSERT_EQ(::listen(listening.get(), 8), 0);
  const UniqueFd connection = connect();
  service = ports.adoptService(std::move(listening), path());
  serviceSource = sources.makeRoutineSource(service, table, WantTrailer::yes);
  ASSERT_TRUE(serviceSource->addTo(*loop));
  pump();
  ASSERT_TRUE(sendTo(connection.get(), message(kEcho)));
  pump();
  ASSERT_TRUE(receiveFrom(connection.get()));
  EXPECT_EQ(table.trailer.size, 52U);
  EXPECT_EQ(table.trailer.auditToken[5], static_cast<std::uint32_t>(::getpid()));
}

TEST_F(ServiceTest, OnlyRefusalsForSecurityMakeAnAccountWait) {
  listen();
  const UniqueFd connection = connect();
  for (const KernelReturn code : {kern::failure, kern::noAccess, kern::invalidSecurity + 1}) {
    table.refuseWith = code;
    for (int i = 0; i < 150; ++i) {
      ASSERT_TRUE(sendTo(connection.get(), message(kRefuse)));
      pump();
      ASSERT_TRUE(receiveFrom(connection.get())) << i;
    }
  }
}

TEST_F(ServiceTest, NoAccountWaitsWhereRefusalsAreUnlimited) {
  ASSERT_EQ(bootstrap().checkIn("service", &service), kern::success);
  SystemPortSources unlimited(ports, regions, SystemPortSources::Refusals::unlimited);
  serviceSource = unlimited.makeRoutineSource(service, table, WantTrailer::yes);
  ASSERT_TRUE(serviceSource->addTo(*loop));
  table.refuseWith = kern::invalidSecurity;
  const UniqueFd connection = connect();
  for (int i = 0; i < 300; ++i) {
    ASSERT_TRUE(sendTo(connection.get(), message(kRefuse)));
    pump();
    ASSERT_TRUE(receiveFrom(connection.get())) << i;
  }
  serviceSource.reset();
}

// A service whose loop the test plays.
class PlayedServiceTest : public ServiceTest {
 protected:
  void SetUp() override {
    ServiceTest::SetUp();
    ASSERT_EQ(bootstrap().checkIn("service", &service), kern::success);
    serviceSource = sources.makeRoutineSource(service, table, WantTrailer::yes);
    ASSERT_TRUE(serviceSource->addTo(played));
  }
  void TearDown() override {
    serviceSource.reset();
    ServiceTest::TearDown();
  }
  void knock() { ASSERT_TRUE(played.makeReady(ports.receiveEnd(service)->get(), {.isReadable = true})); }
  // A new connection with a request that is refused. Whether it got its answer at once.
  bool isRefusedAtOnce(UniqueFd* connection) {
    *connection = connect();
    EXPECT_TRUE(sendTo(connection->get(), message(kRefuse)));
    knock();
    return receiveFrom(connection->get()).has_value();
  }

  ManualClock clock;
  ManualRunLoop played{clock};
};

TEST_F(PlayedServiceTest, ATurnLetsIn16AndTheNextOneGoesOn) {
  std::vector<UniqueFd> connections;
  for (int i = 0; i < 20; ++i) {
    connections.push_back(connect());
    ASSERT_TRUE(sendTo(connections.back().get(), message(kEcho)));
  }
  knock();
  EXPECT_EQ(table.served, 16);
  knock();
  EXPECT_EQ(table.served, 20);
}

TEST_F(PlayedServiceTest, NobodyIsLetInWhileTheClosingLineIsFullAndThatIsSaidOnce) {
  const auto listening = ports.receiveEnd(service);
  const auto line = RecordingLog::unifiedLine(
      LogLevel::error, "too many descriptors of refused callers wait to be closed: new clients wait");
  const auto closeOne = [&] {
    ports.closing().close(UniqueFd(::fcntl(client.get(), F_DUPFD_CLOEXEC, 0)), 12345);
  };
  const UniqueFd first = connect();
  UniqueFd silent;
  UniqueFd last;
  {
    const FailingCall noThread("pthread_attr_init", ENOMEM, 0, FailingCall::HowOften::always);
    while (ports.closing().hasRoomFor(3)) closeOne();
    ASSERT_TRUE(sendTo(first.get(), message(kEcho)));
    knock();
    EXPECT_EQ(table.served, 1) << "there is room for two things, and no other stranger";
    silent = connect();
    knock();
    last = connect();
    ASSERT_TRUE(sendTo(last.get(), message(kEcho)));
    knock();
    knock();
    EXPECT_EQ(table.served, 1);
    EXPECT_EQ(played.interestIn(listening->get()), Interest::none);
    EXPECT_EQ(played.timers(), 1U);
    clock.advance(50ms);
    EXPECT_EQ(table.served, 1);
    EXPECT_EQ(played.timers(), 1U);
    EXPECT_EQ(log.entries(), std::vector{line});
  }
  closeOne();  // makes the thread
  ports.closing().drain();
  clock.advance(50ms);
  EXPECT_EQ(table.served, 2);
  EXPECT_EQ(played.interestIn(listening->get()), Interest::reading);
  EXPECT_EQ(played.timers(), 0U);
}

TEST_F(PlayedServiceTest, WhoeverWaitsAndCannotBeListenedToAgainIsGivenUp) {
  table.refuseWith = kern::invalidSecurity;
  UniqueFd connection;
  int answers = 0;
  while (isRefusedAtOnce(&connection)) ASSERT_LT(++answers, 1000);
  EXPECT_EQ(played.timers(), 1U);
  EXPECT_FALSE(hasHungUp(connection));
  played.refuseDescriptors = true;
  clock.advance(50ms - 1ns);
  EXPECT_FALSE(hasHungUp(connection));
  clock.advance(1ns);
  ports.closing().drain();
  EXPECT_TRUE(hasHungUp(connection));
  EXPECT_EQ(played.timers(), 0U);
}

TEST_F(PlayedServiceTest, WithoutATimerNobodyIsMadeToWait) {
  table.refuseWith = kern::invalidSecurity;
  played.refuseTimers = true;
  UniqueFd connection;
  for (int i = 0; i < 200; ++i) ASSERT_TRUE(isRefusedAtOnce(&connection)) << i;
}

TEST_F(PlayedServiceTest, AServiceThatTheLoopCannotWatchIsNotServed) {
  serviceSource = sources.makeRoutineSource(service, table, WantTrailer::yes);
  played.refuseDescriptors = true;
  EXPECT_FALSE(serviceSource->addTo(played));
}

TEST_F(ServiceTest, AnAdmittedConnectionIsNotGivenUpForOthers) {
  listen();
  const UniqueFd admitted = connect();
  ASSERT_TRUE(sendTo(admitted.get(), message(kEcho)));
  pump();
  ASSERT_TRUE(receiveFrom(admitted.get()));
  std::vector<UniqueFd> others;
  for (int i = 0; i < 100; ++i) {
    others.push_back(connect());
    pump();
  }
  EXPECT_FALSE(isClosed(admitted));
}

TEST_F(ServiceTest, WithoutDescriptorsACheckInIsAnsweredWith6AndALineAndNobodySpins) {
  listen();
  auto [kept, sent] = pair();
  Datagram checkIn = complexMessage(kKeepRight, 1, 40).add(right());
  checkIn.fds = {sent.get()};
  const UniqueFd early = connect();
  const UniqueFd another = connect();
  ASSERT_TRUE(sendTo(early.get(), checkIn));
  ASSERT_TRUE(sendTo(another.get(), checkIn));
  const std::size_t before = openDescriptors();
  {
    const DescriptorShortage shortage(0);
    for (const auto* const connection : {&early, &another}) {
      std::optional<Answer> answer;
      while (!(answer = receiveFrom(connection->get()))) {
        ASSERT_EQ(loop->run(10s, ReturnAfterSource::yes), RunResult::handledSource);
      }
      EXPECT_EQ(answer->code(), kern::resourceShortage);
      while (!isClosed(*connection)) {
        ASSERT_EQ(loop->run(10s, ReturnAfterSource::yes), RunResult::handledSource);
      }
    }
    EXPECT_EQ(table.served, 0);
    EXPECT_EQ(
        log.entries().front(),
        RecordingLog::unifiedLine(LogLevel::error, "out of descriptors or memory: a check-in was refused"));
    EXPECT_EQ(log.entries().size(), 2U);
    ports.closing().drain();
    pump();                                 // what the closing line had to tell
    loop->run(1s, ReturnAfterSource::yes);  // looks again whether there are descriptors
    EXPECT_EQ(loop->run(0s, ReturnAfterSource::yes), RunResult::timedOut);
  }
  ports.closing().drain();
  EXPECT_LE(openDescriptors(), before + 3) << "what the first discarded message needs stays: " << before;
  const UniqueFd later = connect();
  ASSERT_TRUE(sendTo(later.get(), checkIn));
  std::optional<Answer> answer;
  while (!(answer = receiveFrom(later.get()))) {  // with the next look at the latest
    ASSERT_EQ(loop->run(10s, ReturnAfterSource::yes), RunResult::handledSource);
  }
  EXPECT_EQ(answer->code(), 0);
}

TEST_F(ServiceTest, WithoutDescriptorsAConnectionIsKeptUntilItsCheckInComes) {
  listen();
  const UniqueFd connection = connect();
  const DescriptorShortage shortage(0);
  pump();
  loop->run(1s, ReturnAfterSource::yes);  // looks again whether somebody waits
  EXPECT_FALSE(isClosed(connection));
  ASSERT_TRUE(sendTo(connection.get(), message(kEcho)));
  pump();
  const auto answer = receiveFrom(connection.get());
  ASSERT_TRUE(answer);
  EXPECT_EQ(answer->code(), kern::resourceShortage);
}

TEST_F(ServiceTest, WithoutADescriptorForWhoeverWaitsNobodySpinsAndItIsLetInLater) {
  ASSERT_EQ(bootstrap().checkIn("service", &service), kern::success);
  serviceSource = sources.makeRoutineSource(service, table, WantTrailer::yes);
  const UniqueFd connection = connect();
  ASSERT_TRUE(sendTo(connection.get(), message(kEcho)));
  // The loop's first timer takes a descriptor.
  ASSERT_NE(loop->addTimer(
                1h, 0s, [] {}, [] {}),
            nullptr);
  DescriptorShortage shortage(0);
  ASSERT_TRUE(serviceSource->addTo(*loop)) << "even without a reserve";
  EXPECT_EQ(loop->run(0s, ReturnAfterSource::yes), RunResult::handledSource);
  EXPECT_EQ(loop->run(0s, ReturnAfterSource::yes), RunResult::timedOut) << "it waits, and wakes nobody";
  EXPECT_EQ(table.served, 0);
  shortage.giveBack(16);
  EXPECT_EQ(loop->run(10s, ReturnAfterSource::yes), RunResult::handledSource);  // looks again
  const auto answer = receiveFrom(connection.get());
  ASSERT_TRUE(answer);
  EXPECT_EQ(answer->code(), 0);
  const UniqueFd next = connect();
  ASSERT_TRUE(sendTo(next.get(), message(kEcho)));
  EXPECT_EQ(loop->run(0s, ReturnAfterSource::yes), RunResult::handledSource);
  EXPECT_TRUE(receiveFrom(next.get())) << "the next one does not wait";
}

TEST_F(ServiceTest, TheLineThatSaysThatDescriptorsAreShortFindsOne) {
  class OpeningLog final : public LogSink {
   public:
    OpeningLog() : before_(setLogSink(this)) {}
    ~OpeningLog() override { setLogSink(before_); }
    void unified(LogLevel, std::string_view, const LogPlace&, const MessageId&) noexcept override {
      opened.push_back(UniqueFd(::open("/", O_PATH | O_CLOEXEC)).isValid());
    }
    void bsd(SyslogPriority, std::string_view, const MessageId&) noexcept override {}
    std::vector<bool> opened;

   private:
    LogSink* const before_;
  };
  listen();
  const UniqueFd connection = connect();
  ASSERT_TRUE(sendTo(connection.get(), message(kEcho)));
  const OpeningLog openingLog;
  const DescriptorShortage shortage(0);
  pump();
  const auto answer = receiveFrom(connection.get());
  ASSERT_TRUE(answer);
  EXPECT_EQ(answer->code(), kern::resourceShortage);
  EXPECT_EQ(openingLog.opened, std::vector{true});
}

TEST_F(ServiceTest, WhoeverIsServedFindsDescriptorsForALook) {
  listen();
  const UniqueFd connection = connect();
  ASSERT_TRUE(sendTo(connection.get(), message(kEcho)));
  int opened = 0;
  table.whileServing = [&] {
    std::vector<UniqueFd> files;
    while (true) {
      files.emplace_back(::open("/", O_PATH | O_CLOEXEC));
      if (!files.back().isValid()) break;
      ++opened;
    }
  };
  const DescriptorShortage shortage(1);  // for the connection
  pump();
  EXPECT_EQ(table.served, 1);
  EXPECT_EQ(opened, 8);
}

TEST_F(ServiceTest, ConnectionsOfManyAccountsGiveWayWhenDescriptorsRunOut) {
  listen();
  const UniqueFd silent = connect();
  pump();
  const UniqueFd connection = connect();
  ASSERT_TRUE(sendTo(connection.get(), message(kEcho)));
  const DescriptorShortage shortage(0);
  pump();
  EXPECT_TRUE(isClosed(silent));
  const auto answer = receiveFrom(connection.get());
  ASSERT_TRUE(answer);
  EXPECT_EQ(answer->code(), 0);
}

TEST_F(ServiceTest, AnUnknownMessageIsRefusedByItsFormWhateverComesAlong) {
  listen();
  const UniqueFd connection = connect();
  const UniqueFd null(::open("/dev/null", O_RDONLY | O_CLOEXEC));
  Datagram unknown = complexMessage(99, 1, 40).add(right());
  unknown.fds = {null.get()};
  const std::size_t before = openDescriptors();
  for (int i = 0; i < 3; ++i) {
    ASSERT_TRUE(sendTo(connection.get(), unknown));
    pump();
    const auto answer = receiveFrom(connection.get());
    ASSERT_TRUE(answer);
    EXPECT_EQ(answer->code(), -303);
  }
  ports.closing().drain();
  EXPECT_EQ(openDescriptors(), before + 1) << "the connection";
}

TEST_F(ServiceTest, NothingOfAStrangersIsMapped) {
  listen();
  const UniqueFd connection = connect();
  const UniqueFd sealed = memfd("abc");
  Datagram request = complexMessage(kEcho, 1, 44).add(region(0, 3));
  request.fds = {sealed.get()};
  ASSERT_TRUE(sendTo(connection.get(), request));
  pump();
  const auto answer = receiveFrom(connection.get());
  ASSERT_TRUE(answer);
  EXPECT_EQ(answer->code(), -304);
  EXPECT_EQ(table.served, 0);
}

TEST_F(ServiceTest, AMessageWithMoreThanOneDescriptorIsAnsweredAndDroppedElsewhereAndTheConnectionGoesOn) {
  listen();
  const UniqueFd connection = connect();
  auto [kept, sent] = pair();
  for (const std::size_t count : {std::size_t{2}, std::size_t{253}}) {
    Datagram request = complexMessage(kKeepRight, 1, 40).add(right());
    request.fds.assign(count, sent.get());
    ASSERT_TRUE(sendTo(connection.get(), request));
    ASSERT_TRUE(sendTo(connection.get(), message(kEcho)));
    pump();
    auto answer = receiveFrom(connection.get());
    ASSERT_TRUE(answer);
    EXPECT_EQ(answer->code(), -304);
    while (!(answer = receiveFrom(connection.get()))) {
      ASSERT_EQ(loop->run(10s, ReturnAfterSource::yes), RunResult::handledSource);
    }
    EXPECT_EQ(answer->code(), 0);
  }
  sent.reset();
  ports.closing().drain();
  pollfd hungUp{kept.get(), POLLIN, 0};
  EXPECT_EQ(::poll(&hungUp, 1, 0), 1) << "none is kept";
}

// The system's loop, which cannot watch what the closing line has to tell.
class DeafLoop final : public RunLoop {
 public:
  DeafLoop(RunLoop& loop, SystemPortSpace& ports) noexcept : loop_(loop), ports_(ports) {}
  RunResult run(std::chrono::duration<double> timeOut, ReturnAfterSource returnAfterSource) override {
    return loop_.run(timeOut, returnAfterSource);
  }
  void stop() noexcept override { loop_.stop(); }
  std::unique_ptr<DescriptorSource> addDescriptor(int fd, Interest interest,
                                                  DescriptorHandler handler) override {
    if (fd == ports_.closing().readable()) return nullptr;
    return loop_.addDescriptor(fd, interest, std::move(handler));
  }
  std::unique_ptr<LoopSource> addTimer(std::chrono::nanoseconds first, std::chrono::nanoseconds interval,
                                       std::function<void()> handler, std::function<void()> failed) override {
    return loop_.addTimer(first, interval, std::move(handler), std::move(failed));
  }

 private:
  RunLoop& loop_;
  SystemPortSpace& ports_;
};

TEST_F(ServiceTest, AConnectionWhoseMessageNobodyWouldTellIsDroppedEndsAndNothingOfItIsLeft) {
  ASSERT_EQ(bootstrap().checkIn("service", &service), kern::success);
  serviceSource = sources.makeRoutineSource(service, table, WantTrailer::yes);
  DeafLoop deaf(*loop, ports);
  ASSERT_TRUE(serviceSource->addTo(deaf));
  Datagram request = complexMessage(kKeepRight, 1, 40).add(right());
  request.fds.assign(2, client.get());
  const auto sendOne = [&] {
    const UniqueFd connection = connect();
    ASSERT_TRUE(sendTo(connection.get(), request));
    pump();
    const auto answer = receiveFrom(connection.get());
    ASSERT_TRUE(answer);
    EXPECT_EQ(answer->code(), -304);
    ports.closing().drain();
    EXPECT_TRUE(isClosed(connection));
  };
  for (int i = 0; i < 8; ++i) sendOne();  // whatever is made once
  const std::size_t open = openDescriptors();
  const std::size_t before = ::mallinfo2().uordblks;  // nothing, where a sanitizer has its own memory
  for (int i = 0; i < 200; ++i) sendOne();
  EXPECT_EQ(openDescriptors(), open);
  EXPECT_LT(::mallinfo2().uordblks, before + 200 * std::size_t{64});
}

TEST_F(ServiceTest, AnAccountThatIsRefusedTooOftenWaitsAndIsThenAnswered) {
  listen();
  table.refuseWith = kern::invalidSecurity;
  const UniqueFd connection = connect();
  int answers = 0;
  const auto refused = [&] {
    EXPECT_TRUE(sendTo(connection.get(), message(kRefuse)));
    pump();
    const auto answer = receiveFrom(connection.get());
    return answer && answer->code() == kern::invalidSecurity;
  };
  while (refused()) ASSERT_LT(++answers, 1000);
  EXPECT_GE(answers, 50);
  const UniqueFd another = connect();
  ASSERT_TRUE(sendTo(another.get(), message(kEcho)));
  ASSERT_EQ(codeOf(message(kEcho)), 0) << "who is checked in does not wait";
  std::optional<Answer> answer;
  while (!(answer = receiveFrom(another.get()))) {
    ASSERT_EQ(loop->run(10s, ReturnAfterSource::yes), RunResult::handledSource);
  }
  EXPECT_EQ(answer->code(), 0) << "who may come in comes in";
}

TEST_F(ServiceTest, WhoeverHasGoneDoesNotKeepAPlaceUntilItsAccountMayBeRefusedAgain) {
  listen();
  table.refuseWith = kern::invalidSecurity;
  const UniqueFd connection = connect();
  do {
    ASSERT_TRUE(sendTo(connection.get(), message(kRefuse)));
    pump();
  } while (receiveFrom(connection.get()));
  ports.closing().drain();
  const std::size_t before = openDescriptors();
  for (int i = 0; i < 30; ++i) ASSERT_TRUE(sendTo(connect().get(), message(kRefuse)));
  pump();
  (void)loop->run(200ms, ReturnAfterSource::yes);  // all that wait are looked at again
  pump();
  ports.closing().drain();
  EXPECT_EQ(openDescriptors(), before);
}

TEST_F(ServiceTest, AClientTakesTwoDescriptors) {
  listen();
  const std::size_t before = openDescriptors();
  struct Client {
    UniqueFd life;
    UniqueFd channel;
  };
  std::vector<Client> clients;
  for (int i = 0; i < 100; ++i) {
    PortName given = kNullPort;
    ASSERT_EQ(ports.allocateReceiveRight(&given), kern::success);
    ASSERT_EQ(ports.insertSendRight(given), kern::success);
    table.given = given;
    auto [life, sent] = pair();
    Datagram checkIn = complexMessage(kGiveRight, 1, 40).add(right());
    checkIn.fds = {sent.get()};
    const UniqueFd connection = connect();
    ASSERT_TRUE(sendTo(connection.get(), checkIn));
    sent.reset();
    pump();
    auto answer = receiveFrom(connection.get());
    ASSERT_TRUE(answer && answer->fds.size() == 1);
    clients.push_back({std::move(life), std::move(answer->fds[0])});
  }
  pump();
  EXPECT_EQ(openDescriptors(), before + clients.size() * (2 + 2)) << "two of theirs, two of ours";
}

TEST_F(ServiceTest, ConnectionsOfClientsAreKeptUpToALimitAndTheClientsStay) {
  listen();
  std::vector<UniqueFd> connections;
  for (int i = 0; i < 40; ++i) {
    connections.push_back(connect());
    ASSERT_TRUE(sendTo(connections.back().get(), message(kEcho)));
    pump();
    ASSERT_TRUE(receiveFrom(connections.back().get()));
  }
  EXPECT_EQ(std::count_if(connections.begin(), connections.end(), isClosed), 40 - 32);
  EXPECT_TRUE(isClosed(connections.front()));
}

TEST_F(ServiceTest, InvalidatingTheServiceGivesEveryConnectionEndOfFile) {
  listen();
  const UniqueFd connection = connect();
  pump();
  serviceSource->invalidate();
  EXPECT_TRUE(isClosed(connection));
}

}  // namespace
}  // namespace brenvik

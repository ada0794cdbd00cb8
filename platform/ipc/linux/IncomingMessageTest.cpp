// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/ipc/linux/IncomingMessage.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/mman.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <atomic>
#include <fstream>
#include <string>
#include <string_view>

#include "platform/base/fakes/FailingAllocations.h"
#include "platform/base/fakes/FailingCalls.h"
#include "platform/datagram/LocalSocket.h"
#include "platform/datagram/SealedMemory.h"

namespace brenvik {
namespace {

// A descriptor whose close is watched: which thread closed it, and whether it was still mapped then.
std::atomic<int> watchedDescriptor{-1};
std::atomic<pid_t> closedBy{0};
std::atomic<bool> wasMappedAtClose{false};

bool isMapped(std::string_view name) {
  std::ifstream maps("/proc/self/maps");
  for (std::string line; std::getline(maps, line);) {
    if (line.find(name) != std::string::npos) return true;
  }
  return false;
}

}  // namespace
}  // namespace brenvik

extern "C" int close(int fd) {
  int watched = fd;
  if (fd >= 0 && brenvik::watchedDescriptor.compare_exchange_strong(watched, -1)) {
    brenvik::wasMappedAtClose = brenvik::isMapped("/memfd:watched");
    brenvik::closedBy = ::gettid();
  }
  return static_cast<int>(::syscall(SYS_close, fd));
}

extern "C" void* mmap(void* at, std::size_t length, int protection, int flags, int fd,
                      off_t offset) noexcept {
  if (brenvik::FailingCall::failsNow("mmap")) return MAP_FAILED;
  return reinterpret_cast<void*>(::syscall(SYS_mmap, at, length, protection, flags, fd, offset));
}

namespace brenvik {
namespace {

using Received = IncomingMessage::Received;

class IncomingMessageTest : public testing::Test {
 protected:
  void SetUp() override { ASSERT_EQ(makeSocketPair(&ours, &theirs), 0); }

  // A request with one descriptor, and the file descriptor that it speaks of.
  template <class Descriptor>
  void send(const Descriptor& descriptor, int passed) {
    struct [[gnu::packed]] {
      MessageHeader header;
      std::uint32_t count;
      Descriptor descriptor;
    } message{{kComplexBit | kReplyDisposition, sizeof message, 77, 0, 0, 1}, 1, descriptor};
    const std::array parts{iovecOf(std::as_bytes(std::span(&message, 1)))};
    ASSERT_EQ(sendDatagram(theirs.get(), parts, std::span(&passed, 1)), 0);
  }
  static constexpr PortDescriptor kRight{0, 0, 0, kDispositionMoveSend, kPortDescriptorType};

  UniqueFd ours;
  UniqueFd theirs;
  SystemPortSpace ports;
  IncomingMessage incoming{ports};
};

TEST_F(IncomingMessageTest, AChannelWhosePeerLeftMessagesUnreadHasEnded) {
  ASSERT_EQ(::send(ours.get(), "unread", 6, MSG_NOSIGNAL), 6);
  EXPECT_EQ(incoming.receive(ours.get()), Received::nothing);
  theirs.reset();  // a reset, where a peer that had read everything just ends
  EXPECT_EQ(incoming.receive(ours.get()), Received::endOfChannel);
}

TEST_F(IncomingMessageTest, ControlDataThatNobodyKnowsIsPassedOver) {
  const int on = 1;
  ASSERT_EQ(::setsockopt(ours.get(), SOL_SOCKET, SO_TIMESTAMP, &on, sizeof on), 0);
  send(kRight, theirs.get());
  ASSERT_EQ(incoming.receive(ours.get()), Received::message);
  EXPECT_EQ(incoming.unpack(5), kern::success);
  EXPECT_EQ(ports.size(), 1U);
  EXPECT_FALSE(incoming.sender());
}

TEST_F(IncomingMessageTest, ARegionThatCannotBeMappedRefusesTheMessage) {
  const UniqueFd memfd = makeSealedMemory("test", std::as_bytes(std::span("abc", 3)));
  const OutOfLineDescriptor region{0, 0, 1, 0, kOutOfLineDescriptorType, 3};
  send(region, memfd.get());
  ASSERT_EQ(incoming.receive(ours.get()), Received::message);
  {
    const FailingCall noRoom("mmap", ENOMEM);
    EXPECT_EQ(incoming.unpack(5), kern::resourceShortage);
    EXPECT_EQ(noRoom.failures(), 1);
  }
  send(region, memfd.get());
  ASSERT_EQ(incoming.receive(ours.get()), Received::message);
  EXPECT_EQ(incoming.unpack(5), kern::success) << "the next one is served";
}

class MemoryOfTest : public IncomingMessageTest {
 protected:
  // Sends a region of ten bytes in memory of that size, of which the receiver is the last holder, has it
  // served and watches who closes it.
  void serveMemoryOf(off_t size) {
    UniqueFd memory = makeSealableMemory("watched");
    ASSERT_EQ(::ftruncate(memory.get(), size), 0);
    ASSERT_TRUE(sealMemory(memory.get()));
    send(OutOfLineDescriptor{0, 0, 1, 0, kOutOfLineDescriptorType, 10}, memory.get());
    watchedDescriptor = memory.get();
    memory.reset();
    ASSERT_EQ(closedBy, ::gettid());
    closedBy = 0;
    const int next = ::dup(ours.get());  // the number that it will arrive with
    watchedDescriptor = next;
    ASSERT_EQ(::syscall(SYS_close, next), 0);
    ASSERT_EQ(incoming.receive(ours.get()), Received::message);
    ASSERT_EQ(incoming.unpack(5), kern::success);
    EXPECT_TRUE(isMapped("/memfd:watched"));
    incoming.release(true);
    ports.closing().drain();
    EXPECT_FALSE(isMapped("/memfd:watched"));
  }
};

TEST_F(MemoryOfTest, LargeMemoryIsFreedElsewhereWhenItIsNoLongerMapped) {
  serveMemoryOf(off_t{8} << 20);
  EXPECT_NE(closedBy, 0);
  EXPECT_NE(closedBy, ::gettid());
  EXPECT_FALSE(wasMappedAtClose);
}

TEST_F(MemoryOfTest, SmallMemoryIsClosedAtOnce) {
  serveMemoryOf(4096);
  EXPECT_EQ(closedBy, ::gettid());
}

TEST_F(IncomingMessageTest, ARightThatThereIsNoMemoryForRefusesTheMessageAndLeavesNothing) {
  if (!FailingAllocations::kWork) GTEST_SKIP() << "operator new belongs to the sanitizer";
  int refused = 0;
  for (long first = 0;; ++first) {
    send(kRight, theirs.get());
    ASSERT_EQ(incoming.receive(ours.get()), Received::message);
    KernelReturn unpacked = kern::failure;
    {
      const FailingAllocations noMemory(first);
      unpacked = incoming.unpack(5);
    }
    if (unpacked == kern::success) break;
    EXPECT_EQ(unpacked, kern::resourceShortage);
    ++refused;
    EXPECT_EQ(ports.size(), 0U);
  }
  EXPECT_GE(refused, 2) << "for the descriptor, and for its name";
  EXPECT_EQ(ports.size(), 1U);
  incoming.release(false);
  EXPECT_EQ(ports.size(), 0U);
}

}  // namespace
}  // namespace brenvik

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/log/linux/Journal.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <sys/time.h>
#include <unistd.h>

#include <array>
#include <chrono>
#include <cstring>
#include <filesystem>
#include <map>
#include <string>
#include <thread>
#include <vector>

#include "platform/base/UniqueFd.h"

namespace brenvik {
namespace {

using namespace std::chrono_literals;

class JournalTest : public testing::Test {
 protected:
  void SetUp() override {
    std::string name = (std::filesystem::temp_directory_path() / "journal-XXXXXX").string();
    ASSERT_NE(::mkdtemp(name.data()), nullptr);
    folder_ = name;
    path = (folder_ / "socket").string();
  }
  void TearDown() override { std::filesystem::remove_all(folder_); }

  void listen() {
    std::filesystem::remove(path);
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    ASSERT_LT(path.size(), sizeof address.sun_path);
    path.copy(address.sun_path, path.size());
    server_ = UniqueFd(::socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0));
    ASSERT_EQ(::bind(server_.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address), 0);
  }
  // The bytes of the next datagram, and the descriptor that it carries.
  std::string receive(UniqueFd* carried = nullptr) {
    std::string bytes(1 << 18, '\0');
    int fd = -1;
    alignas(cmsghdr) std::array<char, CMSG_SPACE(sizeof fd)> control{};
    iovec io{bytes.data(), bytes.size()};
    msghdr message{};
    message.msg_iov = &io;
    message.msg_iovlen = 1;
    message.msg_control = control.data();
    message.msg_controllen = control.size();
    const ssize_t size = ::recvmsg(server_.get(), &message, MSG_CMSG_CLOEXEC);
    EXPECT_GE(size, 0) << "nothing came";
    bytes.resize(static_cast<std::size_t>(std::max<ssize_t>(size, 0)));
    if (const cmsghdr* const item = CMSG_FIRSTHDR(&message); item != nullptr) {
      std::memcpy(&fd, CMSG_DATA(item), sizeof fd);
    }
    UniqueFd owned(fd);
    EXPECT_EQ(owned.isValid(), carried != nullptr);
    if (carried != nullptr) *carried = std::move(owned);
    return bytes;
  }

  std::string path;

 private:
  std::filesystem::path folder_;
  UniqueFd server_;
};

TEST_F(JournalTest, AnEntryIsOneDatagramOfALineForEachField) {
  listen();
  Journal journal(path.c_str());
  EXPECT_TRUE(
      journal.send(std::array<JournalField, 3>{{{"MESSAGE", "a=b"}, {"PRIORITY", "3"}, {"EMPTY", ""}}}));
  EXPECT_EQ(receive(), "MESSAGE=a=b\nPRIORITY=3\nEMPTY=\n");
}

TEST_F(JournalTest, AValueWithANewlineGoesWithItsLengthAndForgesNoField) {
  listen();
  Journal journal(path.c_str());
  EXPECT_TRUE(
      journal.send(std::array<JournalField, 3>{{{"ONE", "a\nPRIORITY=0\n"}, {"TWO", "b"}, {"THREE", "\n"}}}));
  using namespace std::string_literals;
  EXPECT_EQ(receive(), "ONE\n\x0D\0\0\0\0\0\0\0a\nPRIORITY=0\n\nTWO=b\nTHREE\n\x01\0\0\0\0\0\0\0\n\n"s);
}

TEST_F(JournalTest, WhatIsTooLargeForADatagramGoesInSealedMemory) {
  listen();
  Journal journal(path.c_str());
  const std::string large(4 << 20, 'x');
  EXPECT_TRUE(journal.send(std::array<JournalField, 2>{{{"MESSAGE", large}, {"PRIORITY", "3"}}}));
  UniqueFd memory;
  EXPECT_EQ(receive(&memory), "");
  EXPECT_EQ(::fcntl(memory.get(), F_GET_SEALS), F_SEAL_SHRINK | F_SEAL_GROW | F_SEAL_WRITE | F_SEAL_SEAL);
  struct stat status {};
  ASSERT_EQ(::fstat(memory.get(), &status), 0);
  std::string bytes(static_cast<std::size_t>(status.st_size), '\0');
  ASSERT_EQ(::pread(memory.get(), bytes.data(), bytes.size(), 0), status.st_size);
  EXPECT_TRUE(bytes == "MESSAGE=" + large + "\nPRIORITY=3\n");
}

TEST_F(JournalTest, WithoutAJournalNothingIsSentAndOneThatComesLaterIsFound) {
  Journal journal(path.c_str());
  const std::array<JournalField, 1> fields{{{"MESSAGE", "x"}}};
  EXPECT_FALSE(journal.send(fields));
  listen();
  EXPECT_TRUE(journal.send(fields));
  listen();  // it was started anew
  EXPECT_TRUE(journal.send(fields));
  EXPECT_EQ(receive(), "MESSAGE=x\n");
}

TEST_F(JournalTest, AJournalThatTakesNothingKeepsOneEntryWaitingForAMomentAndNoOther) {
  listen();
  Journal journal(path.c_str());
  const std::array<JournalField, 1> fields{{{"MESSAGE", "x"}}};
  int taken = 0;
  while (journal.send(fields)) ASSERT_LT(++taken, 100'000);
  EXPECT_GT(taken, 0);
  const auto before = std::chrono::steady_clock::now();
  for (int i = 0; i < 1000; ++i) EXPECT_FALSE(journal.send(fields));
  EXPECT_LT(std::chrono::steady_clock::now() - before, 50s) << "it would be 100 s";
  EXPECT_EQ(receive(), "MESSAGE=x\n");
  EXPECT_TRUE(journal.send(fields)) << "there is room again";
  const auto full = std::chrono::steady_clock::now();
  EXPECT_FALSE(journal.send(fields));
  EXPECT_GT(std::chrono::steady_clock::now() - full, 50ms) << "so it is worth waiting once more";
}

TEST_F(JournalTest, WithoutADescriptorForItTheEntryIsNotSentAndTheNextOneTriesAgain) {
  listen();
  Journal journal(path.c_str());
  const std::array<JournalField, 1> fields{{{"MESSAGE", "x"}}};
  std::vector<UniqueFd> all;
  for (;;) {
    UniqueFd fd(::fcntl(STDERR_FILENO, F_DUPFD_CLOEXEC, 0));
    if (!fd.isValid()) break;
    all.push_back(std::move(fd));
  }
  EXPECT_FALSE(journal.send(fields));
  all.clear();
  EXPECT_TRUE(journal.send(fields));
}

TEST_F(JournalTest, ManyThreadsShareOneSocket) {
  listen();
  Journal journal(path.c_str());
  const auto descriptors = [] {
    return std::distance(std::filesystem::directory_iterator("/proc/self/fd"), {});
  };
  const auto before = descriptors();
  std::vector<std::thread> threads;
  for (int i = 0; i < 8; ++i) {
    threads.emplace_back([&] { (void)journal.send(std::array<JournalField, 1>{{{"MESSAGE", "x"}}}); });
  }
  for (auto& thread : threads) thread.join();
  EXPECT_EQ(descriptors(), before + 1);
}

}  // namespace
}  // namespace brenvik

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/security/linux/Sha256.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/mman.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <unistd.h>

#include <cerrno>
#include <string>

#include "platform/base/UniqueFd.h"
#include "platform/base/fakes/FailingCalls.h"

namespace brenvik {
namespace {

std::optional<Sha256Digest> digestOf(const std::string& bytes) {
  const UniqueFd fd(::memfd_create("digest", MFD_CLOEXEC));
  EXPECT_EQ(::write(fd.get(), bytes.data(), bytes.size()), static_cast<ssize_t>(bytes.size()));
  ::lseek(fd.get(), 0, SEEK_SET);
  return sha256OfFile(fd.get());
}

// Vectors of FIPS 180-4's examples.
TEST(Sha256Test, TheStandardsExamplesComeOutRight) {
  EXPECT_EQ(digestOf(""), parseSha256("e3b0c44298fc1c149afbf4c8996fb92427ae41e4649b934ca495991b7852b855"));
  EXPECT_EQ(digestOf("abc"), parseSha256("ba7816bf8f01cfea414140de5dae2223b00361a396177a9cb410ff61f20015ad"));
  EXPECT_EQ(digestOf(std::string(1'000'000, 'a')),
            parseSha256("cdc76e5c9914fb9281a1c7e284d73e67f1809a48a497200e046d39ccc7112cd0"));
}

TEST(Sha256Test, WhatCannotBeReadHasNoDigest) {
  EXPECT_FALSE(sha256OfFile(-1));
  const UniqueFd folder(::open("/", O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  EXPECT_FALSE(sha256OfFile(folder.get()));
}

TEST(Sha256Test, AReadThatASignalInterruptedIsDoneAgainAndTheEndIsTheEndAllTheSame) {
  // A datagram of no bytes reads as the end of a file, and whoever reads on finds nothing there.
  int ends[2];
  ASSERT_EQ(::socketpair(AF_UNIX, SOCK_DGRAM | SOCK_NONBLOCK | SOCK_CLOEXEC, 0, ends), 0);
  const UniqueFd from(ends[0]);
  const UniqueFd to(ends[1]);
  ASSERT_EQ(::send(to.get(), "abc", 3, 0), 3);
  ASSERT_EQ(::send(to.get(), "", 0, 0), 0);
  const FailingCall interrupted("read", EINTR);
  const auto digest = sha256OfFile(from.get());
  EXPECT_EQ(interrupted.failures(), 1);
  EXPECT_EQ(digest, parseSha256("ba7816bf8f01cfea414140de5dae2223b00361a396177a9cb410ff61f20015ad"));
}

// Exits with 7 when a digest cannot be had without a descriptor to spare and can be had with one.
[[noreturn]] void digestWithoutAndWithDescriptors() {
  const UniqueFd empty(::memfd_create("digest", MFD_CLOEXEC));
  rlimit before{};
  ::getrlimit(RLIMIT_NOFILE, &before);
  const rlimit none{0, before.rlim_max};
  ::setrlimit(RLIMIT_NOFILE, &none);
  const bool without = sha256OfFile(empty.get()).has_value();
  ::setrlimit(RLIMIT_NOFILE, &before);
  ::_exit(!without && sha256OfFile(empty.get()) == digestOf("") ? 7 : 1);
}

TEST(Sha256DeathTest, ALibraryThatCouldNotBeLoadedForWantOfADescriptorIsLoadedTheNextTime) {
  testing::FLAGS_gtest_death_test_style = "threadsafe";  // a process of its own, which has not loaded it yet
  EXPECT_EXIT(digestWithoutAndWithDescriptors(), testing::ExitedWithCode(7), "");
}

TEST(Sha256Test, HexadecimalDigitsOfEitherCaseMeanTheSame) {
  const std::string lower = "ba7816bf8f01cfea414140de5dae2223b00361a396177a9cb410ff61f20015ad";
  std::string upper = lower;
  for (char& c : upper) c = static_cast<char>(c >= 'a' && c <= 'f' ? c - 'a' + 'A' : c);
  ASSERT_TRUE(parseSha256(lower));
  EXPECT_EQ(parseSha256(lower), parseSha256(upper));
  EXPECT_EQ((*parseSha256(lower))[0], 0xBA);
  EXPECT_EQ((*parseSha256(lower))[31], 0xAD);
}

TEST(Sha256Test, OtherTextsAreNoDigest) {
  const std::string good(64, '0');
  EXPECT_TRUE(parseSha256(good));
  EXPECT_FALSE(parseSha256(""));
  EXPECT_FALSE(parseSha256(good.substr(1)));
  EXPECT_FALSE(parseSha256(good + "0"));
  for (const char wrong : {'g', 'G', '/', ':', '@', '`', ' ', '\0'}) {
    for (const std::size_t place : {32U, 33U}) {  // either half of a byte
      std::string text = good;
      text[place] = wrong;
      EXPECT_FALSE(parseSha256(text)) << wrong;
    }
  }
}

}  // namespace
}  // namespace brenvik

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/gzip/linux/ZlibGunzip.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/mman.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <limits>
#include <string>
#include <vector>

#include "platform/base/UniqueFd.h"
#include "platform/base/fakes/FailingMalloc.h"
#include "platform/gzip/fakes/GzipOf.h"

namespace brenvik {
namespace {

constexpr std::uint64_t kNoLimit = std::numeric_limits<std::uint64_t>::max();

// Text that compresses, but not to nothing.
std::string text(std::size_t size) {
  std::string result;
  result.reserve(size);
  unsigned state = 1;
  while (result.size() < size) {
    state = state * 1664525 + 1013904223;
    result += static_cast<char>('a' + (state >> 28));
  }
  return result;
}

class ZlibGunzipTest : public testing::Test {
 protected:
  GunzipResult run(const std::string& input, std::uint64_t largest = kNoLimit) {
    output.clear();
    return gunzip.gunzip({reinterpret_cast<const std::byte*>(input.data()), input.size()}, largest,
                         [this](std::span<const std::byte> piece) {
                           EXPECT_FALSE(piece.empty());
                           if (output.size() + piece.size() > refuseBeyond) return false;
                           output.append(reinterpret_cast<const char*>(piece.data()), piece.size());
                           return true;
                         });
  }
  ZlibGunzip gunzip;
  std::string output;
  std::size_t refuseBeyond = std::numeric_limits<std::size_t>::max();
};

TEST_F(ZlibGunzipTest, AFileOfOneMemberComesOutWhole) {
  for (const std::size_t size : {0U, 1U, 1000U, 262'143U, 262'144U, 262'145U, 1'000'000U}) {
    const std::string original = text(size);
    EXPECT_EQ(run(gzipOf(original)), GunzipResult::whole) << size;
    EXPECT_EQ(output, original) << size;
  }
}

TEST_F(ZlibGunzipTest, AllMembersComeOutOneAfterTheOther) {
  EXPECT_EQ(run(gzipOf("one ") + gzipOf("") + gzipOf(text(300'000)) + gzipOf(" four")), GunzipResult::whole);
  EXPECT_EQ(output, "one " + text(300'000) + " four");
}

TEST_F(ZlibGunzipTest, EveryShorterLengthIsTruncated) {
  const std::string whole = gzipOf("first") + gzipOf(text(5000));
  const std::size_t boundary = gzipOf("first").size();
  for (std::size_t size = 0; size < whole.size(); ++size) {
    EXPECT_EQ(run(whole.substr(0, size)), size == boundary ? GunzipResult::whole : GunzipResult::truncated)
        << size;
  }
}

TEST_F(ZlibGunzipTest, AllThatACutFileHoldsComesOutWhereverThePiecesEnd) {
  // Every byte in the midst of it stands for the same number of zeros.
  const std::string zeros = gzipOf(std::string(1'000'000, '\0'));
  const auto outputOf = [&](std::size_t size) {
    EXPECT_EQ(run(zeros.substr(0, size)), GunzipResult::truncated) << size;
    return output.size();
  };
  const std::size_t ofOneByte = outputOf(101) - outputOf(100);
  ASSERT_GT(ofOneByte, 1000U);
  for (std::size_t size = 100; size < 700; ++size) {
    EXPECT_EQ(outputOf(size), outputOf(100) + (size - 100) * ofOneByte) << size;
  }
}

TEST_F(ZlibGunzipTest, BytesAfterTheLastMemberAreDamage) {
  const std::string good = gzipOf("good");
  EXPECT_EQ(run(good + "x"), GunzipResult::truncated) << "too short to tell from a cut header";
  EXPECT_EQ(run(good + "trailing"), GunzipResult::damaged);
  EXPECT_EQ(run(good + std::string(512, '\0')), GunzipResult::damaged);
}

TEST_F(ZlibGunzipTest, NoFlippedBitGoesUnnoticed) {
  const std::string original = text(2000);
  const std::string good = gzipOf(original);
  for (std::size_t i = 0; i < good.size(); ++i) {
    for (int bit = 0; bit < 8; ++bit) {
      std::string bad = good;
      bad[i] = static_cast<char>(bad[i] ^ (1 << bit));
      const auto result = run(bad);
      // The header's time, flags of no effect and system carry no checksum; the content is then right.
      EXPECT_TRUE(result != GunzipResult::whole || output == original) << i << "." << bit;
    }
  }
}

TEST_F(ZlibGunzipTest, WhatIsNotGzipIsDamaged) {
  EXPECT_EQ(run(std::string(4096, 'x')), GunzipResult::damaged);
  EXPECT_EQ(run("<html>please log in</html>"), GunzipResult::damaged);
}

TEST_F(ZlibGunzipTest, OutputStopsAtTheLimitOverAllMembers) {
  const std::string bomb = gzipOf(std::string(50'000'000, '\0'));
  EXPECT_EQ(run(bomb, 49'999'999), GunzipResult::tooLarge);
  EXPECT_LE(output.size(), 49'999'999U);
  EXPECT_EQ(run(bomb, 50'000'000), GunzipResult::whole);
  EXPECT_EQ(run(gzipOf("12345") + gzipOf("67890"), 9), GunzipResult::tooLarge);
  EXPECT_EQ(run(gzipOf("12345") + gzipOf("67890"), 10), GunzipResult::whole);
  EXPECT_EQ(run(gzipOf("1"), 0), GunzipResult::tooLarge);
}

TEST_F(ZlibGunzipTest, AReceiverThatSaysNoEndsTheWork) {
  refuseBeyond = 600'000;
  EXPECT_EQ(run(gzipOf(text(1'000'000))), GunzipResult::refused);
}

// ---- into a file ----

class GunzipIntoTest : public ZlibGunzipTest {
 protected:
  GunzipOutcome into(const std::string& input, std::uint64_t room, std::uint64_t largest = kNoLimit) {
    return gunzip.gunzipInto({std::as_bytes(std::span(input))}, file.get(), room, largest);
  }
  std::string written() {
    std::string content(2'000'000, '\0');
    const auto size = ::pread(file.get(), content.data(), content.size(), 0);
    content.resize(static_cast<std::size_t>(std::max<ssize_t>(size, 0)));
    return content;
  }
  UniqueFd file{::memfd_create("gunzip test", MFD_CLOEXEC)};
};

TEST_F(GunzipIntoTest, TheOutputIsWrittenAndCounted) {
  const std::string original = text(1'000'000);
  const auto outcome = into(gzipOf(original), 1'000'000);
  EXPECT_EQ(outcome.result, GunzipResult::whole);
  EXPECT_EQ(outcome.size, original.size());
  EXPECT_EQ(outcome.writeError, 0);
  EXPECT_TRUE(written() == original);
}

TEST_F(GunzipIntoTest, WhatGoesBeyondTheRoomIsCountedAndNotWritten) {
  const auto outcome = into(gzipOf(text(1'000'000)), 500'000);
  EXPECT_EQ(outcome.result, GunzipResult::whole);
  EXPECT_EQ(outcome.size, 1'000'000U);
  EXPECT_LE(written().size(), 500'000U);
  EXPECT_EQ(into(gzipOf(text(1'000'000)), 500'000, 999'999).result, GunzipResult::tooLarge);
}

TEST_F(GunzipIntoTest, WhicheverAllocationFailsItIsALackOfMemoryAndNothingIsCounted) {
  if (!FailingMalloc::kWork) GTEST_SKIP() << "nothing fails under a sanitizer";
  const std::string whole = gzipOf(text(1000));
  long number = 0;
  for (;; ++number) {
    SCOPED_TRACE("allocation " + std::to_string(number));
    GunzipOutcome outcome;
    bool hasFailed = false;
    {
      const FailingMalloc failing(number, FailingMalloc::HowMany::one);
      outcome = into(whole, kNoLimit);
      hasFailed = FailingMalloc::failures() > 0;
    }
    EXPECT_EQ(outcome.writeError, 0);
    if (!hasFailed) {
      EXPECT_EQ(outcome.result, GunzipResult::whole);
      break;
    }
    EXPECT_EQ(outcome.result, GunzipResult::outOfMemory);
    EXPECT_EQ(outcome.size, 0U);
    EXPECT_TRUE(written().empty());
  }
  EXPECT_GE(number, 2) << "of zlib and our own";
}

TEST_F(GunzipIntoTest, WhoeverSaysNoAfterAPieceEndsTheWork) {
  const std::string whole = gzipOf(text(1'000'000));
  int calls = 0;
  const auto outcome = gunzip.gunzipInto({std::as_bytes(std::span(whole))}, file.get(), kNoLimit, kNoLimit,
                                         [&calls] { return ++calls < 2; });
  EXPECT_EQ(outcome.result, GunzipResult::refused);
  EXPECT_EQ(outcome.writeError, 0);
  EXPECT_EQ(calls, 2);
  EXPECT_EQ(outcome.size, written().size());
  EXPECT_LT(outcome.size, 1'000'000U);
}

TEST_F(GunzipIntoTest, AWriteThatFailsEndsTheWorkWithItsError) {
  file.reset(::open("/dev/full", O_WRONLY | O_CLOEXEC));
  const auto outcome = into(gzipOf(text(1'000'000)), kNoLimit);
  EXPECT_EQ(outcome.result, GunzipResult::refused);
  EXPECT_EQ(outcome.writeError, ENOSPC);
}

}  // namespace
}  // namespace brenvik

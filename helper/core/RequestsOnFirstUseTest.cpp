// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "helper/core/RequestsOnFirstUse.h"

#include <gtest/gtest.h>

#include <array>
#include <cstddef>
#include <new>

namespace brenvik {
namespace {

constexpr std::int32_t kKnown = 7;

class OneRoutine final : public RoutineTable {
 public:
  Handler find(std::int32_t id) const noexcept override { return id == kKnown ? &serve : nullptr; }
  void* context() const noexcept override { return const_cast<OneRoutine*>(this); }
  mutable int served = 0;

 private:
  static Outcome serve(void* context, const Request&, Reply& reply) {
    ++static_cast<const OneRoutine*>(context)->served;
    reply.setStatus(kern::success);
    return Outcome::accepted;
  }
};

class RequestsOnFirstUseTest : public testing::Test {
 protected:
  struct Areas {
    explicit Areas(RequestsOnFirstUseTest& test) : test_(test) {}
    const OneRoutine& requests() const noexcept { return test_.routine; }
    void shutDown() noexcept { ++test_.shutDowns; }
    RequestsOnFirstUseTest& test_;
  };

  // As a source of requests does it.
  KernelReturn request(std::int32_t id) {
    alignas(8) std::array<std::byte, sizeof(StatusReply)> bytes{};
    Reply reply(bytes.data());
    const RoutineTable::Handler handler = requests.find(id);
    if (handler == nullptr) return mig::badId;
    MessageHeader header{};
    const MessageTrailer trailer{};
    outcome = handler(requests.context(),
                      Request(reinterpret_cast<std::byte*>(&header), sizeof header, &trailer), reply);
    return reply.as<StatusReply>().returnCode;
  }

  OneRoutine routine;
  int made = 0;
  int shutDowns = 0;
  bool exhausted = false;
  Outcome outcome = Outcome::refused;
  RequestsOnFirstUse<Areas> requests{[this] {
    if (exhausted) throw std::bad_alloc();
    ++made;
    return std::make_unique<Areas>(*this);
  }};
};

TEST_F(RequestsOnFirstUseTest, TheAreasAreMadeForTheFirstRequestAndOnce) {
  EXPECT_EQ(made, 0);
  EXPECT_EQ(requests.context(), nullptr);
  EXPECT_EQ(request(kKnown), kern::success);
  EXPECT_EQ(outcome, Outcome::accepted);
  EXPECT_EQ(request(kKnown), kern::success);
  EXPECT_EQ(request(kKnown + 1), mig::badId);
  EXPECT_EQ(made, 1);
  EXPECT_EQ(routine.served, 2);
}

TEST_F(RequestsOnFirstUseTest, WithoutMemoryForTheAreasARequestGets6AndTheNextTriesAgain) {
  exhausted = true;
  EXPECT_EQ(request(kKnown), kern::resourceShortage);
  EXPECT_EQ(outcome, Outcome::refused);
  EXPECT_EQ(request(kKnown + 1), kern::resourceShortage);
  EXPECT_EQ(routine.served, 0);
  exhausted = false;
  EXPECT_EQ(request(kKnown), kern::success);
  EXPECT_EQ(made, 1);
}

TEST_F(RequestsOnFirstUseTest, OnlyWhatWasMadeIsShutDown) {
  requests.shutDown();
  EXPECT_EQ(shutDowns, 0);
  EXPECT_EQ(made, 0);
  EXPECT_EQ(request(kKnown), kern::success);
  requests.shutDown();
  EXPECT_EQ(shutDowns, 1);
}

}  // namespace
}  // namespace brenvik

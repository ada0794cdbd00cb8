// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include <gtest/gtest.h>
#include <poll.h>
#include <pthread.h>
#include <sys/mman.h>
#include <sys/socket.h>
#include <sys/syscall.h>
#include <sys/timerfd.h>
#include <unistd.h>

#include <atomic>
#include <csignal>
#include <cstring>
#include <functional>
#include <memory>
#include <string>
#include <thread>
#include <vector>

#include "client/fakes/ScriptedHelper.h"
#include "client/include/brenvik/mobile_helper.h"
#include "platform/base/fakes/FailingAllocations.h"

namespace {
std::atomic<int> timersSet{0};
}  // namespace

extern "C" int timerfd_settime(int fd, int flags, const itimerspec* next, itimerspec* last) noexcept {
  ++timersSet;
  return static_cast<int>(::syscall(SYS_timerfd_settime, fd, flags, next, last));
}

// Calls that do not block, and blocking calls that are interrupted.
namespace brenvik::client {
namespace {

struct FreeClient {
  void operator()(bvmh_client* client) const { bvmh_client_free(client); }
};
using ClientPointer = std::unique_ptr<bvmh_client, FreeClient>;

constexpr std::uint32_t kPlenty = 60'000;  // milliseconds; never used up when the code is right
constexpr std::uint32_t kShort = 40;       // milliseconds; always used up

bool isReadable(bvmh_client* client) {
  pollfd entry{bvmh_client_fd(client), POLLIN, 0};
  return ::poll(&entry, 1, 0) == 1;
}

// The next result, waited for as an event loop does.
bvmh_result nextResult(bvmh_client* client) {
  for (;;) {
    bvmh_result result{};
    const std::int32_t code = bvmh_take_result(client, 0, &result);
    if (code != BVMH_ERROR_IN_PROGRESS) {
      EXPECT_EQ(code, BVMH_OK);
      return result;
    }
    pollfd entry{bvmh_client_fd(client), POLLIN, 0};
    if (::poll(&entry, 1, static_cast<int>(kPlenty)) != 1) {
      ADD_FAILURE() << "nothing came";
      return result;
    }
    EXPECT_EQ(bvmh_process(client), BVMH_OK);
  }
}

// Its code; it is freed.
std::int32_t codeOfNext(bvmh_client* client, bvmh_call expected) {
  bvmh_result result = nextResult(client);
  EXPECT_EQ(result.call, expected);
  const std::int32_t code = result.code;
  bvmh_result_free(&result);
  return code;
}

class BegunCallsTest : public testing::Test {
 protected:
  void SetUp() override { before_ = openDescriptors(); }
  void TearDown() override {
    client_.reset();
    helper_.reset();
    EXPECT_EQ(openDescriptors(), before_);
  }

  void serve(std::function<void(Script&)> script) {
    helper_ = std::make_unique<ScriptedHelper>(std::move(script));
    client_.reset(bvmh_client_create());
    ASSERT_EQ(bvmh_client_set_socket(client(), helper_->path().c_str()), BVMH_OK);
    bvmh_client_set_timeout(client(), kPlenty);
  }
  void serveConnected(std::function<void(Script&)> script) {
    serve(std::move(script));
    ASSERT_EQ(bvmh_connect(client()), BVMH_OK);
  }
  bvmh_client* client() { return client_.get(); }
  bvmh_call begin(std::int32_t (*routine)(bvmh_client*, void*, bvmh_call*), void* context = nullptr) {
    bvmh_call call = 0;
    EXPECT_EQ(routine(client(), context, &call), BVMH_OK);
    EXPECT_NE(call, 0U);
    return call;
  }
  bvmh_call beginClear(void* context = nullptr) {
    return begin(BVMobileHelperClearVoicemailTokenBegin, context);
  }
  bvmh_call beginReset(void* context = nullptr) {
    return begin(BVMobileHelperResetVoicemailStoreBegin, context);
  }

  std::unique_ptr<ScriptedHelper> helper_;
  ClientPointer client_;

 private:
  std::size_t before_ = 0;
};

void answer(Script& script, const UniqueFd& channel, std::int32_t code) {
  script.send(channel, statusReply(script.receive(channel), code));
}

TEST_F(BegunCallsTest, SeveralAreUnderWayAtOnceAndEachGetsItsAnswerAndItsContext) {
  serveConnected([](Script& script) {
    const UniqueFd channel = script.checkIn();
    const Message country = script.receive(channel);
    const Message clear = script.receive(channel);
    const Message plist = script.receive(channel);
    const Message subscribed = script.receive(channel);
    script.send(channel, withResult(statusReply(country, 0), "DE" + std::string(62, '\0')));
    script.send(channel, statusReply(clear, 8));
    script.send(channel, inLineReply(plist, "<plist/>"));
    script.send(channel, withResult(statusReply(subscribed, 0), std::string{1, 0, 0, 0}));
  });
  int contexts[4];
  const bvmh_call country = begin(BVMobileHelperCopyCountryCodeBegin, &contexts[0]);
  const bvmh_call clear = beginClear(&contexts[1]);
  bvmh_call plist = 0;
  ASSERT_EQ(BVMobileHelperLoadPlistFileBegin(client(), "/x", &contexts[2], &plist), BVMH_OK);
  const bvmh_call subscribed = begin(BVMobileHelperIsVoicemailServiceSubscribedBegin, &contexts[3]);

  bvmh_result result = nextResult(client());
  EXPECT_EQ(result.call, country);
  EXPECT_EQ(result.context, &contexts[0]);
  EXPECT_EQ(result.message_id, 8683568);
  EXPECT_EQ(result.code, BVMH_OK);
  EXPECT_STREQ(result.text, "DE");
  bvmh_result_free(&result);
  result = nextResult(client());
  EXPECT_EQ(result.call, clear);
  EXPECT_EQ(result.context, &contexts[1]);
  EXPECT_EQ(result.code, 8);
  result = nextResult(client());
  EXPECT_EQ(result.call, plist);
  EXPECT_EQ(std::string(static_cast<const char*>(result.region.bytes), result.region.size), "<plist/>");
  bvmh_result_free(&result);
  EXPECT_EQ(result.region.bytes, nullptr);
  result = nextResult(client());
  EXPECT_EQ(result.call, subscribed);
  EXPECT_EQ(result.context, &contexts[3]);
  EXPECT_TRUE(result.boolean);
  EXPECT_EQ(bvmh_take_result(client(), 0, &result), BVMH_ERROR_NO_SUCH_CALL);
}

TEST_F(BegunCallsTest, NothingWaitsForAHelperThatDoesNotAnswer) {
  std::atomic<bool> mayEnd = false;
  serve([&](Script& script) {
    const UniqueFd connection = script.accept();
    while (!mayEnd) std::this_thread::yield();
  });
  bvmh_call connect = 0;
  ASSERT_EQ(bvmh_begin_connect(client(), nullptr, &connect), BVMH_OK);
  const bvmh_call call = beginClear();
  EXPECT_EQ(bvmh_process(client()), BVMH_OK);
  bvmh_result result{};
  EXPECT_EQ(bvmh_take_result(client(), 0, &result), BVMH_ERROR_IN_PROGRESS);
  EXPECT_EQ(bvmh_take_result(client(), call, &result), BVMH_ERROR_IN_PROGRESS);
  EXPECT_FALSE(isReadable(client()));
  mayEnd = true;
  helper_->finish();
}

TEST_F(BegunCallsTest, TheDescriptorIsReadableExactlyWhileThereIsSomethingToDo) {
  serveConnected([](Script& script) {
    const UniqueFd channel = script.checkIn();
    answer(script, channel, 1);
    answer(script, channel, 2);
    script.expectEnd(channel);
  });
  EXPECT_FALSE(isReadable(client()));
  const int descriptor = bvmh_client_fd(client());
  const bvmh_call first = beginClear();
  const bvmh_call second = beginClear();
  bvmh_result result{};
  while (bvmh_take_result(client(), second, &result) != BVMH_OK) {
    pollfd entry{descriptor, POLLIN, 0};
    ASSERT_EQ(::poll(&entry, 1, static_cast<int>(kPlenty)), 1);
    bvmh_process(client());
  }
  // The other result waits, however often nothing else is to be done.
  bvmh_process(client());
  pollfd entry{descriptor, POLLIN, 0};
  EXPECT_EQ(::poll(&entry, 1, static_cast<int>(kPlenty)), 1);
  EXPECT_EQ(bvmh_take_result(client(), first, &result), BVMH_OK);
  EXPECT_FALSE(isReadable(client()));
  EXPECT_EQ(bvmh_client_fd(client()), descriptor);
}

// Setting a timer costs as much as a call where the machine is a virtual one.
TEST_F(BegunCallsTest, TheTimerIsSetForTheFirstCallAndAfterTheLastAndNotForResults) {
  constexpr int kCalls = 20;
  serveConnected([](Script& script) {
    const UniqueFd channel = script.checkIn();
    for (int i = 0; i < kCalls; ++i) answer(script, channel, i + 1);
    script.expectEnd(channel);
  });
  ASSERT_GE(bvmh_client_fd(client()), 0);
  timersSet = 0;
  std::vector<bvmh_call> calls;
  for (int i = 0; i < kCalls; ++i) calls.push_back(beginClear());
  for (int i = 0; i < kCalls; ++i) EXPECT_EQ(codeOfNext(client(), calls[static_cast<std::size_t>(i)]), i + 1);
  EXPECT_FALSE(isReadable(client()));
  EXPECT_EQ(timersSet, 2);
}

TEST_F(BegunCallsTest, CallsWaitForACheckInThatIsUnderWay) {
  serve([](Script& script) {
    const UniqueFd channel = script.checkIn();
    EXPECT_EQ(script.receive(channel).id(), 8683551);
    const Message second = script.receive(channel);
    EXPECT_EQ(second.id(), 8683552);
    script.send(channel, statusReply(second, 4));
  });
  bvmh_call connect = 0;
  bvmh_call unused = 0;
  EXPECT_EQ(BVMobileHelperClearVoicemailTokenBegin(client(), nullptr, &unused), BVMH_ERROR_NOT_CONNECTED);
  ASSERT_EQ(bvmh_begin_connect(client(), nullptr, &connect), BVMH_OK);
  const bvmh_call clear = beginClear();
  const bvmh_call reset = beginReset();
  bvmh_result result = nextResult(client());
  EXPECT_EQ(result.call, connect);
  EXPECT_EQ(result.message_id, 4792174);
  EXPECT_EQ(result.code, BVMH_OK);
  // The second is answered, the first never.
  EXPECT_EQ(codeOfNext(client(), reset), 4);
  EXPECT_EQ(codeOfNext(client(), clear), BVMH_ERROR_ANSWER_LOST);
  ASSERT_EQ(bvmh_begin_connect(client(), nullptr, &connect), BVMH_OK);
}

TEST_F(BegunCallsTest, ARefusedCheckInEndsTheCallsThatWaitForItAndTheClientCanTryAgain) {
  serve([](Script& script) {
    {
      const UniqueFd connection = script.accept();
      script.send(connection, statusReply(script.receive(connection), 35));
    }
    const UniqueFd channel = script.checkIn();
    answer(script, channel, 0);
  });
  for (const std::int32_t code : {BVMH_INVALID_SECURITY, BVMH_OK}) {
    bvmh_call connect = 0;
    ASSERT_EQ(bvmh_begin_connect(client(), nullptr, &connect), BVMH_OK);
    const bvmh_call call = beginClear();
    EXPECT_EQ(codeOfNext(client(), connect), code);
    EXPECT_EQ(codeOfNext(client(), call), code);
    if (code != BVMH_OK) {
      bvmh_call unused = 0;
      EXPECT_EQ(BVMobileHelperClearVoicemailTokenBegin(client(), nullptr, &unused), BVMH_ERROR_NOT_CONNECTED);
    }
  }
}

TEST_F(BegunCallsTest, ACheckInWithoutAHelperEndsAtOnceAndSaysWhy) {
  serve([](Script&) {});
  ASSERT_EQ(bvmh_client_set_socket(client(), "/none/at/all"), BVMH_OK);
  bvmh_call connect = 0;
  ASSERT_EQ(bvmh_begin_connect(client(), nullptr, &connect), BVMH_OK);
  const bvmh_call call = beginClear();  // is begun like any other, and ends like the check-in
  for (const bvmh_call each : {connect, call}) {
    bvmh_result result = nextResult(client());
    EXPECT_EQ(result.call, each);
    EXPECT_EQ(result.code, BVMH_ERROR_UNREACHABLE);
    EXPECT_EQ(result.system_error, ENOENT);
  }
  EXPECT_FALSE(isReadable(client()));
}

TEST_F(BegunCallsTest, ACheckInIsTriedAgainWhenTheHelperStopsBeforeItAnswers) {
  serve([](Script& script) {
    for (int i = 0; i < 3; ++i) (void)script.accept();
    const UniqueFd channel = script.checkIn();
    answer(script, channel, 0);
  });
  bvmh_call connect = 0;
  ASSERT_EQ(bvmh_begin_connect(client(), nullptr, &connect), BVMH_OK);
  const bvmh_call call = beginClear();
  EXPECT_EQ(codeOfNext(client(), connect), BVMH_OK);
  EXPECT_EQ(codeOfNext(client(), call), BVMH_OK);
}

TEST_F(BegunCallsTest, ATimeoutLeavesTheClientUsableAndTheLateAnswerIsDropped) {
  serveConnected([](Script& script) {
    const UniqueFd channel = script.checkIn();
    const Message late = script.receive(channel);
    const Message next = script.receive(channel);
    script.send(channel, inLineReply(late, "late"));
    script.send(channel, statusReply(next, 33));
    script.expectEnd(channel);
  });
  bvmh_client_set_timeout(client(), kShort);
  bvmh_call late = 0;
  ASSERT_EQ(BVMobileHelperLoadPlistFileBegin(client(), "/x", nullptr, &late), BVMH_OK);
  EXPECT_EQ(codeOfNext(client(), late), BVMH_ERROR_TIMED_OUT);
  bvmh_client_set_timeout(client(), kPlenty);
  const bvmh_call next = beginClear();
  EXPECT_EQ(codeOfNext(client(), next), 33);
}

TEST_F(BegunCallsTest, ACancelledCallHasNoResultAndItsLateAnswerIsDropped) {
  serveConnected([](Script& script) {
    const UniqueFd channel = script.checkIn();
    const Message cancelled = script.receive(channel);
    const Message next = script.receive(channel);
    const UniqueFd memory = makeMemory("in memory of its own", kAllSeals);
    script.send(channel, outOfLineReply(cancelled, 20, 0), {memory.get()});
    script.send(channel, statusReply(next, 33));
    answer(script, channel, 44);
    script.expectEnd(channel);
  });
  bvmh_call cancelled = 0;
  ASSERT_EQ(BVMobileHelperLoadPlistFileBegin(client(), "/x", nullptr, &cancelled), BVMH_OK);
  EXPECT_EQ(bvmh_cancel(client(), cancelled), BVMH_OK);
  EXPECT_EQ(bvmh_cancel(client(), cancelled), BVMH_ERROR_NO_SUCH_CALL);
  bvmh_result result{};
  EXPECT_EQ(bvmh_take_result(client(), cancelled, &result), BVMH_ERROR_NO_SUCH_CALL);
  const bvmh_call next = beginClear();
  EXPECT_EQ(codeOfNext(client(), next), 33);
  EXPECT_EQ(BVMobileHelperClearVoicemailToken(client()), 44);
}

TEST_F(BegunCallsTest, AResultThatIsThereCanBeCancelledToo) {
  serveConnected([](Script& script) {
    const UniqueFd channel = script.checkIn();
    script.send(channel, inLineReply(script.receive(channel), std::string(20'000, 'x')));
    answer(script, channel, 0);
    script.expectEnd(channel);
  });
  bvmh_call call = 0;
  ASSERT_EQ(BVMobileHelperLoadPlistFileBegin(client(), "/x", nullptr, &call), BVMH_OK);
  const bvmh_call last = beginClear();
  bvmh_result result{};
  while (bvmh_take_result(client(), last, &result) != BVMH_OK) bvmh_process(client());
  EXPECT_EQ(bvmh_cancel(client(), call), BVMH_OK);
  EXPECT_EQ(bvmh_take_result(client(), 0, &result), BVMH_ERROR_NO_SUCH_CALL);
  EXPECT_FALSE(isReadable(client()));
}

// ---- a helper that leaves, or lies ----------------------------------------------------------------------

TEST_F(BegunCallsTest, AChannelThatEndsWhileNothingIsUnderWayIsReplacedWhenItIsNeeded) {
  serveConnected([](Script& script) {
    (void)script.checkIn();
    const UniqueFd channel = script.checkIn();
    answer(script, channel, 7);
  });
  pollfd entry{bvmh_client_fd(client()), POLLIN, 0};
  ASSERT_EQ(::poll(&entry, 1, static_cast<int>(kPlenty)), 1);
  bvmh_process(client());
  EXPECT_FALSE(isReadable(client()));
  EXPECT_EQ(codeOfNext(client(), beginClear()), 7);
}

TEST_F(BegunCallsTest, OfTheCallsOfAHelperThatLeavesTheOldestMayHaveBeenCarriedOutAndTheOthersAreSentAgain) {
  for (const bool readsTheFirst : {true, false}) {
    std::atomic<int> begun = 0;
    serveConnected([&](Script& script) {
      {
        const UniqueFd channel = script.checkIn();
        answer(script, channel, 1);
        while (begun < 4) std::this_thread::yield();
        if (readsTheFirst) (void)script.receive(channel);
      }
      const UniqueFd channel = script.checkIn();
      const Message second = script.receive(channel);
      EXPECT_EQ(second.id(), 8683552);
      const Message third = script.receive(channel);
      EXPECT_EQ(third.id(), 8683551);
      script.send(channel, statusReply(second, 22));
      script.send(channel, statusReply(third, 33));
      script.expectEnd(channel);
    });
    const bvmh_call answered = beginClear();
    const bvmh_call oldest = beginClear();
    const bvmh_call second = beginReset();
    const bvmh_call third = beginClear();
    begun = 4;
    EXPECT_EQ(codeOfNext(client(), answered), 1);
    EXPECT_EQ(codeOfNext(client(), oldest), BVMH_ERROR_ANSWER_LOST);
    EXPECT_EQ(codeOfNext(client(), second), 22);
    EXPECT_EQ(codeOfNext(client(), third), 33);
    client_.reset();
    helper_.reset();
  }
}

TEST_F(BegunCallsTest, ACallThatTheKernelSaysWasLeftUnreadIsSentAgain) {
  serveConnected([](Script& script) {
    {
      const UniqueFd channel = script.checkIn();
      pollfd wait{channel.get(), POLLIN, 0};
      ASSERT_EQ(::poll(&wait, 1, static_cast<int>(kPlenty)), 1);
    }
    const UniqueFd channel = script.checkIn();
    answer(script, channel, 7);
  });
  EXPECT_EQ(codeOfNext(client(), beginClear()), 7);
}

TEST_F(BegunCallsTest, ACallIsSentAgainOnceAtMost) {
  serveConnected([](Script& script) {
    for (int i = 0; i < 2; ++i) {
      const UniqueFd channel = script.checkIn();
      pollfd wait{channel.get(), POLLIN, 0};
      ASSERT_EQ(::poll(&wait, 1, static_cast<int>(kPlenty)), 1);
    }
    const UniqueFd channel = script.checkIn();
    answer(script, channel, 7);
  });
  // The one that is alone was left unread twice.
  EXPECT_EQ(codeOfNext(client(), beginClear()), BVMH_ERROR_HELPER_GONE);
  EXPECT_EQ(codeOfNext(client(), beginClear()), 7);
}

TEST_F(BegunCallsTest, ACallThatFindsTwoChannelsClosedIsNotSentToAThird) {
  serve([](Script& script) {
    const auto checkIn = [&script](const auto& whileClosing) {
      const UniqueFd connection = script.accept();
      const Message request = script.receive(connection);
      int ends[2];
      ASSERT_EQ(::socketpair(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC, 0, ends), 0);
      UniqueFd ours(ends[0]);
      const UniqueFd theirs(ends[1]);
      whileClosing(ours);
      script.send(connection, checkInReply(request), {theirs.get()});
      if (ours.isValid()) answer(script, ours, 7);
    };
    for (int i = 0; i < 2; ++i) checkIn([](UniqueFd& ours) { ours.reset(); });
    checkIn([](UniqueFd&) {});
  });
  bvmh_call connect = 0;
  ASSERT_EQ(bvmh_begin_connect(client(), nullptr, &connect), BVMH_OK);
  const bvmh_call call = beginClear();
  EXPECT_EQ(codeOfNext(client(), connect), BVMH_OK);
  EXPECT_EQ(codeOfNext(client(), call), BVMH_ERROR_HELPER_GONE);
  EXPECT_EQ(codeOfNext(client(), beginClear()), 7);
}

TEST_F(BegunCallsTest, ACheckInThatOnlyACancelledCallWaitedForEndsAtOnce) {
  serve([](Script& script) {
    const UniqueFd connection = script.accept();
    (void)script.receive(connection);
    script.expectEnd(connection);
  });
  const std::size_t before = openDescriptors();
  bvmh_call connect = 0;
  ASSERT_EQ(bvmh_begin_connect(client(), nullptr, &connect), BVMH_OK);
  const bvmh_call call = beginClear();
  EXPECT_EQ(bvmh_process(client()), BVMH_OK);
  EXPECT_EQ(bvmh_cancel(client(), connect), BVMH_OK);
  EXPECT_EQ(bvmh_cancel(client(), call), BVMH_OK);
  helper_.reset();  // its script has seen the end
  EXPECT_LT(openDescriptors(), before) << "the helper's own socket is gone, and the client has none";
}

TEST_F(BegunCallsTest, AnAnswerThatBreaksTheProtocolEndsTheChannelAndNotTheClient) {
  struct Lie {
    const char* name;
    std::function<Bytes(const Message&)> tell;
  };
  for (const Lie& lie : {
           Lie{"ends in the middle",
               [](const Message& m) { return Bytes(statusReply(m, 0).string().substr(0, 30)); }},
           Lie{"shorter than a header", [](const Message&) { return Bytes(8); }},
           Lie{"to a request never made",
               [](const Message& m) { return statusReply(m, 0).u32(12, m.replyPort() + 9); }},
           Lie{"of another form", [](const Message& m) { return inLineReply(m, "x"); }},
           Lie{"a code of the library's own",
               [](const Message& m) { return statusReply(m, BVMH_ERROR_INTERRUPTED); }},
       }) {
    SCOPED_TRACE(lie.name);
    serveConnected([&](Script& script) {
      {
        const UniqueFd channel = script.checkIn();
        const Message first = script.receive(channel);
        (void)script.receive(channel);
        script.send(channel, lie.tell(first));
        script.expectEnd(channel);
      }
      const UniqueFd channel = script.checkIn();
      answer(script, channel, 5);
    });
    const bvmh_call first = beginClear();
    const bvmh_call second = beginClear();
    EXPECT_EQ(codeOfNext(client(), first), BVMH_ERROR_PROTOCOL);
    EXPECT_EQ(codeOfNext(client(), second), BVMH_ERROR_ANSWER_LOST);
    EXPECT_EQ(codeOfNext(client(), beginClear()), 5);
    client_.reset();
    helper_.reset();
  }
}

TEST_F(BegunCallsTest, UnsealedMemoryInAnAnswerIsNotTaken) {
  serveConnected([](Script& script) {
    const UniqueFd channel = script.checkIn();
    const Message request = script.receive(channel);
    const UniqueFd memory = makeMemory("content", 0);
    script.send(channel, outOfLineReply(request, 7, 0), {memory.get()});
    script.expectEnd(channel);
  });
  bvmh_call call = 0;
  ASSERT_EQ(BVMobileHelperLoadPlistFileBegin(client(), "/x", nullptr, &call), BVMH_OK);
  EXPECT_EQ(codeOfNext(client(), call), BVMH_ERROR_PROTOCOL);
}

// ---- many -----------------------------------------------------------------------------------------------

TEST_F(BegunCallsTest, MoreThanTheChannelTakesAreSentAsThereIsRoom) {
  constexpr int kCalls = 1000;
  serveConnected([](Script& script) {
    const UniqueFd channel = script.checkIn();
    for (int i = 0; i < kCalls; ++i) {
      const Message request = script.receive(channel);
      EXPECT_EQ(request.bytes.string().substr(32, 16).c_str(), "/" + std::to_string(i));
      script.send(channel, statusReply(request, i + 1));
    }
  });
  std::vector<bvmh_call> calls(kCalls);
  for (int i = 0; i < kCalls; ++i) {
    ASSERT_EQ(BVMobileHelperReplaceCarrierSymlinkBegin(client(), ("/" + std::to_string(i)).c_str(), "/link",
                                                       "", nullptr, &calls[static_cast<std::size_t>(i)]),
              BVMH_OK);
  }
  for (int i = 0; i < kCalls; ++i) ASSERT_EQ(codeOfNext(client(), calls[static_cast<std::size_t>(i)]), i + 1);
}

TEST_F(BegunCallsTest, TenThousandCallsAndNoReaderEndWithAClearCodeAndLeakNothing) {
  std::atomic<bool> hasCheckedIn = false;  // and holds nothing more that it made for that
  serveConnected([&hasCheckedIn](Script& script) {
    {
      const UniqueFd channel = script.checkIn();  // is never read
      hasCheckedIn = true;
      script.expectEnd(script.deathWatch());
    }
    const UniqueFd channel = script.checkIn();
    answer(script, channel, 7);
  });
  (void)bvmh_client_fd(client());
  while (!hasCheckedIn) std::this_thread::yield();
  const std::size_t before = openDescriptors();
  bvmh_client_set_timeout(client(), kShort);
  const std::string value(70'000, 'v');  // does not fit a datagram: a descriptor each when it is sent
  for (int i = 0; i < 10'000; ++i) {
    const std::int32_t code = i % 100 == 0
                                  ? BVMobileHelperSetPreferenceValueBegin(client(), "d", "k", value.data(),
                                                                          value.size(), nullptr, nullptr)
                                  : BVMobileHelperClearVoicemailTokenBegin(client(), nullptr, nullptr);
    ASSERT_EQ(code, i < BVMH_MOST_CALLS ? BVMH_OK : BVMH_ERROR_TOO_MANY_CALLS);
  }
  EXPECT_EQ(bvmh_begin_connect(client(), nullptr, nullptr), BVMH_ERROR_TOO_MANY_CALLS);
  EXPECT_EQ(openDescriptors(), before);
  for (int i = 0; i < BVMH_MOST_CALLS; ++i) {
    bvmh_result result = nextResult(client());
    ASSERT_EQ(result.code, BVMH_ERROR_TIMED_OUT);
  }
  // The object is usable: with its old channel, and with a new one.
  bvmh_call call = beginClear();
  EXPECT_EQ(codeOfNext(client(), call), BVMH_ERROR_TIMED_OUT);
  bvmh_client_set_timeout(client(), kPlenty);
  ASSERT_EQ(bvmh_reconnect(client()), BVMH_OK);
  EXPECT_EQ(codeOfNext(client(), beginClear()), 7);
}

TEST_F(BegunCallsTest, AClientCanBeFreedWithCallsInEveryState) {
  serveConnected([](Script& script) {
    const UniqueFd channel = script.checkIn();
    script.send(channel, inLineReply(script.receive(channel), std::string(20'000, 'x')));
    script.expectEnd(script.deathWatch());
  });
  ASSERT_EQ(BVMobileHelperLoadPlistFileBegin(client(), "/x", nullptr, nullptr), BVMH_OK);
  while (!isReadable(client())) std::this_thread::yield();
  bvmh_process(client());
  const std::string value(60'000, 'v');
  for (int i = 0; i < 20; ++i) {
    ASSERT_EQ(BVMobileHelperSetPreferenceValueBegin(client(), "d", "k", value.data(), value.size(), nullptr,
                                                    nullptr),
              BVMH_OK);
  }
}

TEST_F(BegunCallsTest, DisconnectingEndsThemAll) {
  serveConnected([](Script& script) {
    const UniqueFd channel = script.checkIn();
    script.expectEnd(script.deathWatch());
  });
  const std::string value(60'000, 'v');
  std::vector<bvmh_call> calls(20);
  for (bvmh_call& each : calls) {
    ASSERT_EQ(
        BVMobileHelperSetPreferenceValueBegin(client(), "d", "k", value.data(), value.size(), nullptr, &each),
        BVMH_OK);
  }
  bvmh_disconnect(client());
  EXPECT_EQ(codeOfNext(client(), calls.front()), BVMH_ERROR_ANSWER_LOST);
  bvmh_result result{};
  ASSERT_EQ(bvmh_take_result(client(), calls.back(), &result), BVMH_OK);
  EXPECT_EQ(result.code, BVMH_ERROR_NOT_CONNECTED);
}

TEST_F(BegunCallsTest, APushIsMatchedToTheOneQuestionThatIsUnderWay) {
  serveConnected([](Script& script) {
    const UniqueFd channel = script.checkIn();
    for (const std::int32_t code : {0, 0, 5, 0}) answer(script, channel, code);
    script.expectEnd(channel);
  });
  bvmh_event civic{};
  civic.kind = BVMH_EVENT_CIVIC_INFO;
  bvmh_call matched = 99;
  EXPECT_EQ(bvmh_match_push(client(), &civic, &matched), BVMH_ERROR_NOT_ASKED);
  EXPECT_EQ(matched, 0U);
  bvmh_call first = 0;
  ASSERT_EQ(BVMobileHelperRequestCountryCodeFromLocationBegin(client(), 1, 2, nullptr, &first), BVMH_OK);
  // A push may be there before the answer is read.
  EXPECT_EQ(bvmh_match_push(client(), &civic, &matched), BVMH_OK);
  EXPECT_EQ(matched, first);
  // A blocking call has no number.
  EXPECT_EQ(BVMobileHelperRequestCountryCodeFromLocation(client(), 1, 2), BVMH_OK);
  EXPECT_EQ(bvmh_match_push(client(), &civic, &matched), BVMH_OK);
  EXPECT_EQ(matched, 0U);
  // One that the helper refused will not be answered.
  EXPECT_EQ(codeOfNext(client(), first), BVMH_OK);
  bvmh_call refused = 0;
  ASSERT_EQ(BVMobileHelperRequestCountryCodeFromLocationBegin(client(), 1, 2, nullptr, &refused), BVMH_OK);
  EXPECT_EQ(codeOfNext(client(), refused), 5);
  EXPECT_EQ(bvmh_match_push(client(), &civic, nullptr), BVMH_ERROR_NOT_ASKED);
  EXPECT_EQ(bvmh_match_push(nullptr, &civic, nullptr), BVMH_ERROR_INVALID_ARGUMENT);
  EXPECT_EQ(bvmh_match_push(client(), nullptr, nullptr), BVMH_ERROR_INVALID_ARGUMENT);
  EXPECT_EQ(BVMobileHelperClearVoicemailToken(client()), BVMH_OK);
}

// ---- beside blocking calls ------------------------------------------------------------------------------

TEST_F(BegunCallsTest, ABlockingCallWaitsForItsTurnAndKeepsTheResultsOfTheOthers) {
  serveConnected([](Script& script) {
    const UniqueFd channel = script.checkIn();
    const Message begun = script.receive(channel);
    const Message blocking = script.receive(channel);
    EXPECT_EQ(blocking.id(), 8683572);
    script.send(channel, statusReply(begun, 1));
    script.send(channel, inLineReply(blocking, "<plist/>"));
  });
  const bvmh_call begun = beginClear();
  bvmh_region region{};
  EXPECT_EQ(BVMobileHelperLoadPlistFile(client(), "/x", &region), BVMH_OK);
  EXPECT_EQ(std::string(static_cast<const char*>(region.bytes), region.size), "<plist/>");
  bvmh_region_free(&region);
  EXPECT_TRUE(isReadable(client()));
  EXPECT_EQ(codeOfNext(client(), begun), 1);
}

TEST_F(BegunCallsTest, ABlockingCallAmongBegunOnesKeepsToItsTimeout) {
  serveConnected([](Script& script) {
    const UniqueFd channel = script.checkIn();
    const Message begun = script.receive(channel);
    (void)script.receive(channel);
    script.expectEnd(script.deathWatch());
  });
  const bvmh_call begun = beginClear();
  bvmh_client_set_timeout(client(), kShort);
  EXPECT_EQ(BVMobileHelperClearVoicemailToken(client()), BVMH_ERROR_TIMED_OUT);
  bvmh_result result{};
  EXPECT_EQ(bvmh_take_result(client(), begun, &result), BVMH_ERROR_IN_PROGRESS);
}

TEST_F(BegunCallsTest, ConnectingWaitsForACheckInThatWasBegun) {
  serve([](Script& script) {
    const UniqueFd channel = script.checkIn();
    script.expectEnd(script.deathWatch());
  });
  bvmh_call connect = 0;
  ASSERT_EQ(bvmh_begin_connect(client(), nullptr, &connect), BVMH_OK);
  EXPECT_EQ(bvmh_connect(client()), BVMH_OK);
  EXPECT_EQ(codeOfNext(client(), connect), BVMH_OK);
}

// ---- the generic call, arguments ------------------------------------------------------------------------

TEST_F(BegunCallsTest, AnyRoutineIsBegunByItsNumber) {
  Message seen;
  serveConnected([&](Script& script) {
    const UniqueFd channel = script.checkIn();
    seen = script.receive(channel);
    script.send(channel, statusReply(seen, 0));
  });
  Bytes request(568);
  request.text(52, "domain").text(308, "key");
  const bvmh_bytes value{"<plist>", 7};
  bvmh_call call = 0;
  ASSERT_EQ(bvmh_begin(client(), 8683555, request.string().data(), 568, &value, 1, nullptr, &call), BVMH_OK);
  EXPECT_EQ(codeOfNext(client(), call), BVMH_OK);
  helper_->finish();
  EXPECT_EQ(seen.bytes, Bytes(568)
                            .u32(0, 0x80000012)
                            .u32(4, 568)
                            .u32(8, seen.replyPort())
                            .i32(20, 8683555)
                            .u32(24, 1)
                            .u64(28, 568)
                            .u8(37, 1)
                            .u8(39, 1)
                            .u32(40, 7)
                            .ndr(44)
                            .text(52, "domain")
                            .text(308, "key")
                            .u32(564, 7)
                            .append("<plist>"));
}

TEST_F(BegunCallsTest, ArgumentsThatDoNotFitBeginNothing) {
  serveConnected([](Script& script) {
    const UniqueFd channel = script.checkIn();
    script.expectEnd(channel);
  });
  const std::string request(568, '\0');
  const bvmh_bytes region{"x", 1};
  const bvmh_bytes noBytes{nullptr, 1};
  const auto begin = [&](std::int32_t id, const void* bytes, std::size_t size, const bvmh_bytes* regions,
                         std::size_t count) {
    bvmh_call call = 99;
    const std::int32_t code = bvmh_begin(client(), id, bytes, size, regions, count, nullptr, &call);
    EXPECT_EQ(call, 0U);
    return code;
  };
  const auto refused = BVMH_ERROR_INVALID_ARGUMENT;
  EXPECT_EQ(begin(8683548, request.data(), 24, nullptr, 0), refused);
  EXPECT_EQ(begin(8683576, request.data(), 24, nullptr, 0), refused);
  EXPECT_EQ(begin(INT32_MIN, request.data(), 24, nullptr, 0), refused);
  EXPECT_EQ(begin(8683551, request.data(), 23, nullptr, 0), refused);
  EXPECT_EQ(begin(8683551, request.data(), 25, nullptr, 0), refused);
  EXPECT_EQ(begin(8683551, nullptr, 24, nullptr, 0), refused);
  EXPECT_EQ(begin(8683551, request.data(), 24, &region, 1), refused);
  EXPECT_EQ(begin(8683555, request.data(), 568, nullptr, 0), refused);
  EXPECT_EQ(begin(8683555, request.data(), 568, nullptr, 1), refused);
  EXPECT_EQ(begin(8683555, request.data(), 568, &noBytes, 1), refused);
  EXPECT_EQ(BVMobileHelperLoadPlistFileBegin(client(), std::string(256, 'x').c_str(), nullptr, nullptr),
            refused);
  EXPECT_EQ(BVMobileHelperClearVoicemailTokenBegin(nullptr, nullptr, nullptr), refused);
  EXPECT_EQ(bvmh_begin_connect(nullptr, nullptr, nullptr), refused);
  EXPECT_EQ(bvmh_process(nullptr), refused);
  EXPECT_EQ(bvmh_take_result(client(), 0, nullptr), refused);
  EXPECT_EQ(bvmh_client_fd(nullptr), -1);
  bvmh_result result{};
  EXPECT_EQ(bvmh_take_result(nullptr, 0, &result), refused);
  EXPECT_EQ(bvmh_take_result(client(), 0, &result), BVMH_ERROR_NO_SUCH_CALL);
  bvmh_result_free(nullptr);
}

TEST_F(BegunCallsTest, WithoutMemoryNothingIsBegunAndNothingIsLost) {
  if (!FailingAllocations::kWork) GTEST_SKIP();
  serveConnected([](Script& script) {
    const UniqueFd channel = script.checkIn();
    answer(script, channel, 7);
    script.expectEnd(channel);
  });
  for (long first = 0;; ++first) {
    std::int32_t code = BVMH_OK;
    bvmh_call call = 0;
    long failures = 0;
    {
      const FailingAllocations failing(first, FailingAllocations::HowMany::one);
      code = BVMobileHelperClearVoicemailTokenBegin(client(), nullptr, &call);
      failures = FailingAllocations::failures();
    }
    if (failures == 0) {
      EXPECT_GT(first, 2);
      EXPECT_EQ(code, BVMH_OK);
      EXPECT_EQ(codeOfNext(client(), call), 7);
      break;
    }
    ASSERT_EQ(code, BVMH_ERROR_NO_MEMORY);
    ASSERT_EQ(call, 0U);
  }
}

// ---- interruption ---------------------------------------------------------------------------------------

class InterruptTest : public BegunCallsTest {};

bvmh_client* interruptedBySignal = nullptr;

TEST_F(InterruptTest, AnotherThreadEndsACallThatWaits) {
  serveConnected([&](Script& script) {
    {
      const UniqueFd channel = script.checkIn();
      (void)script.receive(channel);
      bvmh_client_interrupt(client());
      script.expectEnd(script.deathWatch());
    }
    const UniqueFd channel = script.checkIn();
    answer(script, channel, 7);
  });
  EXPECT_EQ(BVMobileHelperClearVoicemailToken(client()), BVMH_ERROR_INTERRUPTED);
  // One call for each time, and the client is usable.
  EXPECT_EQ(BVMobileHelperClearVoicemailToken(client()), 7);
}

TEST_F(InterruptTest, ASignalHandlerEndsACallThatWaits) {
  std::atomic<pthread_t> caller = ::pthread_self();
  serveConnected([&](Script& script) {
    const UniqueFd channel = script.checkIn();
    (void)script.receive(channel);
    ::pthread_kill(caller, SIGUSR1);
    script.expectEnd(script.deathWatch());
  });
  interruptedBySignal = client();
  struct sigaction action {};
  action.sa_handler = [](int) { bvmh_client_interrupt(interruptedBySignal); };
  action.sa_flags = SA_RESTART;
  struct sigaction before {};
  ASSERT_EQ(::sigaction(SIGUSR1, &action, &before), 0);
  EXPECT_EQ(BVMobileHelperClearVoicemailToken(client()), BVMH_ERROR_INTERRUPTED);
  ::sigaction(SIGUSR1, &before, nullptr);
  // The channel has been given up by now, and the client does not take it for one.
  helper_.reset();
  EXPECT_EQ(bvmh_connect(client()), BVMH_ERROR_UNREACHABLE);
}

TEST_F(InterruptTest, WithoutACallTheNextOneReturnsAndNothingIsSent) {
  serveConnected([](Script& script) {
    const UniqueFd channel = script.checkIn();
    EXPECT_EQ(script.receive(channel).id(), 8683552);
  });
  bvmh_client_interrupt(client());
  bvmh_client_interrupt(client());
  EXPECT_EQ(BVMobileHelperClearVoicemailToken(client()), BVMH_ERROR_INTERRUPTED);
  EXPECT_EQ(BVMobileHelperResetVoicemailStore(client()), BVMH_ERROR_ANSWER_LOST);
  bvmh_client_interrupt(nullptr);
}

TEST_F(InterruptTest, ACheckInThatWaitsEnds) {
  serve([&](Script& script) {
    const UniqueFd connection = script.accept();
    (void)script.receive(connection);
    bvmh_client_interrupt(client());
    script.expectEnd(connection);
  });
  EXPECT_EQ(bvmh_connect(client()), BVMH_ERROR_INTERRUPTED);
  EXPECT_EQ(BVMobileHelperClearVoicemailToken(client()), BVMH_ERROR_NOT_CONNECTED);
}

TEST_F(InterruptTest, CallsThatWereBegunGoOn) {
  serveConnected([&](Script& script) {
    const UniqueFd channel = script.checkIn();
    const Message begun = script.receive(channel);
    const Message blocking = script.receive(channel);
    bvmh_client_interrupt(client());
    answer(script, channel, 3);  // the blocking call has returned by then
    script.send(channel, statusReply(begun, 1));
    script.send(channel, statusReply(blocking, 2));
    script.expectEnd(channel);
  });
  const bvmh_call begun = beginClear();
  EXPECT_EQ(BVMobileHelperClearVoicemailToken(client()), BVMH_ERROR_INTERRUPTED);
  const bvmh_call last = beginReset();
  EXPECT_EQ(codeOfNext(client(), last), 3);
  EXPECT_EQ(codeOfNext(client(), begun), 1);
  bvmh_process(client());
}

TEST_F(InterruptTest, AHelperThatReadsNothingCanBeInterruptedWhileSending) {
  std::atomic<bool> isFull = false;
  serveConnected([&](Script& script) {
    const UniqueFd channel = script.checkIn();
    while (!isFull) std::this_thread::yield();
    bvmh_client_interrupt(client());
    script.expectEnd(script.deathWatch());
  });
  const std::string value(60'000, 'v');
  bvmh_client_set_timeout(client(), 1);
  for (int i = 0; i < 10; ++i) {
    EXPECT_EQ(BVMobileHelperSetPreferenceValue(client(), "d", "k", value.data(), value.size()),
              BVMH_ERROR_TIMED_OUT);
  }
  bvmh_client_set_timeout(client(), kPlenty);
  isFull = true;
  EXPECT_EQ(BVMobileHelperSetPreferenceValue(client(), "d", "k", value.data(), value.size()),
            BVMH_ERROR_INTERRUPTED);
}

TEST_F(InterruptTest, ManyFromManyThreadsHarmNothing) {
  std::atomic<bool> isOver = false;
  serveConnected([&](Script& script) {
    while (!isOver) {
      try {
        const UniqueFd channel = script.checkIn();
        for (;;) answer(script, channel, 7);
      } catch (const std::exception&) {
        // The client cut it.
      }
    }
  });
  std::vector<std::thread> interrupters;
  std::atomic<bool> mayStop = false;
  for (int i = 0; i < 3; ++i) {
    interrupters.emplace_back([&] {
      while (!mayStop) bvmh_client_interrupt(client());
    });
  }
  int answered = 0;
  for (int i = 0; i < 2000; ++i) {
    const std::int32_t code = BVMobileHelperClearVoicemailToken(client());
    ASSERT_TRUE(code == 7 || code == BVMH_ERROR_INTERRUPTED) << code;
  }
  mayStop = true;
  for (std::thread& each : interrupters) each.join();
  while (BVMobileHelperClearVoicemailToken(client()) != 7) ASSERT_LT(++answered, 3);
  isOver = true;
  bvmh_disconnect(client());
  (void)connectTo(helper_->path());  // should it wait for one more
  helper_->finish();
}

}  // namespace
}  // namespace brenvik::client

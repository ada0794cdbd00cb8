// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/web/linux/LoadedWebModule.h"

#include <gtest/gtest.h>
#include <sys/mman.h>
#include <sys/resource.h>
#include <unistd.h>

#include <future>

#include "platform/base/fakes/FailingAllocations.h"
#include "platform/log/Log.h"
#include "platform/log/fakes/RecordingLog.h"
#include "platform/runloop/linux/SystemQueues.h"

namespace brenvik {
namespace {

// One member, "hello", as gzip(1) writes it.
constexpr unsigned char kHello[] = {0x1f, 0x8b, 0x08, 0x00, 0x00, 0x00, 0x00, 0x00, 0x00,
                                    0x03, 0xcb, 0x48, 0xcd, 0xc9, 0xc9, 0x07, 0x00, 0x86,
                                    0xa6, 0x10, 0x36, 0x05, 0x00, 0x00, 0x00};

class LoadedWebModuleTest : public testing::Test {
 protected:
  std::shared_ptr<WebResponse> fetch(LoadedWebModule& module, const std::string& url) {
    std::promise<std::shared_ptr<WebResponse>> answer;
    const auto session = module.webClient().makeSession();
    session->setCellularAllowed(false);
    const auto request = module.webClient().makeRequest(WebRequestType::get, url, {}, session);
    EXPECT_NE(request, nullptr);
    request->setCallbackQueue(callbackQueue);
    request->setTimeLimit(std::chrono::seconds(10));
    request->setLargestBody(1000);
    request->setCompletion(
        [&](std::shared_ptr<WebResponse> response) { answer.set_value(std::move(response)); });
    request->send({});
    return answer.get_future().get();
  }
  GunzipResult unpackHello(LoadedWebModule& module) {
    unpacked.clear();
    const auto outcome = module.gunzip().gunzipInto({std::as_bytes(std::span(kHello))}, file.get(), 100, 100);
    unpacked.resize(100);
    unpacked.resize(static_cast<std::size_t>(::pread(file.get(), unpacked.data(), unpacked.size(), 0)));
    (void)::lseek(file.get(), 0, SEEK_SET);
    return outcome.result;
  }

  // Exits with 7 when the module cannot be had without descriptors, and can be had with them.
  [[noreturn]] void unpackWithoutAndWithDescriptors() {
    LoadedWebModule module(queues, {BRENVIK_TEST_MODULE});
    rlimit before{};
    ::getrlimit(RLIMIT_NOFILE, &before);
    const rlimit none{0, before.rlim_max};
    ::setrlimit(RLIMIT_NOFILE, &none);
    const bool refused = unpackHello(module) == GunzipResult::unavailable &&
                         unpackHello(module) == GunzipResult::unavailable && log.entries().size() == 1;
    ::setrlimit(RLIMIT_NOFILE, &before);
    const bool given = unpackHello(module) == GunzipResult::whole && unpacked == "hello" &&
                       fetch(module, "https://127.0.0.1:1/")->errorKind == WebErrorKind::cannotConnect;
    ::_exit(refused && given ? 7 : 1);
  }

  std::unique_ptr<SystemRunLoop> loop = SystemRunLoop::make();
  SystemQueues queues{*loop};
  std::shared_ptr<WorkQueue> callbackQueue = queues.makeSerial("callbacks", QualityOfService::standard);
  RecordingLog log;
  std::string unpacked;
  UniqueFd file{::memfd_create("gunzip", MFD_CLOEXEC)};
};

TEST_F(LoadedWebModuleTest, TheBuiltModuleGivesTheClientAndGunzip) {
  LoadedWebModule module(queues, {BRENVIK_TEST_MODULE});
  // Port 1 of this machine: nobody listens there, and no packet leaves.
  EXPECT_EQ(fetch(module, "https://127.0.0.1:1/")->errorKind, WebErrorKind::cannotConnect);
  EXPECT_EQ(unpackHello(module), GunzipResult::whole);
  EXPECT_EQ(unpacked, "hello");
  EXPECT_EQ(
      module.webClient().makeRequest(WebRequestType::get, "http://x/", {}, module.webClient().makeSession()),
      nullptr);
  EXPECT_TRUE(log.entries().empty());
}

TEST_F(LoadedWebModuleTest, WithoutTheModuleRequestsCompleteAsUnavailableAndThatIsLoggedOnce) {
  LoadedWebModule module(queues, {"/nonexistent/first.so", "/nonexistent/second.so"});
  EXPECT_TRUE(log.entries().empty()) << "not looked for before it is needed";
  EXPECT_EQ(fetch(module, "https://127.0.0.1:1/")->errorKind, WebErrorKind::clientUnavailable);
  EXPECT_EQ(fetch(module, "https://127.0.0.1:1/")->errorKind, WebErrorKind::clientUnavailable);
  EXPECT_EQ(unpackHello(module), GunzipResult::unavailable);
  ASSERT_EQ(log.entries().size(), 1U);
  EXPECT_EQ(log.entries()[0].level, static_cast<int>(LogLevel::error));
  EXPECT_NE(log.entries()[0].line.find("/nonexistent/first.so"), std::string::npos) << log.entries()[0].line;
}

using LoadedWebModuleDeathTest = LoadedWebModuleTest;

TEST_F(LoadedWebModuleDeathTest, AModuleThatCouldNotBeLoadedForWantOfDescriptorsIsLoadedTheNextTime) {
  testing::FLAGS_gtest_death_test_style = "threadsafe";  // a process of its own, which has not loaded it yet
  EXPECT_EXIT(unpackWithoutAndWithDescriptors(), testing::ExitedWithCode(7), "");
}

TEST_F(LoadedWebModuleTest, AModuleThatLackedMemoryWhenItWasStartedIsStartedTheNextTime) {
  if (!FailingAllocations::kWork) GTEST_SKIP() << "operator new belongs to the sanitizer";
  setLogSink(nullptr);  // it needs memory of its own
  int unavailable = 0;
  for (long first = 0;; ++first) {
    LoadedWebModule module(queues, {BRENVIK_TEST_MODULE});
    GunzipResult result = GunzipResult::whole;
    {
      const FailingAllocations noMemory(first);
      result = unpackHello(module);
    }
    EXPECT_EQ(unpackHello(module), GunzipResult::whole) << first;
    EXPECT_EQ(unpacked, "hello");
    if (result == GunzipResult::whole) break;
    EXPECT_TRUE(result == GunzipResult::unavailable || result == GunzipResult::outOfMemory) << first;
    if (result == GunzipResult::unavailable) ++unavailable;
  }
  EXPECT_GT(unavailable, 2);
}

TEST_F(LoadedWebModuleTest, AFileThatIsNoModuleIsPassedOver) {
  LoadedWebModule module(queues, {"/proc/self/exe", "/etc/passwd", BRENVIK_TEST_MODULE});
  EXPECT_EQ(fetch(module, "https://127.0.0.1:1/")->errorKind, WebErrorKind::cannotConnect);
}

TEST_F(LoadedWebModuleTest, AfterShuttingDownRequestsCompleteAsCancelled) {
  LoadedWebModule module(queues, {BRENVIK_TEST_MODULE});
  EXPECT_EQ(fetch(module, "https://127.0.0.1:1/")->errorKind, WebErrorKind::cannotConnect);
  module.shutDown();
  EXPECT_EQ(fetch(module, "https://127.0.0.1:1/")->errorKind, WebErrorKind::cancelled);
  LoadedWebModule unused(queues, {BRENVIK_TEST_MODULE});
  unused.shutDown();
  EXPECT_EQ(fetch(unused, "https://127.0.0.1:1/")->errorKind, WebErrorKind::cancelled);
}

TEST_F(LoadedWebModuleTest, TheModuleIsLookedForBesideTheProgramFirst) {
  const auto places = webModulePlaces();
  ASSERT_EQ(places.size(), 2U);
  EXPECT_TRUE(places[0].starts_with('/'));
  EXPECT_TRUE(places[0].ends_with("/unit/brenvik-web.so")) << places[0];
  EXPECT_TRUE(places[1].ends_with("/brenvik/brenvik-web.so")) << places[1];
}

}  // namespace
}  // namespace brenvik

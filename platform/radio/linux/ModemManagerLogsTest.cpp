// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/radio/linux/ModemManagerLogs.h"

#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <poll.h>
#include <spawn.h>
#include <sys/eventfd.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <systemd/sd-bus.h>
#include <unistd.h>

#include <chrono>
#include <csignal>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <mutex>
#include <new>
#include <thread>
#include <utility>

#include "platform/base/UniqueFd.h"
#include "platform/runloop/fakes/ManualRunLoop.h"

namespace brenvik {
namespace {

using namespace std::chrono_literals;
using testing::Each;
using testing::ElementsAre;
using testing::IsEmpty;

class TemporaryFolder {
 public:
  TemporaryFolder() {
    std::string name = (std::filesystem::temp_directory_path() / "radio-XXXXXX").string();
    path_ = ::mkdtemp(name.data());
  }
  TemporaryFolder(const TemporaryFolder&) = delete;
  TemporaryFolder& operator=(const TemporaryFolder&) = delete;
  ~TemporaryFolder() { std::filesystem::remove_all(path_); }
  std::filesystem::path operator/(const char* name) const { return path_ / name; }

 private:
  std::filesystem::path path_;
};

// A message bus of the test's own, with one service that the bus could start: ModemManager, whose program
// leaves a marker.
class PrivateBus {
 public:
  explicit PrivateBus(const TemporaryFolder& folder) : marker_(folder / "started") {
    std::filesystem::create_directory(folder / "services");
    std::ofstream(folder / "services" / "mm.service")
        << "[D-BUS Service]\nName=org.freedesktop.ModemManager1\n"
        << "Exec=/usr/bin/touch " << marker_.string() << "\n";
    const auto configuration = folder / "bus.conf";
    std::ofstream(configuration)
        << "<busconfig><listen>unix:path=" << (folder / "bus").string() << "</listen>"
        << "<auth>EXTERNAL</auth><servicedir>" << (folder / "services").string()
        << "</servicedir><policy context='default'><allow send_destination='*' eavesdrop='true'/>"
        << "<allow eavesdrop='true'/>"
        << "<allow own='*'/></policy></busconfig>";
    int ready[2];
    if (::pipe2(ready, 0) != 0) std::abort();
    UniqueFd reading(ready[0]);
    UniqueFd writing(ready[1]);
    ::fcntl(reading.get(), F_SETFD, FD_CLOEXEC);
    std::string program = "dbus-daemon";
    std::string configurationFlag = "--config-file=" + configuration.string();
    std::string readyFlag = "--print-address=" + std::to_string(writing.get());
    std::string foreground = "--nofork";
    char* arguments[] = {program.data(), foreground.data(), configurationFlag.data(), readyFlag.data(),
                         nullptr};
    if (::posix_spawnp(&process_, program.c_str(), nullptr, nullptr, arguments, environ) != 0) process_ = -1;
    writing.reset();
    char text[256];
    isUp_ = ::read(reading.get(), text, sizeof text) > 0;
    address_ = "unix:path=" + (folder / "bus").string();
  }
  PrivateBus(const PrivateBus&) = delete;
  PrivateBus& operator=(const PrivateBus&) = delete;
  ~PrivateBus() {
    if (process_ <= 0) return;
    ::kill(process_, SIGTERM);
    ::waitpid(process_, nullptr, 0);
  }
  bool isUp() const { return isUp_; }
  const std::string& address() const { return address_; }
  bool startedTheService() const { return std::filesystem::exists(marker_); }

 private:
  std::filesystem::path marker_;
  pid_t process_ = -1;
  bool isUp_ = false;
  std::string address_;
};

enum class Manners { answers, refuses, isSilent };

// ModemManager on a bus of the test's, on a thread of its own.
class StandinModemManager {
 public:
  StandinModemManager(const std::string& address, Manners manners) : manners_(manners) {
    sd_bus_new(&bus_);
    sd_bus_set_address(bus_, address.c_str());
    sd_bus_set_bus_client(bus_, 1);
    isUp_ = sd_bus_start(bus_) >= 0 &&
            sd_bus_add_object(bus_, nullptr, "/org/freedesktop/ModemManager1", &onCall, this) >= 0 &&
            sd_bus_request_name(bus_, "org.freedesktop.ModemManager1", 0) > 0;
    thread_ = std::thread([this] { serve(); });
  }
  StandinModemManager(const StandinModemManager&) = delete;
  StandinModemManager& operator=(const StandinModemManager&) = delete;
  ~StandinModemManager() {
    ::eventfd_write(stop_.get(), 1);
    thread_.join();
    sd_bus_flush_close_unref(bus_);
  }
  bool isUp() const { return isUp_; }
  std::vector<std::string> calls() const {
    const std::lock_guard lock(mutex_);
    return calls_;
  }

 private:
  static int onCall(sd_bus_message* call, void* self, sd_bus_error* error) {
    return static_cast<StandinModemManager*>(self)->take(call, error);
  }
  int take(sd_bus_message* call, sd_bus_error* error) {
    const char* level = "?";
    if (!sd_bus_message_is_method_call(call, "org.freedesktop.ModemManager1", "SetLogging") ||
        !sd_bus_message_has_signature(call, "s") || sd_bus_message_read(call, "s", &level) < 0) {
      level = "not SetLogging(s)";
    }
    {
      const std::lock_guard lock(mutex_);
      calls_.emplace_back(level);
    }
    if (manners_ == Manners::isSilent) return 1;
    if (manners_ == Manners::refuses) {
      return sd_bus_error_set(error, "org.freedesktop.ModemManager1.Error.Core.InvalidArgs", "no");
    }
    return sd_bus_reply_method_return(call, "");
  }
  void serve() {
    for (;;) {
      while (sd_bus_process(bus_, nullptr) > 0) {
      }
      pollfd ready[2] = {{stop_.get(), POLLIN, 0}, {sd_bus_get_fd(bus_), POLLIN, 0}};
      ready[1].events = static_cast<short>(sd_bus_get_events(bus_));
      if (::poll(ready, 2, -1) < 0 || ready[0].revents != 0) return;
    }
  }

  const Manners manners_;
  sd_bus* bus_ = nullptr;
  bool isUp_ = false;
  UniqueFd stop_{::eventfd(0, EFD_CLOEXEC)};
  std::thread thread_;
  mutable std::mutex mutex_;
  std::vector<std::string> calls_;
};

class ModemManagerLogsTest : public testing::Test {
 protected:
  // Runs what was posted and returns how long that took.
  std::chrono::steady_clock::duration runQueue() {
    const auto start = std::chrono::steady_clock::now();
    for (const auto& queue : queues.serial) queue->runReady();
    return std::chrono::steady_clock::now() - start;
  }
  ManualClock clock;
  ManualWorkQueues queues{clock};
  TemporaryFolder folder;
};

// Where the bus or the manager answers; never used up, however busy the machine is.
constexpr auto kPlenty = 60s;
// Where they keep silent; always used up.
constexpr auto kShort = 200ms;
// Far less than kPlenty, and than the library's own 25 seconds for an answer and 90 for a bus.
constexpr auto kAtMost = 20s;

TEST_F(ModemManagerLogsTest, PatienceIsOneSecond) { EXPECT_EQ(ModemManagerLogs::kPatience, 1s); }

TEST_F(ModemManagerLogsTest, OnAsksForDebugAndOffPutsInfoBack) {
  PrivateBus bus(folder);
  ASSERT_TRUE(bus.isUp()) << "is dbus-daemon installed?";
  StandinModemManager manager(bus.address(), Manners::answers);
  ASSERT_TRUE(manager.isUp());
  ModemManagerLogs logs(queues, bus.address(), kPlenty);
  logs.setLogToFile(true);
  runQueue();
  EXPECT_THAT(manager.calls(), ElementsAre("DEBUG"));
  logs.setLogToFile(false);
  runQueue();
  EXPECT_THAT(manager.calls(), ElementsAre("DEBUG", "INFO"));
}

TEST_F(ModemManagerLogsTest, NothingIsDoneOnTheCallersThread) {
  PrivateBus bus(folder);
  ASSERT_TRUE(bus.isUp());
  StandinModemManager manager(bus.address(), Manners::answers);
  ModemManagerLogs logs(queues, bus.address(), kPlenty);
  EXPECT_THAT(queues.serial, IsEmpty()) << "a queue is made with the first switch";
  logs.setLogToFile(true);
  ASSERT_EQ(queues.serial.size(), 1U);
  EXPECT_EQ(queues.serial[0]->label(), "RadioManagerLogs");
  EXPECT_EQ(queues.serial[0]->qualityOfService(), QualityOfService::utility);
  EXPECT_EQ(queues.serial[0]->pending(), 1U);
  EXPECT_THAT(manager.calls(), IsEmpty());
}

TEST_F(ModemManagerLogsTest, SwitchingWhileTheQueueIsBusyKeepsTheLastPositionOnly) {
  PrivateBus bus(folder);
  ASSERT_TRUE(bus.isUp());
  StandinModemManager manager(bus.address(), Manners::answers);
  ModemManagerLogs logs(queues, bus.address(), kPlenty);
  for (int i = 0; i < 1000; ++i) logs.setLogToFile(i % 2 == 0);
  EXPECT_EQ(queues.serial.at(0)->pending(), 1U);
  runQueue();
  EXPECT_THAT(manager.calls(), ElementsAre("INFO"));
}

TEST_F(ModemManagerLogsTest, ASwitchThatCouldNotBeQueuedKeepsNoLaterOneBack) {
  class QueuesWithoutMemoryAtFirst final : public WorkQueues {
   public:
    explicit QueuesWithoutMemoryAtFirst(ManualWorkQueues& others) : others_(others) {}
    WorkQueue& main() noexcept override { return others_.main(); }
    WorkQueue& global() override { return others_.global(); }
    std::shared_ptr<WorkQueue> makeSerial(std::string label, QualityOfService qualityOfService) override {
      if (std::exchange(isFirst_, false)) throw std::bad_alloc();
      return others_.makeSerial(std::move(label), qualityOfService);
    }
    std::unique_ptr<ProcessExitSource> makeProcessExitSource(pid_t, std::uint32_t, WorkQueue::Task,
                                                             WorkQueue::Task) override {
      return nullptr;
    }

   private:
    ManualWorkQueues& others_;
    bool isFirst_ = true;
  } scarce(queues);
  ModemManagerLogs logs(scarce, "unix:path=" + (folder / "nobody").string(), kPlenty);
  logs.setLogToFile(true);
  EXPECT_THAT(queues.serial, IsEmpty());
  logs.setLogToFile(true);
  ASSERT_EQ(queues.serial.size(), 1U);
  EXPECT_EQ(queues.serial[0]->pending(), 1U);
}

TEST_F(ModemManagerLogsTest, ARefusalIsTakenAndTheNextSwitchAsksAgain) {
  PrivateBus bus(folder);
  ASSERT_TRUE(bus.isUp());
  StandinModemManager manager(bus.address(), Manners::refuses);
  ModemManagerLogs logs(queues, bus.address(), kPlenty);
  logs.setLogToFile(true);
  runQueue();
  logs.setLogToFile(true);
  runQueue();
  EXPECT_THAT(manager.calls(), ElementsAre("DEBUG", "DEBUG"));
}

TEST_F(ModemManagerLogsTest, ASilentManagerIsGivenUpWhenThePatienceIsOver) {
  PrivateBus bus(folder);
  ASSERT_TRUE(bus.isUp());
  StandinModemManager manager(bus.address(), Manners::isSilent);
  // On a busy machine a short patience may be over before the manager is asked; then a longer one is needed.
  for (std::chrono::milliseconds patience = kShort; manager.calls().empty(); patience *= 4) {
    ASSERT_LT(patience, kAtMost) << "it was never asked";
    ModemManagerLogs logs(queues, bus.address(), patience);
    logs.setLogToFile(true);
    const auto took = runQueue();
    EXPECT_GE(took, patience);
    EXPECT_LT(took, patience + kAtMost);
  }
  EXPECT_THAT(manager.calls(), Each("DEBUG"));
}

TEST_F(ModemManagerLogsTest, AManagerThatDoesNotRunIsNotStartedAndNotWaitedFor) {
  PrivateBus bus(folder);
  ASSERT_TRUE(bus.isUp());
  ModemManagerLogs logs(queues, bus.address(), kPlenty);
  logs.setLogToFile(true);
  EXPECT_LT(runQueue(), kAtMost) << "the bus says at once that there is none";
  EXPECT_FALSE(bus.startedTheService());
}

TEST_F(ModemManagerLogsTest, WithoutABusNothingHappensAtOnce) {
  ModemManagerLogs logs(queues, "unix:path=" + (folder / "no-bus").string(), kPlenty);
  logs.setLogToFile(true);
  EXPECT_LT(runQueue(), kAtMost);
}

TEST_F(ModemManagerLogsTest, ABusThatAcceptsAndSaysNothingIsGivenUpWhenThePatienceIsOver) {
  const std::string path = (folder / "mute").string();
  UniqueFd listening(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  ASSERT_LT(path.size(), sizeof address.sun_path);
  path.copy(address.sun_path, path.size());
  ASSERT_EQ(::bind(listening.get(), reinterpret_cast<sockaddr*>(&address), sizeof address), 0);
  ASSERT_EQ(::listen(listening.get(), 1), 0);
  ModemManagerLogs logs(queues, "unix:path=" + path, kShort);
  logs.setLogToFile(true);
  const auto took = runQueue();
  EXPECT_GE(took, kShort);
  EXPECT_LT(took, kAtMost);
}

// Where the loader has found a library, of which this process says so itself (proc(5)).
std::string placeOf(const std::string& library) {
  std::ifstream maps("/proc/self/maps");
  for (std::string line; std::getline(maps, line);) {
    if (line.find(library) != std::string::npos) return line.substr(line.find('/'));
  }
  return "";
}

TEST_F(ModemManagerLogsTest, WithoutTheLibraryOrWithAnotherOneNothingHappens) {
  PrivateBus bus(folder);
  ASSERT_TRUE(bus.isUp());
  StandinModemManager manager(bus.address(), Manners::answers);
  for (const std::string& library : {(folder / "missing.so").string(), placeOf("libc.so.6")}) {
    ModemManagerLogs logs(queues, bus.address(), kPlenty, library.c_str());
    logs.setLogToFile(true);
    EXPECT_LT(runQueue(), kAtMost);
  }
  EXPECT_THAT(manager.calls(), IsEmpty());
}

TEST_F(ModemManagerLogsTest, ALibraryThatCouldNotBeLoadedIsLookedForAgain) {
  PrivateBus bus(folder);
  ASSERT_TRUE(bus.isUp());
  StandinModemManager manager(bus.address(), Manners::answers);
  const std::string library = (folder / "late.so").string();
  ModemManagerLogs logs(queues, bus.address(), kPlenty, library.c_str());
  logs.setLogToFile(true);
  runQueue();
  std::filesystem::create_symlink(placeOf("libsystemd.so.0"), library);
  logs.setLogToFile(true);
  runQueue();
  EXPECT_THAT(manager.calls(), ElementsAre("DEBUG"));
}

TEST_F(ModemManagerLogsTest, AnAddressThatIsNoneIsNoBus) {
  ModemManagerLogs logs(queues, "", kPlenty);
  logs.setLogToFile(true);
  EXPECT_LT(runQueue(), kAtMost);
}

TEST_F(ModemManagerLogsTest, ASwitchThatWasPostedSurvivesTheObject) {
  PrivateBus bus(folder);
  ASSERT_TRUE(bus.isUp());
  StandinModemManager manager(bus.address(), Manners::answers);
  {
    ModemManagerLogs logs(queues, bus.address(), kPlenty);
    logs.setLogToFile(true);
  }
  runQueue();
  EXPECT_THAT(manager.calls(), ElementsAre("DEBUG"));
}

}  // namespace
}  // namespace brenvik

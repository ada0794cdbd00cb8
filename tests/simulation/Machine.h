// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <deque>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "Disk.h"
#include "Rules.h"
#include "Services.h"
#include "Workers.h"
#include "World.h"
#include "platform/accounts/fakes/FakeAccountDirectory.h"
#include "platform/baseband/fakes/FakeBaseband.h"
#include "platform/geo/fakes/ManualGeoService.h"
#include "platform/ipc/AuditToken.h"
#include "platform/ipc/fakes/HeapRegions.h"
#include "platform/log/Log.h"
#include "platform/messageport/fakes/RecordingMessagePorts.h"
#include "platform/servicemanager/fakes/RecordingServiceManager.h"
#include "platform/telephony/fakes/RecordingTelephonyDaemon.h"
#include "platform/voicemail/VisualVoicemail.h"

namespace brenvik::simulation {

// A program on the machine that may be a client.
struct Process {
  AuditToken token;
  std::string program;
  enum class Holds { nothing, yes, no, text, number, unreadable };
  Holds holds = Holds::nothing;
  bool isAlive = true;
  std::vector<int> connections;

  std::pair<pid_t, std::uint32_t> key() const { return {token.pid(), token.pidVersion()}; }
};

// A port of a client, and what its check-in has brought.
struct Connection {
  std::size_t process = 0;
  PortName watched = kNullPort;  // the helper's name of the client's port
  PortName port = kNullPort;     // the port that the client has got
  bool isOpen = true;
};

// What is wrong with a check-in.
enum class CheckInForm {
  right,
  notComplex,
  twoDescriptors,
  shorter,
  copySend,
  wrongType,
  trailerType,
  shortTrailer
};

// What goes wrong while a check-in is served.
struct CheckInWhims {
  bool diesAtOnce = false;  // the caller's port
  // The allocation that fails, counted from 0; none if it is negative.
  long failsAt = -1;
  WorkerEnd callerWorker = WorkerEnd::none;
};

// How the helper's process comes to its end before its time.
enum class Disaster { none, killed, powerCut };

// One machine with its helper, and everything around it. A history drives it.
class Machine final : public LogSink {
 public:
  // `trace` gets a line for all that happens.
  Machine(std::uint64_t seed, std::function<void(const std::string&)> trace);
  Machine(const Machine&) = delete;
  Machine& operator=(const Machine&) = delete;
  ~Machine() override;

  // Lets everything happen that was scheduled, until `end`, and then until the helper has left. Throws
  // Finding.
  void runUntil(Time end);

  // ---- what a step may do ----
  std::size_t spawn(uid_t uid, Process::Holds holds);
  void exec(std::size_t process, Process::Holds holds);
  void exits(std::size_t process);
  void checkIn(std::size_t process, CheckInForm form, const CheckInWhims& whims);
  void close(int connection);
  void call(int connection, const Call& call);
  void serviceMessage(std::size_t process, std::int32_t id);
  // What it was to answer is never answered. The next question finds another worker.
  void networkWorkerDies();
  // The next change of the disk, counted from now, is the last thing that the helper does.
  void bringAbout(Disaster disaster, long atChange);

  // After `around` was changed.
  void surroundingsChange();
  bool hasHelper() const noexcept { return life_ != nullptr; }

  World world;
  Surroundings around;
  Rules rules;
  SimulatedWeb web{world};
  SimulatedEcho echo{world};
  std::vector<Process> processes;
  std::map<int, Connection> connections;
  // How the geo service answers, and after how long; nothing: never.
  struct GeoAnswer {
    std::optional<Time> delay;
    std::optional<MapItems> items;
    std::optional<std::string> address;
    std::optional<std::string> error;
  };
  std::function<GeoAnswer()> geoAnswer;
  void trace(const std::string& text);

  // What has happened so far.
  struct Counts {
    std::uint64_t lives = 0;
    std::uint64_t calls = 0;
    std::uint64_t checkIns = 0;
    std::uint64_t deaths = 0;
  };
  Counts counts;

  void unified(LogLevel level, std::string_view line, const LogPlace& place,
               const MessageId& id) noexcept override;
  void bsd(SyslogPriority priority, std::string_view line, const MessageId& id) noexcept override;

 private:
  class Life;
  class Platform;
  struct ServiceMessage {
    std::size_t process;
    int connection;
    CheckInForm form;
    std::int32_t id;
    CheckInWhims whims;
  };

  void live();
  void serve(const ServiceMessage& message);
  void serve(int connection, const Call& call);
  Answer dispatch(PortName port, std::vector<std::byte>& bytes, std::uint32_t size,
                  const MessageTrailer& trailer, long failsAt, Outcome* outcome);
  // Whether the process would end in it.
  bool wouldEndIn(const std::function<void()>& work);
  void check(const Call& call, const Expected& expected, const Answer& answer);
  void observe();
  void observeQuestions(Life& life);
  void observeNotifications();
  void answerCivic(std::size_t index, const GeoAnswer& answer);
  void answerAddress(std::size_t index, const GeoAnswer& answer);
  std::optional<SecurityTask::Answer> heldBy(const AuditToken& token) const;
  void log(bool isBsd, int level, std::string_view line);
  void strike();
  void lookForLeaks(Life& life);

  const std::function<void(const std::string&)> trace_;
  LogSink* const sinkBefore_;
  FakeAccountDirectory accounts_;
  SimulatedSecurity security_;
  FakeBasebandLibrary baseband_;
  SimulatedRadio radio_;
  SimulatedLabeler labeler_;
  SimulatedContacts contacts_;
  SimulatedGunzip gunzip_;
  RecordingMessagePorts messagePorts_;
  SimulatedVoicemailStore voicemail_;
  RecordingTelephonyDaemon telephony_;
  RecordingServiceManager serviceManager_;
  SimulatedArchives archives_;

  std::unique_ptr<Life> life_;
  std::deque<ServiceMessage> waiting_;  // at the service's socket
  int lastConnection_ = 0;
  pid_t lastPid_ = 100;
  std::size_t pushesSeen_ = 0;
  std::size_t notificationsSeen_ = 0;
  Disaster disaster_ = Disaster::none;
  std::optional<Tree> remains_;  // of the disk, after a death
  int pendingCalls_ = 0;
  bool isTrial_ = false;  // of what another process would go through
};

}  // namespace brenvik::simulation

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/log/Log.h"

#include <gtest/gtest.h>

#include <cerrno>
#include <functional>
#include <map>
#include <memory>
#include <string>
#include <thread>
#include <vector>

#include "platform/log/LogContext.h"
#include "platform/log/fakes/RecordingLog.h"

namespace brenvik {
namespace {

TEST(LogTest, LinesKeepTheirChannelLevelAndText) {
  RecordingLog log;
  logUnified(LogLevel::info, "Loading %s as plist", "/a");
  logBsd(SyslogPriority::error, "VM_ALLOCATE %ul (mhs1)\n", 12U);
  EXPECT_EQ(log.entries(),
            (std::vector{RecordingLog::unifiedLine(LogLevel::info, "Loading /a as plist"),
                         RecordingLog::bsdLine(SyslogPriority::error, "VM_ALLOCATE 12l (mhs1)\n")}));
}

TEST(LogTest, LoggingLeavesErrnoAsItWas) {
  RecordingLog log;
  errno = ENOSPC;
  logUnified(LogLevel::error, "%s", "text");
  EXPECT_EQ(errno, ENOSPC);
}

TEST(LogTest, ALineThatIsTooLongIsCutAndNotLost) {
  RecordingLog log;
  logUnified(LogLevel::error, "%s", std::string(10000, 'x').c_str());
  ASSERT_EQ(log.entries().size(), 1U);
  EXPECT_EQ(log.entries()[0].line, std::string(4095, 'x'));
}

TEST(LogTest, AMessageIdIsMadeOfTheTextAsItStandsInTheSource) {
  // The published value of FNV-1a for "foobar".
  EXPECT_EQ(messageIdOf("foobar", "line"), (MessageId{0x343E1662793C64BF, 0x6F0D3597BA446F18}));
  EXPECT_EQ(messageIdOf("foobar\n", "line"), messageIdOf("foobar", "another line"));
  EXPECT_EQ(messageIdOf("%s", "foobar"), messageIdOf("foobar", ""));
  EXPECT_NE(messageIdOf("%s: %s", "foobar"), messageIdOf("foobar", ""));
}

// Keeps the name of the function that the last line came from.
class LastFunction final : public LogSink {
 public:
  LastFunction() : previous_(setLogSink(this)) {}
  ~LastFunction() override { setLogSink(previous_); }
  void unified(LogLevel, std::string_view, const LogPlace& place, const MessageId&) noexcept override {
    name = place.function;
  }
  void bsd(SyslogPriority, std::string_view, const MessageId&) noexcept override {}
  std::string name;

 private:
  LogSink* const previous_;
};

template <typename Value>
struct Template {
  template <typename Other>
  std::map<Value, Other> logsItself(const std::map<Value, Other>& values) const noexcept {
    logUnified(LogLevel::info, "text");
    return values;
  }
  void operator()(int) const { logUnified(LogLevel::info, "text"); }
};

std::unique_ptr<int> logsFromALambda(const std::function<void(int)>& also) {
  const auto outer = [&also](const std::vector<int>& values) {
    [&] { logUnified(LogLevel::info, "text"); }();
    also(static_cast<int>(values.size()));
  };
  outer({});
  return nullptr;
}

TEST(LogTest, TheFunctionIsTheNameOfOneAlsoWithinALambda) {
  LastFunction last;
  (void)logsFromALambda([](int) {});
  EXPECT_EQ(last.name, "logsFromALambda");
  (void)Template<int>().logsItself<std::string>({});
  EXPECT_EQ(last.name, "logsItself");
  Template<int>()(1);
  EXPECT_EQ(last.name, "operator()");
}

TEST(LogTest, AFunctionsNameIsFoundInTheSignaturesOfBothCompilers) {
  for (const auto& [signature, name] : std::vector<std::pair<const char*, const char*>>{
           {"int main()", "main"},
           {"brenvik::{anonymous}::Some<T>::Some(int) [with T = int]", "Some"},
           {"brenvik::Some::~Some()", "~Some"},
           {"const char* brenvik::f(std::function<void(int)>)::<lambda(auto:1)> [with auto:1 = int]", "f"},
           {"auto brenvik::(anonymous namespace)::f(int)::(anonymous class)::operator()(int) const", "f"},
           {"std::pair<int, void (*)(int)> brenvik::g(int)", "g"},
           {"void brenvik::S::operator()(int) const", "operator()"},
           {"f", "f"},
           {"", ""}}) {
    EXPECT_EQ(functionNameIn(signature), name) << signature;
  }
}

TEST(LogContextTest, LinesOfARequestCarryItsCallerAndRoutineAndOthersNothing) {
  RecordingLog log;
  LogCallers::shared().add(
      7, std::make_shared<LogCaller>(LogCaller{123, 501, "/usr/bin/program", "program.service"}));
  logUnified(LogLevel::info, "before");
  {
    const LogScope scope("Routine", 7);
    logUnified(LogLevel::info, "within");
    {
      const LogScope inner("Another", 8);
      logBsd(SyslogPriority::error, "of a port nobody knows");
    }
    logBsd(SyslogPriority::error, "within again");
  }
  LogCallers::shared().remove(7);
  {
    const LogScope scope("Routine", 7);
    logUnified(LogLevel::info, "of a client that has gone");
  }
  logUnified(LogLevel::info, "after");
  using Fields = std::map<std::string, std::string>;
  const Fields whole{{"BRENVIK_CALLER_PID", "123"},
                     {"BRENVIK_CALLER_UID", "501"},
                     {"BRENVIK_CALLER_EXE", "/usr/bin/program"},
                     {"BRENVIK_CALLER_UNIT", "program.service"},
                     {"BRENVIK_ROUTINE", "Routine"}};
  EXPECT_EQ(log.fields(),
            (std::vector<Fields>{
                {}, whole, {{"BRENVIK_ROUTINE", "Another"}}, whole, {{"BRENVIK_ROUTINE", "Routine"}}, {}}));
}

TEST(LogContextTest, ATaskCarriesTheFieldsToAnotherThreadAndBeyondTheClient) {
  RecordingLog log;
  std::function<void()> task;
  LogCallers::shared().add(7, std::make_shared<LogCaller>(LogCaller{1, 0, "", ""}));
  {
    const LogScope scope("Routine", 7);
    task = inCurrentLogContext([&] {
      logUnified(LogLevel::info, "there");
      inCurrentLogContext([] { logUnified(LogLevel::info, "and further"); })();
    });
  }
  LogCallers::shared().remove(7);
  std::thread(task).join();
  const std::map<std::string, std::string> fields{
      {"BRENVIK_CALLER_PID", "1"}, {"BRENVIK_CALLER_UID", "0"}, {"BRENVIK_ROUTINE", "Routine"}};
  EXPECT_EQ(log.fields(), (std::vector{fields, fields})) << "what is not known is no field";
}

TEST(LogContextTest, OutsideOfARequestATaskStaysAsItIs) {
  RecordingLog log;
  inCurrentLogContext([] { logUnified(LogLevel::info, "text"); })();
  EXPECT_EQ(log.fields(), (std::vector<std::map<std::string, std::string>>{{}}));
}

TEST(LogTest, WithoutASinkNothingHappens) {
  LogSink* const before = setLogSink(nullptr);
  logUnified(LogLevel::error, "%d", 1);
  logBsd(SyslogPriority::notice, "%d", 1);
  setLogSink(before);
}

}  // namespace
}  // namespace brenvik

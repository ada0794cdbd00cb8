// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/radio/linux/ModemManagerLogs.h"

#include <atomic>
#include <chrono>
#include <exception>
#include <utility>

#include "platform/radio/linux/SdBus.h"

namespace brenvik {
namespace {

using Clock = std::chrono::steady_clock;

// Owners of what sd-bus makes. A bus is closed without the flush that sd-bus offers: that could wait for a
// bus that does not read.
struct Unref {
  const SdBus& functions;
  void operator()(sd_bus* bus) const noexcept { functions.closeUnref(bus); }
  void operator()(sd_bus_message* message) const noexcept { functions.unrefMessage(message); }
  void operator()(sd_bus_slot* slot) const noexcept { functions.unrefSlot(slot); }
};
template <typename Object>
using Owned = std::unique_ptr<Object, Unref>;

std::uint64_t microsecondsUntil(Clock::time_point deadline) noexcept {
  const auto left = std::chrono::duration_cast<std::chrono::microseconds>(deadline - Clock::now());
  return left.count() > 0 ? static_cast<std::uint64_t>(left.count()) : 0;
}

int takeAnswer(sd_bus_message*, void* answered, sd_bus_error*) {
  *static_cast<bool*>(answered) = true;
  return 1;
}

// A bus that is absent, refuses or keeps silent changes nothing for anybody, so every failure just ends it.
void setLogging(SdBus& sd, const char* busAddress, const char* level,
                std::chrono::milliseconds patience) noexcept {
  const auto deadline = Clock::now() + patience;
  if (!sd.load()) return;
  sd_bus* opened = nullptr;
  if (sd.create(&opened) < 0) return;
  const Owned<sd_bus> bus(opened, {sd});
  if (sd.setAddress(opened, busAddress) < 0 || sd.setBusClient(opened, 1) < 0) return;
  if (sd.start(opened) < 0) return;

  sd_bus_message* made = nullptr;
  if (sd.newMethodCall(opened, &made, "org.freedesktop.ModemManager1", "/org/freedesktop/ModemManager1",
                       "org.freedesktop.ModemManager1", "SetLogging") < 0) {
    return;
  }
  const Owned<sd_bus_message> call(made, {sd});
  if (sd.append(made, "s", level) < 0 || sd.setAutoStart(made, 0) < 0) return;

  bool answered = false;
  sd_bus_slot* asked = nullptr;
  if (sd.callAsync(opened, &asked, made, takeAnswer, &answered, microsecondsUntil(deadline)) < 0) return;
  const Owned<sd_bus_slot> slot(asked, {sd});
  // The answer is waited for although it changes nothing: a sender that hangs up at once may not be heard.
  while (!answered) {
    const int handled = sd.process(opened, nullptr);
    if (handled < 0) return;
    if (handled > 0) continue;
    const std::uint64_t left = microsecondsUntil(deadline);
    if (left == 0 || sd.wait(opened, left) < 0) return;
  }
}

}  // namespace

struct ModemManagerLogs::Switch {
  enum Position : int { unchanged, off, on };
  const std::string busAddress;
  const std::chrono::milliseconds patience;
  SdBus bus;  // of the queue alone
  std::atomic<Position> wanted{unchanged};
};

ModemManagerLogs::ModemManagerLogs(WorkQueues& queues, std::string busAddress,
                                   std::chrono::milliseconds patience, const char* library)
    : queues_(queues), switch_(new Switch{std::move(busAddress), patience, SdBus(library)}) {}

ModemManagerLogs::~ModemManagerLogs() = default;

void ModemManagerLogs::setLogToFile(bool enable) noexcept {
  // Not one task a call: a client that switches all day must not leave a second of waiting behind each time.
  if (switch_->wanted.exchange(enable ? Switch::on : Switch::off) != Switch::unchanged) return;
  try {
    if (queue_ == nullptr) queue_ = queues_.makeSerial("RadioManagerLogs", QualityOfService::utility);
    queue_->post([state = switch_] {
      const auto wanted = state->wanted.exchange(Switch::unchanged);
      if (wanted == Switch::unchanged) return;
      setLogging(state->bus, state->busAddress.c_str(), wanted == Switch::on ? "DEBUG" : "INFO",
                 state->patience);
    });
  } catch (const std::exception&) {
    switch_->wanted = Switch::unchanged;  // no memory or no thread: the next switch tries again
  }
}

}  // namespace brenvik

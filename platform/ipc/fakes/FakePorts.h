// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <deque>
#include <functional>
#include <map>
#include <memory>
#include <new>
#include <string>
#include <utility>
#include <vector>

#include "platform/ipc/Ports.h"

namespace brenvik {

// Ports without descriptors: names, references and refusals as a test asks for them. A right dropped once too
// often is an error here as it is in the real space, and lack of memory is a shortage.
class FakePortSpace final : public PortSpace {
 public:
  KernelReturn allocateReceiveRight(PortName* name) noexcept override try {
    if (refuseAllocate != kern::success) return refuseAllocate;
    receiveRights[next_] = 1;
    *name = next_++;
    return kern::success;
  } catch (const std::bad_alloc&) {
    return kern::resourceShortage;
  }
  KernelReturn insertSendRight(PortName name) noexcept override try {
    if (refuseInsert != kern::success) return refuseInsert;
    if (receiveRights.count(name) == 0) return kern::invalidName;
    ++sendRights[name];
    return kern::success;
  } catch (const std::bad_alloc&) {
    return kern::resourceShortage;
  }
  KernelReturn dropReceiveRight(PortName name) noexcept override {
    if (whenReceiveRightIsDropped) whenReceiveRightIsDropped(name);
    return drop(receiveRights, name);
  }
  KernelReturn deallocateSendRight(PortName name) noexcept override { return drop(sendRights, name); }

  // A right that arrived in a message.
  PortName adoptSendRight() {
    const PortName name = next_++;
    sendRights[name] = 1;
    return name;
  }

  std::map<PortName, int> receiveRights;
  std::map<PortName, int> sendRights;
  std::function<void(PortName)> whenReceiveRightIsDropped;  // before it is
  int failedDrops = 0;
  KernelReturn refuseAllocate = kern::success;
  KernelReturn refuseInsert = kern::success;

 private:
  KernelReturn drop(std::map<PortName, int>& rights, PortName name) {
    const auto right = rights.find(name);
    if (right == rights.end()) {
      ++failedDrops;
      return kern::invalidName;
    }
    if (--right->second == 0) rights.erase(right);
    return kern::success;
  }
  PortName next_ = 0x103;
};

class FakeBootstrap final : public Bootstrap {
 public:
  explicit FakeBootstrap(FakePortSpace& ports) : ports_(ports) {}
  KernelReturn checkIn(const char* serviceName, PortName* receiveRight) noexcept override {
    name = serviceName;
    if (refuseWith != kern::success) return refuseWith;
    return ports_.allocateReceiveRight(receiveRight);
  }
  std::string name;
  KernelReturn refuseWith = kern::success;

 private:
  FakePortSpace& ports_;
};

class FakeRoutineSource final : public RoutineSource {
 public:
  FakeRoutineSource(PortName servedPort, const RoutineTable& servedTable, WantTrailer trailer)
      : port(servedPort), table(servedTable), wantTrailer(trailer) {}
  bool addTo(RunLoop&) noexcept override { return added = !refuseToBeAdded; }
  void invalidate() noexcept override {
    if (std::exchange(valid, false) && whenInvalidated) whenInvalidated();
  }

  std::function<void()> whenInvalidated;
  const PortName port;
  const RoutineTable& table;
  const WantTrailer wantTrailer;
  bool added = false;
  bool valid = true;
  bool refuseToBeAdded = false;
};

class FakeDeathWatch final : public DeathWatch {
 public:
  explicit FakeDeathWatch(PortName port) : port_(port) {}
  PortName port() const noexcept override { return port_; }
  bool isValid() const noexcept override { return valid_ && !died; }
  void setInvalidationCallback(std::function<void(DeathWatch&)> callback) noexcept override {
    callback_ = std::move(callback);
  }
  void invalidate() noexcept override {
    if (std::exchange(valid_, false) && whenInvalidated) whenInvalidated();
  }
  bool hasCallback() const noexcept { return callback_ != nullptr; }

  std::function<void()> whenInvalidated;

  // The run loop notices that the port has died.
  void tellDeath() {
    died = true;
    if (!valid_) return;
    valid_ = false;
    if (auto callback = std::exchange(callback_, {})) callback(*this);
  }
  bool died = false;

 private:
  const PortName port_;
  bool valid_ = true;
  std::function<void(DeathWatch&)> callback_;
};

// A table that knows no routine.
class NoRoutines final : public RoutineTable {
 public:
  Handler find(std::int32_t) const noexcept override { return nullptr; }
  void* context() const noexcept override { return nullptr; }
};

class FakePortSources final : public PortSources {
 public:
  std::shared_ptr<RoutineSource> makeRoutineSource(PortName port, const RoutineTable& table,
                                                   WantTrailer trailer) noexcept override try {
    if (refuseRoutineSources) return nullptr;
    auto source = std::make_shared<FakeRoutineSource>(port, table, trailer);
    source->refuseToBeAdded = refuseToBeAdded;
    routineSources.push_back(source);
    return source;
  } catch (const std::bad_alloc&) {
    return nullptr;
  }
  std::shared_ptr<DeathWatch> makeDeathWatch(PortName port, RunLoop&) noexcept override try {
    if (refuseDeathWatches) return nullptr;
    auto watch = std::make_shared<FakeDeathWatch>(port);
    watch->died = portsAreDead;
    deathWatches.push_back(watch);
    return watch;
  } catch (const std::bad_alloc&) {
    return nullptr;
  }

  std::vector<std::shared_ptr<FakeRoutineSource>> routineSources;
  std::vector<std::shared_ptr<FakeDeathWatch>> deathWatches;
  bool refuseRoutineSources = false;
  bool refuseToBeAdded = false;
  bool refuseDeathWatches = false;
  bool portsAreDead = false;
};

}  // namespace brenvik

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "client/TurnedAway.h"

#include <poll.h>
#include <pthread.h>
#include <sys/eventfd.h>
#include <sys/socket.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <atomic>
#include <cerrno>
#include <csignal>
#include <cstdint>
#include <new>
#include <utility>

#include "platform/datagram/LocalSocket.h"

namespace brenvik::client {
namespace {

constexpr std::size_t kStackBytes = 256 * 1024;

// One descriptor, and what the thread that closes it needs.
struct Slot {
  // `kept`: its thread could not be started; the next close() tries again.
  enum class Use : std::uint8_t { free, kept, closing };
  std::atomic<Use> use{Use::free};
  UniqueFd descriptor;
  std::shared_ptr<void> owner;
  int told = -1;  // the owner's event
};

void* closeSlot(void* given) noexcept {
  auto& slot = *static_cast<Slot*>(given);
  slot.descriptor.reset();
  const std::shared_ptr<void> owner = std::move(slot.owner);  // the slot goes with it
  slot.use = Slot::Use::free;
  const std::uint64_t one = 1;
  [[maybe_unused]] const ssize_t written = ::write(slot.told, &one, sizeof one);
  return nullptr;
}

void startThread(Slot& slot, const std::shared_ptr<void>& owner) noexcept {
  slot.owner = owner;
  slot.use = Slot::Use::closing;
  pthread_attr_t attributes;
  bool isStarted = false;
  if (::pthread_attr_init(&attributes) == 0) {
    (void)::pthread_attr_setstacksize(&attributes, kStackBytes);
    (void)::pthread_attr_setdetachstate(&attributes, PTHREAD_CREATE_DETACHED);
    // The program's signals are for its own threads.
    sigset_t all;
    ::sigfillset(&all);
    (void)::pthread_attr_setsigmask_np(&attributes, &all);
    pthread_t thread{};
    isStarted = ::pthread_create(&thread, &attributes, closeSlot, &slot) == 0;
    ::pthread_attr_destroy(&attributes);
  }
  if (isStarted) return;
  slot.owner.reset();
  slot.use = Slot::Use::kept;
}

}  // namespace

struct TurnedAway::State {
  UniqueFd event;
  std::array<Slot, kMaxThreads + kMaxListening> slots;
};

bool TurnedAway::prepare() noexcept {
  if (state_ != nullptr) return true;
  try {
    auto state = std::make_shared<State>();
    state->event.reset(::eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK));
    if (!state->event.isValid()) return false;
    for (Slot& slot : state->slots) slot.told = state->event.get();
    state_ = std::move(state);
    return true;
  } catch (const std::bad_alloc&) {
    errno = ENOMEM;
    return false;
  }
}

bool TurnedAway::hasRoom() const noexcept {
  const auto free = std::count_if(state_->slots.begin(), state_->slots.end(),
                                  [](const Slot& slot) { return slot.use == Slot::Use::free; });
  return static_cast<std::size_t>(free) > kMaxListening;
}

void TurnedAway::close(UniqueFd connection) noexcept {
  // Nothing is put into it once it is shut, and most are empty then.
  (void)::shutdown(connection.get(), SHUT_RDWR);
  if (!isDrained(connection.get())) closeOnThread(std::move(connection));
}

void TurnedAway::closeListening(UniqueFd listening) noexcept {
  // Others may hold the same socket, so it is not shut, and none of its connections is accepted.
  pollfd waiting{listening.get(), POLLIN, 0};
  if (::poll(&waiting, 1, 0) != 0) closeOnThread(std::move(listening));
}

void TurnedAway::closeOnThread(UniqueFd descriptor) noexcept {
  for (Slot& slot : state_->slots) {
    if (slot.use == Slot::Use::free && descriptor.isValid()) {
      slot.descriptor = std::move(descriptor);
      slot.use = Slot::Use::kept;
    }
    if (slot.use == Slot::Use::kept) startThread(slot, state_);
  }
}

int TurnedAway::readable() const noexcept { return state_ != nullptr ? state_->event.get() : -1; }

void TurnedAway::wasTold() const noexcept {
  std::uint64_t count = 0;
  [[maybe_unused]] const ssize_t taken = ::read(readable(), &count, sizeof count);
}

}  // namespace brenvik::client

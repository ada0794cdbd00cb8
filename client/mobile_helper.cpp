// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "client/include/brenvik/mobile_helper.h"

#include <algorithm>
#include <array>
#include <cerrno>
#include <cstring>
#include <new>
#include <utility>

#include "client/EventText.h"
#include "client/HandedOver.h"
#include "client/Handles.h"
#include "client/Listener.h"
#include "interface/TelephonyMessages.h"

// The C functions but for the routines, which are in Routines.cpp, and the values, in Values.cpp.

struct bvmh_listener {
  brenvik::client::Listener listener;
};

namespace brenvik::client {
namespace {

bool areServices(unsigned bits) noexcept {
  return bits != 0 && (bits & ~unsigned{BVMH_PUSHES | BVMH_NOTIFICATIONS}) == 0;
}

// Opens a new listener as Listener::open is told. errno stands after BVMH_ERROR_SYSTEM.
template <class... Arguments>
std::int32_t makeListener(bvmh_listener** listener, Arguments... arguments) noexcept {
  auto* made = new (std::nothrow) bvmh_listener;
  if (made == nullptr) return BVMH_ERROR_NO_MEMORY;
  const std::int32_t code = made->listener.open(arguments...);
  if (code == BVMH_OK) {
    *listener = made;
    return code;
  }
  const int error = made->listener.systemError();
  delete made;
  errno = error;
  return code;
}

}  // namespace
}  // namespace brenvik::client

using namespace brenvik;

extern "C" {

const char* bvmh_bootstrap_directory(void) { return BRENVIK_BOOTSTRAP_DIRECTORY; }

const char* bvmh_service_socket(void) {
  static constexpr auto path = [] {
    constexpr std::string_view directory = BRENVIK_BOOTSTRAP_DIRECTORY "/";
    std::array<char, directory.size() + sizeof kServiceName> joined{};
    std::copy(std::begin(kServiceName), std::end(kServiceName),
              std::copy(directory.begin(), directory.end(), joined.begin()));
    return joined;
  }();
  return path.data();
}

bvmh_client* bvmh_client_create(void) { return new (std::nothrow) bvmh_client; }

void bvmh_client_free(bvmh_client* client) { delete client; }

void bvmh_client_set_timeout(bvmh_client* client, uint32_t milliseconds) {
  if (client != nullptr) client->client.setTimeout(milliseconds);
}

int32_t bvmh_client_set_socket(bvmh_client* client, const char* path) {
  return client != nullptr && client->client.setSocket(path) ? BVMH_OK : BVMH_ERROR_INVALID_ARGUMENT;
}

int32_t bvmh_connect(bvmh_client* client) {
  return client == nullptr ? BVMH_ERROR_INVALID_ARGUMENT : client->client.connect();
}

void bvmh_disconnect(bvmh_client* client) {
  if (client != nullptr) client->client.disconnect();
}

int32_t bvmh_reconnect(bvmh_client* client) {
  bvmh_disconnect(client);
  return bvmh_connect(client);
}

int bvmh_client_errno(const bvmh_client* client) {
  return client == nullptr ? 0 : client->client.systemError();
}

void bvmh_client_interrupt(bvmh_client* client) {
  if (client != nullptr) client->client.interrupt();
}

uint32_t bvmh_version(void) { return BVMH_VERSION; }

// ---- calls that do not block ----

int bvmh_client_fd(bvmh_client* client) { return client == nullptr ? -1 : client->client.descriptor(); }

int32_t bvmh_process(bvmh_client* client) {
  if (client == nullptr) return BVMH_ERROR_INVALID_ARGUMENT;
  client->client.process();
  return BVMH_OK;
}

int32_t bvmh_take_result(bvmh_client* client, bvmh_call call, bvmh_result* result) {
  if (result == nullptr) return BVMH_ERROR_INVALID_ARGUMENT;
  *result = bvmh_result{};
  return client == nullptr ? BVMH_ERROR_INVALID_ARGUMENT : client->client.takeResult(call, result);
}

void bvmh_result_free(bvmh_result* result) {
  if (result == nullptr) return;
  bvmh_region_free(&result->region);
  *result = bvmh_result{};
}

int32_t bvmh_cancel(bvmh_client* client, bvmh_call call) {
  return client == nullptr ? BVMH_ERROR_INVALID_ARGUMENT : client->client.cancel(call);
}

int32_t bvmh_begin_connect(bvmh_client* client, void* context, bvmh_call* call) {
  if (call != nullptr) *call = 0;
  return client == nullptr ? BVMH_ERROR_INVALID_ARGUMENT : client->client.beginConnect(context, call);
}

int32_t bvmh_begin(bvmh_client* client, int32_t message_id, const void* request, size_t size,
                   const bvmh_bytes* regions, size_t region_count, void* context, bvmh_call* call) {
  if (call != nullptr) *call = 0;
  const std::int64_t row = std::int64_t{message_id} - kFirstRequestId;
  if (client == nullptr || row < 0 || row >= std::int64_t{kRequestRoutines.size()})
    return BVMH_ERROR_INVALID_ARGUMENT;
  const RoutineFacts& routine = kRequestRoutines[static_cast<std::size_t>(row)];
  if (request == nullptr || size != routine.requestSize || region_count != routine.descriptors ||
      (regions == nullptr && region_count != 0)) {
    return BVMH_ERROR_INVALID_ARGUMENT;
  }
  std::array<std::byte, client::kLargestRequest> copy;
  const std::span<std::byte> message = std::span(copy).first(size);
  std::memcpy(message.data(), request, size);
  std::array<std::span<const std::byte>, client::kMaxRegions> parts;
  for (std::size_t i = 0; i < region_count; ++i) {
    if ((regions[i].bytes == nullptr && regions[i].size != 0) || regions[i].size > UINT32_MAX)
      return BVMH_ERROR_INVALID_ARGUMENT;
    parts[i] = {static_cast<const std::byte*>(regions[i].bytes), regions[i].size};
    client::putRegionLength(routine, message, i, regions[i].size);
  }
  client::putFixedParts(routine, message);
  return client->client.begin(routine, message, std::span(parts).first(region_count), context, call);
}

// ---- pushes and notifications ----

int32_t bvmh_listener_create(const char* directory, unsigned services, bvmh_listener** listener) {
  if (listener == nullptr) return BVMH_ERROR_INVALID_ARGUMENT;
  *listener = nullptr;
  if (!client::areServices(services)) return BVMH_ERROR_INVALID_ARGUMENT;
  return client::makeListener(listener, directory == nullptr ? bvmh_bootstrap_directory() : directory,
                              services);
}

int32_t bvmh_listener_create_from_fds(int pushes, int notifications, bvmh_listener** listener) {
  if (listener == nullptr) return BVMH_ERROR_INVALID_ARGUMENT;
  *listener = nullptr;
  return client::makeListener(listener, pushes, notifications);
}

int32_t bvmh_listener_create_from_environment(unsigned services, bvmh_listener** listener) {
  if (listener == nullptr) return BVMH_ERROR_INVALID_ARGUMENT;
  *listener = nullptr;
  if (!client::areServices(services)) return BVMH_ERROR_INVALID_ARGUMENT;
  const auto handedOver = [&](unsigned service, const char* name) {
    return (services & service) != 0 ? client::descriptorHandedOver(name) : -1;
  };
  const int pushes = handedOver(BVMH_PUSHES, kTelephonyServiceName);
  const int notifications = handedOver(BVMH_NOTIFICATIONS, kNotificationServiceName);
  if (pushes == -1 && notifications == -1) return BVMH_ERROR_NOT_HANDED_OVER;
  return client::makeListener(listener, pushes, notifications);
}

void bvmh_listener_free(bvmh_listener* listener) { delete listener; }

void bvmh_listener_allow_uid(bvmh_listener* listener, uint32_t uid) {
  if (listener != nullptr) listener->listener.allow(uid);
}

int bvmh_listener_fd(const bvmh_listener* listener) {
  return listener == nullptr ? -1 : listener->listener.descriptor();
}

int bvmh_listener_errno(const bvmh_listener* listener) {
  return listener == nullptr ? 0 : listener->listener.systemError();
}

int32_t bvmh_listener_next(bvmh_listener* listener, int timeout_ms, bvmh_event* event) {
  if (listener == nullptr || event == nullptr) return BVMH_ERROR_INVALID_ARGUMENT;
  const auto deadline =
      timeout_ms < 0 ? Deadline::never() : Deadline::in(std::chrono::milliseconds(timeout_ms));
  return listener->listener.next(deadline, event);
}

int32_t bvmh_listener_reply(bvmh_listener* listener, const bvmh_event* event, int32_t error_domain,
                            int32_t error_code) {
  if (listener == nullptr || event == nullptr) return BVMH_ERROR_INVALID_ARGUMENT;
  return listener->listener.reply(*event, error_domain, error_code);
}

ptrdiff_t bvmh_event_text(const bvmh_event* event, const char* key, char* buffer, size_t capacity) {
  if (event == nullptr || key == nullptr || (buffer == nullptr && capacity != 0)) return -1;
  return client::textOfBinaryDictionary(
      {static_cast<const std::byte*>(event->payload.bytes), event->payload.size}, key, {buffer, capacity});
}

int32_t bvmh_match_push(bvmh_client* client, const bvmh_event* event, bvmh_call* call) {
  if (call != nullptr) *call = 0;
  if (client == nullptr || event == nullptr) return BVMH_ERROR_INVALID_ARGUMENT;
  return client->client.matchPush(*event, call);
}

void bvmh_event_free(bvmh_event* event) {
  if (event == nullptr) return;
  bvmh_region_free(&event->payload);
  *event = bvmh_event{};
}

}  // extern "C"

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "client/include/brenvik/mobile_helper.h"

#include <algorithm>
#include <array>
#include <cerrno>
#include <cstring>
#include <new>
#include <utility>

#include "client/Client.h"
#include "client/EventText.h"
#include "client/HandedOver.h"
#include "client/Listener.h"
#include "interface/TelephonyMessages.h"

// The C functions: arguments into the message structs, replies into the caller's variables.

struct bvmh_client {
  brenvik::client::Client client;
};

struct bvmh_listener {
  brenvik::client::Listener listener;
};

namespace brenvik::client {
namespace {

consteval const RoutineFacts& routineNamed(std::string_view name) {
  return *std::find_if(kRequestRoutines.begin(), kRequestRoutines.end(),
                       [&](const RoutineFacts& each) { return each.name == name; });
}

// One call: the request as a struct, zero-filled, with its NDR record; put in the arguments, then send.
template <class Request>
class Call {
 public:
  Call(bvmh_client* client, const RoutineFacts& routine) noexcept : client_(client), routine_(routine) {
    if constexpr (requires { request.ndr; }) request.ndr = kNdrRecord;
  }

  // The text must fit its field with its NUL.
  template <std::size_t size>
  Call& put(char (&field)[size], const char* text) noexcept {
    const std::size_t length = text == nullptr ? size : ::strnlen(text, size);
    if (length == size) {
      isValid_ = false;
    } else {
      std::memcpy(field, text, length);
    }
    return *this;
  }

  // Adds the next out-of-line region and its length in the body.
  Call& put(std::uint32_t& lengthField, const void* bytes, std::size_t length) noexcept {
    if ((bytes == nullptr && length != 0) || length > UINT32_MAX) {
      isValid_ = false;
    } else {
      lengthField = static_cast<std::uint32_t>(length);
      regions_[regionCount_++] = {static_cast<const std::byte*>(bytes), length};
    }
    return *this;
  }

  Call& require(bool condition) noexcept {
    isValid_ = isValid_ && condition;
    return *this;
  }

  std::int32_t send() noexcept {
    if (client_ == nullptr || !isValid_) return BVMH_ERROR_INVALID_ARGUMENT;
    return client_->client.call(routine_, std::as_writable_bytes(std::span(&request, 1)),
                                std::span(regions_).first(regionCount_), &reply_);
  }

  std::int32_t sendForBoolean(bool* result) noexcept {
    const std::int32_t code = require(result != nullptr).send();
    if (code == BVMH_OK) {
      // Only the first byte of the field means anything.
      *result = reply_.datagram[offsetof(IntegerReply, result)] != std::byte{0};
    }
    return code;
  }

  std::int32_t sendForText(char* text, std::size_t capacity, std::size_t fieldSize) noexcept {
    const std::int32_t code = require(text != nullptr && capacity > fieldSize).send();
    if (code == BVMH_OK) {
      const auto* field = reinterpret_cast<const char*>(reply_.datagram.data()) + sizeof(StatusReply);
      const std::size_t length = ::strnlen(field, fieldSize);
      std::memcpy(text, field, length);
      text[length] = '\0';
    }
    return code;
  }

  std::int32_t sendForRegion(bvmh_region* region) noexcept {
    if (region != nullptr) *region = bvmh_region{};
    const std::int32_t code = require(region != nullptr).send();
    return code == BVMH_OK ? client_->client.takeRegion(reply_, region) : code;
  }

  Request request{};

 private:
  bvmh_client* client_;
  const RoutineFacts& routine_;
  std::array<std::span<const std::byte>, 2> regions_;
  std::size_t regionCount_ = 0;
  bool isValid_ = true;
  Reply reply_;
};

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
using brenvik::client::Call;

// Names the routine once for the function and for the row of the table; the row's size must be the struct's.
#define BVMH_CALL(Request, name)                                              \
  static constexpr const RoutineFacts& routine = client::routineNamed(#name); \
  static_assert(routine.requestSize == sizeof(Request));                      \
  Call<Request> call(client, routine)

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

// ---- voicemail ----

int32_t BVMobileHelperSetVoicemailToken(bvmh_client* client, const char* token) {
  BVMH_CALL(String256Request, BVMobileHelperSetVoicemailToken);
  return call.put(call.request.text, token).send();
}

int32_t BVMobileHelperSetVoicemailTokenForKey(bvmh_client* client, const char* key, const char* token) {
  BVMH_CALL(TwoStrings256Request, BVMobileHelperSetVoicemailTokenForKey);
  return call.put(call.request.first, key).put(call.request.second, token).send();
}

int32_t BVMobileHelperClearVoicemailToken(bvmh_client* client) {
  BVMH_CALL(EmptyRequest, BVMobileHelperClearVoicemailToken);
  return call.send();
}

int32_t BVMobileHelperResetVoicemailStore(bvmh_client* client) {
  BVMH_CALL(EmptyRequest, BVMobileHelperResetVoicemailStore);
  return call.send();
}

int32_t BVMobileHelperCopyVoicemailTokenForKey(bvmh_client* client, const char* key, char* token,
                                               size_t capacity) {
  BVMH_CALL(String256Request, BVMobileHelperCopyVoicemailTokenForKey);
  return call.put(call.request.text, key).sendForText(token, capacity, sizeof(String256Reply::text));
}

int32_t BVMobileHelperCopyVoicemailToken(bvmh_client* client, char* token, size_t capacity) {
  BVMH_CALL(EmptyRequest, BVMobileHelperCopyVoicemailToken);
  return call.sendForText(token, capacity, sizeof(String256Reply::text));
}

int32_t BVMobileHelperIsVoicemailServiceSubscribed(bvmh_client* client, bool* subscribed) {
  BVMH_CALL(EmptyRequest, BVMobileHelperIsVoicemailServiceSubscribed);
  return call.sendForBoolean(subscribed);
}

// ---- preferences ----

int32_t BVMobileHelperSetPreferenceValue(bvmh_client* client, const char* domain, const char* key,
                                         const void* value, size_t length) {
  BVMH_CALL(SetPreferenceValueRequest, BVMobileHelperSetPreferenceValue);
  call.request.descriptorCount = 1;
  std::uint32_t valueLength = 0;
  call.put(call.request.domain, domain).put(call.request.key, key).put(valueLength, value, length);
  call.request.valueLength = valueLength;
  return call.send();
}

int32_t BVMobileHelperCopyPreferenceValue(bvmh_client* client, const char* domain, const char* key,
                                          bvmh_region* value) {
  BVMH_CALL(TwoStrings256Request, BVMobileHelperCopyPreferenceValue);
  return call.put(call.request.first, domain).put(call.request.second, key).sendForRegion(value);
}

int32_t BVMobileHelperCopyAppPreferenceValue(bvmh_client* client, const char* domain, const char* key,
                                             bvmh_region* value) {
  BVMH_CALL(TwoStrings256Request, BVMobileHelperCopyAppPreferenceValue);
  return call.put(call.request.first, domain).put(call.request.second, key).sendForRegion(value);
}

int32_t BVMobileHelperLoadPlistFile(bvmh_client* client, const char* path, bvmh_region* plist) {
  BVMH_CALL(String256Request, BVMobileHelperLoadPlistFile);
  return call.put(call.request.text, path).sendForRegion(plist);
}

// ---- carrier files ----

int32_t BVMobileHelperReplaceCarrierSymlink(bvmh_client* client, const char* target, const char* link_path,
                                            const char* domain) {
  BVMH_CALL(ThreeStrings1024Request, BVMobileHelperReplaceCarrierSymlink);
  return call.put(call.request.first, target)
      .put(call.request.second, link_path)
      .put(call.request.third, domain)
      .send();
}

int32_t BVMobileHelperCreateSymlink(bvmh_client* client, const char* target, const char* link_path) {
  BVMH_CALL(TwoStrings1024Request, BVMobileHelperCreateSymlink);
  return call.put(call.request.first, target).put(call.request.second, link_path).send();
}

int32_t BVMobileHelperRemoveCarrierFile(bvmh_client* client, const char* path, const char* domain) {
  BVMH_CALL(TwoStrings1024Request, BVMobileHelperRemoveCarrierFile);
  return call.put(call.request.first, path).put(call.request.second, domain).send();
}

int32_t BVMobileHelperCopyCarrierFile(bvmh_client* client, const char* source_directory,
                                      const char* destination_directory, const char* file_name,
                                      bool* success) {
  BVMH_CALL(ThreeStrings256Request, BVMobileHelperCopyCarrierFile);
  return call.put(call.request.first, source_directory)
      .put(call.request.second, destination_directory)
      .put(call.request.third, file_name)
      .sendForBoolean(success);
}

int32_t BVMobileHelperCopyCrashLogs(bvmh_client* client, const char* path, bool* success) {
  BVMH_CALL(String256Request, BVMobileHelperCopyCrashLogs);
  return call.put(call.request.text, path).sendForBoolean(success);
}

int32_t BVMobileHelperMoveIntoCarrierBundles(bvmh_client* client, const char* source_path,
                                             const char* destination_directory, const char* name,
                                             bool* success) {
  BVMH_CALL(ThreeStrings256Request, BVMobileHelperMoveIntoCarrierBundles);
  return call.put(call.request.first, source_path)
      .put(call.request.second, destination_directory)
      .put(call.request.third, name)
      .sendForBoolean(success);
}

int32_t BVMobileHelperUnpackArchive(bvmh_client* client, const char* archive_path,
                                    const char* destination_path, bool* success) {
  BVMH_CALL(TwoStrings256Request, BVMobileHelperUnpackArchive);
  return call.put(call.request.first, archive_path)
      .put(call.request.second, destination_path)
      .sendForBoolean(success);
}

// ---- location ----

int32_t BVMobileHelperRequestCountryCodeFromLocation(bvmh_client* client, double latitude, double longitude) {
  BVMH_CALL(CoordinateRequest, BVMobileHelperRequestCountryCodeFromLocation);
  call.request.latitude = latitude;
  call.request.longitude = longitude;
  return call.send();
}

int32_t BVMobileHelperRequestWanIPFromLocation(bvmh_client* client) {
  BVMH_CALL(EmptyRequest, BVMobileHelperRequestWanIPFromLocation);
  return call.send();
}

int32_t BVMobileHelperCopyCountryCode(bvmh_client* client, char* country_code, size_t capacity) {
  BVMH_CALL(EmptyRequest, BVMobileHelperCopyCountryCode);
  return call.sendForText(country_code, capacity, sizeof(String64Reply::text));
}

// ---- labels and contacts ----

int32_t BVMobileHelperCopyBadgeLabels(bvmh_client* client, const void* labels, size_t labels_length,
                                      const void* languages, size_t languages_length, bvmh_region* result) {
  BVMH_CALL(LabelsRequest, BVMobileHelperCopyBadgeLabels);
  call.request.descriptorCount = 2;
  std::uint32_t lengths[2] = {};
  call.put(lengths[0], labels, labels_length).put(lengths[1], languages, languages_length);
  call.request.labelsLength = lengths[0];
  call.request.languagesLength = lengths[1];
  return call.sendForRegion(result);
}

int32_t BVMobileHelperCopyLocalizedLabels(bvmh_client* client, const void* labels, size_t labels_length,
                                          const void* languages, size_t languages_length,
                                          bvmh_region* result) {
  BVMH_CALL(LabelsRequest, BVMobileHelperCopyLocalizedLabels);
  call.request.descriptorCount = 2;
  std::uint32_t lengths[2] = {};
  call.put(lengths[0], labels, labels_length).put(lengths[1], languages, languages_length);
  call.request.labelsLength = lengths[0];
  call.request.languagesLength = lengths[1];
  return call.sendForRegion(result);
}

int32_t BVMobileHelperRemapContactsChannel(bvmh_client* client, const char* from, const char* to,
                                           bool* success) {
  BVMH_CALL(TwoStrings64Request, BVMobileHelperRemapContactsChannel);
  return call.put(call.request.first, from).put(call.request.second, to).sendForBoolean(success);
}

// ---- switches ----

int32_t BVMobileHelperCellularHeartbeat(bvmh_client* client, int32_t value) {
  BVMH_CALL(IntegerRequest, BVMobileHelperCellularHeartbeat);
  call.request.value = value;
  return call.send();
}

int32_t BVMobileHelperCheckLASDUpdate(bvmh_client* client, int32_t value) {
  BVMH_CALL(IntegerRequest, BVMobileHelperCheckLASDUpdate);
  call.request.value = value;
  return call.send();
}

int32_t BVMobileHelperEnableRadioManagerLogs(bvmh_client* client, int32_t enable) {
  BVMH_CALL(IntegerRequest, BVMobileHelperEnableRadioManagerLogs);
  call.request.value = enable;
  return call.send();
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
  const auto deadline = timeout_ms < 0 ? client::Deadline::never()
                                       : client::Deadline::in(std::chrono::milliseconds(timeout_ms));
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

void bvmh_event_free(bvmh_event* event) {
  if (event == nullptr) return;
  bvmh_region_free(&event->payload);
  *event = bvmh_event{};
}

}  // extern "C"

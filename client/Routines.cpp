// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include <algorithm>
#include <array>
#include <cstring>
#include <span>
#include <string_view>

#include "client/Handles.h"

// The routines: arguments into the message structs, results into the caller's variables. How a request is put
// together is said once, for the function that waits and the one that begins.
namespace brenvik::client {
namespace {

consteval const RoutineFacts& routineNamed(std::string_view name) {
  return *std::find_if(kRequestRoutines.begin(), kRequestRoutines.end(),
                       [&](const RoutineFacts& each) { return each.name == name; });
}

// One call: the request as a struct, zero-filled but for what nobody chooses; put in the arguments, then send
// or begin.
template <class Request>
class Call {
 public:
  Call(bvmh_client* client, const RoutineFacts& routine) noexcept : client_(client), routine_(routine) {
    putFixedParts(routine, message());
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
  Call& put(const void* bytes, std::size_t length) noexcept {
    if ((bytes == nullptr && length != 0) || length > UINT32_MAX) {
      isValid_ = false;
    } else {
      putRegionLength(routine_, message(), regionCount_, length);
      regions_[regionCount_++] = {static_cast<const std::byte*>(bytes), length};
    }
    return *this;
  }

  std::int32_t send() noexcept { return send(true); }

  std::int32_t sendForBoolean(bool* result) noexcept {
    const std::int32_t code = send(result != nullptr);
    if (code == BVMH_OK) *result = result_.boolean;
    return code;
  }

  std::int32_t sendForText(char* text, std::size_t capacity) noexcept {
    const std::size_t fieldSize = sizeOfReply(routine_.reply) - sizeof(StatusReply);
    const std::int32_t code = send(text != nullptr && capacity > fieldSize);
    if (code == BVMH_OK) std::memcpy(text, result_.text, std::strlen(result_.text) + 1);
    return code;
  }

  std::int32_t sendForRegion(bvmh_region* region) noexcept {
    if (region != nullptr) *region = bvmh_region{};
    const std::int32_t code = send(region != nullptr);
    if (code == BVMH_OK) *region = result_.region;
    return code;
  }

  std::int32_t begin(void* context, bvmh_call* number) noexcept {
    if (number != nullptr) *number = 0;
    if (client_ == nullptr || !isValid_) return BVMH_ERROR_INVALID_ARGUMENT;
    return client_->client.begin(routine_, message(), regions(), context, number);
  }

  Request request{};

 private:
  std::span<std::byte> message() noexcept { return std::as_writable_bytes(std::span(&request, 1)); }
  Regions regions() const noexcept { return std::span(regions_).first(regionCount_); }

  std::int32_t send(bool hasPlaceForResult) noexcept {
    if (client_ == nullptr || !isValid_ || !hasPlaceForResult) return BVMH_ERROR_INVALID_ARGUMENT;
    return client_->client.call(routine_, message(), regions(), &result_);
  }

  bvmh_client* client_;
  const RoutineFacts& routine_;
  std::array<std::span<const std::byte>, kMaxRegions> regions_;
  std::size_t regionCount_ = 0;
  bool isValid_ = true;
  bvmh_result result_;  // written by a call that succeeds
};

// Names the routine once for the function and for the row of the table; the row's size must be the struct's.
#define BVMH_CALL(Request, name)                                      \
  static constexpr const RoutineFacts& routine = routineNamed(#name); \
  static_assert(routine.requestSize == sizeof(Request));              \
  Call<Request> call(client, routine)

Call<String256Request> setVoicemailToken(bvmh_client* client, const char* token) noexcept {
  BVMH_CALL(String256Request, BVMobileHelperSetVoicemailToken);
  call.put(call.request.text, token);
  return call;
}

Call<TwoStrings256Request> setVoicemailTokenForKey(bvmh_client* client, const char* key,
                                                   const char* token) noexcept {
  BVMH_CALL(TwoStrings256Request, BVMobileHelperSetVoicemailTokenForKey);
  call.put(call.request.first, key).put(call.request.second, token);
  return call;
}

Call<EmptyRequest> clearVoicemailToken(bvmh_client* client) noexcept {
  BVMH_CALL(EmptyRequest, BVMobileHelperClearVoicemailToken);
  return call;
}

Call<EmptyRequest> resetVoicemailStore(bvmh_client* client) noexcept {
  BVMH_CALL(EmptyRequest, BVMobileHelperResetVoicemailStore);
  return call;
}

Call<String256Request> copyVoicemailTokenForKey(bvmh_client* client, const char* key) noexcept {
  BVMH_CALL(String256Request, BVMobileHelperCopyVoicemailTokenForKey);
  call.put(call.request.text, key);
  return call;
}

Call<EmptyRequest> copyVoicemailToken(bvmh_client* client) noexcept {
  BVMH_CALL(EmptyRequest, BVMobileHelperCopyVoicemailToken);
  return call;
}

Call<EmptyRequest> isVoicemailServiceSubscribed(bvmh_client* client) noexcept {
  BVMH_CALL(EmptyRequest, BVMobileHelperIsVoicemailServiceSubscribed);
  return call;
}

Call<SetPreferenceValueRequest> setPreferenceValue(bvmh_client* client, const char* domain, const char* key,
                                                   const void* value, size_t length) noexcept {
  BVMH_CALL(SetPreferenceValueRequest, BVMobileHelperSetPreferenceValue);
  call.put(call.request.domain, domain).put(call.request.key, key).put(value, length);
  return call;
}

Call<TwoStrings256Request> copyPreferenceValue(bvmh_client* client, const char* domain,
                                               const char* key) noexcept {
  BVMH_CALL(TwoStrings256Request, BVMobileHelperCopyPreferenceValue);
  call.put(call.request.first, domain).put(call.request.second, key);
  return call;
}

Call<TwoStrings256Request> copyAppPreferenceValue(bvmh_client* client, const char* domain,
                                                  const char* key) noexcept {
  BVMH_CALL(TwoStrings256Request, BVMobileHelperCopyAppPreferenceValue);
  call.put(call.request.first, domain).put(call.request.second, key);
  return call;
}

Call<String256Request> loadPlistFile(bvmh_client* client, const char* path) noexcept {
  BVMH_CALL(String256Request, BVMobileHelperLoadPlistFile);
  call.put(call.request.text, path);
  return call;
}

Call<ThreeStrings1024Request> replaceCarrierSymlink(bvmh_client* client, const char* target,
                                                    const char* link_path, const char* domain) noexcept {
  BVMH_CALL(ThreeStrings1024Request, BVMobileHelperReplaceCarrierSymlink);
  call.put(call.request.first, target).put(call.request.second, link_path).put(call.request.third, domain);
  return call;
}

Call<TwoStrings1024Request> createSymlink(bvmh_client* client, const char* target,
                                          const char* link_path) noexcept {
  BVMH_CALL(TwoStrings1024Request, BVMobileHelperCreateSymlink);
  call.put(call.request.first, target).put(call.request.second, link_path);
  return call;
}

Call<TwoStrings1024Request> removeCarrierFile(bvmh_client* client, const char* path,
                                              const char* domain) noexcept {
  BVMH_CALL(TwoStrings1024Request, BVMobileHelperRemoveCarrierFile);
  call.put(call.request.first, path).put(call.request.second, domain);
  return call;
}

Call<ThreeStrings256Request> copyCarrierFile(bvmh_client* client, const char* source_directory,
                                             const char* destination_directory,
                                             const char* file_name) noexcept {
  BVMH_CALL(ThreeStrings256Request, BVMobileHelperCopyCarrierFile);
  call.put(call.request.first, source_directory)
      .put(call.request.second, destination_directory)
      .put(call.request.third, file_name);
  return call;
}

Call<String256Request> copyCrashLogs(bvmh_client* client, const char* path) noexcept {
  BVMH_CALL(String256Request, BVMobileHelperCopyCrashLogs);
  call.put(call.request.text, path);
  return call;
}

Call<ThreeStrings256Request> moveIntoCarrierBundles(bvmh_client* client, const char* source_path,
                                                    const char* destination_directory,
                                                    const char* name) noexcept {
  BVMH_CALL(ThreeStrings256Request, BVMobileHelperMoveIntoCarrierBundles);
  call.put(call.request.first, source_path)
      .put(call.request.second, destination_directory)
      .put(call.request.third, name);
  return call;
}

Call<TwoStrings256Request> unpackArchive(bvmh_client* client, const char* archive_path,
                                         const char* destination_path) noexcept {
  BVMH_CALL(TwoStrings256Request, BVMobileHelperUnpackArchive);
  call.put(call.request.first, archive_path).put(call.request.second, destination_path);
  return call;
}

Call<CoordinateRequest> requestCountryCodeFromLocation(bvmh_client* client, double latitude,
                                                       double longitude) noexcept {
  BVMH_CALL(CoordinateRequest, BVMobileHelperRequestCountryCodeFromLocation);
  call.request.latitude = latitude;
  call.request.longitude = longitude;
  return call;
}

Call<EmptyRequest> requestWanIPFromLocation(bvmh_client* client) noexcept {
  BVMH_CALL(EmptyRequest, BVMobileHelperRequestWanIPFromLocation);
  return call;
}

Call<EmptyRequest> copyCountryCode(bvmh_client* client) noexcept {
  BVMH_CALL(EmptyRequest, BVMobileHelperCopyCountryCode);
  return call;
}

Call<LabelsRequest> copyBadgeLabels(bvmh_client* client, const void* labels, size_t labels_length,
                                    const void* languages, size_t languages_length) noexcept {
  BVMH_CALL(LabelsRequest, BVMobileHelperCopyBadgeLabels);
  call.put(labels, labels_length).put(languages, languages_length);
  return call;
}

Call<LabelsRequest> copyLocalizedLabels(bvmh_client* client, const void* labels, size_t labels_length,
                                        const void* languages, size_t languages_length) noexcept {
  BVMH_CALL(LabelsRequest, BVMobileHelperCopyLocalizedLabels);
  call.put(labels, labels_length).put(languages, languages_length);
  return call;
}

Call<TwoStrings64Request> remapContactsChannel(bvmh_client* client, const char* from,
                                               const char* to) noexcept {
  BVMH_CALL(TwoStrings64Request, BVMobileHelperRemapContactsChannel);
  call.put(call.request.first, from).put(call.request.second, to);
  return call;
}

Call<IntegerRequest> cellularHeartbeat(bvmh_client* client, int32_t value) noexcept {
  BVMH_CALL(IntegerRequest, BVMobileHelperCellularHeartbeat);
  call.request.value = value;
  return call;
}

Call<IntegerRequest> checkLASDUpdate(bvmh_client* client, int32_t value) noexcept {
  BVMH_CALL(IntegerRequest, BVMobileHelperCheckLASDUpdate);
  call.request.value = value;
  return call;
}

Call<IntegerRequest> enableRadioManagerLogs(bvmh_client* client, int32_t enable) noexcept {
  BVMH_CALL(IntegerRequest, BVMobileHelperEnableRadioManagerLogs);
  call.request.value = enable;
  return call;
}

}  // namespace
}  // namespace brenvik::client

using namespace brenvik::client;

extern "C" {

// ---- voicemail ----

int32_t BVMobileHelperSetVoicemailToken(bvmh_client* client, const char* token) {
  return setVoicemailToken(client, token).send();
}

int32_t BVMobileHelperSetVoicemailTokenBegin(bvmh_client* client, const char* token, void* context,
                                             bvmh_call* call) {
  return setVoicemailToken(client, token).begin(context, call);
}

int32_t BVMobileHelperSetVoicemailTokenForKey(bvmh_client* client, const char* key, const char* token) {
  return setVoicemailTokenForKey(client, key, token).send();
}

int32_t BVMobileHelperSetVoicemailTokenForKeyBegin(bvmh_client* client, const char* key, const char* token,
                                                   void* context, bvmh_call* call) {
  return setVoicemailTokenForKey(client, key, token).begin(context, call);
}

int32_t BVMobileHelperClearVoicemailToken(bvmh_client* client) { return clearVoicemailToken(client).send(); }

int32_t BVMobileHelperClearVoicemailTokenBegin(bvmh_client* client, void* context, bvmh_call* call) {
  return clearVoicemailToken(client).begin(context, call);
}

int32_t BVMobileHelperResetVoicemailStore(bvmh_client* client) { return resetVoicemailStore(client).send(); }

int32_t BVMobileHelperResetVoicemailStoreBegin(bvmh_client* client, void* context, bvmh_call* call) {
  return resetVoicemailStore(client).begin(context, call);
}

int32_t BVMobileHelperCopyVoicemailTokenForKey(bvmh_client* client, const char* key, char* token,
                                               size_t capacity) {
  return copyVoicemailTokenForKey(client, key).sendForText(token, capacity);
}

int32_t BVMobileHelperCopyVoicemailTokenForKeyBegin(bvmh_client* client, const char* key, void* context,
                                                    bvmh_call* call) {
  return copyVoicemailTokenForKey(client, key).begin(context, call);
}

int32_t BVMobileHelperCopyVoicemailToken(bvmh_client* client, char* token, size_t capacity) {
  return copyVoicemailToken(client).sendForText(token, capacity);
}

int32_t BVMobileHelperCopyVoicemailTokenBegin(bvmh_client* client, void* context, bvmh_call* call) {
  return copyVoicemailToken(client).begin(context, call);
}

int32_t BVMobileHelperIsVoicemailServiceSubscribed(bvmh_client* client, bool* subscribed) {
  return isVoicemailServiceSubscribed(client).sendForBoolean(subscribed);
}

int32_t BVMobileHelperIsVoicemailServiceSubscribedBegin(bvmh_client* client, void* context, bvmh_call* call) {
  return isVoicemailServiceSubscribed(client).begin(context, call);
}

// ---- preferences ----

int32_t BVMobileHelperSetPreferenceValue(bvmh_client* client, const char* domain, const char* key,
                                         const void* value, size_t length) {
  return setPreferenceValue(client, domain, key, value, length).send();
}

int32_t BVMobileHelperSetPreferenceValueBegin(bvmh_client* client, const char* domain, const char* key,
                                              const void* value, size_t length, void* context,
                                              bvmh_call* call) {
  return setPreferenceValue(client, domain, key, value, length).begin(context, call);
}

int32_t BVMobileHelperCopyPreferenceValue(bvmh_client* client, const char* domain, const char* key,
                                          bvmh_region* value) {
  return copyPreferenceValue(client, domain, key).sendForRegion(value);
}

int32_t BVMobileHelperCopyPreferenceValueBegin(bvmh_client* client, const char* domain, const char* key,
                                               void* context, bvmh_call* call) {
  return copyPreferenceValue(client, domain, key).begin(context, call);
}

int32_t BVMobileHelperCopyAppPreferenceValue(bvmh_client* client, const char* domain, const char* key,
                                             bvmh_region* value) {
  return copyAppPreferenceValue(client, domain, key).sendForRegion(value);
}

int32_t BVMobileHelperCopyAppPreferenceValueBegin(bvmh_client* client, const char* domain, const char* key,
                                                  void* context, bvmh_call* call) {
  return copyAppPreferenceValue(client, domain, key).begin(context, call);
}

int32_t BVMobileHelperLoadPlistFile(bvmh_client* client, const char* path, bvmh_region* plist) {
  return loadPlistFile(client, path).sendForRegion(plist);
}

int32_t BVMobileHelperLoadPlistFileBegin(bvmh_client* client, const char* path, void* context,
                                         bvmh_call* call) {
  return loadPlistFile(client, path).begin(context, call);
}

// ---- carrier files ----

int32_t BVMobileHelperReplaceCarrierSymlink(bvmh_client* client, const char* target, const char* link_path,
                                            const char* domain) {
  return replaceCarrierSymlink(client, target, link_path, domain).send();
}

int32_t BVMobileHelperReplaceCarrierSymlinkBegin(bvmh_client* client, const char* target,
                                                 const char* link_path, const char* domain, void* context,
                                                 bvmh_call* call) {
  return replaceCarrierSymlink(client, target, link_path, domain).begin(context, call);
}

int32_t BVMobileHelperCreateSymlink(bvmh_client* client, const char* target, const char* link_path) {
  return createSymlink(client, target, link_path).send();
}

int32_t BVMobileHelperCreateSymlinkBegin(bvmh_client* client, const char* target, const char* link_path,
                                         void* context, bvmh_call* call) {
  return createSymlink(client, target, link_path).begin(context, call);
}

int32_t BVMobileHelperRemoveCarrierFile(bvmh_client* client, const char* path, const char* domain) {
  return removeCarrierFile(client, path, domain).send();
}

int32_t BVMobileHelperRemoveCarrierFileBegin(bvmh_client* client, const char* path, const char* domain,
                                             void* context, bvmh_call* call) {
  return removeCarrierFile(client, path, domain).begin(context, call);
}

int32_t BVMobileHelperCopyCarrierFile(bvmh_client* client, const char* source_directory,
                                      const char* destination_directory, const char* file_name,
                                      bool* success) {
  return copyCarrierFile(client, source_directory, destination_directory, file_name).sendForBoolean(success);
}

int32_t BVMobileHelperCopyCarrierFileBegin(bvmh_client* client, const char* source_directory,
                                           const char* destination_directory, const char* file_name,
                                           void* context, bvmh_call* call) {
  return copyCarrierFile(client, source_directory, destination_directory, file_name).begin(context, call);
}

int32_t BVMobileHelperCopyCrashLogs(bvmh_client* client, const char* path, bool* success) {
  return copyCrashLogs(client, path).sendForBoolean(success);
}

int32_t BVMobileHelperCopyCrashLogsBegin(bvmh_client* client, const char* path, void* context,
                                         bvmh_call* call) {
  return copyCrashLogs(client, path).begin(context, call);
}

int32_t BVMobileHelperMoveIntoCarrierBundles(bvmh_client* client, const char* source_path,
                                             const char* destination_directory, const char* name,
                                             bool* success) {
  return moveIntoCarrierBundles(client, source_path, destination_directory, name).sendForBoolean(success);
}

int32_t BVMobileHelperMoveIntoCarrierBundlesBegin(bvmh_client* client, const char* source_path,
                                                  const char* destination_directory, const char* name,
                                                  void* context, bvmh_call* call) {
  return moveIntoCarrierBundles(client, source_path, destination_directory, name).begin(context, call);
}

int32_t BVMobileHelperUnpackArchive(bvmh_client* client, const char* archive_path,
                                    const char* destination_path, bool* success) {
  return unpackArchive(client, archive_path, destination_path).sendForBoolean(success);
}

int32_t BVMobileHelperUnpackArchiveBegin(bvmh_client* client, const char* archive_path,
                                         const char* destination_path, void* context, bvmh_call* call) {
  return unpackArchive(client, archive_path, destination_path).begin(context, call);
}

// ---- location ----

int32_t BVMobileHelperRequestCountryCodeFromLocation(bvmh_client* client, double latitude, double longitude) {
  return requestCountryCodeFromLocation(client, latitude, longitude).send();
}

int32_t BVMobileHelperRequestCountryCodeFromLocationBegin(bvmh_client* client, double latitude,
                                                          double longitude, void* context, bvmh_call* call) {
  return requestCountryCodeFromLocation(client, latitude, longitude).begin(context, call);
}

int32_t BVMobileHelperRequestWanIPFromLocation(bvmh_client* client) {
  return requestWanIPFromLocation(client).send();
}

int32_t BVMobileHelperRequestWanIPFromLocationBegin(bvmh_client* client, void* context, bvmh_call* call) {
  return requestWanIPFromLocation(client).begin(context, call);
}

int32_t BVMobileHelperCopyCountryCode(bvmh_client* client, char* country_code, size_t capacity) {
  return copyCountryCode(client).sendForText(country_code, capacity);
}

int32_t BVMobileHelperCopyCountryCodeBegin(bvmh_client* client, void* context, bvmh_call* call) {
  return copyCountryCode(client).begin(context, call);
}

// ---- labels and contacts ----

int32_t BVMobileHelperCopyBadgeLabels(bvmh_client* client, const void* labels, size_t labels_length,
                                      const void* languages, size_t languages_length, bvmh_region* result) {
  return copyBadgeLabels(client, labels, labels_length, languages, languages_length).sendForRegion(result);
}

int32_t BVMobileHelperCopyBadgeLabelsBegin(bvmh_client* client, const void* labels, size_t labels_length,
                                           const void* languages, size_t languages_length, void* context,
                                           bvmh_call* call) {
  return copyBadgeLabels(client, labels, labels_length, languages, languages_length).begin(context, call);
}

int32_t BVMobileHelperCopyLocalizedLabels(bvmh_client* client, const void* labels, size_t labels_length,
                                          const void* languages, size_t languages_length,
                                          bvmh_region* result) {
  return copyLocalizedLabels(client, labels, labels_length, languages, languages_length)
      .sendForRegion(result);
}

int32_t BVMobileHelperCopyLocalizedLabelsBegin(bvmh_client* client, const void* labels, size_t labels_length,
                                               const void* languages, size_t languages_length, void* context,
                                               bvmh_call* call) {
  return copyLocalizedLabels(client, labels, labels_length, languages, languages_length).begin(context, call);
}

int32_t BVMobileHelperRemapContactsChannel(bvmh_client* client, const char* from, const char* to,
                                           bool* success) {
  return remapContactsChannel(client, from, to).sendForBoolean(success);
}

int32_t BVMobileHelperRemapContactsChannelBegin(bvmh_client* client, const char* from, const char* to,
                                                void* context, bvmh_call* call) {
  return remapContactsChannel(client, from, to).begin(context, call);
}

// ---- switches ----

int32_t BVMobileHelperCellularHeartbeat(bvmh_client* client, int32_t value) {
  return cellularHeartbeat(client, value).send();
}

int32_t BVMobileHelperCellularHeartbeatBegin(bvmh_client* client, int32_t value, void* context,
                                             bvmh_call* call) {
  return cellularHeartbeat(client, value).begin(context, call);
}

int32_t BVMobileHelperCheckLASDUpdate(bvmh_client* client, int32_t value) {
  return checkLASDUpdate(client, value).send();
}

int32_t BVMobileHelperCheckLASDUpdateBegin(bvmh_client* client, int32_t value, void* context,
                                           bvmh_call* call) {
  return checkLASDUpdate(client, value).begin(context, call);
}

int32_t BVMobileHelperEnableRadioManagerLogs(bvmh_client* client, int32_t enable) {
  return enableRadioManagerLogs(client, enable).send();
}

int32_t BVMobileHelperEnableRadioManagerLogsBegin(bvmh_client* client, int32_t enable, void* context,
                                                  bvmh_call* call) {
  return enableRadioManagerLogs(client, enable).begin(context, call);
}

}  // extern "C"

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <chrono>
#include <cstddef>
#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

#include "platform/worker/WorkerMessage.h"

// The protocol between the helper and the store worker. Each request has one answer, and the next request
// follows that answer. Encoding and decoding throw std::bad_alloc; decoding returns nothing for a malformed
// message.
namespace brenvik::stores {

inline constexpr const char* kService = "com.norvale.brenvik.mobile-helper.stores";
inline constexpr const char* kProgram = "brenvik-store-worker";
inline constexpr const char* kVoicemailFile = "voicemail.db";
inline constexpr const char* kContactsFile = "contacts.db";

// The kinds of channels: the voicemail store, for any number of requests; one manager of contacts.
enum class Work : std::uint32_t { voicemail = 1, contacts = 2 };

// The longest description of an error, in bytes; lines of the log are cut at the same length.
inline constexpr std::size_t kLongestDescription = 4096;

enum class Operation : std::uint32_t {
  setToken = 1,
  clearToken,
  setTokenForKey,
  removeAllRecords,
  readToken,
  readTokenForKey
};
constexpr bool writes(Operation operation) noexcept {
  return operation != Operation::readToken && operation != Operation::readTokenForKey;
}

// A request to the voicemail store. If it carries a descriptor, that is the store's folder from now on.
struct VoicemailRequest {
  Operation operation = Operation::readToken;
  std::uint32_t serial = 0;  // the answer has the same
  bool insists = false;      // try even if the account does not own the file; the failure is then logged
  std::string key;
  std::string token;
};
enum class VoicemailOutcome : std::uint32_t {
  done = 1,  // done, or the store has logged why not
  outOfMemory,
  notAllowed  // the account may not use the file or the folder; nothing was done
};
struct VoicemailAnswer {
  VoicemailOutcome outcome = VoicemailOutcome::done;
  std::uint32_t serial = 0;
  std::optional<std::string> token;
};

WorkerMessage encode(const VoicemailRequest& request);
std::optional<VoicemailRequest> decodeVoicemailRequest(const WorkerMessage& message);
WorkerMessage encode(const VoicemailAnswer& answer);
std::optional<VoicemailAnswer> decodeVoicemailAnswer(const WorkerMessage& message);

// Requests to a manager of contacts: first its folder (kOpenContacts, with the descriptor), then remaps.
inline constexpr std::uint32_t kOpenContacts = 1;
inline constexpr std::uint32_t kRemap = 2;
enum class ContactsOutcome : std::uint32_t { open = 1, noDatabase, outOfMemory };
struct RemapRequest {
  std::string from;
  std::string to;
};
struct RemapAnswer {
  bool done = false;
  std::optional<std::string> error;
};

WorkerMessage encode(ContactsOutcome outcome);
std::optional<ContactsOutcome> decodeContactsOutcome(const WorkerMessage& message) noexcept;
WorkerMessage encode(const RemapRequest& request);
std::optional<RemapRequest> decodeRemapRequest(const WorkerMessage& message);
WorkerMessage encode(const RemapAnswer& answer);
std::optional<RemapAnswer> decodeRemapAnswer(const WorkerMessage& message);

}  // namespace brenvik::stores

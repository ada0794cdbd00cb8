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

// What the helper and the store worker say to each other. Each request has one answer, and the next one comes
// after it. Encoding throws std::bad_alloc, and so does decoding; what does not have the form is nothing.
namespace brenvik::stores {

inline constexpr const char* kService = "com.norvale.brenvik.mobile-helper.stores";
inline constexpr const char* kProgram = "brenvik-store-worker";
inline constexpr const char* kVoicemailFile = "voicemail.db";
inline constexpr const char* kContactsFile = "contacts.db";

// The sorts of channels: the voicemail store, for as long as the helper likes; one manager of contacts.
enum class Work : std::uint32_t { voicemail = 1, contacts = 2 };

// The longest description of an error that travels: a line of the log is cut there, too.
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

// To the voicemail store. With one descriptor: from now on its folder is this one.
struct VoicemailRequest {
  Operation operation = Operation::readToken;
  std::uint32_t serial = 0;  // the answer has the same
  bool insists = false;  // do it although the file is not the account's: then it fails, and that is logged
  std::string key;
  std::string token;
};
enum class VoicemailOutcome : std::uint32_t {
  done = 1,  // or the store has logged why not
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

// To a manager of contacts: first its folder (kOpenContacts, with the descriptor), then remaps.
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

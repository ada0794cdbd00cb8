// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/stores/StoreMessages.h"

#include "platform/worker/WorkerFields.h"

namespace brenvik::stores {
namespace {

constexpr std::uint32_t kRemapAnswer = 3;

}  // namespace

WorkerMessage encode(const VoicemailRequest& request) {
  WorkerMessage message;
  message.kind = static_cast<std::uint32_t>(request.operation);
  message.payload =
      FieldWriter().u32(request.serial).boolean(request.insists).text(request.key).text(request.token).take();
  return message;
}

std::optional<VoicemailRequest> decodeVoicemailRequest(const WorkerMessage& message) {
  if (message.kind < static_cast<std::uint32_t>(Operation::setToken) ||
      message.kind > static_cast<std::uint32_t>(Operation::readTokenForKey) ||
      message.descriptors.size() > 1) {
    return std::nullopt;
  }
  FieldReader reader(message.payload);
  VoicemailRequest request;
  request.operation = static_cast<Operation>(message.kind);
  request.serial = reader.u32();
  request.insists = reader.boolean();
  request.key = reader.text();
  request.token = reader.text();
  if (!reader.whole()) return std::nullopt;
  return request;
}

WorkerMessage encode(const VoicemailAnswer& answer) {
  WorkerMessage message;
  message.kind = static_cast<std::uint32_t>(answer.outcome);
  message.payload = FieldWriter().u32(answer.serial).optionalText(answer.token).take();
  return message;
}

std::optional<VoicemailAnswer> decodeVoicemailAnswer(const WorkerMessage& message) {
  if (message.kind < static_cast<std::uint32_t>(VoicemailOutcome::done) ||
      message.kind > static_cast<std::uint32_t>(VoicemailOutcome::notAllowed) ||
      !message.descriptors.empty()) {
    return std::nullopt;
  }
  FieldReader reader(message.payload);
  VoicemailAnswer answer;
  answer.outcome = static_cast<VoicemailOutcome>(message.kind);
  answer.serial = reader.u32();
  if (const auto token = reader.optionalText()) answer.token.emplace(*token);
  if (!reader.whole() || (answer.token && answer.outcome != VoicemailOutcome::done)) return std::nullopt;
  return answer;
}

WorkerMessage encode(ContactsOutcome outcome) {
  WorkerMessage message;
  message.kind = static_cast<std::uint32_t>(outcome);
  return message;
}

std::optional<ContactsOutcome> decodeContactsOutcome(const WorkerMessage& message) noexcept {
  if (message.kind < static_cast<std::uint32_t>(ContactsOutcome::open) ||
      message.kind > static_cast<std::uint32_t>(ContactsOutcome::outOfMemory) || !message.payload.empty() ||
      !message.descriptors.empty()) {
    return std::nullopt;
  }
  return static_cast<ContactsOutcome>(message.kind);
}

WorkerMessage encode(const RemapRequest& request) {
  WorkerMessage message;
  message.kind = kRemap;
  message.payload = FieldWriter().text(request.from).text(request.to).take();
  return message;
}

std::optional<RemapRequest> decodeRemapRequest(const WorkerMessage& message) {
  if (message.kind != kRemap || !message.descriptors.empty()) return std::nullopt;
  FieldReader reader(message.payload);
  RemapRequest request;
  request.from = reader.text();
  request.to = reader.text();
  if (!reader.whole()) return std::nullopt;
  return request;
}

WorkerMessage encode(const RemapAnswer& answer) {
  WorkerMessage message;
  message.kind = kRemapAnswer;
  std::optional<std::string> error = answer.error;
  if (error && error->size() > kLongestDescription) error->resize(kLongestDescription);
  message.payload = FieldWriter().boolean(answer.done).optionalText(error).take();
  return message;
}

std::optional<RemapAnswer> decodeRemapAnswer(const WorkerMessage& message) {
  if (message.kind != kRemapAnswer || !message.descriptors.empty()) return std::nullopt;
  FieldReader reader(message.payload);
  RemapAnswer answer;
  answer.done = reader.boolean();
  if (const auto error = reader.optionalText()) answer.error.emplace(*error);
  if (!reader.whole() || (answer.error && (answer.done || answer.error->size() > kLongestDescription))) {
    return std::nullopt;
  }
  return answer;
}

}  // namespace brenvik::stores

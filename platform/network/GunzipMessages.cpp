// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/network/GunzipMessages.h"

#include "platform/network/ErrorNumbers.h"
#include "platform/worker/WorkerFields.h"

namespace brenvik {

std::vector<std::byte> encode(const GunzipQuestion& question) {
  return FieldWriter().u64(question.inputSize).u64(question.room).u64(question.largestOutput).take();
}

std::optional<GunzipQuestion> decodeGunzipQuestion(std::span<const std::byte> payload) {
  FieldReader from(payload);
  GunzipQuestion question;
  question.inputSize = from.u64();
  question.room = from.u64();
  question.largestOutput = from.u64();
  if (!from.whole() || question.room > question.largestOutput) return std::nullopt;
  return question;
}

std::vector<std::byte> encode(const GunzipOutcome& outcome) {
  FieldWriter to;
  to.u32(static_cast<std::uint32_t>(outcome.result)).u64(outcome.size);
  return to.u32(static_cast<std::uint32_t>(outcome.writeError)).take();
}

std::optional<GunzipOutcome> decodeGunzipOutcome(std::span<const std::byte> payload,
                                                 const GunzipQuestion& question) {
  FieldReader from(payload);
  GunzipOutcome outcome;
  const auto result = from.u32();
  outcome.size = from.u64();
  const auto error = from.u32();
  if (!from.whole() || result > static_cast<std::uint32_t>(GunzipResult::unavailable)) return std::nullopt;
  outcome.result = static_cast<GunzipResult>(result);
  // A write that failed has a reason, and nothing else has.
  if (outcome.size > question.largestOutput || !isErrorNumber(error)) return std::nullopt;
  if ((outcome.result == GunzipResult::refused) != (error != 0)) return std::nullopt;
  outcome.writeError = static_cast<int>(error);
  return outcome;
}

}  // namespace brenvik

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
//
// Any answers of the caller worker: its kind, and its payload. What is taken for an answer can be sent again,
// and is no question.
#include <cstddef>
#include <cstdint>
#include <cstdlib>

#include "platform/security/linux/CallerFacts.h"

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  using namespace brenvik;
  if (size == 0) return 0;
  WorkerMessage answer;
  answer.kind = data[0];
  const auto* const bytes = reinterpret_cast<const std::byte*>(data);
  answer.payload.assign(bytes + 1, bytes + size);
  if (callers::isQuestion(answer)) std::abort();  // without a folder
  const auto facts = callers::decode(answer);
  if (facts && callers::encode(*facts).payload != answer.payload) std::abort();
  return 0;
}

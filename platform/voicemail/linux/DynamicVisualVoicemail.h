// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <string>

#include "platform/voicemail/VisualVoicemail.h"

namespace brenvik {

// Finds the query in a shared library with dlopen(3), lazily bound and never closed.
class DynamicVisualVoicemail final : public VisualVoicemailLibrary {
 public:
  // The symbol as the library's export list spells it, leading underscore included.
  DynamicVisualVoicemail(std::string library, std::string symbol)
      : library_(std::move(library)), symbol_(std::move(symbol)) {}
  SubscriptionQuery lookUpSubscriptionQuery() noexcept override;

 private:
  const std::string library_;
  const std::string symbol_;
};

}  // namespace brenvik

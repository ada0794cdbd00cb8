// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

namespace brenvik {

// Asks the visual voicemail service whether the user is subscribed.
using SubscriptionQuery = bool (*)();

// The visual voicemail library, which a system may lack.
class VisualVoicemailLibrary {
 public:
  virtual ~VisualVoicemailLibrary() = default;
  // Loads the library for the life of the process and finds its query; returns null if either is missing. Any
  // thread.
  virtual SubscriptionQuery lookUpSubscriptionQuery() noexcept = 0;
};

}  // namespace brenvik

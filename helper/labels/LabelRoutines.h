// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <cstdint>

#include "platform/ipc/OutOfLinePayload.h"
#include "platform/ipc/RegionAllocator.h"
#include "platform/labeler/SubscriptionLabeler.h"
#include "platform/plist/PropertyList.h"

namespace brenvik {

// The two label requests: texts for subscription labels in a user's language. Main loop only.
class LabelRoutines {
 public:
  // Both must outlive the object.
  LabelRoutines(SubscriptionLabeler& labeler, RegionAllocator& regions) noexcept
      : labeler_(labeler), regions_(regions) {}

  // `labels` and `languages` are serialized property lists (XML or binary) that must be arrays; lengths in
  // bytes. On success the payload is the labeler's answer as an XML property list, which the caller must
  // release. On failure the payload is empty and the result is kern::failure or the allocator's code. The
  // bytes are read only during the call.
  //
  // Returns short forms. Labels come in pairs of a key of the vocabulary and a text; the text is used only if
  // the key is empty, and is then a user's own label.
  KernelReturn copyBadgeLabels(const void* labels, std::uint32_t labelsLength, const void* languages,
                               std::uint32_t languagesLength, OutOfLinePayload* payload) noexcept;
  // Returns the names of predefined labels. Labels are keys of the vocabulary.
  KernelReturn copyLocalizedLabels(const void* labels, std::uint32_t labelsLength, const void* languages,
                                   std::uint32_t languagesLength, OutOfLinePayload* payload) noexcept;

  // The labeler's answers to the decoded arrays; no value if it has none.
  PropertyList getLocalizedBadgeLabelsForUnlocalizedLabels(const PropertyList& labels,
                                                           const PropertyList& languages) noexcept;
  PropertyList getLocalizedPredefinedLabels(const PropertyList& labels,
                                            const PropertyList& languages) noexcept;

 private:
  SubscriptionLabeler& labeler_;
  RegionAllocator& regions_;
};

}  // namespace brenvik

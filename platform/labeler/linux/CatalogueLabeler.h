// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include "platform/labeler/SubscriptionLabeler.h"

namespace brenvik {

// The labeler that uses the catalogues compiled into the program. It has no state; making one costs nothing.
class CatalogueLabeler final : public SubscriptionLabeler {
 public:
  PropertyList localizedBadgeLabels(const PropertyList& labels, const PropertyList& languages) override;
  PropertyList localizedLabels(const PropertyList& labels, const PropertyList& languages) override;
};

}  // namespace brenvik

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <string_view>

#include "platform/plist/PropertyList.h"

namespace brenvik {

// The labeler's identifiers of the predefined labels. They are in the system's name space, so that nobody's
// own label is mistaken for one.
namespace label_identifier {
inline constexpr std::string_view primary = "com.norvale.subscription-label.primary";
inline constexpr std::string_view secondary = "com.norvale.subscription-label.secondary";
inline constexpr std::string_view personal = "com.norvale.subscription-label.personal";
inline constexpr std::string_view business = "com.norvale.subscription-label.business";
inline constexpr std::string_view travel = "com.norvale.subscription-label.travel";
inline constexpr std::string_view data = "com.norvale.subscription-label.data";
}  // namespace label_identifier

// The platform's source of subscription labels in a user's language. Both operations take an array of texts
// and an array of language identifiers (BCP 47, the preferred one first). They return an array of texts, or
// no value on failure. Elements of either array that are not texts are ignored: the result has one element
// for each text among the labels, in their order. If no language is known, the result is in English. The same
// arguments give the same result. Any thread. Both throw std::bad_alloc.
class SubscriptionLabeler {
 public:
  virtual ~SubscriptionLabeler() = default;

  // Returns short forms of the labels (identifiers above, or a user's own texts): one to three grapheme
  // clusters each, no two of one result alike. No value if there are more labels than such forms.
  virtual PropertyList localizedBadgeLabels(const PropertyList& labels, const PropertyList& languages) = 0;

  // Returns the labels' names. A text that is not an identifier is its own name. `languages` may be no value.
  virtual PropertyList localizedLabels(const PropertyList& labels, const PropertyList& languages) = 0;
};

}  // namespace brenvik

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "helper/labels/LabelVocabulary.h"

#include <array>
#include <utility>

#include "platform/labeler/SubscriptionLabeler.h"

namespace brenvik {
namespace {

using Vocabulary = std::array<std::pair<PropertyList, PropertyList>, 6>;

const Vocabulary& vocabulary() {
  static const Vocabulary table{{
      {PropertyList::string("USER_LABEL_PRIMARY"), PropertyList::string(label_identifier::primary)},
      {PropertyList::string("USER_LABEL_SECONDARY"), PropertyList::string(label_identifier::secondary)},
      {PropertyList::string("USER_LABEL_PERSONAL"), PropertyList::string(label_identifier::personal)},
      {PropertyList::string("USER_LABEL_BUSINESS"), PropertyList::string(label_identifier::business)},
      {PropertyList::string("USER_LABEL_TRAVEL"), PropertyList::string(label_identifier::travel)},
      {PropertyList::string("USER_LABEL_CELL_DATA"), PropertyList::string(label_identifier::data)},
  }};
  return table;
}

}  // namespace

PropertyList labelIdentifierForKey(std::string_view key) {
  for (const auto& [known, identifier] : vocabulary()) {
    if (known.asString() == key) return identifier;
  }
  return {};
}

}  // namespace brenvik

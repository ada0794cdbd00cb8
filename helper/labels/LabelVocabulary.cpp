// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "helper/labels/LabelVocabulary.h"

#include <array>
#include <new>
#include <utility>

#include "platform/labeler/SubscriptionLabeler.h"

namespace brenvik {
namespace {

PropertyList text(std::string_view utf8) {
  PropertyList value = PropertyList::string(utf8);
  // Half a table must not become the table.
  if (!value.hasValue()) throw std::bad_alloc();
  return value;
}

using Vocabulary = std::array<std::pair<PropertyList, PropertyList>, 6>;

const Vocabulary& vocabulary() {
  static const Vocabulary table{{
      {text("USER_LABEL_PRIMARY"), text(label_identifier::primary)},
      {text("USER_LABEL_SECONDARY"), text(label_identifier::secondary)},
      {text("USER_LABEL_PERSONAL"), text(label_identifier::personal)},
      {text("USER_LABEL_BUSINESS"), text(label_identifier::business)},
      {text("USER_LABEL_TRAVEL"), text(label_identifier::travel)},
      {text("USER_LABEL_CELL_DATA"), text(label_identifier::data)},
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

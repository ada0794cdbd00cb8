// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/labeler/linux/CatalogueLabeler.h"

#include <array>
#include <optional>
#include <utility>
#include <vector>

#include "platform/labeler/linux/Badges.h"
#include "platform/labeler/linux/Catalogue.h"

namespace brenvik {
namespace {

constexpr std::pair<std::string_view, Label> kIdentifiers[] = {
    {label_identifier::primary, Label::primary},   {label_identifier::secondary, Label::secondary},
    {label_identifier::personal, Label::personal}, {label_identifier::business, Label::business},
    {label_identifier::travel, Label::travel},     {label_identifier::data, Label::data},
};
static_assert(std::size(kIdentifiers) == kLabelCount);

// The first language of the list that any catalogue serves, each range followed to its end before the next.
LabelCatalogue catalogueFor(const PropertyList& languages) noexcept {
  for (std::size_t i = 0; i < languages.size(); ++i) {
    const std::optional<std::string_view> range = languages.at(i).asString();
    if (!range.has_value()) continue;
    if (const catalogue::Catalogue* const found = LabelCatalogue::find(*range)) return LabelCatalogue(*found);
  }
  return {};
}

// The predefined label that an identifier stands for; nothing for a user's own text.
std::optional<Label> labelOf(std::string_view text) noexcept {
  for (const auto& [identifier, predefined] : kIdentifiers) {
    if (text == identifier) return predefined;
  }
  return std::nullopt;
}

// Calls `make` with each label that is a text and gathers what it returns; no value as soon as that is none.
template <class Make>
PropertyList textsFor(const PropertyList& labels, const Make& make) {
  std::vector<PropertyList> texts;
  texts.reserve(labels.size());
  for (std::size_t i = 0; i < labels.size(); ++i) {
    const PropertyList label = labels.at(i);
    const std::optional<std::string_view> text = label.asString();
    if (!text.has_value()) continue;
    PropertyList made = make(label, *text);
    if (!made.hasValue()) return {};
    texts.push_back(std::move(made));
  }
  return PropertyList::array(std::move(texts));
}

}  // namespace

PropertyList CatalogueLabeler::localizedBadgeLabels(const PropertyList& labels,
                                                    const PropertyList& languages) {
  const LabelCatalogue catalogue = catalogueFor(languages);
  Badges badges(catalogue.language());
  return textsFor(labels, [&](const PropertyList&, std::string_view text) {
    const std::optional<Label> predefined = labelOf(text);
    const std::optional<std::string> badge = badges.make(predefined ? catalogue.text(*predefined) : text);
    return badge.has_value() ? PropertyList::string(*badge) : PropertyList();
  });
}

PropertyList CatalogueLabeler::localizedLabels(const PropertyList& labels, const PropertyList& languages) {
  const LabelCatalogue catalogue = catalogueFor(languages);
  std::array<PropertyList, kLabelCount> names;  // one value for all labels alike, however many a client sends
  return textsFor(labels, [&](const PropertyList& label, std::string_view text) {
    const std::optional<Label> predefined = labelOf(text);
    if (!predefined) return label;
    PropertyList& name = names[static_cast<std::size_t>(*predefined)];
    if (!name.hasValue()) name = PropertyList::string(catalogue.text(*predefined));
    return name;
  });
}

}  // namespace brenvik

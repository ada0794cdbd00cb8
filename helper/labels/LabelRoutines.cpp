// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "helper/labels/LabelRoutines.h"

#include <cstddef>
#include <new>
#include <optional>
#include <span>
#include <string>
#include <utility>
#include <vector>

#include "helper/labels/LabelVocabulary.h"
#include "platform/log/Log.h"
#include "platform/plist/PropertyListCodec.h"

namespace brenvik {
namespace {

struct FieldTexts {
  const char* cannotDecode;
  const char* cannotBuild;
  const char* invalidType;
};

constexpr FieldTexts kBadgeLabelsField{"CopyBadgeLabels, cannot decode 'labels' field",
                                       "CopyBadgeLabels, cannot build labels from data",
                                       "CopyBadgeLabels, invalid type of 'labels' field"};
constexpr FieldTexts kBadgeLanguagesField{"CopyBadgeLabels, cannot decode 'languages' field",
                                          "CopyBadgeLabels, cannot build languages from data",
                                          "CopyBadgeLabels, invalid type of 'languages' field"};
constexpr FieldTexts kLocalizedLabelsField{"CopyLocalizedLabels, cannot decode 'labels' field",
                                           "CopyLocalizedLabels, cannot build labels from data",
                                           "CopyLocalizedLabels, invalid type of 'labels' field"};
constexpr FieldTexts kLocalizedLanguagesField{"CopyLocalizedLabels, cannot decode 'languages' field",
                                              "CopyLocalizedLabels, cannot build languages from data",
                                              "CopyLocalizedLabels, invalid type of 'languages' field"};

// The bytes in place, or nothing when there should be some and are none.
std::optional<std::span<const std::byte>> wrap(const void* bytes, std::uint32_t length) noexcept {
  if (bytes == nullptr && length != 0) return std::nullopt;
  return std::span(static_cast<const std::byte*>(bytes), length);
}

// The array that a field of the request holds; no value, and a line in the log, when it holds none.
PropertyList decodeArray(const void* bytes, std::uint32_t length, const FieldTexts& texts) noexcept {
  const auto data = wrap(bytes, length);
  if (!data.has_value()) {
    logUnified(LogLevel::error, "%s", texts.cannotDecode);
    return {};
  }
  PropertyList value;
  try {
    value = parsePropertyList(*data);
  } catch (const std::bad_alloc&) {
    // It cannot be built, as the line says.
  }
  if (!value.hasValue()) {
    logUnified(LogLevel::error, "%s", texts.cannotBuild);
    return {};
  }
  if (!value.is(PropertyList::Type::array)) {
    logUnified(LogLevel::error, "%s", texts.invalidType);
    return {};
  }
  return value;
}

// Leaves the result as XML in a fresh region. `refused` writes the line for a region that could not be had.
KernelReturn handOver(const PropertyList& result, RegionAllocator& regions, OutOfLinePayload* payload,
                      void (*refused)(int length)) noexcept try {
  if (!result.hasValue()) return kern::failure;
  const std::optional<std::string> xml = serializePropertyList(result, PropertyListFormat::xml);
  if (!xml.has_value() || xml->empty()) return kern::failure;
  const KernelReturn code = fillPayload(regions, *xml, payload);
  if (code != kern::success) {
    refused(static_cast<int>(xml->size()));
    // A call that fails returns no length.
    *payload = {};
  }
  return code;
} catch (const std::bad_alloc&) {
  return kern::failure;
}

}  // namespace

KernelReturn LabelRoutines::copyBadgeLabels(const void* labels, std::uint32_t labelsLength,
                                            const void* languages, std::uint32_t languagesLength,
                                            OutOfLinePayload* payload) noexcept {
  *payload = {};
  logUnified(LogLevel::standard, "CopyBadgeLabels, compiling badge labels. labels len:%d, languages len:%d",
             static_cast<int>(labelsLength), static_cast<int>(languagesLength));
  const PropertyList labelArray = decodeArray(labels, labelsLength, kBadgeLabelsField);
  if (!labelArray.hasValue()) return kern::failure;
  const PropertyList languageArray = decodeArray(languages, languagesLength, kBadgeLanguagesField);
  if (!languageArray.hasValue()) return kern::failure;
  return handOver(getLocalizedBadgeLabelsForUnlocalizedLabels(labelArray, languageArray), regions_, payload,
                  [](int length) {
                    logUnified(LogLevel::error, "CopyBadgeLabels, Could not allocate %d bytes for payload",
                               length);
                  });
}

KernelReturn LabelRoutines::copyLocalizedLabels(const void* labels, std::uint32_t labelsLength,
                                                const void* languages, std::uint32_t languagesLength,
                                                OutOfLinePayload* payload) noexcept {
  *payload = {};
  logUnified(LogLevel::standard,
             "CopyLocalizedLabels, compiling localized labels. labels len:%d, languages len:%d",
             static_cast<int>(labelsLength), static_cast<int>(languagesLength));
  const PropertyList labelArray = decodeArray(labels, labelsLength, kLocalizedLabelsField);
  if (!labelArray.hasValue()) return kern::failure;
  const PropertyList languageArray = decodeArray(languages, languagesLength, kLocalizedLanguagesField);
  if (!languageArray.hasValue()) return kern::failure;
  return handOver(getLocalizedPredefinedLabels(labelArray, languageArray), regions_, payload, [](int length) {
    logUnified(LogLevel::error, "CopyLocalizedLabels, Could not allocate %d bytes for payload", length);
  });
}

PropertyList LabelRoutines::getLocalizedBadgeLabelsForUnlocalizedLabels(
    const PropertyList& labels, const PropertyList& languages) noexcept {
  try {
    std::vector<PropertyList> wanted;
    wanted.reserve(labels.size() / 2);
    for (std::size_t i = 0; i < labels.size(); ++i) {
      const PropertyList element = labels.at(i);
      const std::optional<std::string_view> key = element.asString();
      if (!key.has_value()) {
        logUnified(LogLevel::error, "invalid object in array - ignore the rest");
        break;
      }
      ++i;  // to the pair's text
      if (key->empty()) {
        // As it stands, whatever it is: the labeler passes over what is no text. An empty key at the very end
        // has no text and adds nothing.
        if (i < labels.size()) wanted.push_back(labels.at(i));
      } else if (PropertyList identifier = labelIdentifierForKey(*key); identifier.hasValue()) {
        wanted.push_back(std::move(identifier));
      }
      // A key that is not in the vocabulary is skipped together with its text: one label that this version
      // does not know does not cost the caller the others.
    }
    if (wanted.empty()) {
      logUnified(LogLevel::error, "no labels given");
      return {};
    }
    logUnified(LogLevel::standard, "getLocalizedBadgeLabelsForUnlocalizedLabels, %zu label(s)",
               wanted.size());
    return labeler_.localizedBadgeLabels(PropertyList::array(wanted), languages);
  } catch (const std::bad_alloc&) {
    return {};
  }
}

PropertyList LabelRoutines::getLocalizedPredefinedLabels(const PropertyList& labels,
                                                         const PropertyList& languages) noexcept {
  try {
    logUnified(LogLevel::standard, "getLocalizedPredefinedLabels, %zu label(s), %zu language(s)",
               labels.size(), languages.size());
    std::vector<PropertyList> wanted;
    wanted.reserve(labels.size());
    for (std::size_t i = 0; i < labels.size(); ++i) {
      const std::optional<std::string_view> key = labels.at(i).asString();
      // Skipped, as above: what is no text, and a key that is not in the vocabulary.
      if (!key.has_value()) continue;
      if (PropertyList identifier = labelIdentifierForKey(*key); identifier.hasValue()) {
        wanted.push_back(std::move(identifier));
      }
    }
    // No labels are not an error here, unlike above: the caller gets an empty array.
    return labeler_.localizedLabels(PropertyList::array(wanted),
                                    languages.size() == 0 ? PropertyList() : languages);
  } catch (const std::bad_alloc&) {
    return {};
  }
}

}  // namespace brenvik

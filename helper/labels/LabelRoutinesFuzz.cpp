// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
//
// Both label requests with foreign property lists. The first byte of the input chooses the request, the next
// two (little-endian) say how many of those that follow are the labels; the rest are the languages.
#include <cstdint>
#include <cstdlib>
#include <set>
#include <string_view>

#include "helper/labels/LabelRoutines.h"
#include "platform/ipc/fakes/HeapRegions.h"
#include "platform/labeler/linux/CatalogueLabeler.h"
#include "platform/plist/PropertyListCodec.h"

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size);

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  using namespace brenvik;
  if (size < 3) return 0;
  const bool badges = (data[0] & 1) != 0;
  const std::string_view input(reinterpret_cast<const char*>(data) + 3, size - 3);
  const std::string_view labels = input.substr(0, data[1] + std::size_t{256} * data[2]);
  const std::string_view languages = input.substr(labels.size());

  CatalogueLabeler labeler;
  HeapRegions regions;
  LabelRoutines routines(labeler, regions);
  OutOfLinePayload payload;
  const auto method = badges ? &LabelRoutines::copyBadgeLabels : &LabelRoutines::copyLocalizedLabels;
  const KernelReturn code =
      (routines.*method)(labels.data(), static_cast<std::uint32_t>(labels.size()), languages.data(),
                         static_cast<std::uint32_t>(languages.size()), &payload);
  if (code != kern::success) {
    if (payload.address != nullptr || payload.length != 0 || regions.live() != 0) std::abort();
    return 0;
  }
  // What was answered is an array of texts, and of badges no two are alike and none is empty.
  const PropertyList answer =
      parsePropertyList({static_cast<const std::byte*>(payload.address), payload.length});
  if (!answer.is(PropertyList::Type::array)) std::abort();
  std::set<std::string_view> seen;
  for (std::size_t i = 0; i < answer.size(); ++i) {
    const PropertyList element = answer.at(i);
    if (!element.is(PropertyList::Type::string)) std::abort();
    const std::string_view text = element.asString().value_or("");
    if (badges && (text.empty() || !seen.insert(text).second)) std::abort();
  }
  return 0;
}

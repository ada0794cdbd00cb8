// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include <cstdint>
#include <cstdlib>
#include <span>

#include "helper/lasd/DatabaseInstaller.h"
#include "helper/lasd/DatabaseTypes.h"
#include "helper/lasd/LASDUpdater.h"
#include "helper/lasd/VersionText.h"
#include "platform/plist/PropertyListCodec.h"

using namespace brenvik;

// What an update server sends as its manifest, compared with nothing and then with itself.
extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  const PropertyList manifest = parsePropertyList(std::as_bytes(std::span(data, size)));
  LASDUpdater updater;
  for (const std::int32_t type : kDatabaseTypesInOrder)
    (void)updater.isUpToDate(manifest, type);  // makes entries
  const std::int64_t first = updater.compareWithManifest(manifest, ~0U);
  if ((first & ~std::int64_t{31}) != 0) std::abort();
  const std::int64_t second = updater.compareWithManifest(manifest, ~0U);
  if ((second & ~first) != 0) std::abort();  // an entry that was just taken over cannot become newer
  for (const std::int32_t type : kDatabaseTypesInOrder) {
    const PropertyList entry = manifest.find(keyOfDatabaseType(type));
    const PropertyList version = entry.find(kVersionKey);
    if (const auto text = version.asString(); text && !sameVersion(*text, *text)) std::abort();
    const PropertyList url = entry.find(kContentUrlKey);
    if (const auto text = url.asString()) {
      const std::string name = databaseFileName(std::string(*text));
      if (name.find('/') != std::string::npos || name == "..") std::abort();
    }
  }
  return 0;
}

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <span>
#include <string>

#include "platform/plist/EditableDictionary.h"
#include "platform/plist/PropertyListCodec.h"

namespace {

using namespace brenvik;

PropertyList parse(std::string_view bytes) { return parsePropertyList(std::as_bytes(std::span(bytes))); }

std::string contentOf(EditableDictionary& edited) {
  const auto pieces = edited.content();
  return std::string(pieces[0]) + std::string(pieces[1]);
}

void require(bool holds) {
  if (!holds) std::abort();
}

}  // namespace

// The bytes as a domain's file: it is taken over, changed and read back. What was not changed stays, and what
// comes out is always a file that the reader takes.
extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  const PropertyList before = parsePropertyList(std::as_bytes(std::span(data, size)));
  if (!before.is(PropertyList::Type::dictionary)) return 0;
  auto edited = EditableDictionary::of(before);
  if (!edited) return 0;
  require(parse(contentOf(*edited)) == before);

  // Each value moves to a new key, the old one gets another value or goes.
  PropertyList expected = before;
  for (std::size_t i = 0; i < before.size() && i < 64; ++i) {
    const std::string key(before.keyAt(i));
    const PropertyList value = before.at(i);
    require(edited->find(key) == expected.find(key));
    const auto change = [&](const std::string& name, const PropertyList& to) {
      if (edited->set(name, to) != EditableDictionary::Change::refused)
        expected = expected.withEntry(name, to);
    };
    change(key + "'", value);
    change(key, i % 3 == 0 ? PropertyList() : i % 3 == 1 ? PropertyList::string("other") : before);
  }
  require(parse(contentOf(*edited)) == expected);
  return 0;
}

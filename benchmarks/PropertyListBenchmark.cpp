// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
//
// Both codecs beside libplist's, on one mixed document of 1 MiB as XML. Reading includes destroying what was
// read, on both sides.
#include <plist/plist.h>

#include <cstdlib>
#include <random>

#include "Ratios.h"
#include "platform/plist/PropertyListCodec.h"

namespace brenvik {
namespace {

// Records as a carrier's settings have them: short texts, numbers, flags, dates, some data, some nesting.
// Keys repeat from record to record and most values do not. The same bytes at every run: mt19937_64 is
// specified to the bit, and its distributions are not used.
PropertyList mixedDocument() {
  std::mt19937_64 random(20240229);
  auto below = [&random](std::uint64_t limit) { return random() % limit; };
  auto text = [&](std::size_t longest) {
    static constexpr std::string_view kLetters =
        "abcdefghijklmnopqrstuvwxyz ABCDEFGHIJKLMNOPQRSTUVWXYZ0123456789-_./&<";
    std::string letters;
    for (std::size_t length = 4 + below(longest); letters.size() < length;) {
      if (below(60) == 0) {
        letters += "\xC3\xBC";
      } else {
        letters += kLetters[below(kLetters.size())];
      }
    }
    return PropertyList::string(letters);
  };
  std::vector<std::pair<std::string, PropertyList>> records;
  std::size_t size = 0;
  while (size < (std::size_t{1} << 20)) {
    std::vector<PropertyList> ports;
    for (std::uint64_t count = below(8); count > 0; --count) {
      ports.push_back(PropertyList::integer(static_cast<std::int64_t>(below(65536))));
    }
    std::string blob;
    for (std::uint64_t count = below(120); count > 0; --count) blob += static_cast<char>(random());
    PropertyList record = PropertyList::dictionary(
        {{"Name", text(24)},
         {"Description", text(120)},
         {"Identifier", PropertyList::integer(static_cast<std::int64_t>(random() >> 12))},
         {"Enabled", PropertyList::boolean(below(2) == 0)},
         {"SupportsRoaming", PropertyList::boolean(below(2) == 0)},
         {"SignalThreshold", PropertyList::real(-static_cast<double>(below(120000)) / 1000)},
         {"LastUpdated", PropertyList::date(static_cast<double>(below(800000000)))},
         {"Ports", PropertyList::array(ports)},
         {"Certificate", PropertyList::data(std::as_bytes(std::span(blob)))},
         {"Gateway",
          PropertyList::dictionary({{"Address", text(20)},
                                    {"Port", PropertyList::integer(static_cast<std::int64_t>(below(65536)))},
                                    {"Protocols", PropertyList::array({text(6), text(6)})}})}});
    size += serializePropertyList(record, PropertyListFormat::xml).value().size() - 150;
    records.emplace_back("com.norvale.bundle." + std::to_string(records.size()), std::move(record));
  }
  return PropertyList::dictionary(records);
}

struct Documents {
  PropertyList value = mixedDocument();
  std::string xml = serializePropertyList(value, PropertyListFormat::xml).value();
  std::string binary = serializePropertyList(value, PropertyListFormat::binary).value();
  plist_t peer = nullptr;
  Documents() {
    ::plist_from_xml(xml.data(), static_cast<std::uint32_t>(xml.size()), &peer);
    // Both sides must mean the same document, or the times say nothing.
    char* bytes = nullptr;
    std::uint32_t length = 0;
    ::plist_to_xml(peer, &bytes, &length);
    if (!(parsePropertyList(std::as_bytes(std::span(bytes, length))) == value)) std::abort();
    ::plist_to_xml_free(bytes);
  }
};

const Documents& documents() {
  static const Documents all;
  return all;
}

void oursRead(benchmark::State& state, const std::string& document) {
  for (auto _ : state) {
    const PropertyList value = parsePropertyList(std::as_bytes(std::span(document)));
    if (!value) std::abort();
    benchmark::DoNotOptimize(value);
  }
}

void oursWrite(benchmark::State& state, PropertyListFormat format) {
  for (auto _ : state) {
    const auto document = serializePropertyList(documents().value, format);
    if (!document) std::abort();
    benchmark::DoNotOptimize(document->data());
  }
}

void oursXmlRead(benchmark::State& state) { oursRead(state, documents().xml); }
void oursBinaryRead(benchmark::State& state) { oursRead(state, documents().binary); }
void oursXmlWrite(benchmark::State& state) { oursWrite(state, PropertyListFormat::xml); }
void oursBinaryWrite(benchmark::State& state) { oursWrite(state, PropertyListFormat::binary); }

template <typename Parse>
void peerRead(benchmark::State& state, const std::string& document, Parse parse) {
  for (auto _ : state) {
    plist_t value = nullptr;
    parse(document.data(), static_cast<std::uint32_t>(document.size()), &value);
    if (value == nullptr) std::abort();
    ::plist_free(value);
  }
}

void peerXmlRead(benchmark::State& state) { peerRead(state, documents().xml, ::plist_from_xml); }
void peerBinaryRead(benchmark::State& state) { peerRead(state, documents().binary, ::plist_from_bin); }

template <typename Write, typename Free>
void peerWrite(benchmark::State& state, Write write, Free release) {
  for (auto _ : state) {
    char* document = nullptr;
    std::uint32_t length = 0;
    write(documents().peer, &document, &length);
    if (document == nullptr) std::abort();
    release(document);
  }
}

void peerXmlWrite(benchmark::State& state) { peerWrite(state, ::plist_to_xml, ::plist_to_xml_free); }
void peerBinaryWrite(benchmark::State& state) { peerWrite(state, ::plist_to_bin, ::plist_to_bin_free); }

BENCHMARK(oursXmlRead)->Unit(benchmark::kMicrosecond);
BENCHMARK(peerXmlRead)->Unit(benchmark::kMicrosecond);
BENCHMARK(oursXmlWrite)->Unit(benchmark::kMicrosecond);
BENCHMARK(peerXmlWrite)->Unit(benchmark::kMicrosecond);
BENCHMARK(oursBinaryRead)->Unit(benchmark::kMicrosecond);
BENCHMARK(peerBinaryRead)->Unit(benchmark::kMicrosecond);
BENCHMARK(oursBinaryWrite)->Unit(benchmark::kMicrosecond);
BENCHMARK(peerBinaryWrite)->Unit(benchmark::kMicrosecond);

}  // namespace
}  // namespace brenvik

int main(int argc, char** argv) {
  const auto& all = brenvik::documents();
  std::printf("document: %zu bytes as XML, %zu binary\n", all.xml.size(), all.binary.size());
  return brenvik::runAndCompare(argc, argv,
                                {{"XML read / libplist", "oursXmlRead", "peerXmlRead", 0.3},
                                 {"XML write / libplist", "oursXmlWrite", "peerXmlWrite", 0.4},
                                 {"binary read / libplist", "oursBinaryRead", "peerBinaryRead", 0.3},
                                 {"binary write / libplist", "oursBinaryWrite", "peerBinaryWrite", 0.3}});
}

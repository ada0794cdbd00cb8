// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <array>
#include <cstddef>
#include <cstdint>
#include <string_view>

namespace brenvik {

// The predefined labels, in the order of the compiled tables.
enum class Label : std::uint8_t { primary, secondary, personal, business, travel, data };
inline constexpr std::size_t kLabelCount = 6;

// The tables compiled from the .po files. They hold offsets, not pointers: constant pages that need neither
// relocation nor construction when the daemon starts.
namespace catalogue {

struct Text {
  std::uint16_t offset;  // into kTexts, bytes
  std::uint16_t size;    // bytes
};
struct Catalogue {
  char language[4];  // primary language subtag, NUL-padded
  std::array<Text, kLabelCount> texts;
};
struct ServedTag {
  char tag[16];  // lower case, NUL-padded
  std::uint8_t catalogue;
};

extern const std::size_t kCatalogueCount;
extern const std::size_t kServedTagCount;
extern const std::uint8_t kFallbackCatalogue;
extern const char kTexts[];
extern const Catalogue kCatalogues[];
extern const ServedTag kServedTags[];  // in the order of their tags

}  // namespace catalogue

// One language's labels. Cheap to copy; returned texts live as long as the program. Any thread.
class LabelCatalogue {
 public:
  // Finds the catalogue for one language range by RFC 4647 lookup (section 3.4), which shortens the range
  // subtag by subtag until a catalogue serves it. Ignores case; '_' counts as '-'. Returns null if no
  // catalogue serves it, and for "*" and malformed ranges.
  static const catalogue::Catalogue* find(std::string_view range) noexcept;

  // English, for a request none of whose languages is served.
  LabelCatalogue() noexcept : tables_(&catalogue::kCatalogues[catalogue::kFallbackCatalogue]) {}
  explicit LabelCatalogue(const catalogue::Catalogue& tables) noexcept : tables_(&tables) {}

  // Its ISO 639 code, NUL-terminated, which decides the rules for upper case.
  const char* language() const noexcept { return tables_->language; }
  std::string_view text(Label label) const noexcept {
    const catalogue::Text& text = tables_->texts[static_cast<std::size_t>(label)];
    return {catalogue::kTexts + text.offset, text.size};
  }

 private:
  const catalogue::Catalogue* tables_;
};

}  // namespace brenvik

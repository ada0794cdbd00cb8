// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/labeler/linux/Catalogue.h"

#include <algorithm>
#include <span>

namespace brenvik {
namespace {

constexpr std::size_t kLongestTag = sizeof(catalogue::ServedTag::tag) - 1;

// The subtags of a range that can matter, lower-cased. A malformed range gives an empty one.
class NormalizedRange {
 public:
  explicit NormalizedRange(std::string_view range) noexcept {
    std::size_t end = 0;  // of the last whole subtag that fits
    for (std::size_t i = 0; i < range.size(); ++i) {
      char c = range[i];
      if (c >= 'A' && c <= 'Z') c = static_cast<char>(c - 'A' + 'a');
      if (c == '_') c = '-';
      if (c != '-' && !(c >= 'a' && c <= 'z') && !(c >= '0' && c <= '9')) return;
      if (i > kLongestTag)
        continue;  // still looked at, so that a malformed range is refused whatever its length
      if (c == '-') end = i;
      if (i < kLongestTag) bytes_[i] = c;
    }
    size_ = range.size() <= kLongestTag ? range.size() : end;
  }
  std::string_view text() const noexcept { return {bytes_.data(), size_}; }

 private:
  std::array<char, kLongestTag> bytes_{};
  std::size_t size_ = 0;
};

}  // namespace

const catalogue::Catalogue* LabelCatalogue::find(std::string_view range) noexcept {
  const NormalizedRange normalized(range);
  const std::span tags(catalogue::kServedTags, catalogue::kServedTagCount);
  // A singleton (the "x" of a private range, the "u" of an extension) goes together with what follows it; no
  // served tag has one, so leaving it standing for one more round finds nothing either.
  for (std::string_view wanted = normalized.text(); !wanted.empty();) {
    const auto found = std::lower_bound(tags.begin(), tags.end(), wanted,
                                        [](const catalogue::ServedTag& served, std::string_view tag) {
                                          return std::string_view(served.tag) < tag;
                                        });
    if (found != tags.end() && wanted == found->tag) return &catalogue::kCatalogues[found->catalogue];
    const std::size_t cut = wanted.rfind('-');
    wanted = wanted.substr(0, cut == std::string_view::npos ? 0 : cut);
  }
  return nullptr;
}

}  // namespace brenvik

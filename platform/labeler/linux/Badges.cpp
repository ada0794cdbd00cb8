// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/labeler/linux/Badges.h"

#include <unictype.h>
#include <unigbrk.h>
#include <unistr.h>

#include <algorithm>
#include <array>
#include <cstddef>
#include <vector>

#include "platform/labeler/linux/Uppercase.h"

namespace brenvik {
namespace {

constexpr std::size_t kLongestBadge = 3;  // grapheme clusters

// A label is whatever a client sends, and one cluster may hold any number of combining marks. No cluster that
// people write comes near these limits (the longest emoji sequences have 10 characters), and the tables of
// libunistring are not asked about megabytes.
constexpr std::size_t kLargestCluster = 32;   // characters
constexpr std::size_t kLargestWindow = 1024;  // bytes

constexpr int kLargestOwnNumber = 99;

const std::uint8_t* bytesOf(std::string_view text) noexcept {
  return reinterpret_cast<const std::uint8_t*>(text.data());
}

// The first character of a text that is not empty, and its size in bytes.
ucs4_t firstCharacter(std::string_view text, std::size_t* size) noexcept {
  ucs4_t c = 0;
  const int count = u8_mbtouc(&c, bytesOf(text), text.size());
  *size = count > 0 ? static_cast<std::size_t>(count) : 1;
  return c;
}

// A person sees something of it. Control characters and noncharacters could not even be said in the reply.
bool isVisible(ucs4_t c) noexcept {
  if (c > 0x20 && c < 0x7F) return true;
  return c > 0x9F && (c & 0xFFFE) != 0xFFFE && !(c >= 0xFDD0 && c <= 0xFDEF) &&
         !uc_is_property_white_space(c) && !uc_is_property_default_ignorable_code_point(c);
}

bool isVisible(std::string_view cluster) noexcept {
  while (!cluster.empty()) {
    std::size_t size = 0;
    if (isVisible(firstCharacter(cluster, &size))) return true;
    cluster.remove_prefix(size);
  }
  return false;
}

std::string_view cutCluster(std::string_view cluster) noexcept {
  std::size_t end = 0;
  for (std::size_t count = 0; count < kLargestCluster && end < cluster.size(); ++count) {
    std::size_t size = 0;
    (void)firstCharacter(cluster.substr(end), &size);
    end += size;
  }
  return cluster.substr(0, end);
}

// Whether a virama joins consonants of the script: the six Indic scripts of UAX 29's rule GB9c.
bool isJoiningVirama(ucs4_t c) noexcept {
  switch (c) {
    case 0x094D:
    case 0x09CD:
    case 0x0ACD:
    case 0x0B4D:
    case 0x0C4D:
    case 0x0D4D:
      return true;
    default:
      return false;
  }
}

bool isJoiningConsonant(ucs4_t c) noexcept {
  if (c < 0x0900 || c > 0x0D7F) return false;
  // The blocks follow one plan; places that a script leaves unassigned do no harm.
  switch (c & ~ucs4_t{0x7F}) {
    case 0x0900:  // Devanagari
      return (c >= 0x0915 && c <= 0x0939) || (c >= 0x0958 && c <= 0x095F) || c >= 0x0978;
    case 0x0980:  // Bangla
      return (c >= 0x0995 && c <= 0x09B9) || (c >= 0x09DC && c <= 0x09DF) || c == 0x09F0 || c == 0x09F1;
    case 0x0A80:  // Gujarati
      return (c >= 0x0A95 && c <= 0x0AB9) || c == 0x0AF9;
    case 0x0B00:  // Odia
      return (c >= 0x0B15 && c <= 0x0B39) || (c >= 0x0B5C && c <= 0x0B5F) || c == 0x0B71;
    case 0x0C00:  // Telugu
      return (c >= 0x0C15 && c <= 0x0C39) || (c >= 0x0C58 && c <= 0x0C5A);
    case 0x0D00:  // Malayalam
      return c >= 0x0D15 && c <= 0x0D3A;
    default:
      return false;
  }
}

// A cluster ends in a consonant and a virama, and so has to be read with a consonant that follows.
bool wantsConsonant(std::string_view cluster) noexcept {
  bool consonant = false;
  bool virama = false;
  while (!cluster.empty()) {
    std::size_t size = 0;
    const ucs4_t c = firstCharacter(cluster, &size);
    cluster.remove_prefix(size);
    if (isJoiningConsonant(c)) {
      consonant = true;
      virama = false;
    } else if (isJoiningVirama(c)) {
      virama = true;
    } else if (c != 0x200D && uc_combining_class(c) == 0) {
      consonant = virama = false;
    }
  }
  return consonant && virama;
}

// A text of at most a window's size, cluster by cluster. The rules are those of UAX 29 with conjuncts kept
// whole (GB9c), which libunistring knows since 1.2 and not before: "व्य" is one cluster, not "व्" and "य".
class Clusters {
 public:
  explicit Clusters(std::string_view text) noexcept : text_(text) {
    u8_grapheme_breaks(bytesOf(text), text.size(), breaks_.data());
  }
  bool atEnd() const noexcept { return at_ == text_.size(); }
  // The next cluster; `parts` is set to the number of clusters it has by the rules without GB9c.
  std::string_view next(std::size_t* parts = nullptr) noexcept {
    const std::size_t start = at_;
    std::size_t count = 0;
    bool joins = true;
    for (std::size_t partStart = at_; joins; partStart = at_) {
      do {
        ++at_;
        joins = joinsHere(partStart);
      } while (at_ < text_.size() && breaks_[at_] == 0 && !joins);
      ++count;
    }
    if (parts != nullptr) *parts = count;
    return text_.substr(start, at_ - start);
  }
  // Where the next cluster starts, in bytes.
  std::size_t offset() const noexcept { return at_; }

 private:
  // Capitals take up to three times the room of the window's letters.
  static constexpr std::size_t kRoom = 4 * kLargestWindow;

  // GB9c holds between the part of a conjunct that starts there and what comes now.
  bool joinsHere(std::size_t partStart) const noexcept {
    std::size_t size = 0;
    return !atEnd() && isJoiningConsonant(firstCharacter(text_.substr(at_), &size)) &&
           wantsConsonant(text_.substr(partStart, at_ - partStart));
  }

  std::string_view text_;
  std::array<char, kRoom> breaks_;
  std::size_t at_ = 0;
};

// The part of a label that can have a say in its badge, from its first visible character on.
std::string_view windowOf(std::string_view label) noexcept {
  while (!label.empty()) {
    std::size_t size = 0;
    if (isVisible(firstCharacter(label, &size))) break;
    label.remove_prefix(size);
  }
  if (label.size() > kLargestWindow) {
    std::size_t end = kLargestWindow;
    while ((static_cast<unsigned char>(label[end]) & 0xC0) == 0x80) --end;
    label = label.substr(0, end);
  }
  // One cluster more than a badge has, because capitals may depend on the letter that follows.
  Clusters clusters(label);
  for (std::size_t visible = 0; visible <= kLongestBadge && !clusters.atEnd();) {
    if (isVisible(clusters.next())) ++visible;
  }
  return label.substr(0, clusters.offset());
}

// What a person sees of a badge. The tags that tell one region's flag from another are seen.
std::string visiblePartOf(std::string_view badge) {
  std::string seen;
  while (!badge.empty()) {
    std::size_t size = 0;
    const ucs4_t c = firstCharacter(badge, &size);
    const bool isTag = c >= 0xE0020 && c <= 0xE007F;
    if (isTag || !uc_is_property_default_ignorable_code_point(c)) seen.append(badge.substr(0, size));
    badge.remove_prefix(size);
  }
  return seen;
}

// The capitals of a label that starts plainly: its first visible characters, as many as a badge has, are
// ASCII and nothing else can have a say in them. Nothing for all others. A shortcut and no more, for
// most of what is written in Latin letters.
std::optional<std::string> plainCapitals(std::string_view label, std::string_view language) {
  if (language == "tr" || language == "az") return std::nullopt;  // their i is not plain
  std::string capitals;
  for (const char c : label) {
    const auto byte = static_cast<unsigned char>(c);
    if (byte >= 0x80) return std::nullopt;  // of its own, or a mark on the character before
    if (capitals.size() == kLongestBadge) return capitals;
    if (isVisible(byte)) capitals += c >= 'a' && c <= 'z' ? static_cast<char>(c - 'a' + 'A') : c;
  }
  return capitals;
}

}  // namespace

std::optional<std::string> Badges::make(std::string_view label) {
  const std::optional<std::string> plain = plainCapitals(label, language_);
  const std::string upper = plain ? *plain : upperCased(windowOf(label), language_);
  std::string badge;
  std::string first;
  bool passedOver = false;
  Clusters clusters(upper);
  for (std::size_t count = 0; count < kLongestBadge && !clusters.atEnd();) {
    std::size_t parts = 0;
    const std::string_view cluster = clusters.next(&parts);
    if (!isVisible(cluster)) {
      passedOver = true;
      continue;
    }
    // More of a label only as far as it is short for whoever counts without GB9c, too.
    count += parts;
    if (!first.empty() && count > kLongestBadge) break;
    badge.append(cutCluster(cluster));
    // What stood between may have kept a mark from its letter. Now they look like one, so they have to be
    // one.
    if (passedOver) badge = composed(badge);
    if (take(badge)) return badge;
    if (first.empty()) first = badge;
  }
  if (first.empty()) return takeCode();
  int& number = nextNumber_.try_emplace(first, 2).first->second;
  while (number <= kLargestOwnNumber) {
    std::string numbered = first + std::to_string(number++);
    if (take(numbered)) return numbered;
  }
  return takeCode();
}

bool Badges::take(const std::string& badge) {
  const bool plain = std::ranges::all_of(badge, [](char c) { return static_cast<unsigned char>(c) < 0x80; });
  return taken_.insert(plain ? badge : composed(visiblePartOf(badge))).second;
}

// 1 to 999, then three characters of 0-9 and A-Z.
std::optional<std::string> Badges::takeCode() {
  constexpr std::uint32_t kLargestNumber = 999;
  constexpr std::string_view kDigits = "0123456789ABCDEFGHIJKLMNOPQRSTUVWXYZ";
  constexpr std::uint32_t kBase = kDigits.size();
  constexpr std::uint32_t kCodes = kBase * kBase * kBase;
  while (nextCode_ < kLargestNumber + kCodes) {
    const std::uint32_t code = nextCode_++;
    std::string badge;
    if (code < kLargestNumber) {
      badge = std::to_string(code + 1);
    } else {
      const std::uint32_t rest = code - kLargestNumber;
      badge = {kDigits[rest / (kBase * kBase)], kDigits[rest / kBase % kBase], kDigits[rest % kBase]};
    }
    if (take(badge)) return badge;
  }
  return std::nullopt;
}

}  // namespace brenvik

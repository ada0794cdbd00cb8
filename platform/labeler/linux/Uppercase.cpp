// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/labeler/linux/Uppercase.h"

#include <unicase.h>
#include <unictype.h>
#include <uninorm.h>
#include <unistr.h>

#include <algorithm>
#include <cstdint>
#include <cstdlib>
#include <memory>
#include <new>
#include <span>

namespace brenvik {
namespace {

struct Free {
  void operator()(void* memory) const noexcept { std::free(memory); }
};
using Characters = std::unique_ptr<ucs4_t, Free>;

constexpr std::size_t kGeorgianSize = 3;  // bytes of a letter
constexpr ucs4_t kDialytika = 0x0308;
constexpr ucs4_t kTonos = 0x0301;
constexpr ucs4_t kYpogegrammeni = 0x0345;

const std::uint8_t* bytesOf(std::string_view text) noexcept {
  return reinterpret_cast<const std::uint8_t*>(text.data());
}

void append(std::string& text, ucs4_t c) {
  std::uint8_t bytes[6];
  const int size = u8_uctomb(bytes, c, sizeof bytes);
  if (size > 0) text.append(reinterpret_cast<const char*>(bytes), static_cast<std::size_t>(size));
}

bool isGreekLetter(ucs4_t c) noexcept {
  return ((c >= 0x0370 && c <= 0x03FF) || c == 0x2126) && uc_is_property_alphabetic(c) && uc_toupper(c) != c;
}

bool isGreekCapital(ucs4_t c) noexcept {
  return (c >= 0x0386 && c <= 0x03AB && uc_is_property_uppercase(c)) || c == 0x2126;
}

bool isGreekVowel(ucs4_t capital) noexcept {
  switch (capital) {
    case 0x0391:
    case 0x0395:
    case 0x0397:
    case 0x0399:
    case 0x039F:
    case 0x03A5:
    case 0x03A9:
      return true;
    default:
      return false;
  }
}

bool isAccent(ucs4_t c) noexcept {
  switch (c) {
    case 0x0300:
    case 0x0301:
    case 0x0302:
    case 0x0303:
    case 0x0311:
    case 0x0342:
      return true;
    default:
      return false;
  }
}

// Breathings and lengths, which capitals drop, too, but which leave no trace on a following vowel.
bool isOtherMark(ucs4_t c) noexcept {
  switch (c) {
    case 0x0304:
    case 0x0306:
    case 0x0313:
    case 0x0314:
    case 0x0343:
      return true;
    default:
      return false;
  }
}

bool isCased(ucs4_t c) noexcept { return uc_is_property_cased(c); }

// The nearest character in one direction that counts for a word's boundary is a cased letter.
bool casedFollows(const ucs4_t* text, std::size_t size, std::size_t from) noexcept {
  while (from < size && uc_is_property_case_ignorable(text[from])) ++from;
  return from < size && isCased(text[from]);
}

// The marks that follow a Greek letter in decomposed text.
struct GreekMarks {
  bool accent = false;
  bool dialytika = false;
  std::size_t ypogegrammenis = 0;
};

// *next: the character after the letter; afterwards the one after its marks.
GreekMarks takeGreekMarks(std::span<const ucs4_t> text, std::size_t* next) noexcept {
  GreekMarks marks;
  for (; *next < text.size(); ++*next) {
    const ucs4_t mark = text[*next];
    if (mark == kDialytika) {
      marks.dialytika = true;
    } else if (mark == kYpogegrammeni) {
      ++marks.ypogegrammenis;
    } else if (isAccent(mark)) {
      marks.accent = true;
    } else if (!isOtherMark(mark)) {
      break;
    }
  }
  return marks;
}

// Greek capitals carry no accents: "ά" becomes "Α". What the accent said is kept where it matters: a vowel
// pair it kept apart gets a dialytika ("μάιος", "ΜΑΪΟΣ"), and the word "ή" (or) keeps it.
std::string greekWithoutAccents(std::string_view text) {
  std::size_t size = 0;
  const Characters decomposed([&] {
    std::size_t count = 0;
    const Characters characters(u8_to_u32(bytesOf(text), text.size(), nullptr, &count));
    if (characters == nullptr) throw std::bad_alloc();
    return u32_normalize(UNINORM_NFD, characters.get(), count, nullptr, &size);
  }());
  if (decomposed == nullptr) throw std::bad_alloc();

  std::string result;
  bool afterCased = false;
  bool accentRemoved = false;  // from the vowel just before, which has no dialytika
  for (std::size_t i = 0; i < size;) {
    const ucs4_t c = decomposed.get()[i++];
    const bool casedBefore = afterCased;
    if (!uc_is_property_case_ignorable(c)) afterCased = isCased(c);
    if (!isGreekLetter(c) && !isGreekCapital(c)) {
      append(result, c);
      accentRemoved = false;
      continue;
    }
    const ucs4_t capital = uc_toupper(c);
    GreekMarks marks = takeGreekMarks(std::span(decomposed.get(), size), &i);
    if (accentRemoved && (capital == 0x0399 || capital == 0x03A5)) marks.dialytika = true;
    accentRemoved = marks.accent && !marks.dialytika && isGreekVowel(capital);
    append(result, capital);
    if (marks.dialytika) append(result, kDialytika);
    const bool isLoneEta = capital == 0x0397 && marks.ypogegrammenis == 0 && !casedBefore;
    if (isLoneEta && marks.accent && !casedFollows(decomposed.get(), size, i)) append(result, kTonos);
    for (; marks.ypogegrammenis > 0; --marks.ypogegrammenis) append(result, kYpogegrammeni);
  }
  return result;
}

// The ligature's capitals are those of the two letters it is pronounced as, not of those it is drawn from.
std::string armenianWithoutLigature(std::string_view text) {
  constexpr std::string_view kLigature = "և";
  std::string result;
  for (std::size_t at = 0;;) {
    const std::size_t next = text.find(kLigature, at);
    result.append(text.substr(at, next - at));
    if (next == std::string_view::npos) return result;
    result.append("եվ");
    at = next + kLigature.size();
  }
}

// Georgian is written in one case. Its capitals (Mtavruli) are for headings in them throughout: a lone one
// looks foreign, and many fonts lack them. Everyday letters, U+10D0 to U+10FF, are E1 83 90 to E1 83 BF.
std::size_t findGeorgian(std::string_view text, std::size_t at) noexcept {
  for (at = text.find("\xE1\x83", at); at != std::string_view::npos; at = text.find("\xE1\x83", at + 3)) {
    if (static_cast<unsigned char>(text[at + 2]) >= 0x90) return at;
  }
  return text.size();
}

// What libunistring has made; nothing but memory can have been in its way, for the text is UTF-8.
std::string owned(std::uint8_t* made, std::size_t size) {
  const std::unique_ptr<std::uint8_t, Free> bytes(made);
  if (bytes == nullptr) throw std::bad_alloc();
  return {reinterpret_cast<const char*>(bytes.get()), size};
}

std::string upperCasedRun(std::string_view text, const char* language) {
  std::size_t size = 0;
  std::uint8_t* const upper = u8_toupper(bytesOf(text), text.size(), language, UNINORM_NFC, nullptr, &size);
  return owned(upper, size);
}

}  // namespace

std::string upperCased(std::string_view text, const char* language) {
  const std::string_view code(language);
  std::string prepared;
  if (code == "el") {
    prepared = greekWithoutAccents(text);
    text = prepared;
  } else if (code == "hy") {
    prepared = armenianWithoutLigature(text);
    text = prepared;
  }
  // Georgian letters stand between others as they are: no rule of capitals looks across them, and no mark
  // composes with them.
  std::string result;
  for (std::size_t at = 0; at < text.size();) {
    const std::size_t georgian = findGeorgian(text, at);
    if (georgian > at) result += upperCasedRun(text.substr(at, georgian - at), language);
    at = std::min(georgian + kGeorgianSize, text.size());
    result += text.substr(georgian, at - georgian);
  }
  return result;
}

std::string composed(std::string_view text) {
  std::size_t size = 0;
  std::uint8_t* const made = u8_normalize(UNINORM_NFC, bytesOf(text), text.size(), nullptr, &size);
  return owned(made, size);
}

}  // namespace brenvik
